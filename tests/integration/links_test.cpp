// Peer links with real processes: the link manager brokers the reference compositing peer
// (tidelinkpeer) to this test process, which opens projects through the library and survives the
// peer's death.
#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <mutex>

#include "Harness.h"
#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/core/Server.h"
#include "tidelink/peers/PeerServers.h"
#include "tidelink/peers/Project.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;

namespace {

constexpr double kWait = 30.0;

std::string Example(const std::string& name) {
    return std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/" + name;
}

// One result handed over from a callback thread; counts the calls to catch double completion.
template <class T>
struct Result {
    struct State {
        std::mutex mutex;
        Gate gate;
        int calls = 0;
        ConnectionStatus status = ConnectionStatus::Failed;
        T value{};
        bool onTransportThread = false;
    };
    std::shared_ptr<State> state = std::make_shared<State>();

    Result() = default;
    Result(const Result&) = delete;
    // A server, project or source keeps the callback it was made with: drop what it delivered so
    // that nothing keeps itself alive.
    ~Result() {
        std::lock_guard lock(state->mutex);
        state->value = T{};
    }

    auto Callback() {
        auto s = state;
        return [s](ConnectionStatus status, T value) {
            std::lock_guard lock(s->mutex);
            if (++s->calls == 1) {
                s->status = status;
                s->value = std::move(value);
                s->onTransportThread = IsTransportThread();
            }
            s->gate.Open();
        };
    }
    bool Wait(double seconds = kWait) { return state->gate.Wait(static_cast<int>(seconds * 1000)); }
    ConnectionStatus Status() {
        std::lock_guard lock(state->mutex);
        return state->status;
    }
    T Value() {
        std::lock_guard lock(state->mutex);
        return state->value;
    }
    // Moves the value out: a project's open callback lives as long as the project, so a result
    // that kept the project would keep it alive for ever.
    T Take() {
        std::lock_guard lock(state->mutex);
        return std::move(state->value);
    }
    int Calls() {
        std::lock_guard lock(state->mutex);
        return state->calls;
    }
};

// Asks the link manager for its figures (blocking).
Value ManagerInfo() {
    auto client = LaunchTidelinkManagerRPC();
    Result<platform::Value> r;
    auto cb = r.Callback();
    client->SendRequest(
        BuildCall(kManagerInfoMessage), [cb](const Value& v, RequestId) { cb(ConnectionStatus::Connected, v); },
        [cb](int32_t, const WString&, RequestId) { cb(ConnectionStatus::Failed, Value()); });
    EXPECT_TRUE(r.Wait());
    return r.Value().value("value", Value::object());
}

int64_t RequestCount(const std::string& name) {
    const Value info = ManagerInfo();
    const Value requests = info.value("broker", Value::object()).value("requests", Value::object());
    return requests.value("com.quenlo.tidelink." + name, int64_t{0});
}

Value LastArguments(const std::string& name) {
    const Value info = ManagerInfo();
    return info.value("broker", Value::object()).value("last", Value::object()).value("com.quenlo.tidelink." + name, Value());
}

// Process ids of the running peers of |role| known to the link manager.
std::vector<uint32_t> PeerPids(const std::string& role) {
    std::vector<uint32_t> pids;
    const Value info = ManagerInfo();
    for (const auto& p : info.value("broker", Value::object()).value("peers", Value::array())) {
        if (p.value("role", std::string()) == role) pids.push_back(p.value("pid", 0u));
    }
    return pids;
}

KestrelServerPtr ConnectKestrel(ServerConnectionType type = ServerConnectionType::Default) {
    Result<KestrelServerPtr> r;
    KestrelServer::CreateTideLinkServer(r.Callback(), type);
    EXPECT_TRUE(r.Wait());
    EXPECT_EQ(r.Status(), ConnectionStatus::Connected);
    return r.Take();
}

ServerPtr Link(const GenericServerPtr& generic, ServerConnectionType type = kCreationConnectionType) {
    Result<ServerPtr> r;
    generic->CreateLink(r.Callback(), type);
    EXPECT_TRUE(r.Wait());
    EXPECT_EQ(r.Status(), ConnectionStatus::Connected);
    return r.Take();  // a server keeps its creation callback
}

ProjectPtr Open(const ServerPtr& server, const std::string& file) {
    Result<ProjectPtr> r;
    server->OpenProject(r.Callback(), file);
    EXPECT_TRUE(r.Wait(60));
    EXPECT_EQ(r.Status(), ConnectionStatus::Connected) << file;
    return r.Take();
}

// Records what a connection's status callbacks saw.
struct StatusLog {
    std::mutex mutex;
    std::vector<ConnectionStatus> seen;
    std::vector<bool> onTransportThread;
    Gate settled;

    void Attach(const ServerReconnectPtr& link) {
        link->AddStatusCallback([this](ConnectionStatus s, const WString&, const File&) {
            std::lock_guard lock(mutex);
            seen.push_back(s);
            onTransportThread.push_back(IsTransportThread());
            if (s != ConnectionStatus::Reconnecting) settled.Open();
        });
    }
    std::vector<ConnectionStatus> Seen() {
        std::lock_guard lock(mutex);
        return seen;
    }
};

// Sends RuntimeFontChange on |link|; the reference peer answers with how many it has answered.
struct FontCount {
    Result<uint32_t> result;
    void Send(const ServerReconnectPtr& link) {
        auto cb = result.Callback();
        link->SendDirectRequest(
            BuildCall("com.quenlo.tidelink.RuntimeFontChange"),
            OKHandler<uint32_t>([cb](uint32_t v) { cb(ConnectionStatus::Connected, v); },
                                [cb](int32_t, const WString&, RequestId) { cb(ConnectionStatus::Failed, 0); }),
            [cb](int32_t, const WString&, RequestId) { cb(ConnectionStatus::Failed, 0); });
    }
};

}  // namespace

TEST(PeerLinks, EveryBrokeredApplicationOpensItsProject) {
    struct Case {
        std::function<void(std::function<void(ConnectionStatus, GenericServerPtr)>)> connect;
        std::string file;
        std::u16string name;
    };
    const Case cases[] = {
        {[](auto cb) { KestrelServer::CreateTideLinkServer([cb](ConnectionStatus s, KestrelServerPtr p) { cb(s, p); }); },
         Example("demo.kstproj"), u"Kestrel"},
        {[](auto cb) { OspreyServer::CreateTideLinkServer([cb](ConnectionStatus s, OspreyServerPtr p) { cb(s, p); }); },
         Example("titles.ospproj"), u"Osprey"},
        {[](auto cb) { PuffinServer::CreateTideLinkServer([cb](ConnectionStatus s, PuffinServerPtr p) { cb(s, p); }); },
         Example("show.pufproj"), u"Puffin"},
    };
    for (const auto& c : cases) {
        Result<GenericServerPtr> described;
        c.connect(described.Callback());
        ASSERT_TRUE(described.Wait());
        ASSERT_EQ(described.Status(), ConnectionStatus::Connected);
        GenericServerPtr generic = described.Take();
        EXPECT_EQ(generic->GetName(), c.name);
        SourceTypes types;
        generic->GetSourceTypes(types);
        EXPECT_EQ(types.size(), 1u);

        ServerPtr server = Link(generic);
        std::mutex progressMutex;
        std::vector<std::pair<std::string, double>> progress;
        server->SetProgressCallback([&](const std::string& m, double f, const std::vector<WString>&) {
            // The library's own steps; the peer's messages travel on another session.
            std::lock_guard lock(progressMutex);
            if (m.rfind("$$$/tidelink/tidelink/", 0) == 0) progress.emplace_back(m, f);
        });
        ProjectPtr project = Open(server, c.file);
        ASSERT_TRUE(project);
        EXPECT_FALSE(project->GetName().empty());
        EXPECT_EQ(project->GetFile(), File(c.file));
        EXPECT_TRUE(project->GetMissingAssets().IsEmpty());
        // The connection reconnects: the status notification is registered with the peer.
        EXPECT_FALSE(project->GetReconnect()->GetNotificationID().IsNil());
        std::lock_guard lock(progressMutex);
        ASSERT_GE(progress.size(), 4u);
        EXPECT_NE(progress.front().first.find("ConnectingToServer="), std::string::npos);
        EXPECT_EQ(progress.front().second, -1.0);
        EXPECT_NE(progress.back().first.find("ConnectingToProjectOK="), std::string::npos);
        EXPECT_EQ(progress.back().second, 1.0);
    }
    EXPECT_EQ(PeerPids("Kestrel").size(), 1u);
    EXPECT_EQ(PeerPids("Osprey").size(), 1u);
    EXPECT_EQ(PeerPids("Puffin").size(), 1u);
}

TEST(PeerLinks, FailuresReachTheCallbackOnce) {
    ServerPtr server = Link(ConnectKestrel());
    // A project the peer cannot read, and one it does not serve.
    const auto dir = std::filesystem::temp_directory_path() / ("tl-links-" + std::to_string(::getpid()));
    std::filesystem::create_directories(dir);
    std::ofstream(dir / "broken.kstproj") << "{ not json";
    std::vector<std::string> progress;
    std::mutex progressMutex;
    server->SetProgressCallback([&](const std::string& m, double, const std::vector<WString>&) {
        std::lock_guard lock(progressMutex);
        if (m.rfind("$$$/tidelink/tidelink/OpenProjectFailed=", 0) == 0) progress.push_back(m);
    });
    for (const auto& file : {dir / "broken.kstproj", dir / "absent.kstproj"}) {
        Result<ProjectPtr> r;
        server->OpenProject(r.Callback(), file);
        ASSERT_TRUE(r.Wait());
        EXPECT_EQ(r.Status(), ConnectionStatus::Failed);
        EXPECT_EQ(r.Value(), nullptr);
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        EXPECT_EQ(r.Calls(), 1);
    }
    {
        std::lock_guard lock(progressMutex);
        EXPECT_EQ(progress.size(), 2u);
    }
    // RuntimeFontChange on the server's own link: a brokered server has no direct session there.
    Result<uint32_t> font;
    server->RuntimeFontChange(font.Callback());
    ASSERT_TRUE(font.Wait());
    EXPECT_EQ(font.Status(), ConnectionStatus::Failed);
    EXPECT_EQ(font.Value(), 0xFFFFFFFFu);
    std::filesystem::remove_all(dir);
}

TEST(PeerLinks, ARefusedVersionedConnectFallsBackExactlyOnce) {
    // An installed Kestrel that predates the versioned connect.
    const auto dir = std::filesystem::temp_directory_path() / ("tl-peers-" + std::to_string(::getpid()));
    std::filesystem::create_directories(dir);
    std::ofstream(dir / "kestrel.json") << R"({"role": "Kestrel", "executable": ")" << BinDir()
                                       << R"(/tidelinkpeer", "arguments": ["--role", "kestrel"], "legacyOnly": true,
        "description": {"servername": "Old Kestrel", "serverapiversion": 1, "serverappversion": "0.9",
                        "sourcetypes": {"Kestrel Project": ".kstproj"}}})";
    // The manager reads the variable from the environment it starts with.
    StopOurManagers();
    ::setenv("TIDELINK_PEERS_PATH", dir.c_str(), 1);
    KestrelServerPtr kestrel = ConnectKestrel();
    ASSERT_TRUE(kestrel);
    EXPECT_EQ(kestrel->GetName(), u"Old Kestrel");
    EXPECT_EQ(RequestCount("ConnectToKestrelServerWithVersion"), 1);
    EXPECT_EQ(RequestCount("ConnectToKestrelServer"), 1);
    // The legacy request carries the client name only.
    const Value args = LastArguments("ConnectToKestrelServer");
    ASSERT_TRUE(args.is_array());
    ASSERT_EQ(args.size(), 1u);
    EXPECT_EQ(args[0], ToUTF8(GetClientName()));
    ::unsetenv("TIDELINK_PEERS_PATH");
    std::filesystem::remove_all(dir);
}

TEST(PeerLinks, ConnectionTypesShapeTheLinkRequests) {
    KestrelServerPtr kestrel = ConnectKestrel(ServerConnectionType::NoReconnect);
    ASSERT_TRUE(kestrel);

    // The type given to the factory, by default.
    ServerPtr noReconnect = Link(kestrel);
    EXPECT_EQ(noReconnect->GetConnectionType(), ServerConnectionType::NoReconnect);
    EXPECT_FALSE(noReconnect->GetLink()->SupportsReconnect());
    ProjectPtr a = Open(noReconnect, Example("demo.kstproj"));
    ASSERT_TRUE(a);
    Value args = LastArguments("CreateKestrelTideLink");
    ASSERT_EQ(args.size(), 3u);
    EXPECT_EQ(args[0], Example("demo.kstproj"));
    EXPECT_EQ(args[2], true);
    // No status notification is registered with the peer.
    EXPECT_TRUE(a->GetReconnect()->GetNotificationID().IsNil());

    // Headed: only the endpoint travels, and the project opens in the same peer.
    ServerPtr headed = Link(kestrel, ServerConnectionType::Headed);
    EXPECT_TRUE(headed->GetLink()->SupportsReconnect());
    const int64_t createLinks = RequestCount("CreateKestrelTideLink");
    ProjectPtr b = Open(headed, Example("demo.kstproj"));
    ASSERT_TRUE(b);
    args = LastArguments("CreateKestrelHeadedLink");
    ASSERT_TRUE(args.is_array());
    ASSERT_EQ(args.size(), 1u);
    EXPECT_TRUE(args[0].contains("address"));
    EXPECT_TRUE(args[0].contains("port"));
    EXPECT_EQ(RequestCount("CreateKestrelTideLink"), createLinks);
    EXPECT_FALSE(b->GetReconnect()->GetNotificationID().IsNil());

    // Default: reconnecting, and the flag is false.
    ProjectPtr c = Open(Link(kestrel, ServerConnectionType::Default), Example("demo.kstproj"));
    ASSERT_TRUE(c);
    EXPECT_EQ(LastArguments("CreateKestrelTideLink")[2], false);
}

TEST(PeerLinks, ADirectServerSendsNothingToTheLinkManager) {
    PloverServer::SetServerPath(ToUTF16(BinDir() + "/tidelinkpeer"));
    Result<PloverServerPtr> described;
    PloverServer::CreateTideLinkServer(described.Callback());
    ASSERT_TRUE(described.Wait());
    ASSERT_EQ(described.Status(), ConnectionStatus::Connected);
    EXPECT_EQ(described.Value()->GetName(), u"Plover");

    Result<ServerPtr> linked;
    described.Value()->CreateLink(linked.Callback());
    ASSERT_TRUE(linked.Wait());
    ASSERT_EQ(linked.Status(), ConnectionStatus::Connected);
    ServerPtr server = linked.Take();
    EXPECT_TRUE(server->IsDirect());
    EXPECT_EQ(RequestCount("CreateNamedServerLinkWithVersion"), 1);

    const Value before = ManagerInfo()["broker"]["requests"];
    ProjectPtr project = Open(server, Example("library.plvcat"));
    ASSERT_TRUE(project);
    Result<uint32_t> font;
    server->RuntimeFontChange(font.Callback());
    ASSERT_TRUE(font.Wait());
    EXPECT_EQ(font.Status(), ConnectionStatus::Connected);
    EXPECT_EQ(ManagerInfo()["broker"]["requests"], before);

    // Its link has no link-manager requests to reconnect with: losing the peer ends in Failed,
    // reported from the shared executor after Reconnecting.
    StatusLog log;
    log.Attach(project->GetReconnect());
    Result<ProjectPtr> lost;  // the open callback hears of the loss
    const auto pids = PeerPids("Plover");
    ASSERT_EQ(pids.size(), 1u);
    SendSignal(pids[0], SIGKILL);
    ASSERT_TRUE(log.settled.Wait(kWait * 1000));
    const auto seen = log.Seen();
    ASSERT_EQ(seen.size(), 2u);
    EXPECT_EQ(seen[0], ConnectionStatus::Reconnecting);
    EXPECT_EQ(seen[1], ConnectionStatus::Failed);
    EXPECT_FALSE(log.onTransportThread[1]);
    EXPECT_TRUE(WaitForExit(pids[0], 10));
}

TEST(PeerLinks, CancelledNamedServerRequestsStaySilent) {
    // A named server that never announces itself: its answer (a failed start) comes only after
    // the start limit, long after the cancel.
    const auto dir = std::filesystem::temp_directory_path() / ("tl-named-" + std::to_string(::getpid()));
    std::filesystem::create_directories(dir);
    const auto script = dir / "silent-server";
    std::ofstream(script) << "#!/bin/sh\nexec sleep 30\n";
    std::filesystem::permissions(script, std::filesystem::perms::owner_all);
    StopOurManagers();
    ::setenv("TIDELINK_PEER_START_TIMEOUT", "1", 1);
    std::atomic<int> calls{0};
    const int64_t id = CreateNamedServerConnection(u"Silent", ToUTF16(script.string()), u"m7",
                                                   [&](ServerConnection) { ++calls; });
    ASSERT_NE(id, 0);
    CancelNamedServerConnection(id);
    // A named server that cannot be started answers port 0 (not silence).
    Result<ServerConnection> bad;
    auto cb = bad.Callback();
    ASSERT_NE(CreateNamedServerConnection(u"Nothing", u"/nonexistent/server", WString(),
                                          [cb](ServerConnection c) { cb(ConnectionStatus::Connected, c); }),
              0);
    ASSERT_TRUE(bad.Wait());
    EXPECT_EQ(bad.Value().mPort, 0);
    // Past the start limit: the cancelled request's answer has come and gone.
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    EXPECT_EQ(calls.load(), 0);
    ::unsetenv("TIDELINK_PEER_START_TIMEOUT");
    StopOurManagers();
    std::filesystem::remove_all(dir);
}

// The heart of it: the peer dies with requests queued; they arrive, in order, at the new peer.
TEST(PeerReconnection, AKilledPeerIsReplacedAndQueuedRequestsArriveInOrder) {
    ProjectPtr project = Open(Link(ConnectKestrel()), Example("demo.kstproj"));
    ASSERT_TRUE(project);
    const auto link = project->GetReconnect();
    const WString name = project->GetName();
    const auto before = PeerPids("Kestrel");
    ASSERT_EQ(before.size(), 1u);

    constexpr int kQueued = 5;
    std::vector<std::unique_ptr<FontCount>> queued;
    std::vector<RequestId> ids;
    std::mutex mutex;
    std::vector<ConnectionStatus> seen;
    Gate settled;
    link->AddStatusCallback([&](ConnectionStatus s, const WString&, const File&) {
        std::lock_guard lock(mutex);
        seen.push_back(s);
        if (s == ConnectionStatus::Reconnecting) {
            // Sent while the reconnection runs: held back, returned id 0.
            for (int i = 0; i < kQueued; ++i) {
                queued.push_back(std::make_unique<FontCount>());
                auto& q = *queued.back();
                auto cb = q.result.Callback();
                ids.push_back(link->SendDirectRequest(
                    BuildCall("com.quenlo.tidelink.RuntimeFontChange"),
                    OKHandler<uint32_t>([cb](uint32_t v) { cb(ConnectionStatus::Connected, v); }),
                    [cb](int32_t, const WString&, RequestId) { cb(ConnectionStatus::Failed, 0); }));
            }
        } else {
            settled.Open();
        }
    });
    SendSignal(before[0], SIGKILL);
    ASSERT_TRUE(settled.Wait(static_cast<int>(kWait * 1000)));
    {
        std::lock_guard lock(mutex);
        ASSERT_EQ(seen.size(), 2u);
        EXPECT_EQ(seen[0], ConnectionStatus::Reconnecting);
        EXPECT_EQ(seen[1], ConnectionStatus::Connected);
        ASSERT_EQ(queued.size(), static_cast<size_t>(kQueued));
        for (auto id : ids) EXPECT_EQ(id, 0u);
    }
    // The project is open again in a new process, under the same name.
    const auto after = PeerPids("Kestrel");
    ASSERT_EQ(after.size(), 1u);
    EXPECT_NE(after[0], before[0]);
    EXPECT_EQ(project->GetName(), name);
    EXPECT_EQ(project->GetFile(), File(Example("demo.kstproj")));
    // The new peer counted them in the order they were queued.
    for (int i = 0; i < kQueued; ++i) {
        ASSERT_TRUE(queued[i]->result.Wait());
        EXPECT_EQ(queued[i]->result.Status(), ConnectionStatus::Connected);
        EXPECT_EQ(queued[i]->result.Value(), static_cast<uint32_t>(i + 1));
        EXPECT_EQ(queued[i]->result.Calls(), 1);
    }
    // And the link is usable as before.
    FontCount next;
    next.Send(link);
    ASSERT_TRUE(next.result.Wait());
    EXPECT_EQ(next.result.Value(), static_cast<uint32_t>(kQueued + 1));
    EXPECT_FALSE(link->IsReconnecting());
}

TEST(PeerReconnection, TheEleventhCloseFailsWithoutAskingTheLinkManager) {
    ::unsetenv("TideLinkClientMaxReconnectForDirect");
    ProjectPtr project = Open(Link(ConnectKestrel()), Example("demo.kstproj"));
    ASSERT_TRUE(project);
    const auto link = project->GetReconnect();
    StatusLog log;
    log.Attach(link);
    for (int close = 1; close <= 10; ++close) {
        log.settled.Close();
        link->GetDirectSession()->Close();
        ASSERT_TRUE(log.settled.Wait(static_cast<int>(kWait * 1000))) << "close " << close;
        ASSERT_EQ(log.Seen().back(), ConnectionStatus::Connected) << "close " << close;
    }
    const int64_t links = RequestCount("CreateKestrelTideLink");
    const int64_t connects = RequestCount("ConnectToKestrelServerWithVersion");
    Result<ProjectPtr> dummy;
    log.settled.Close();
    link->GetDirectSession()->Close();
    ASSERT_TRUE(log.settled.Wait(static_cast<int>(kWait * 1000)));
    const auto seen = log.Seen();
    EXPECT_EQ(seen.back(), ConnectionStatus::Failed);
    EXPECT_EQ(seen[seen.size() - 2], ConnectionStatus::Connected);  // no Reconnecting before it
    EXPECT_EQ(link->GetSessionCloseCount(), 11);
    EXPECT_EQ(RequestCount("CreateKestrelTideLink"), links);
    EXPECT_EQ(RequestCount("ConnectToKestrelServerWithVersion"), connects);
    // A request after the failure still completes, with a failure.
    FontCount late;
    late.Send(link);
    ASSERT_TRUE(late.result.Wait());
    EXPECT_EQ(late.result.Status(), ConnectionStatus::Failed);
}

TEST(PeerReconnection, ANegativeLimitMeansNoLimit) {
    ::setenv("TideLinkClientMaxReconnectForDirect", "-1", 1);
    ProjectPtr project = Open(Link(ConnectKestrel()), Example("demo.kstproj"));
    ASSERT_TRUE(project);
    const auto link = project->GetReconnect();
    StatusLog log;
    log.Attach(link);
    for (int close = 1; close <= 12; ++close) {
        log.settled.Close();
        link->GetDirectSession()->Close();
        ASSERT_TRUE(log.settled.Wait(static_cast<int>(kWait * 1000))) << "close " << close;
        ASSERT_EQ(log.Seen().back(), ConnectionStatus::Connected) << "close " << close;
    }
    ::unsetenv("TideLinkClientMaxReconnectForDirect");
}

TEST(PeerReconnection, ObjectsGoneBeforeTheirRepliesAreLeftAlone) {
    ServerPtr server = Link(ConnectKestrel());
    // The server goes while its open request is under way: the callback still runs, once.
    Result<ProjectPtr> opened;
    server->OpenProject(opened.Callback(), Example("demo.kstproj"));
    server.reset();
    ASSERT_TRUE(opened.Wait(60));
    EXPECT_EQ(opened.Status(), ConnectionStatus::Connected);
    ProjectPtr project = opened.Take();
    ASSERT_TRUE(project);

    // The project and its connection go as soon as the loss is reported, while the reconnection
    // chain waits for the link manager and the new peer: nothing more is called, nothing crashes.
    std::atomic<int> statusCalls{0};
    auto link = project->GetReconnect();
    std::weak_ptr<ServerReconnect> weak = link;
    std::mutex mutex;
    link->AddStatusCallback([&](ConnectionStatus, const WString&, const File&) {
        ++statusCalls;
        std::lock_guard lock(mutex);
        link.reset();
        project.reset();
    });
    const auto pids = PeerPids("Kestrel");
    ASSERT_EQ(pids.size(), 1u);
    SendSignal(pids[0], SIGKILL);
    EXPECT_TRUE(WaitFor([&] { return weak.expired(); }, 10));
    // Let the chain's replies arrive (the link manager starts a new peer meanwhile).
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    EXPECT_EQ(statusCalls.load(), 1);
}
