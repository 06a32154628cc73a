#include "BrokerService.h"

#include <utility>  // before asio: its C++20 coroutine header needs std::exchange
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>

#include <signal.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "platform/Guid.h"
#include "platform/Process.h"
#include "platform/Trace.h"
#include "platform/media/ValueAccess.h"
#include "tidelink/core/Brokering.h"

namespace tidelink::manager {

using namespace platform;
namespace asio = boost::asio;
namespace fs = std::filesystem;

namespace {

constexpr const char* kCat = "TideLinkManager";
// How often a start under way is looked at: the process may have exited or run out of time.
constexpr auto kPollInterval = std::chrono::milliseconds(50);
constexpr uintmax_t kMaxManifestBytes = 256 * 1024;
// Errors of the broker itself (nothing installed, cannot start, not ready in time).
constexpr int32_t kBrokerError = -1;

// The requests of one brokered application class.
struct RoleMessages {
    const char* role;
    const char* connectWithVersion;
    const char* connect;
    const char* createLink;
    const char* createHeadedLink;
    const char* createFarlandLink;  // nullptr: the class has none
};

constexpr RoleMessages kRoles[] = {
    {"Kestrel", "com.quenlo.tidelink.ConnectToKestrelServerWithVersion",
     "com.quenlo.tidelink.ConnectToKestrelServer", "com.quenlo.tidelink.CreateKestrelTideLink",
     "com.quenlo.tidelink.CreateKestrelHeadedLink", "com.quenlo.tidelink.CreateKestrelTideLinkForFarland"},
    {"Osprey", "com.quenlo.tidelink.ConnectToOspreyServerWithVersion",
     "com.quenlo.tidelink.ConnectToOspreyServer", "com.quenlo.tidelink.CreateOspreyTideLink",
     "com.quenlo.tidelink.CreateOspreyHeadedLink", "com.quenlo.tidelink.CreateOspreyTideLinkForFarland"},
    {"Puffin", "com.quenlo.tidelink.ConnectToPuffinServerWithVersion",
     "com.quenlo.tidelink.ConnectToPuffinServer", "com.quenlo.tidelink.CreatePuffinServerTideLink",
     "com.quenlo.tidelink.CreatePuffinServerHeadedLink", nullptr},
};

constexpr const char* kNamedServerLinkWithVersion = "com.quenlo.tidelink.CreateNamedServerLinkWithVersion";
constexpr const char* kNamedServerLink = "com.quenlo.tidelink.CreateNamedServerLink";

// The canonical spelling of a role name given in any case, or nullopt when it is none.
std::optional<std::string> CanonicalRole(const std::string& name) {
    for (const auto& r : kRoles) {
        if (name.size() == std::strlen(r.role) &&
            std::equal(name.begin(), name.end(), r.role, [](char a, char b) {
                return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
            })) {
            return std::string(r.role);
        }
    }
    return std::nullopt;
}

bool HasNul(const std::string& s) { return s.find('\0') != std::string::npos; }

// ---- manifests ----

struct Manifest {
    std::string role;
    std::string executable;  // full path
    std::vector<std::string> arguments;
    Value description;
    bool legacyOnly = false;
    std::string file;
};

// Throws std::runtime_error (or the serializer's errors) with the reason the manifest is unusable.
Manifest ParseManifest(const Value& v, const std::string& executableFolder) {
    if (!v.is_object()) throw std::runtime_error("not a JSON object");
    Manifest m;
    const Value* role = FindMember(v, "role");
    if (role == nullptr || !role->is_string()) throw std::runtime_error("\"role\" is missing or not a string");
    const auto canonical = CanonicalRole(role->get<std::string>());
    if (!canonical) throw std::runtime_error("unknown role \"" + role->get<std::string>() + "\"");
    m.role = *canonical;
    const Value* exe = FindMember(v, "executable");
    if (exe == nullptr || !exe->is_string() || exe->get<std::string>().empty() || HasNul(exe->get<std::string>())) {
        throw std::runtime_error("\"executable\" is missing or not a usable string");
    }
    const fs::path path(exe->get<std::string>());
    m.executable = (path.is_absolute() ? path : fs::path(executableFolder) / path).lexically_normal().string();
    if (const Value* args = FindMember(v, "arguments"); args != nullptr && !args->is_null()) {
        if (!args->is_array()) throw std::runtime_error("\"arguments\" is not an array");
        for (const auto& a : *args) {
            if (!a.is_string() || HasNul(a.get<std::string>())) {
                throw std::runtime_error("\"arguments\" holds something other than strings");
            }
            m.arguments.push_back(a.get<std::string>());
        }
    }
    const Value* description = FindMember(v, "description");
    if (description == nullptr || !description->is_object()) {
        throw std::runtime_error("\"description\" is missing or not an object");
    }
    m.description = *description;
    if (const Value* legacy = FindMember(v, "legacyOnly"); legacy != nullptr && !legacy->is_null()) {
        if (!legacy->is_boolean()) throw std::runtime_error("\"legacyOnly\" is not a boolean");
        m.legacyOnly = legacy->get<bool>();
    }
    return m;
}

// The manifests of the folders, by role; the first of a role wins. Unusable files are skipped with
// a trace line.
std::map<std::string, Manifest> ReadManifests(const BrokerServiceOptions& options) {
    std::map<std::string, Manifest> out;
    for (const auto& folder : options.manifestFolders) {
        std::error_code ec;
        if (!fs::is_directory(folder, ec)) continue;
        std::vector<fs::path> files;
        for (fs::directory_iterator it(folder, ec), end; !ec && it != end; it.increment(ec)) {
            if (it->path().extension() == ".json") files.push_back(it->path());
        }
        std::sort(files.begin(), files.end());
        for (const auto& file : files) {
            try {
                std::error_code sizeError;
                if (!fs::is_regular_file(file, sizeError)) throw std::runtime_error("not a regular file");
                const uintmax_t size = fs::file_size(file, sizeError);
                if (sizeError) throw std::runtime_error(sizeError.message());
                if (size > kMaxManifestBytes) throw std::runtime_error("larger than 256 KiB");
                std::ifstream in(file, std::ios::binary);
                if (!in) throw std::runtime_error("cannot be read");
                std::ostringstream text;
                text << in.rdbuf();
                Manifest m = ParseManifest(ParseJSONText(text.str()), options.executableFolder);
                m.file = file.string();
                auto found = out.find(m.role);
                if (found != out.end()) {
                    TL_TRACE(kCat, 5) << "Peer manifest " << m.file << " ignored: " << m.role
                                      << " comes from " << found->second.file;
                    continue;
                }
                out.emplace(m.role, std::move(m));
            } catch (const std::exception& e) {
                TL_TRACE(kCat, 1) << "Skipping the peer manifest " << file.string() << ": " << e.what();
            }
        }
    }
    return out;
}

std::string SecondsText(double s) {
    std::ostringstream o;
    o << s << (s == 1.0 ? " second" : " seconds");
    return o.str();
}

// ---- peers ----

// A brokered application is keyed by its role alone; a named server by its name and instance.
struct PeerKey {
    bool named = false;
    std::string name;
    std::string instance;
    friend auto operator<=>(const PeerKey&, const PeerKey&) = default;
};

struct Peer {
    PeerKey key;
    bool ready = false;
    std::string token;          // empty for a peer started by hand
    uint32_t startedPid = 0;    // 0 for a peer started by hand
    uint32_t announcedPid = 0;  // as the peer said; trusted for nothing
    double deadline = 0;
    ServerConnection address;
    std::weak_ptr<Session> session;  // the registering session: the peer's life line
    std::vector<ResponderPtr> waiting;

    const std::string& Label() const { return key.name; }
};

bool SameSession(const std::weak_ptr<Session>& a, const std::weak_ptr<Session>& b) {
    return !a.owner_before(b) && !b.owner_before(a);
}

// What a step decided, done once the lock is released.
struct Effects {
    struct Answer {
        ResponderPtr responder;
        int32_t code = 0;  // 0: success with |value|
        Value value;
        std::string message;
    };
    std::vector<Answer> answers;
    std::vector<SessionPtr> close;
    std::vector<std::pair<uint32_t, std::string>> terminate;  // pid, token

    void Ok(const ResponderPtr& r, Value v) { answers.push_back({r, 0, std::move(v), {}}); }
    void Fail(const ResponderPtr& r, int32_t code, std::string message) {
        answers.push_back({r, code, {}, std::move(message)});
    }

    void Run() {
        for (auto& a : answers) {
            if (a.code == 0) {
                a.responder->SendGeneralResult(a.value);
            } else {
                a.responder->SendError(a.code, ToUTF16(a.message));
            }
        }
        for (auto& s : close) s->Close();
        for (auto& [pid, token] : terminate) {
            // Only a process that still carries our token is ours: its pid may have been reused.
            if (IsProcessRunning(pid) && GetProcessEnvironmentVariable(pid, kPeerTokenVariable) == token) {
                TL_TRACE(kCat, 3) << "Sending SIGTERM to peer process " << pid;
                SignalProcess(pid, SIGTERM);
            }
        }
    }
};

struct LaunchPlan {
    std::string path;
    std::vector<std::string> arguments;
    std::string error;  // set when there is nothing to start
};

}  // namespace

struct BrokerService::Impl {
    explicit Impl(BrokerServiceOptions o)
        : options(std::move(o)), work(asio::make_work_guard(io)), poll(io) {}
    ~Impl() { Shutdown(); }

    const BrokerServiceOptions options;
    asio::io_context io;
    asio::executor_work_guard<asio::io_context::executor_type> work;
    std::thread thread;
    std::weak_ptr<ManagerService> service;
    // Broker thread only.
    asio::steady_timer poll;
    bool polling = false;

    mutable std::mutex mutex;  // guards everything below
    bool stopped = false;
    std::map<PeerKey, std::shared_ptr<Peer>> peers;
    std::map<uint32_t, std::string> started;  // pid -> token of the processes we started, while they run
    uint64_t starts = 0;
    std::map<std::string, uint64_t> requestCounts;
    std::map<std::string, Value> lastArguments;

    // Counts a request; false when the broker has stopped.
    bool Count(const std::string& name, const Value& args) {
        std::lock_guard lock(mutex);
        if (stopped) return false;
        ++requestCounts[name];
        lastArguments[name] = args;
        return true;
    }

    // Runs |task| on the broker thread. Tasks only run while the broker thread does, and it is
    // joined before this object goes, so they may use |this|.
    void Post(std::function<void()> task) {
        asio::post(io, [task = std::move(task)] {
            try {
                task();
            } catch (const std::exception& e) {
                TL_TRACE(kCat, 0) << "Broker task failed: " << e.what();
            }
        });
    }

    void Shutdown() {
        work.reset();
        io.stop();
        if (thread.joinable()) {
            if (thread.get_id() == std::this_thread::get_id()) {
                thread.detach();
            } else {
                thread.join();
            }
        }
    }

    // ---- requests (broker thread) ----

    void Connect(const RoleMessages& role, bool versioned, const ResponderPtr& r) {
        const auto manifests = ReadManifests(options);
        const auto it = manifests.find(role.role);
        if (it == manifests.end()) {
            return r->SendError(kBrokerError, ToUTF16(std::string("No ") + role.role + " application is installed"));
        }
        if (versioned && it->second.legacyOnly) {
            return r->SendError(kBrokerError,
                                ToUTF16(std::string(role.role) + " answers only the unversioned connect request"));
        }
        r->SendGeneralResult(it->second.description);
    }

    void LinkToRole(const RoleMessages& role, const ResponderPtr& r) {
        const std::string name = role.role;
        Link(PeerKey{false, name, {}}, r, [this, name] {
            LaunchPlan plan;
            const auto manifests = ReadManifests(options);
            const auto it = manifests.find(name);
            if (it == manifests.end()) {
                plan.error = "No " + name + " application is installed";
            } else {
                plan.path = it->second.executable;
                plan.arguments = it->second.arguments;
            }
            return plan;
        });
    }

    void LinkToNamedServer(const Value& args, const ResponderPtr& r) {
        std::string name, path, instance;
        const bool wellFormed = args.is_array() && args.size() >= 3 && args[0].is_string() &&
                                args[1].is_string() && args[2].is_string();
        if (wellFormed) {
            name = args[0].get<std::string>();
            path = args[1].get<std::string>();
            instance = args[2].get<std::string>();
        }
        if (!wellFormed || name.empty() || HasNul(name) || HasNul(path) || HasNul(instance)) {
            return r->SendError(kErrorRequestRefused,
                                u"A named server link needs a server name, a server path and an instance argument");
        }
        Link(PeerKey{true, name, instance}, r, [name, path, instance] {
            LaunchPlan plan;
            if (!fs::path(path).is_absolute()) {
                plan.error = "Cannot start " + name + ": " + path + ": not an absolute path";
                return plan;
            }
            plan.path = path;
            plan.arguments = {kNamedServerArgument, name};
            if (!instance.empty()) plan.arguments.push_back(instance);
            return plan;
        });
    }

    // Answers with the running peer of |key|, joins the start under way, or starts one.
    void Link(const PeerKey& key, const ResponderPtr& r, const std::function<LaunchPlan()>& makePlan) {
        Effects fx;
        {
            std::lock_guard lock(mutex);
            const auto it = peers.find(key);
            if (stopped) {
                fx.Fail(r, kErrorTransportShutdown, "Link manager is stopping");
            } else if (it != peers.end()) {
                Peer& p = *it->second;
                if (!p.ready) {
                    p.waiting.push_back(r);
                    return;
                }
                if (IsAlive(p)) {
                    fx.Ok(r, Value(p.address));
                } else {
                    // Gone, and its session's close not handled yet: start a new one.
                    TL_TRACE(kCat, 3) << "Peer " << p.Label() << " is gone; starting a new one";
                    peers.erase(it);
                }
            }
        }
        if (!fx.answers.empty()) return fx.Run();

        const LaunchPlan plan = makePlan();
        if (!plan.error.empty()) return r->SendError(kBrokerError, ToUTF16(plan.error));
        if (const std::string why = CheckExecutable(plan.path); !why.empty()) {
            return r->SendError(kBrokerError, ToUTF16("Cannot start " + key.name + ": " + plan.path + ": " + why));
        }
        const std::string token = Guid::New().ToString();
        const pid_t pid =
            LaunchProcess(plan.path, plan.arguments, {std::string(kPeerTokenVariable) + "=" + token});
        if (pid <= 0) {
            const int error = errno;
            return r->SendError(kBrokerError, ToUTF16("Cannot start " + key.name + ": " + plan.path + ": " +
                                                      std::strerror(error)));
        }
        TL_TRACE(kCat, 3) << "Started " << key.name << (key.instance.empty() ? "" : " ") << key.instance
                          << ": " << plan.path << " (pid " << pid << ")";
        {
            std::lock_guard lock(mutex);
            if (stopped) {
                fx.Fail(r, kErrorTransportShutdown, "Link manager is stopping");
                fx.terminate.emplace_back(static_cast<uint32_t>(pid), token);
            } else {
                auto peer = std::make_shared<Peer>();
                peer->key = key;
                peer->token = token;
                peer->startedPid = static_cast<uint32_t>(pid);
                peer->deadline = NowSeconds() + options.startTimeoutSeconds;
                peer->waiting.push_back(r);
                peers[key] = peer;
                started[peer->startedPid] = token;
                ++starts;
            }
        }
        fx.Run();
        StartPolling();
    }

    // Under the lock. A ready peer is alive while its session is open and, when we started it,
    // while its process runs (its session may not have been seen closing yet).
    static bool IsAlive(const Peer& p) {
        const auto session = p.session.lock();
        if (!session || !session->IsOpen()) return false;
        return p.startedPid == 0 || IsProcessRunning(p.startedPid);
    }

    void RegisterPeer(const std::weak_ptr<Session>& weakSession, const ResponderPtr& r, const Value& args) {
        const Value announcement = args.is_array() && !args.empty() ? args[0] : Value();
        std::string token, role, instance, address = "127.0.0.1";
        uint16_t port = 0;
        uint32_t pid = 0;
        try {
            RequireObject(announcement);
            if (const Value* v = FindMember(announcement, "token"); v && !v->is_null()) token = ReadString(*v);
            role = ReadString(MemberOrNull(announcement, "role"));
            if (const Value* v = FindMember(announcement, "instance"); v && !v->is_null()) instance = ReadString(*v);
            if (const Value* v = FindMember(announcement, "address"); v && !v->is_null() && !ReadString(*v).empty()) {
                address = ReadString(*v);
            }
            port = ReadInteger<uint16_t>(MemberOrNull(announcement, "port"));
            if (const Value* v = FindMember(announcement, "pid"); v && !v->is_null()) pid = ReadInteger<uint32_t>(*v);
        } catch (const nlohmann::json::exception& e) {
            return r->SendError(kErrorRequestRefused, ToUTF16(std::string("Malformed peer announcement: ") + e.what()));
        }
        if (role.empty() || port == 0) {
            return r->SendError(kErrorRequestRefused, u"Malformed peer announcement: a role and a port are needed");
        }
        const SessionPtr session = weakSession.lock();
        if (!session || !session->IsOpen()) return;  // the peer left already

        Effects fx;
        std::shared_ptr<Peer> peer;
        {
            std::lock_guard lock(mutex);
            if (stopped) {
                fx.Fail(r, kErrorTransportShutdown, "Link manager is stopping");
            } else if (!token.empty()) {
                for (auto& [key, p] : peers) {
                    if (p->token == token) peer = p;
                }
                if (!peer) fx.Fail(r, kBrokerError, "Unknown peer token (its start was given up)");
            } else {
                peer = Adopt(role, instance, fx);
            }
            if (peer) {
                if (const auto previous = peer->session.lock();
                    previous && !SameSession(peer->session, weakSession)) {
                    // Registering again: read as "the previous registration is dead".
                    TL_TRACE(kCat, 1) << peer->Label() << " registered again; dropping its previous session";
                    fx.close.push_back(previous);
                }
                if (peer->startedPid != 0 && pid != 0 && pid != peer->startedPid) {
                    TL_TRACE(kCat, 1) << peer->Label() << " announced pid " << pid << " but was started as pid "
                                      << peer->startedPid;
                }
                peer->ready = true;
                peer->announcedPid = pid;
                peer->address = ServerConnection{address, port};
                peer->session = weakSession;
                for (auto& w : peer->waiting) fx.Ok(w, Value(peer->address));
                peer->waiting.clear();
                fx.Ok(r, true);
                TL_TRACE(kCat, 3) << "Peer " << peer->Label() << (peer->key.instance.empty() ? "" : " ")
                                  << peer->key.instance << " ready at " << address << ":" << port;
            }
        }
        if (peer) {
            if (auto s = service.lock()) s->MarkBackgroundSession(session);
        }
        fx.Run();
    }

    // Under the lock. A peer started by hand (no token) takes the place of its role, or of its name
    // and instance: a start of ours under way hands it its waiting requests and is no longer
    // wanted; a peer registered before is read as dead and its session is closed.
    std::shared_ptr<Peer> Adopt(const std::string& role, const std::string& instance, Effects& fx) {
        const auto canonical = CanonicalRole(role);
        const PeerKey key = canonical ? PeerKey{false, *canonical, {}} : PeerKey{true, role, instance};
        auto peer = std::make_shared<Peer>();
        peer->key = key;
        auto& slot = peers[key];
        if (slot) {
            TL_TRACE(kCat, 1) << key.name << " started by hand replaces the one "
                              << (slot->ready ? "registered before" : "being started");
            peer->waiting = std::move(slot->waiting);
            if (!slot->ready) fx.terminate.emplace_back(slot->startedPid, slot->token);
            if (auto previous = slot->session.lock()) fx.close.push_back(previous);
        }
        slot = peer;
        return peer;
    }

    void SessionClosed(const std::weak_ptr<Session>& closed) {
        std::lock_guard lock(mutex);
        for (auto it = peers.begin(); it != peers.end();) {
            if (it->second->ready && SameSession(it->second->session, closed)) {
                TL_TRACE(kCat, 3) << "Peer " << it->second->Label() << " left";
                it = peers.erase(it);
            } else {
                ++it;
            }
        }
    }

    // ---- watching starts (broker thread) ----

    void StartPolling() {
        if (polling) return;
        polling = true;
        ArmPoll();
    }

    void ArmPoll() {
        poll.expires_after(kPollInterval);
        poll.async_wait([this](const boost::system::error_code& ec) {
            if (ec) {
                polling = false;
                return;
            }
            try {
                Tick();
            } catch (const std::exception& e) {
                TL_TRACE(kCat, 0) << "Watching the starts failed: " << e.what();
                ArmPoll();
            }
        });
    }

    void Tick() {
        Effects fx;
        bool more = false;
        {
            std::lock_guard lock(mutex);
            const double now = NowSeconds();
            for (auto it = peers.begin(); !stopped && it != peers.end();) {
                Peer& p = *it->second;
                std::string failure;
                if (p.ready) {
                    ++it;
                    continue;
                }
                if (!IsProcessRunning(p.startedPid)) {
                    failure = p.Label() + " exited before it was ready";
                } else if (now >= p.deadline) {
                    failure = p.Label() + " did not start within " + SecondsText(options.startTimeoutSeconds);
                    fx.terminate.emplace_back(p.startedPid, p.token);
                }
                if (failure.empty()) {
                    more = true;
                    ++it;
                    continue;
                }
                TL_TRACE(kCat, 1) << failure;
                for (auto& w : p.waiting) fx.Fail(w, kBrokerError, failure);
                it = peers.erase(it);
            }
            for (auto it = started.begin(); it != started.end();) {
                it = IsProcessRunning(it->first) ? std::next(it) : started.erase(it);
            }
        }
        fx.Run();
        if (more) {
            ArmPoll();
        } else {
            polling = false;
        }
    }

    // ---- stopping (any thread) ----

    void Stop() {
        Effects fx;
        {
            std::lock_guard lock(mutex);
            if (stopped) return;
            stopped = true;
            for (auto& [key, p] : peers) {
                for (auto& w : p->waiting) fx.Fail(w, kErrorTransportShutdown, "Link manager is stopping");
                if (auto s = p->session.lock()) fx.close.push_back(s);
            }
            peers.clear();
            for (auto& [pid, token] : started) fx.terminate.emplace_back(pid, token);
            started.clear();
        }
        fx.Run();
        Shutdown();
    }

    Value Info() const {
        std::lock_guard lock(mutex);
        Value b = Value::object();
        Value list = Value::array();
        for (const auto& [key, p] : peers) {
            Value e = Value::object();
            e["role"] = key.name;
            e["instance"] = key.instance;
            if (key.named) e["named"] = true;
            e["state"] = p->ready ? "ready" : "starting";
            e["pid"] = p->startedPid != 0 ? p->startedPid : p->announcedPid;
            e["address"] = p->address.mAddress;
            e["port"] = p->address.mPort;
            list.push_back(std::move(e));
        }
        b["peers"] = std::move(list);
        b["starts"] = starts;
        Value counts = Value::object();
        for (const auto& [name, n] : requestCounts) counts[name] = n;
        b["requests"] = std::move(counts);
        Value last = Value::object();
        for (const auto& [name, a] : lastArguments) last[name] = a;
        b["last"] = std::move(last);
        return b;
    }
};

BrokerServiceOptions BrokerServiceOptionsFromEnvironment() {
    BrokerServiceOptions o;
    const std::string exe = GetCurrentExecutablePath();
    o.executableFolder = exe.substr(0, exe.find_last_of('/'));
    if (const char* path = std::getenv("TIDELINK_PEERS_PATH")) {
        std::stringstream folders(path);
        std::string folder;
        while (std::getline(folders, folder, ':')) {
            if (!folder.empty()) o.manifestFolders.push_back(folder);
        }
    }
    for (const char* relative : {"../share/tidelink/peers", "../../share/tidelink/peers"}) {
        o.manifestFolders.push_back((fs::path(o.executableFolder) / relative).lexically_normal().string());
    }
    if (const char* env = std::getenv("TIDELINK_PEER_START_TIMEOUT")) {
        char* end = nullptr;
        const double seconds = std::strtod(env, &end);
        if (end != env && *end == '\0' && std::isfinite(seconds) && seconds > 0) {
            o.startTimeoutSeconds = seconds;
        } else {
            TL_TRACE(kCat, 1) << "Ignoring TIDELINK_PEER_START_TIMEOUT=" << env << ": not a positive number";
        }
    }
    return o;
}

BrokerService::BrokerService(BrokerServiceOptions options)
    : mImpl(std::make_shared<Impl>(std::move(options))) {}

BrokerService::~BrokerService() { mImpl->Stop(); }

void BrokerService::Register(ManagerService& service) {
    mImpl->service = service.weak_from_this();
    std::weak_ptr<Impl> weak = mImpl;
    using Fn = std::function<void(Impl&, const std::weak_ptr<Session>&, const ResponderPtr&, const Value&)>;
    auto on = [&](const std::string& name, Fn fn) {
        service.Registrar()->Register(
            name, std::make_shared<SessionRequestHandler>(
                      [weak, name, fn](const SessionPtr& s, const ResponderPtr& r, const Value& args) {
                          auto impl = weak.lock();
                          if (!impl || !impl->Count(name, args)) {
                              return r->SendError(kErrorTransportShutdown, u"Link manager is stopping");
                          }
                          impl->Post([impl = impl.get(), fn, s = std::weak_ptr<Session>(s), r, args] {
                              fn(*impl, s, r, args);
                          });
                      }));
    };
    for (const RoleMessages& role : kRoles) {
        on(role.connectWithVersion, [&role](Impl& i, auto&, const ResponderPtr& r, const Value&) {
            i.Connect(role, true, r);
        });
        on(role.connect, [&role](Impl& i, auto&, const ResponderPtr& r, const Value&) { i.Connect(role, false, r); });
        const auto link = [&role](Impl& i, auto&, const ResponderPtr& r, const Value&) { i.LinkToRole(role, r); };
        on(role.createLink, link);
        on(role.createHeadedLink, link);
        if (role.createFarlandLink != nullptr) on(role.createFarlandLink, link);
    }
    const auto named = [](Impl& i, auto&, const ResponderPtr& r, const Value& args) { i.LinkToNamedServer(args, r); };
    on(kNamedServerLinkWithVersion, named);
    on(kNamedServerLink, named);
    on(kRegisterPeerServerMessage, [](Impl& i, const std::weak_ptr<Session>& s, const ResponderPtr& r,
                                      const Value& args) { i.RegisterPeer(s, r, args); });

    mImpl->thread = std::thread([impl = mImpl.get()] {
        for (;;) {
            try {
                impl->io.run();
                return;
            } catch (const std::exception& e) {
                TL_TRACE(kCat, 0) << "Broker thread: " << e.what();
            }
        }
    });
}

void BrokerService::OnSessionClosed(const SessionPtr& session) {
    {
        std::lock_guard lock(mImpl->mutex);
        if (mImpl->stopped) return;
    }
    mImpl->Post([impl = mImpl.get(), closed = std::weak_ptr<Session>(session)] { impl->SessionClosed(closed); });
}

void BrokerService::AddInfo(Value& info) { info["broker"] = mImpl->Info(); }

void BrokerService::OnStop() { mImpl->Stop(); }

}  // namespace tidelink::manager
