// The link manager: one per user and suite version. It listens on 127.0.0.1, publishes its port in
// the shared-memory mapping named after its process id and protocol version, and serves the
// requests of hosts and peers. Services register their messages through ManagerModule.
//
// A ManagerService can run inside any process (tests start one in their own); the tidelinkmanager
// executable is a thin main over it.
#pragma once

#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/Rpc.h"
#include "platform/SharedMemory.h"
#include "platform/Transport.h"

namespace tidelink::manager {

struct ManagerOptions {
    // Exit after this many seconds without any session; 0 keeps running.
    double idleExitSeconds = 300.0;
    // Publish the port mapping (tests running several services in one process turn it off).
    bool publishPort = true;
    // Hold the per-user, per-version instance lock (turned off by in-process tests).
    bool singleInstance = true;
    // Test seam: publish this value instead of the real port (a "manager" that seems not running).
    std::optional<uint32_t> publishedPortOverride;
};

class ManagerService;

// A service of the link manager.
class ManagerModule {
public:
    virtual ~ManagerModule() = default;
    virtual void Register(ManagerService& service) = 0;
    // Called on a transport thread when a session of a client ends.
    virtual void OnSessionClosed(const platform::SessionPtr&) {}
    // Adds the module's figures to the status query's answer.
    virtual void AddInfo(platform::Value&) {}
    // Called once when the service stops.
    virtual void OnStop() {}
};

enum class StartResult { Started, AlreadyRunning, Failed };

class ManagerService : public std::enable_shared_from_this<ManagerService> {
public:
    explicit ManagerService(ManagerOptions options = {});
    ~ManagerService();
    ManagerService(const ManagerService&) = delete;
    ManagerService& operator=(const ManagerService&) = delete;

    void AddModule(std::shared_ptr<ManagerModule> module);
    // Listens, registers every module's messages and publishes the port. |error| says why not.
    StartResult Start(std::string& error);
    // Stops serving, closes every session and removes the port mapping. Idempotent.
    void Stop();

    // Blocks until RequestStop or the idle limit; returns true when it ended by idling.
    bool WaitForExit(double pollSeconds = 0.25);
    void RequestStop();

    uint16_t Port() const;
    size_t SessionCount() const;
    // Marks |session| as a background session (a peer's life line): while open it does not keep
    // the service from idling out. Any thread; a session already closed is ignored.
    void MarkBackgroundSession(const platform::SessionPtr& session);
    // Open sessions marked as background.
    size_t BackgroundSessionCount() const;
    const platform::MessageRegistrarPtr& Registrar() const { return mRegistrar; }
    double UptimeSeconds() const;
    // True when this service holds the per-user, per-version instance lock.
    bool HoldsInstanceLock() const { return mLockFd >= 0; }
    // Lets every module add its figures to |info|.
    void CollectInfo(platform::Value& info) const;

private:
    void SweepStalePortFiles();
    void OnSession(const platform::SessionPtr& session);

    ManagerOptions mOptions;
    platform::MessageRegistrarPtr mRegistrar;
    platform::SocketTransportPtr mTransport;
    platform::ListeningServerPtr mServer;
    std::shared_ptr<platform::RPCServer> mRpcServer;
    platform::MemoryMappedFile mPortFile;
    std::vector<std::shared_ptr<ManagerModule>> mModules;
    int mLockFd = -1;
    double mStartTime = 0;

    mutable std::mutex mMutex;
    std::condition_variable mCond;
    bool mStopRequested = false;
    bool mStopped = false;
    double mLastActivity = 0;
    std::set<const platform::Session*> mBackground;  // open background sessions
};

// Answers the probe and the status query.
std::shared_ptr<ManagerModule> CreateCoreModule();

}  // namespace tidelink::manager
