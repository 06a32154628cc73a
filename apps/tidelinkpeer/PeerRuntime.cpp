#include "PeerRuntime.h"

#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Sync.h"
#include "platform/Trace.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/LinkManager.h"

#ifndef TIDELINK_VERSION_STRING
#define TIDELINK_VERSION_STRING "0.0.0"
#endif

namespace tidelink::peer {

using namespace platform;

namespace {
constexpr const char* kCat = "TideLinkPeer";

// One per hardware thread and two more (TIDELINK_RENDER_THREADS: 1 to 64).
unsigned RenderThreads() {
    if (const char* env = std::getenv("TIDELINK_RENDER_THREADS")) {
        const int n = std::atoi(env);
        if (n >= 1 && n <= 64) return static_cast<unsigned>(n);
    }
    return HardwareThreadCount() + 2;
}
}  // namespace

PeerRuntime::PeerRuntime(PeerRuntimeOptions options) : mOptions(std::move(options)) {}

PeerRuntime::~PeerRuntime() { Stop(); }

bool PeerRuntime::Start(std::string& error) {
    mStarted = true;
    mRegistrar = mOptions.registrar ? mOptions.registrar : MessageRegistrar::Instance();
    mTransport = GetSharedTransport();
    mServer = ServerStart(mTransport, 0, true);
    if (!mServer) {
        error = "cannot listen on 127.0.0.1";
        return false;
    }
    mAddress = mServer->GetAddress();
    mPort = mServer->GetPort();
    mNotifier = std::make_shared<EndpointNotifier>(mTransport, GetSharedExecutor());
    mService = PeerService::Create(mOptions.role, GetSharedExecutor(), mNotifier);
    std::weak_ptr<PeerService> weakService = mService;
    mNotifier->SetUnreachableHandler([weakService](const ServerConnection& endpoint) {
        if (auto service = weakService.lock()) service->ForgetEndpoint(endpoint);
    });
    mService->Register(mRegistrar);
    mProjects = ProjectServer::Create(mService, mRegistrar);
    // Frames are drawn on every core, several at once, on threads of their own: drawing waits for
    // the link manager's buffers, and the extra threads draw meanwhile.
    mRenders = RenderService::Create(mService, CreateWorkerPool(RenderThreads()));
    mRenders->Register(mRegistrar);
    mRpcServer = std::make_shared<RPCServer>(mServer, "TideLinkPeer", mRegistrar);
    TL_TRACE(kCat, 3) << mOptions.role.serverName << " serving on " << mAddress << ":" << mPort;
    if (mOptions.announce && !Announce(error)) return false;
    return true;
}

bool PeerRuntime::Announce(std::string& error) {
    try {
        // Finds the link manager, or starts one, as every host does.
        mManager = LaunchTidelinkManagerRPC();
        if (mOptions.dedicatedManagerSession) {
            auto session = ClientStart(mTransport, GetAddressForTideLinkManager(), GetPortForTideLinkManager());
            if (!session) {
                error = "cannot open a session to the link manager";
                return false;
            }
            mManager = std::make_shared<RPCClient>(session, "PeerAnnouncement");
        }
    } catch (const LinkError& e) {
        error = std::string("cannot reach the link manager: ") + e.what();
        return false;
    }
    std::weak_ptr<StopState> stop = mStop;
    mManagerCloseHandler = mManager->GetSession()->AddCloseHandler([stop](const SessionPtr&, TransportError why) {
        auto state = stop.lock();
        if (!state) return;
        TL_TRACE(kCat, 3) << "The session to the link manager closed (" << Describe(why) << ")";
        {
            std::lock_guard lock(state->mutex);
            if (state->reason == StopReason::None) state->reason = StopReason::ManagerGone;
        }
        state->cond.notify_all();
    });

    const char* tokenVar = std::getenv(kPeerTokenVariable);
    const std::string token = tokenVar ? tokenVar : "";
    Value info = Value::object();
    info["token"] = token;
    info["role"] = mOptions.role.announceName;
    info["instance"] = mOptions.role.instance;
    info["address"] = mAddress;
    info["port"] = mPort;
    info["pid"] = GetCurrentProcessID();

    struct Answer {
        Gate done;
        bool ok = false;
        int32_t code = 0;
        WString message;
    };
    auto answer = std::make_shared<Answer>();
    mManager->SendRequest(
        BuildCall(kRegisterPeerServerMessage, Value::array({info})),
        [answer](const Value&, RequestId) {
            answer->ok = true;
            answer->done.Open();
        },
        [answer](int32_t code, const WString& message, RequestId) {
            answer->code = code;
            answer->message = message;
            answer->done.Open();
        });
    if (!answer->done.Wait(mOptions.announceTimeoutMs)) {
        error = "the link manager did not answer the announcement";
        return false;
    }
    if (!answer->ok) {
        const std::string why = ToUTF8(answer->message) + " (" + std::to_string(answer->code) + ")";
        if (!token.empty()) {
            error = "the link manager refused the announcement: " + why;
            return false;
        }
        // Started by hand: still useful to hosts that are given our address.
        TL_TRACE(kCat, 1) << "The link manager did not take the announcement: " << why << "; serving unannounced";
        return true;
    }
    mAnnounced = true;
    TL_TRACE(kCat, 3) << "Announced as " << mOptions.role.announceName << " to the link manager";
    return true;
}

StopReason PeerRuntime::WaitForStop() {
    std::unique_lock lock(mStop->mutex);
    mStop->cond.wait(lock, [this] { return mStop->reason != StopReason::None; });
    return mStop->reason;
}

void PeerRuntime::RequestStop(StopReason reason) {
    {
        std::lock_guard lock(mStop->mutex);
        if (mStop->reason == StopReason::None) mStop->reason = reason;
    }
    mStop->cond.notify_all();
}

void PeerRuntime::Stop() {
    if (mStopped) return;
    mStopped = true;
    RequestStop();
    if (!mStarted) return;
    // No new requests; the sessions of hosts close.
    if (mServer) mServer->Stop();
    if (mRenders) {
        mRenders->Unregister(mRegistrar);
        mRenders->Shutdown();
    }
    if (mProjects) mProjects->Stop();
    if (mService) {
        mService->Unregister(mRegistrar);
        mService->Shutdown(mOptions.shutdownFlushMs);
    }
    if (mManager) {
        if (auto session = mManager->GetSession()) {
            session->RemoveCloseHandler(mManagerCloseHandler);
            if (mOptions.dedicatedManagerSession) session->Close();
        }
        mManager.reset();
    }
    mRpcServer.reset();
    mServer.reset();
    mRenders.reset();
    mProjects.reset();
    mService.reset();
    mNotifier.reset();
    mTransport.reset();
    TL_TRACE(kCat, 3) << mOptions.role.serverName << " stopped";
}

int RunPeerMain(int argc, char** argv) {
    // Signals are taken synchronously by one thread; block them before any thread starts.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGHUP);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    std::vector<std::string> args(argv + (argc > 0 ? 1 : 0), argv + argc);
    std::string error;
    const auto options = ParsePeerArguments(args, error);
    if (!options) {
        std::fprintf(stderr, "tidelinkpeer: %s\n%s", error.c_str(), PeerUsage().c_str());
        return 2;
    }
    if (options->help) {
        std::fputs(PeerUsage().c_str(), stdout);
        return 0;
    }
    if (options->version) {
        std::printf("tidelinkpeer version %s (protocol %s)\n", TIDELINK_VERSION_STRING,
                    CSVersionPortNumberString().c_str());
        return 0;
    }
    if (std::getenv("TIDELINK_TRACE") == nullptr) {
        SetTraceSelection(options->traceLevel < 0 ? "*:-1" : "*:" + std::to_string(options->traceLevel));
    }
    SetClientInfo(u"tidelinkpeer", ToUTF16(TIDELINK_VERSION_STRING));

    PeerRuntimeOptions runtimeOptions;
    runtimeOptions.role = options->role;
    runtimeOptions.announce = options->announce;
    runtimeOptions.dedicatedManagerSession = false;
    PeerRuntime runtime(runtimeOptions);
    if (!runtime.Start(error)) {
        std::fprintf(stderr, "tidelinkpeer: cannot start: %s\n", error.c_str());
        runtime.Stop();
        return 1;
    }
    std::printf("tidelinkpeer: %s listening on %s:%u%s\n", options->role.serverName.c_str(),
                runtime.Address().c_str(), static_cast<unsigned>(runtime.Port()),
                runtime.Announced() ? "" : " (not announced)");
    std::fflush(stdout);

    std::atomic<bool> waking{false};
    std::thread signalWaiter([&] {
        int sig = 0;
        sigwait(&signals, &sig);
        if (!waking.load()) TL_TRACE(kCat, 3) << "Stopping on signal " << sig;
        runtime.RequestStop();
    });
    const StopReason reason = runtime.WaitForStop();
    if (reason == StopReason::ManagerGone) TL_TRACE(kCat, 3) << "The link manager is gone; stopping";
    runtime.Stop();
    // Wake the signal waiter if we did not stop on a signal.
    waking.store(true);
    pthread_kill(signalWaiter.native_handle(), SIGTERM);
    signalWaiter.join();
    return 0;
}

}  // namespace tidelink::peer
