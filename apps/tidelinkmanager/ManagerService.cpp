#include "ManagerService.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Trace.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink::manager {

using namespace platform;

namespace {
constexpr const char* kCat = "TideLinkManager";

class CoreModule final : public ManagerModule {
public:
    void Register(ManagerService& service) override {
        std::weak_ptr<ManagerService> weak = service.shared_from_this();
        service.Registrar()->Register(
            kManagerProbeMessage,
            std::make_shared<FunctionRequestHandler>(
                [](const ResponderPtr& r, const Value&) { r->SendGeneralResult(true); }));
        service.Registrar()->Register(
            kManagerInfoMessage,
            std::make_shared<FunctionRequestHandler>([weak](const ResponderPtr& r, const Value&) {
                auto self = weak.lock();
                if (!self) return r->SendError(kErrorTransportShutdown, u"Link manager is stopping");
                Value info = Value::object();
                info["pid"] = GetCurrentProcessID();
                info["port"] = self->Port();
                info["protocol_version"] = CSVersionPortNumberString();
                info["sessions"] = self->SessionCount();
                info["uptime_s"] = self->UptimeSeconds();
                self->CollectInfo(info);
                r->SendGeneralResult(info);
            }));
    }
};

}  // namespace

std::shared_ptr<ManagerModule> CreateCoreModule() { return std::make_shared<CoreModule>(); }

ManagerService::ManagerService(ManagerOptions options)
    : mOptions(options), mRegistrar(MessageRegistrar::Create()) {}

ManagerService::~ManagerService() { Stop(); }

void ManagerService::AddModule(std::shared_ptr<ManagerModule> module) { mModules.push_back(std::move(module)); }

StartResult ManagerService::Start(std::string& error) {
    mStartTime = NowSeconds();
    if (mOptions.singleInstance) {
        const std::string dir = GetRuntimeDir();
        if (dir.empty()) {
            error = "no usable runtime folder";
            return StartResult::Failed;
        }
        const std::string lockPath = dir + "/" + GetKeyFileName() + ".lock";
        mLockFd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
        if (mLockFd < 0) {
            error = "cannot open " + lockPath + ": " + std::strerror(errno);
            return StartResult::Failed;
        }
        if (::flock(mLockFd, LOCK_EX | LOCK_NB) != 0) {
            ::close(mLockFd);
            mLockFd = -1;
            error = "another link manager of version " + CSVersionPortNumberString() + " is running";
            return StartResult::AlreadyRunning;
        }
    }
    mTransport = SocketTransport::Create(CreateSubExecutor(CreateCPUBoundExecutor(), -1));
    mServer = mTransport->ServerStart(0, true);
    if (!mServer) {
        error = "cannot listen on 127.0.0.1";
        return StartResult::Failed;
    }
    for (auto& m : mModules) m->Register(*this);
    mRpcServer = std::make_shared<RPCServer>(mServer, "TideLinkManager", mRegistrar);
    std::weak_ptr<ManagerService> weak = shared_from_this();
    mServer->SetSessionHandler([weak](const SessionPtr& session) {
        if (auto self = weak.lock()) self->OnSession(session);
    });
    {
        std::lock_guard lock(mMutex);
        mLastActivity = NowSeconds();
    }
    if (mOptions.publishPort) {
        SweepStalePortFiles();
        const std::string name = GetTideLinkManagerPortFileName(GetCurrentProcessID());
        // A mapping under our own name can only be left by a dead process that had our pid.
        if (!mPortFile.Init(name, 4, kMMFReplaceStale)) {
            error = "cannot create port mapping " + name + ": " + std::strerror(mPortFile.LastError());
            return StartResult::Failed;
        }
        auto* p = static_cast<uint8_t*>(mPortFile.GetAddress());
        const uint32_t port = mOptions.publishedPortOverride.value_or(mServer->GetPort());
        for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(port >> (8 * i));
    }
    TL_TRACE(kCat, 3) << "Link manager " << CSVersionPortNumberString() << " serving on 127.0.0.1:"
                      << mServer->GetPort();
    return StartResult::Started;
}

// Port mappings outlive a manager killed without warning. Remove those of dead managers of this
// version and user. A name is "tlm" + pid + version, so the digits alone could also be read as
// a shorter pid followed by another version: a name is kept when any live link manager's pid
// is a prefix of its digits.
void ManagerService::SweepStalePortFiles() {
    const std::string suffix = CSVersionPortNumberString();
    const auto live = GetProcessIDsForName(kTideLinkManagerName);
    for (const auto& name : ListSharedMemoryNames("tlm")) {
        if (name.size() <= 3 + suffix.size() ||
            name.compare(name.size() - suffix.size(), suffix.size(), suffix) != 0) {
            continue;
        }
        const std::string digits = name.substr(3, name.size() - 3 - suffix.size());
        if (digits.empty() || digits.size() > 10 ||
            digits.find_first_not_of("0123456789") != std::string::npos) {
            continue;
        }
        const auto pid = static_cast<uint32_t>(std::stoull(digits));
        if (pid == GetCurrentProcessID() || IsProcessAlive(pid)) continue;
        bool ambiguous = false;
        for (uint32_t other : live) {
            if (digits.rfind(std::to_string(other), 0) == 0) ambiguous = true;
        }
        if (!ambiguous && MemoryMappedFile::Remove(name)) {
            TL_TRACE(kCat, 3) << "Removed the port mapping " << name << " of a dead link manager";
        }
    }
}

void ManagerService::OnSession(const SessionPtr& session) {
    {
        std::lock_guard lock(mMutex);
        mLastActivity = NowSeconds();
    }
    TL_TRACE(kCat, 5) << "Client connected from port " << session->GetRemotePort();
    std::weak_ptr<ManagerService> weak = shared_from_this();
    session->AddCloseHandler([weak](const SessionPtr& s, TransportError) {
        auto self = weak.lock();
        if (!self) return;
        {
            std::lock_guard lock(self->mMutex);
            self->mLastActivity = NowSeconds();
            self->mBackground.erase(s.get());
        }
        for (auto& m : self->mModules) m->OnSessionClosed(s);
        self->mCond.notify_all();
    });
}

void ManagerService::Stop() {
    {
        std::lock_guard lock(mMutex);
        if (mStopped) return;
        mStopped = true;
        mStopRequested = true;
    }
    mCond.notify_all();
    // The mapping goes first, so no new client finds a manager that is going away.
    mPortFile.Close();
    if (mServer) mServer->Stop();
    for (auto& m : mModules) m->OnStop();
    mRpcServer.reset();
    mServer.reset();
    mTransport.reset();
    if (mLockFd >= 0) {
        ::close(mLockFd);
        mLockFd = -1;
    }
}

bool ManagerService::WaitForExit(double pollSeconds) {
    std::unique_lock lock(mMutex);
    for (;;) {
        if (mStopRequested) return false;
        // Background sessions (peers' life lines) do not keep the service running.
        const size_t sessions = mServer ? mServer->SessionCount() : 0;
        if (mOptions.idleExitSeconds > 0 && mServer && sessions <= mBackground.size() &&
            NowSeconds() - mLastActivity >= mOptions.idleExitSeconds) {
            TL_TRACE(kCat, 3) << "No clients for " << mOptions.idleExitSeconds << " s; exiting";
            return true;
        }
        mCond.wait_for(lock, std::chrono::duration<double>(pollSeconds));
    }
}

void ManagerService::RequestStop() {
    {
        std::lock_guard lock(mMutex);
        mStopRequested = true;
    }
    mCond.notify_all();
}

void ManagerService::MarkBackgroundSession(const SessionPtr& session) {
    if (!session) return;
    {
        std::lock_guard lock(mMutex);
        mBackground.insert(session.get());
    }
    // A session that closed meanwhile may have run its close handler before the insertion.
    if (!session->IsOpen()) {
        std::lock_guard lock(mMutex);
        mBackground.erase(session.get());
    }
    mCond.notify_all();
}

size_t ManagerService::BackgroundSessionCount() const {
    std::lock_guard lock(mMutex);
    return mBackground.size();
}

uint16_t ManagerService::Port() const { return mServer ? mServer->GetPort() : 0; }

size_t ManagerService::SessionCount() const { return mServer ? mServer->SessionCount() : 0; }

double ManagerService::UptimeSeconds() const { return NowSeconds() - mStartTime; }

void ManagerService::CollectInfo(Value& info) const {
    for (const auto& m : mModules) m->AddInfo(info);
}

}  // namespace tidelink::manager
