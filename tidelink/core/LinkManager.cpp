#include "tidelink/core/LinkManager.h"

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstring>

#include "platform/Config.h"
#include "platform/FileSystem.h"
#include "platform/Process.h"
#include "platform/SharedMemory.h"
#include "platform/Sync.h"
#include "platform/Trace.h"

namespace tidelink {

using namespace platform;

LinkError::~LinkError() = default;

namespace {

// Opening the port mapping: read-only (our platform's reading of the open flag 0x20).
constexpr uint32_t kPortFileOpenFlags = kMMFReadOnly;

struct ManagerState {
    RecursiveMutex managerLock;
    RecursiveMutex sharedLock;
    // Guarded by managerLock.
    WString managerFolder;
    uint16_t managerPort = 0;
    std::weak_ptr<Session> managerSession;
    std::weak_ptr<RPCClient> managerClient;
    // Guarded by sharedLock.
    std::weak_ptr<Executor> executor;
    std::weak_ptr<SocketTransport> transport;
    std::weak_ptr<ListeningServer> server;
    std::weak_ptr<RPCServer> rpcServer;
};

ManagerState& State() {
    static auto* state = new ManagerState();  // immortal: used by objects released at exit
    return *state;
}

bool EndsWith(const std::string& s, const std::string& suffix) {
    return s.size() >= suffix.size() && s.compare(s.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// A program we start must not be replaceable by anyone but us (or root).
bool IsSafeToLaunch(const std::string& path, std::string& why) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) {
        why = std::strerror(errno);
        return false;
    }
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        why = "it is writable by group or others";
        return false;
    }
    if (st.st_uid != ::getuid() && st.st_uid != 0) {
        why = "it belongs to another user";
        return false;
    }
    return true;
}

void LaunchManagerProcess() {
    const WString path = GetSharedServerPath(ToUTF16(std::string(kTideLinkManagerName) + kExecutableSuffix),
                                             u"", GetTideLinkProtocolVersion(), State().managerFolder);
    TL_TRACE("TideLink", 6) << "Attempting to launch tidelinkmanager";
    TL_TRACE("TideLink", 6) << ToUTF8(path);
    const std::string p = ToUTF8(path);
    std::string why;
    if (p.empty() || !IsSafeToLaunch(p, why)) {
        TL_TRACE("TideLink", 0) << "Refusing to launch " << p << ": " << why;
        throw LinkError(kErrorLaunchingManager);
    }
    if (LaunchProcess(p, {}) < 0) {
        TL_TRACE("TideLink", 0) << "Launching " << p << " failed: " << std::strerror(errno);
        throw LinkError(kErrorLaunchingManager);
    }
}

}  // namespace

WString GetTideLinkProtocolVersion() {
    // Immortal, like the state: a reconnection may still ask for it while the process exits.
    static const WString& version = *new WString([] {
        char buf[32];
        std::snprintf(buf, sizeof(buf), "%i.%i", GetSuiteVersionInfo().major, 0);
        return ToUTF16(buf);
    }());
    return version;
}

std::tuple<int32_t, int32_t, int32_t> GetTideLinkVersionInfo() {
    static const auto info = std::make_tuple(GetSuiteVersionInfo().major, 0, 0);
    return info;
}

std::string CSVersionPortNumberString() {
    std::string s = ToUTF8(GetTideLinkProtocolVersion());
    if (IsBetaPrime()) s += "(Beta)";
    return s;
}

std::string GetTideLinkManagerPortFileName(uint32_t processId) {
    return "tlm" + std::to_string(processId) + CSVersionPortNumberString();
}

std::string GetKeyFileName() { return "com.quenlo.tidelinkmanager" + CSVersionPortNumberString(); }

std::string GetAddressForTideLinkManager() { return "127.0.0.1"; }

uint16_t ReadManagerPort(uint32_t processId) {
    const std::string version = CSVersionPortNumberString();
    TL_TRACE("tidelink", 7) << "GetTideLinkManagerPortFileName : inTideLinkManagerProcessID = "
                            << processId << ", CSVersionPortNumberString = " << version;
    MemoryMappedFile file;
    if (!file.Open(GetTideLinkManagerPortFileName(processId), 4, kPortFileOpenFlags)) return 0;
    const auto* p = static_cast<const uint8_t*>(file.GetAddress());
    if (p == nullptr) {
        TL_TRACE("TideLink", 6) << "Could not retrieve address of memory mapped file for tide link.";
        return 0;
    }
    const uint32_t value = static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) |
                           (static_cast<uint32_t>(p[2]) << 16) | (static_cast<uint32_t>(p[3]) << 24);
    return static_cast<uint16_t>(value & 0xFFFF);
}

WString GetSharedServerPath(const WString& name, const WString&, const WString&, const WString& folder) {
    const std::string narrow = ToUTF8(name);
    // A shortcut in the package folder wins: on this platform a symbolic link under the
    // program's own name (the executable suffix is empty).
    if (EndsWith(narrow, kExecutableSuffix)) {
        const std::string shortcut =
            narrow.substr(0, narrow.size() - std::strlen(kExecutableSuffix)) + kShortcutSuffix;
        const File link = Dir::PackageDir().GetFile(shortcut);
        if (link.IsSymlink()) {
            const std::string target = link.ResolveLink();
            if (!target.empty() && File(target).Exists()) return ToUTF16(target);
        }
    }
    std::vector<Dir> dirs{Dir::PackageDir(), Dir::AppDir()};
    if (!folder.empty()) dirs.emplace_back(ToUTF8(folder));
    for (const auto& dir : dirs) {
        const File f = dir.GetFile(narrow);
        if (f.Exists()) {
            return f.Path().find(narrow) == std::string::npos ? WString() : ToUTF16(f.Path());
        }
    }
    throw LinkError(kCannotFindServer);
}

void SetTideLinkManagerFolderPath(const WString& folder) {
    auto& s = State();
    RecursiveMutex::Guard lock(s.managerLock, "SetTideLinkManagerFolderPath");
    s.managerFolder = folder;
}

SessionPtr LaunchTidelinkManager(const SocketTransportPtr& transport) {
    if (!transport) return nullptr;
    auto& s = State();
    RecursiveMutex::Guard lock(s.managerLock, "LaunchTidelinkManager");
    if (auto alive = s.managerSession.lock(); alive && alive->IsOpen()) return alive;

    const double start = NowSeconds();
    double now = start;
    double lastLaunch = -1.0;
    double wait = 1.0;
    int spin = 1;
    uint32_t pid = 0;
    SessionPtr session;
    // Set by the probe of the current session only, so a probe answered on a session dropped
    // meanwhile cannot end the hunt without a session.
    auto connected = std::make_shared<std::atomic<bool>>(false);

    for (;;) {
        if (session && ReadManagerPort(pid) != s.managerPort) {
            session->Close();  // its pending probe holds it; closing completes the probe
            session.reset();
            connected = std::make_shared<std::atomic<bool>>(false);
            s.managerPort = 0;
        }
        if (s.managerPort == 0) {
            for (uint32_t id : GetProcessIDsForName(kTideLinkManagerName)) {
                s.managerPort = ReadManagerPort(id);
                if (s.managerPort != 0) {
                    pid = id;
                    break;
                }
            }
        }
        if (s.managerPort == 0 && now - lastLaunch >= wait) {
            lastLaunch = now;
            LaunchManagerProcess();
            wait *= 2.0;
            TL_TRACE("TideLink", 5) << "Increase wait time to " << wait;
        }
        if (s.managerPort != 0 && !session) {
            session = transport->ClientStart(GetAddressForTideLinkManager(), s.managerPort);
            if (!session) {
                s.managerPort = 0;
            } else {
                auto probe = std::make_shared<RPCClient>(session, "TLMClient");
                probe->SendRequest(
                    BuildCall(kManagerProbeMessage),
                    [probe, connected](const Value&, RequestId) { connected->store(true); },
                    [probe](int32_t, const WString&, RequestId) {});
            }
        }
        if (connected->load() || now - start >= kManagerHuntSeconds) break;
        if (spin <= 16) {
            for (int i = 0; i < spin; ++i) CpuPause();
            spin *= 2;
        } else {
            spin = 1;
            SleepMilliseconds(1);
        }
        now = NowSeconds();
    }

    s.managerSession = session;
    if (!session) throw LinkError(kUnableToConnectToManager);
    return session;
}

RPCClientPtr LaunchTidelinkManagerRPC() {
    auto& s = State();
    RecursiveMutex::Guard lock(s.managerLock, "LaunchTidelinkManagerRPC");
    if (auto alive = s.managerClient.lock()) {
        if (alive->GetSession() && alive->GetSession()->IsOpen()) return alive;
    }
    auto session = LaunchTidelinkManager(GetSharedTransport());
    auto client = std::make_shared<RPCClient>(session, "TLMClient");
    s.managerClient = client;
    return client;
}

uint16_t GetPortForTideLinkManager() {
    auto& s = State();
    RecursiveMutex::Guard lock(s.managerLock, "GetPortForTideLinkManager");
    LaunchTidelinkManager(GetSharedTransport());
    return s.managerPort;
}

namespace {

// Returns the object in |slot| while someone still holds it, otherwise a new one from |create|.
template <class T, class F>
std::shared_ptr<T> SharedObject(std::weak_ptr<T>& slot, const char* label, F create) {
    RecursiveMutex::Guard lock(State().sharedLock, label);
    auto object = slot.lock();
    if (!object) {
        object = create();
        slot = object;
    }
    return object;
}

}  // namespace

ExecutorPtr GetSharedExecutor() {
    return SharedObject(State().executor, "GetSharedExecutor",
                        [] { return CreateSubExecutor(CreateCPUBoundExecutor(), -1); });
}

SocketTransportPtr GetSharedTransport() {
    return SharedObject(State().transport, "GetSharedTransport",
                        [] { return SocketTransport::Create(GetSharedExecutor()); });
}

ListeningServerPtr GetSharedServer() {
    return SharedObject(State().server, "GetSharedServer",
                        [] { return ServerStart(GetSharedTransport(), 0, true); });
}

RPCServerPtr GetSharedRPCServer() {
    return SharedObject(State().rpcServer, "GetSharedRPCServer",
                        [] { return std::make_shared<RPCServer>(GetSharedServer(), "SharedServer"); });
}

}  // namespace tidelink
