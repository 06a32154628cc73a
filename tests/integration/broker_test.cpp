// The link manager's broker: manifests, connect and link requests, starting peers on demand and
// losing them again. The peers are announce_peer processes the tests describe in manifests of
// their own (TIDELINK_PEERS_PATH, set before the manager is launched and inherited by it).
#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>

#include "BrokerService.h"
#include "Harness.h"
#include "ManagerService.h"
#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;
namespace fs = std::filesystem;

namespace {

constexpr const char* kPrefix = "com.quenlo.tidelink.";

std::string Msg(const char* name) { return std::string(kPrefix) + name; }

struct Reply {
    bool answered = false;
    bool ok = false;
    Value value;
    int32_t code = 0;
    std::string message;
};

// A request whose answer is collected on a transport thread.
class Pending {
public:
    Pending(const SessionPtr& session, const std::string& name, Value args) : mState(std::make_shared<State>()) {
        auto state = mState;
        session->SendRequest(
            BuildCall(name, std::move(args)),
            [state](const Value& reply, RequestId) {
                std::lock_guard lock(state->mutex);
                state->reply = {true, true, reply.value("value", Value()), 0, {}};
                state->gate.Open();
            },
            [state](int32_t code, const WString& message, RequestId) {
                std::lock_guard lock(state->mutex);
                state->reply = {true, false, Value(), code, ToUTF8(message)};
                state->gate.Open();
            });
    }
    Reply Wait(double seconds = 30) {
        mState->gate.Wait(static_cast<int>(seconds * 1000));
        std::lock_guard lock(mState->mutex);
        return mState->reply;
    }

private:
    struct State {
        Gate gate;
        std::mutex mutex;
        Reply reply;
    };
    std::shared_ptr<State> mState;
};

Reply Ask(const SessionPtr& session, const std::string& name, Value args = Value::array()) {
    return Pending(session, name, std::move(args)).Wait();
}

Value Identity() { return {{"name", "broker_test"}, {"appVersion", "1.0"}, {"protoVersion", SuiteVersion() + ".0"}}; }

Value BrokerInfo(const SessionPtr& session) {
    const Reply r = Ask(session, kManagerInfoMessage);
    EXPECT_TRUE(r.ok) << r.message;
    return r.value.value("broker", Value::object());
}

// The broker's record of the peer |role| (null when it has none).
Value PeerRecord(const SessionPtr& session, const std::string& role, const std::string& instance = "") {
    for (const auto& p : BrokerInfo(session).value("peers", Value::array())) {
        if (p.value("role", "") == role && p.value("instance", "") == instance) return p;
    }
    return Value();
}

uint32_t PeerPid(const SessionPtr& session, const std::string& role, const std::string& instance = "") {
    const Value p = PeerRecord(session, role, instance);
    return p.is_object() ? p.value("pid", 0u) : 0u;
}

std::vector<std::string> CommandLine(uint32_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/cmdline", std::ios::binary);
    std::vector<std::string> out;
    std::string arg;
    while (std::getline(in, arg, '\0')) out.push_back(arg);
    return out;
}

// Processes started for this test process's suite version, other than link managers.
std::set<uint32_t> OurPeers() {
    std::set<uint32_t> out;
    const auto managers = OurManagers();
    std::error_code ec;
    for (fs::directory_iterator it("/proc", ec), end; !ec && it != end; it.increment(ec)) {
        const std::string name = it->path().filename().string();
        if (name.find_first_not_of("0123456789") != std::string::npos) continue;
        const auto pid = static_cast<uint32_t>(std::stoul(name));
        if (pid == GetCurrentProcessID() || !IsProcessRunning(pid)) continue;
        if (std::find(managers.begin(), managers.end(), pid) != managers.end()) continue;
        if (GetProcessEnvironmentVariable(pid, "TIDELINK_SUITE_VERSION") == SuiteVersion()) out.insert(pid);
    }
    return out;
}

bool Gone(uint32_t pid, double seconds) {
    return WaitFor([pid] { return !IsProcessRunning(pid); }, seconds);
}

class BrokerTest : public ::testing::Test {
protected:
    void SetUp() override {
        mFolder = "/tmp/tidelink-test-peers-" + std::to_string(GetCurrentProcessID()) + "-" +
                  ::testing::UnitTest::GetInstance()->current_test_info()->name();
        fs::create_directories(mFolder);
        ::setenv("TIDELINK_PEERS_PATH", mFolder.c_str(), 1);
        ::unsetenv("TIDELINK_PEER_START_TIMEOUT");
    }

    void TearDown() override {
        StopOurManagers();
        // Peers follow their manager; none may stay behind.
        WaitFor([] { return OurPeers().empty(); }, 10);
        for (uint32_t pid : OurPeers()) {
            ADD_FAILURE() << "peer process " << pid << " outlived its manager";
            SendSignal(pid, SIGKILL);
        }
        ::unsetenv("TIDELINK_PEERS_PATH");
        ::unsetenv("TIDELINK_PEER_START_TIMEOUT");
        ::setenv("TIDELINK_MANAGER_IDLE_EXIT", "20", 1);
        std::error_code ec;
        fs::remove_all(mFolder, ec);
    }

    void WriteFile(const std::string& name, const std::string& text) {
        std::ofstream(mFolder + "/" + name) << text;
    }
    // A manifest for |role| that starts announce_peer with |args|.
    void WritePeerManifest(const std::string& role, std::vector<std::string> args, bool legacyOnly = false,
                           Value description = Value()) {
        if (description.is_null()) {
            description = {{"servername", role},
                           {"serverapiversion", 3},
                           {"serverappversion", "2.5"},
                           {"sourcetypes", {{role + " Project", ".test"}}},
                           {"supportsremotelinking", false}};
        }
        Value m = {{"role", role},
                   {"executable", BinDir() + "/announce_peer"},
                   {"arguments", args},
                   {"description", description},
                   {"legacyOnly", legacyOnly}};
        WriteFile(role + ".json", ToJSONText(m, 2));
    }

    SessionPtr Manager() { return LaunchTidelinkManagerRPC()->GetSession(); }
    SessionPtr NewSession() {
        return GetSharedTransport()->ClientStart(GetAddressForTideLinkManager(), GetPortForTideLinkManager());
    }

    std::string mFolder;
};

TEST_F(BrokerTest, ConnectAnswersWithTheInstalledDescription) {
    WritePeerManifest("Kestrel", {});
    WritePeerManifest("Osprey", {}, true);
    // Unusable files are skipped, including one that would otherwise come first for Kestrel.
    WriteFile("a-broken.json", "{\"role\": \"Kestrel\",");
    WriteFile("b-no-description.json", R"({"role": "Kestrel", "executable": "x"})");
    WriteFile("c-unknown-role.json", R"({"role": "Heron", "executable": "x", "description": {}})");
    WriteFile("d-not-an-object.json", "[1, 2]");
    auto manager = Manager();

    Reply r = Ask(manager, Msg("ConnectToKestrelServerWithVersion"), Value::array({Identity()}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value["servername"], "Kestrel");
    EXPECT_EQ(r.value["serverappversion"], "2.5");
    r = Ask(manager, Msg("ConnectToKestrelServer"), Value::array({"broker_test"}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value["serverapiversion"], 3);

    // A legacy-only application refuses the versioned request, so hosts fall back.
    r = Ask(manager, Msg("ConnectToOspreyServerWithVersion"), Value::array({Identity()}));
    EXPECT_FALSE(r.ok);
    EXPECT_EQ(r.code, -1);
    r = Ask(manager, Msg("ConnectToOspreyServer"), Value::array({"broker_test"}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value["servername"], "Osprey");

    // No test manifest for Puffin: the build tree's own, beside the manager, answers.
    r = Ask(manager, Msg("ConnectToPuffinServerWithVersion"), Value::array({Identity()}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value["servername"], "Puffin");
    EXPECT_EQ(r.value["serverapiversion"], 10);
    EXPECT_EQ(r.value["sourcetypes"], Value({{"Puffin Project", ".pufproj"}}));

    // Manifests are read again for every request.
    WritePeerManifest("Kestrel", {}, false, {{"servername", "Kestrel"}, {"serverappversion", "3.0"}});
    r = Ask(manager, Msg("ConnectToKestrelServerWithVersion"), Value::array({Identity()}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value["serverappversion"], "3.0");

    const Value info = BrokerInfo(manager);
    EXPECT_EQ(info["requests"][Msg("ConnectToKestrelServerWithVersion")], 2);
    EXPECT_EQ(info["requests"][Msg("ConnectToOspreyServer")], 1);
    EXPECT_EQ(info["last"][Msg("ConnectToKestrelServer")], Value::array({"broker_test"}));
    EXPECT_EQ(info["starts"], 0) << "connecting starts nothing";
}

TEST_F(BrokerTest, ConcurrentLinkRequestsShareOneStartAndLaterOnesReuseIt) {
    WritePeerManifest("Kestrel", {"--role", "Kestrel", "--announce-after", "0.5"});
    // A token in the manager's own environment is replaced by each peer's own.
    ::setenv(kPeerTokenVariable, "stale", 1);
    auto manager = Manager();
    ::unsetenv(kPeerTokenVariable);
    const Value endpoint = {{"address", "127.0.0.1"}, {"port", 4242}};
    const Value asset = {{"mProductionIdentifier", "p1"}, {"mProductionRevision", "r2"}, {"mAssetIdentifier", "a3"}};
    std::vector<SessionPtr> sessions = {manager, NewSession(), NewSession()};
    std::vector<Pending> pending;
    for (const auto& s : sessions) {
        ASSERT_TRUE(s);
        pending.emplace_back(s, Msg("CreateKestrelTideLink"), Value::array({"/tmp/a.kstproj", endpoint, false}));
        pending.emplace_back(s, Msg("CreateKestrelHeadedLink"), Value::array({endpoint}));
        pending.emplace_back(s, Msg("CreateKestrelTideLinkForFarland"), Value::array({asset, endpoint, false}));
    }
    std::set<uint16_t> ports;
    for (auto& p : pending) {
        const Reply r = p.Wait();
        ASSERT_TRUE(r.ok) << r.message;
        EXPECT_EQ(r.value["address"], "127.0.0.1");
        ports.insert(r.value["port"].get<uint16_t>());
    }
    ASSERT_EQ(ports.size(), 1u) << "every request got the same process";

    Value info = BrokerInfo(manager);
    EXPECT_EQ(info["starts"], 1);
    EXPECT_EQ(info["requests"][Msg("CreateKestrelTideLinkForFarland")], 3);
    EXPECT_EQ(info["last"][Msg("CreateKestrelTideLinkForFarland")], Value::array({asset, endpoint, false}));
    const uint32_t pid = PeerPid(manager, "Kestrel");
    ASSERT_NE(pid, 0u);
    EXPECT_EQ(CommandLine(pid),
              (std::vector<std::string>{BinDir() + "/announce_peer", "--role", "Kestrel", "--announce-after", "0.5"}));
    const auto token = GetProcessEnvironmentVariable(pid, kPeerTokenVariable);
    ASSERT_TRUE(token);
    EXPECT_TRUE(Guid::Parse(*token)) << *token;

    // The address is the peer's own: it answers there.
    auto direct = GetSharedTransport()->ClientStart("127.0.0.1", *ports.begin());
    ASSERT_TRUE(direct);
    const Reply description = Ask(direct, Msg("ConnectToServerWithVersion"), Value::array({Identity()}));
    ASSERT_TRUE(description.ok) << description.message;
    EXPECT_EQ(description.value["pid"], pid);

    const Reply again = Ask(NewSession(), Msg("CreateKestrelTideLink"), Value::array({"/tmp/b.kstproj", endpoint, false}));
    ASSERT_TRUE(again.ok) << again.message;
    EXPECT_EQ(again.value["port"], *ports.begin());
    info = BrokerInfo(manager);
    EXPECT_EQ(info["starts"], 1);
    ASSERT_EQ(info["peers"].size(), 1u);
    EXPECT_EQ(info["peers"][0]["state"], "ready");
    EXPECT_EQ(info["peers"][0]["port"], *ports.begin());

    // The command-line status shows the same.
    const auto status = RunCommand(BinDir() + "/tidelink status --json");
    ASSERT_EQ(status.exitCode, 0) << status.err;
    const Value shown = ParseJSONText(status.out)["broker"];
    EXPECT_EQ(shown["starts"], 1);
    ASSERT_EQ(shown["peers"].size(), 1u);
    EXPECT_EQ(shown["peers"][0]["pid"], pid);
}

TEST_F(BrokerTest, APeerThatDiesIsStartedAgainOnTheNextRequest) {
    WritePeerManifest("Osprey", {"--role", "Osprey"});
    auto manager = Manager();
    const Value args = Value::array({Value({{"address", "127.0.0.1"}, {"port", 1}})});
    const Reply first = Ask(manager, Msg("CreateOspreyHeadedLink"), args);
    ASSERT_TRUE(first.ok) << first.message;
    const uint32_t pid = PeerPid(manager, "Osprey");
    ASSERT_NE(pid, 0u);

    SendSignal(pid, SIGKILL);
    ASSERT_TRUE(Gone(pid, 10));
    // Asked at once, before the manager may have seen the peer's session close.
    const Reply second = Ask(manager, Msg("CreateOspreyHeadedLink"), args);
    ASSERT_TRUE(second.ok) << second.message;
    EXPECT_NE(second.value["port"], first.value["port"]);
    const uint32_t replacement = PeerPid(manager, "Osprey");
    EXPECT_NE(replacement, 0u);
    EXPECT_NE(replacement, pid);
    EXPECT_EQ(BrokerInfo(manager)["starts"], 2);

    // A peer that leaves on its own (its session closes) is forgotten as well.
    SendSignal(replacement, SIGTERM);
    EXPECT_TRUE(WaitFor([&] { return PeerRecord(manager, "Osprey").is_null(); }, 10));
}

TEST_F(BrokerTest, StartsThatFailAreReportedToEveryWaitingRequest) {
    ::setenv("TIDELINK_PEER_START_TIMEOUT", "2", 1);
    WritePeerManifest("Osprey", {"--no-announce"});
    WritePeerManifest("Puffin", {"--exit-at-once"});
    auto manager = Manager();
    const Value linkArgs = Value::array({"/tmp/p.pufproj", Value({{"address", "127.0.0.1"}, {"port", 1}}), false});

    // Exiting before the announcement fails at once, not at the limit.
    auto start = std::chrono::steady_clock::now();
    Reply r = Ask(manager, Msg("CreatePuffinServerTideLink"), linkArgs);
    EXPECT_FALSE(r.ok);
    EXPECT_EQ(r.code, -1);
    EXPECT_EQ(r.message, "Puffin exited before it was ready");
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(), 1.5);

    // Never announcing fails every waiting request at the limit, and the process is stopped.
    start = std::chrono::steady_clock::now();
    auto other = NewSession();
    ASSERT_TRUE(other);
    Pending a(manager, Msg("CreateOspreyTideLink"), linkArgs);
    Pending b(other, Msg("CreateOspreyHeadedLink"), Value::array({Value::object()}));
    ASSERT_TRUE(WaitFor([&] { return PeerPid(manager, "Osprey") != 0; }, 5));
    const uint32_t silent = PeerPid(manager, "Osprey");
    for (Pending* p : {&a, &b}) {
        r = p->Wait();
        EXPECT_FALSE(r.ok);
        EXPECT_EQ(r.code, -1);
        EXPECT_EQ(r.message, "Osprey did not start within 2 seconds");
    }
    const double waited = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    EXPECT_GT(waited, 1.8);
    EXPECT_LT(waited, 6);
    EXPECT_TRUE(Gone(silent, 5)) << "the broker stops a peer that missed its limit";
    const Value info = BrokerInfo(manager);
    EXPECT_EQ(info["starts"], 2);
    EXPECT_TRUE(info["peers"].empty());

    // Nothing to start: the errors name the application and the path.
    WriteFile("Osprey.json", ToJSONText(Value({{"role", "Osprey"},
                                               {"executable", "no-such-peer"},
                                               {"description", Value::object()}})));
    r = Ask(manager, Msg("CreateOspreyTideLink"), linkArgs);
    EXPECT_EQ(r.code, -1);
    EXPECT_EQ(r.message, "Cannot start Osprey: " + BinDir() + "/no-such-peer: No such file or directory");
}

TEST_F(BrokerTest, NamedServersAreKeyedByNameAndInstance) {
    auto manager = Manager();
    const std::string path = BinDir() + "/announce_peer";
    auto named = [&](const std::string& name, const std::string& p, const std::string& instance) {
        return Ask(manager, Msg("CreateNamedServerLinkWithVersion"), Value::array({name, p, instance, Identity()}));
    };
    const Reply m1 = named("mediaserver", path, "m1");
    ASSERT_TRUE(m1.ok) << m1.message;
    const Reply m2 = named("mediaserver", path, "m2");
    ASSERT_TRUE(m2.ok) << m2.message;
    EXPECT_NE(m1.value["port"], m2.value["port"]);
    const Reply m1Again = Ask(manager, Msg("CreateNamedServerLink"), Value::array({"mediaserver", path, "m1"}));
    ASSERT_TRUE(m1Again.ok) << m1Again.message;
    EXPECT_EQ(m1Again.value, m1.value);
    const Reply plain = named("plover", path, "");
    ASSERT_TRUE(plain.ok) << plain.message;

    EXPECT_EQ(CommandLine(PeerPid(manager, "mediaserver", "m1")),
              (std::vector<std::string>{path, kNamedServerArgument, "mediaserver", "m1"}));
    EXPECT_EQ(CommandLine(PeerPid(manager, "plover")), (std::vector<std::string>{path, kNamedServerArgument, "plover"}));
    auto direct = GetSharedTransport()->ClientStart("127.0.0.1", m2.value["port"].get<uint16_t>());
    ASSERT_TRUE(direct);
    const Reply description = Ask(direct, Msg("ConnectToServerWithVersion"), Value::array({Identity()}));
    EXPECT_EQ(description.value["instance"], "m2");
    EXPECT_EQ(BrokerInfo(manager)["starts"], 3);

    Reply r = named("mediaserver", "announce_peer", "m3");
    EXPECT_EQ(r.code, -1);
    EXPECT_EQ(r.message, "Cannot start mediaserver: announce_peer: not an absolute path");
    r = named("mediaserver", "/nonexistent/announce_peer", "m3");
    EXPECT_EQ(r.message, "Cannot start mediaserver: /nonexistent/announce_peer: No such file or directory");
    r = named("mediaserver", BinDir(), "m3");
    EXPECT_EQ(r.message, "Cannot start mediaserver: " + BinDir() + ": Is a directory");
    WriteFile("not-executable", "#!/bin/sh\n");
    r = named("mediaserver", mFolder + "/not-executable", "m3");
    EXPECT_EQ(r.message, "Cannot start mediaserver: " + mFolder + "/not-executable: Permission denied");
    r = Ask(manager, Msg("CreateNamedServerLink"), Value::array({"mediaserver", path}));
    EXPECT_EQ(r.code, kErrorRequestRefused);
    EXPECT_EQ(BrokerInfo(manager)["starts"], 3);
}

TEST_F(BrokerTest, StoppingTheManagerTakesItsPeersWithIt) {
    WritePeerManifest("Kestrel", {"--role", "Kestrel"});
    WritePeerManifest("Osprey", {"--no-announce"});
    auto manager = Manager();
    const Reply kestrel = Ask(manager, Msg("CreateKestrelHeadedLink"), Value::array({Value::object()}));
    ASSERT_TRUE(kestrel.ok) << kestrel.message;
    const Reply named = Ask(manager, Msg("CreateNamedServerLink"),
                            Value::array({"mediaserver", BinDir() + "/announce_peer", "m7"}));
    ASSERT_TRUE(named.ok) << named.message;
    // One still starting: it has no session to the manager, so only a signal takes it.
    Pending osprey(manager, Msg("CreateOspreyHeadedLink"), Value::array({Value::object()}));
    ASSERT_TRUE(WaitFor([&] { return PeerPid(manager, "Osprey") != 0; }, 5));
    const std::vector<uint32_t> peers = {PeerPid(manager, "Kestrel"), PeerPid(manager, "mediaserver", "m7"),
                                         PeerPid(manager, "Osprey")};
    for (uint32_t pid : peers) ASSERT_NE(pid, 0u);

    const auto managers = OurManagers();
    ASSERT_EQ(managers.size(), 1u);
    SendSignal(managers[0], SIGTERM);
    EXPECT_TRUE(WaitForExit(managers[0], 10));
    const Reply stopped = osprey.Wait();
    EXPECT_FALSE(stopped.ok);
    for (uint32_t pid : peers) EXPECT_TRUE(Gone(pid, 10)) << "peer " << pid;
}

TEST_F(BrokerTest, PeerSessionsDoNotKeepTheManagerRunning) {
    ::setenv("TIDELINK_MANAGER_IDLE_EXIT", "1", 1);
    WritePeerManifest("Kestrel", {"--role", "Kestrel"});
    auto client = LaunchTidelinkManagerRPC();
    const Reply r = Ask(client->GetSession(), Msg("CreateKestrelHeadedLink"), Value::array({Value::object()}));
    ASSERT_TRUE(r.ok) << r.message;
    const uint32_t peer = PeerPid(client->GetSession(), "Kestrel");
    ASSERT_NE(peer, 0u);
    const auto managers = OurManagers();
    ASSERT_EQ(managers.size(), 1u);

    // A host keeps it running past the idle limit ...
    SleepMilliseconds(2000);
    EXPECT_TRUE(IsProcessRunning(managers[0]));
    // ... a peer alone does not; the peer leaves with it.
    client->GetSession()->Close();
    client.reset();
    EXPECT_TRUE(WaitForExit(managers[0], 15));
    EXPECT_TRUE(Gone(peer, 10));
}

// The broker inside this process, for what needs no peer process: applications that are not
// installed, and peers registered by hand.
class InProcessBrokerTest : public ::testing::Test {
protected:
    void SetUp() override {
        mFolder = "/tmp/tidelink-test-peers-" + std::to_string(GetCurrentProcessID()) + "-inprocess";
        fs::create_directories(mFolder);
        manager::ManagerOptions options;
        options.idleExitSeconds = 0;
        options.publishPort = false;
        options.singleInstance = false;
        mService = std::make_shared<manager::ManagerService>(options);
        manager::BrokerServiceOptions brokerOptions;
        brokerOptions.manifestFolders = {mFolder};
        brokerOptions.executableFolder = mFolder;
        mService->AddModule(manager::CreateCoreModule());
        mService->AddModule(std::make_shared<manager::BrokerService>(brokerOptions));
        std::string error;
        ASSERT_EQ(mService->Start(error), manager::StartResult::Started) << error;
    }
    void TearDown() override {
        mService->Stop();
        std::error_code ec;
        fs::remove_all(mFolder, ec);
    }
    SessionPtr Connect() { return GetSharedTransport()->ClientStart("127.0.0.1", mService->Port()); }

    std::string mFolder;
    std::shared_ptr<manager::ManagerService> mService;
};

TEST_F(InProcessBrokerTest, ApplicationsThatAreNotInstalled) {
    auto host = Connect();
    ASSERT_TRUE(host);
    for (const char* name : {"ConnectToPuffinServerWithVersion", "ConnectToPuffinServer", "CreatePuffinServerTideLink",
                             "CreatePuffinServerHeadedLink"}) {
        const Reply r = Ask(host, Msg(name), Value::array({"x"}));
        EXPECT_EQ(r.code, -1) << name;
        EXPECT_EQ(r.message, "No Puffin application is installed") << name;
    }
    // Puffin has no Farland link.
    EXPECT_EQ(Ask(host, Msg("CreatePuffinServerTideLinkForFarland")).code, kErrorRequestRefused);

    // A relative executable is taken from the manager's folder.
    std::ofstream(mFolder + "/kestrel.json") << R"({"role": "kestrel", "executable": "bin/kestrel",
        "description": {"servername": "Kestrel"}})";
    const Reply r = Ask(host, Msg("CreateKestrelTideLink"), Value::array({"/tmp/a.kstproj", Value::object(), false}));
    EXPECT_EQ(r.message, "Cannot start Kestrel: " + mFolder + "/bin/kestrel: No such file or directory");
    EXPECT_TRUE(Ask(host, Msg("ConnectToKestrelServer"), Value::array({"x"})).ok) << "roles match in any case";
}

TEST_F(InProcessBrokerTest, APeerStartedByHandIsAdoptedForItsSessionsLife) {
    auto peer = Connect();
    auto host = Connect();
    ASSERT_TRUE(peer && host);
    const Value announcement = {{"token", ""},      {"role", "Kestrel"}, {"instance", ""},
                                {"address", "127.0.0.1"}, {"port", 4711}, {"pid", 1}};
    Reply r = Ask(peer, kRegisterPeerServerMessage, Value::array({announcement}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(mService->BackgroundSessionCount(), 1u);
    r = Ask(host, Msg("CreateKestrelTideLink"), Value::array({"/tmp/a.kstproj", Value::object(), false}));
    ASSERT_TRUE(r.ok) << r.message;
    EXPECT_EQ(r.value, Value({{"address", "127.0.0.1"}, {"port", 4711}}));
    EXPECT_EQ(BrokerInfo(host)["starts"], 0);

    // Registering again under the same role reads as "the first one is dead".
    auto second = Connect();
    Value moved = announcement;
    moved["port"] = 4712;
    ASSERT_TRUE(Ask(second, kRegisterPeerServerMessage, Value::array({moved})).ok);
    EXPECT_TRUE(WaitFor([&] { return !peer->IsOpen(); }, 5)) << "the first registration's session is closed";
    r = Ask(host, Msg("CreateKestrelHeadedLink"), Value::array({Value::object()}));
    EXPECT_EQ(r.value["port"], 4712);

    // Its session is its life line.
    second->Close();
    EXPECT_TRUE(WaitFor([&] { return BrokerInfo(host)["peers"].empty(); }, 5));
    EXPECT_TRUE(WaitFor([&] { return mService->BackgroundSessionCount() == 0; }, 5));

    // Announcements that cannot be taken.
    Value stranger = announcement;
    stranger["token"] = Guid::New().ToString();
    r = Ask(peer = Connect(), kRegisterPeerServerMessage, Value::array({stranger}));
    EXPECT_EQ(r.code, -1);
    for (const Value& bad : {Value::array(), Value::array({"text"}), Value::array({Value({{"role", "Kestrel"}})}),
                             Value::array({Value({{"role", "Kestrel"}, {"port", 70000}})})}) {
        r = Ask(peer, kRegisterPeerServerMessage, bad);
        EXPECT_EQ(r.code, kErrorRequestRefused) << ToJSONText(bad);
    }
    EXPECT_TRUE(BrokerInfo(host)["peers"].empty());
    EXPECT_EQ(BrokerInfo(host)["requests"][kRegisterPeerServerMessage], 7);
}

}  // namespace
