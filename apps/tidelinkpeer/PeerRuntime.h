// A running reference peer: listens on a loopback port, answers through the message registrar,
// announces itself to the link manager and lives as long as its session to the manager (see
// docs/brokering.md and docs/peer.md). The tidelinkpeer executable is RunPeerMain; a test binary
// can run a PeerRuntime in its own process, or call RunPeerMain when it is started as a named
// server.
//
// Threading: Start, WaitForStop and Stop are for one controlling thread (never a transport
// thread); RequestStop may be called from any thread, signal waiters included.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "PeerRole.h"
#include "PeerService.h"
#include "ProjectServer.h"
#include "RenderService.h"
#include "platform/Rpc.h"
#include "platform/Transport.h"

namespace tidelink::peer {

struct PeerRuntimeOptions {
    PeerRole role;
    // Announce to the link manager (and stop when that session closes). Without it the peer only
    // listens, and never contacts the link manager.
    bool announce = true;
    // Announce on a session of our own instead of the process's shared link-manager session, so
    // that Stop takes the announcement back (in-process peers). The executable uses the shared one.
    bool dedicatedManagerSession = true;
    // Where the messages are registered; the process-wide registrar when null. A test process that
    // is also a host should give the peer a registrar of its own, or its own shared server would
    // answer the peer's messages too.
    platform::MessageRegistrarPtr registrar;
    int announceTimeoutMs = 30000;
    // How long Stop waits for hosts to take the last status notifications.
    int shutdownFlushMs = 2000;
};

enum class StopReason { None, Requested, ManagerGone };

class PeerRuntime {
public:
    explicit PeerRuntime(PeerRuntimeOptions options);
    ~PeerRuntime();
    PeerRuntime(const PeerRuntime&) = delete;
    PeerRuntime& operator=(const PeerRuntime&) = delete;

    // Listens, registers the messages and announces. False with |error| when it cannot; a peer
    // started by the link manager (TIDELINK_PEER_TOKEN set) also fails when the manager refuses
    // the announcement, one started by hand then serves unannounced.
    bool Start(std::string& error);

    const std::string& Address() const { return mAddress; }
    uint16_t Port() const { return mPort; }
    bool Announced() const { return mAnnounced; }
    const std::shared_ptr<PeerService>& Service() const { return mService; }
    const std::shared_ptr<ProjectServer>& Projects() const { return mProjects; }
    const std::shared_ptr<RenderService>& Renders() const { return mRenders; }

    // Blocks until RequestStop, or until the session to the link manager closes.
    StopReason WaitForStop();
    void RequestStop(StopReason reason = StopReason::Requested);
    // Stops listening, ends the renders (queued frames are published as cancelled, those being
    // drawn are finished), finishes the project work, tells every status registration that the peer
    // is gone, takes the announcement back (dedicated session) and releases every session.
    // Idempotent.
    void Stop();

private:
    bool Announce(std::string& error);

    PeerRuntimeOptions mOptions;
    platform::MessageRegistrarPtr mRegistrar;
    platform::SocketTransportPtr mTransport;
    platform::ListeningServerPtr mServer;
    platform::RPCServerPtr mRpcServer;
    std::shared_ptr<EndpointNotifier> mNotifier;
    std::shared_ptr<PeerService> mService;
    std::shared_ptr<ProjectServer> mProjects;
    std::shared_ptr<RenderService> mRenders;
    platform::RPCClientPtr mManager;
    platform::Guid mManagerCloseHandler;
    std::string mAddress;
    uint16_t mPort = 0;
    bool mAnnounced = false;
    bool mStarted = false;
    bool mStopped = false;

    // Shared with the close handler of the manager session, which may run after we are gone.
    struct StopState {
        std::mutex mutex;
        std::condition_variable cond;
        StopReason reason = StopReason::None;
    };
    std::shared_ptr<StopState> mStop = std::make_shared<StopState>();
};

// The whole program: arguments, signals (SIGTERM, SIGINT, SIGHUP stop it cleanly), start, wait,
// stop. Returns the exit status: 0 after a clean stop, 1 when the peer cannot start, 2 for a
// usage error. Call it before any thread starts (it blocks the stop signals in the caller).
int RunPeerMain(int argc, char** argv);

}  // namespace tidelink::peer
