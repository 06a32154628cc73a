// The peer's message handling, driven directly (no sockets): notifications to hosts are recorded.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <future>
#include <mutex>

#include "PeerRole.h"
#include "PeerService.h"
#include "PeerTestSupport.h"
#include "tidelink/peers/ProjectProtocol.h"

using namespace tidelink;
using namespace tidelink::peer;
using tidelink::peer::test::ExamplesDir;
using tidelink::peer::test::TempDir;
using platform::Value;
namespace fs = std::filesystem;

namespace {

class RecordingSink final : public NotificationSink {
public:
    struct Sent {
        ServerConnection to;
        std::string name;
        Value args;
    };
    void Send(const ServerConnection& to, platform::Call call) override {
        std::lock_guard lock(mMutex);
        mSent.push_back({to, call.name, call.args});
    }
    bool Flush(int) override {
        ++flushes;
        return true;
    }
    void Close() override { closed = true; }
    std::vector<Sent> Take() {
        std::lock_guard lock(mMutex);
        return std::exchange(mSent, {});
    }
    std::atomic<int> flushes{0};
    std::atomic<bool> closed{false};

private:
    std::mutex mMutex;
    std::vector<Sent> mSent;
};

const ServerConnection kHostA{"127.0.0.1", 40001};
const ServerConnection kHostB{"127.0.0.1", 40002};

Value Endpoint(const ServerConnection& c) { return Value(c); }

Value EmptyProductionRequest() { return Value(FarlandProductionRequestInfo()); }

class PeerServiceTest : public ::testing::Test {
protected:
    void SetUp() override { Make("kestrel"); }

    void Make(const char* role) {
        sink = std::make_shared<RecordingSink>();
        service = PeerService::Create(*RoleByName(role), platform::CreateCPUBoundExecutor(), sink);
    }

    // Sends one request and waits for its one answer.
    Outcome Ask(const std::string& name, Value args) {
        struct State {
            std::promise<Outcome> promise;
            std::atomic<int> calls{0};
        };
        auto state = std::make_shared<State>();
        auto future = state->promise.get_future();
        service->Handle("com.quenlo.tidelink." + name, args, [state](Outcome o) {
            if (state->calls.fetch_add(1) == 0) state->promise.set_value(std::move(o));
        });
        if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
            ADD_FAILURE() << name << " was not answered";
            return Outcome::Error("no answer");
        }
        service->WaitUntilIdle();
        EXPECT_EQ(state->calls.load(), 1) << name << " answered more than once";
        return future.get();
    }

    // A notification: no answer expected.
    void Tell(const std::string& name, Value args) {
        service->Handle("com.quenlo.tidelink." + name, args, nullptr);
        service->WaitUntilIdle();
    }

    static std::string Message(const Outcome& o) { return platform::ToUTF8(o.message); }

    fs::path Copy(const char* example, const std::string& as = {}) {
        const fs::path to = dir.Path() / (as.empty() ? example : as);
        fs::copy_file(ExamplesDir() / example, to);
        return to;
    }

    TempDir dir;
    std::shared_ptr<RecordingSink> sink;
    std::shared_ptr<PeerService> service;
};

}  // namespace

TEST_F(PeerServiceTest, ConnectRequestsAnswerTheRolesDescription) {
    const struct {
        const char* role;
        const char* description;
    } cases[] = {
        {"kestrel", R"({"servername": "Kestrel", "serverapiversion": 1, "serverappversion": "1.0",
                        "sourcetypes": {"Kestrel Project": ".kstproj"}, "supportsremotelinking": false})"},
        {"osprey", R"({"servername": "Osprey", "serverapiversion": 1, "serverappversion": "1.0",
                       "sourcetypes": {"Osprey Project": ".ospproj"}, "supportsremotelinking": false})"},
        {"puffin", R"({"servername": "Puffin", "serverapiversion": 10, "serverappversion": "1.0",
                       "sourcetypes": {"Puffin Project": ".pufproj"}, "supportsremotelinking": false})"},
        {"plover", R"({"servername": "Plover", "serverapiversion": 1, "serverappversion": "1.0",
                       "sourcetypes": {"Plover Catalog": ".plvcat"}, "supportsremotelinking": false})"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.role);
        Make(c.role);
        const Value expected = platform::ParseJSONText(c.description);
        const auto versioned = Ask("ConnectToServerWithVersion",
                                   Value::array({{{"name", "host"}, {"appVersion", "1.0"}, {"protoVersion", "8.0"}}}));
        ASSERT_TRUE(versioned.ok) << Message(versioned);
        EXPECT_EQ(versioned.value, expected);
        const auto legacy = Ask("ConnectToServer", Value::array({"host", platform::Guid::New().ToString()}));
        ASSERT_TRUE(legacy.ok) << Message(legacy);
        EXPECT_EQ(legacy.value, expected);
    }
    const auto font = Ask("RuntimeFontChange", Value::array());
    ASSERT_TRUE(font.ok);
    EXPECT_TRUE(font.value.is_number_unsigned());
}

TEST_F(PeerServiceTest, MalformedArgumentsAreAnsweredWithAnError) {
    const std::vector<Value> bad = {
        nullptr,
        5,
        "text",
        Value::array(),
        Value::array({5}),
        Value::array({Value::object()}),
        Value::array({nullptr, nullptr, nullptr}),
        Value::array({Value::array(), Value::array(), Value::array()}),
        Value::array({"", Value::object({{"address", 1}})}),
        Value::array({"id", Value::object({{"address", "127.0.0.1"}, {"port", 0}}), "/x.kstproj"}),
        Value::array({"id", Value::object({{"address", "127.0.0.1"}, {"port", 70000}}), "/x.kstproj"}),
        Value::array({"id", Endpoint(kHostA), "relative.kstproj"}),
        Value::array({"id", Endpoint(kHostA), Value::object({{"mAssetIdentifier", 5}})}),
        Value::array({Value::object({{"name", 5}})}),
        Value::array({"host", "not-a-guid"}),
        Value::array({Value::object({{"mServerConnectInfo", 3}})}),
        Value::array({"/tmp", std::string("a\0b", 3)}),
        Value::array({std::string("/tmp/x\0.kstproj", 15)}),
        Value::array({"/no/such/project.kstproj", 17}),
    };
    size_t errors = 0;
    for (const auto& name : PeerService::MessageNames()) {
        for (const auto& args : bad) {
            SCOPED_TRACE(name + " " + platform::ToJSONText(args));
            const auto o = Ask(name.substr(std::strlen("com.quenlo.tidelink.")), args);
            if (!o.ok) {
                ++errors;
                EXPECT_EQ(o.code, kPeerError);
                EXPECT_FALSE(o.message.empty());
            }
            Tell(name.substr(std::strlen("com.quenlo.tidelink.")), args);  // as a notification: no crash either
        }
    }
    EXPECT_GT(errors, PeerService::MessageNames().size() * 10);
    EXPECT_EQ(service->StatusRegistrationCount(), 0u);
    EXPECT_EQ(service->ProgressRegistrationCount(), 0u);

    EXPECT_EQ(Message(Ask("OpenProject", Value::array({5}))),
              "Bad arguments for OpenProject (project path): argument 1 (the project path) must be a string");
    EXPECT_EQ(Message(Ask("RegisterServerProgress", Value::array({"p"}))),
              "Bad arguments for RegisterServerProgress (progress id, endpoint): argument 2 is missing");
    EXPECT_EQ(Message(Ask("ConnectToServerWithVersion", Value::array({"host"}))),
              "Bad arguments for ConnectToServerWithVersion (client identity {\"name\", \"appVersion\", "
              "\"protoVersion\"}): argument 1 (the client identity) must be an object");
    EXPECT_EQ(Message(Ask("NoSuchThing", Value::array())), "The peer does not answer \"com.quenlo.tidelink.NoSuchThing\"");
}

TEST_F(PeerServiceTest, OpenProjectAnswersTheProjectsDescription) {
    const fs::path demo = Copy("demo.kstproj");
    // The path as the host wrote it need not be normal; the answer names the file plainly.
    const auto o = Ask("OpenProject", Value::array({(dir.Path() / "." / "demo.kstproj").string()}));
    ASSERT_TRUE(o.ok) << Message(o);
    EXPECT_EQ(o.value, platform::ParseJSONText(R"({"name": "Demo", "file": ")" + demo.string() + R"(",
        "missing": {"missAssetsPropMissingFonts": [], "missAssetsPropMissingPlugins": [], "missAssetsPropMissingFootage": []},
        "farlandProductionInfo": {"mProductionIdentifier": "", "mRevision": "", "mDisplayName": ""}})"));
    EXPECT_NE(service->FindOpenProject(demo), nullptr);

    const auto missing = Ask("OpenProject", Value::array({(ExamplesDir() / "missing-footage.kstproj").string()}));
    ASSERT_TRUE(missing.ok) << Message(missing);
    const auto info = missing.value.get<projectprotocol::ProjectInfo>();
    EXPECT_EQ(info.mName, u"Missing footage");
    ASSERT_EQ(info.mMissingAssets.mMissingFootage.size(), 3u);
    EXPECT_EQ(info.mMissingAssets.mMissingFootage[1].mPath, u"/nonexistent/archive/b-roll.mov");
    EXPECT_EQ(service->OpenProjectFiles().size(), 2u);
}

TEST_F(PeerServiceTest, ProjectsThatCannotBeOpenedSayWhy) {
    const fs::path upper = Copy("demo.kstproj", "Upper.KSTPROJ");
    EXPECT_TRUE(Ask("OpenProject", Value::array({upper.string()})).ok);  // extensions compare without case

    const std::string absent = (dir.Path() / "absent.kstproj").string();
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({absent}))), "Cannot open project " + absent + ": no such file");
    const std::string titles = (ExamplesDir() / "titles.ospproj").string();
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({titles}))),
              "Cannot open project " + titles + ": not a Kestrel project (Kestrel opens .kstproj files)");
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({"demo.kstproj"}))),
              "Cannot open project demo.kstproj: the path is not absolute");
    const std::string broken = dir.Write("broken.kstproj", R"({"format": "tidelink-project", "version": 1, "items": [{"type": "bin"}]})").string();
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({broken}))),
              "Cannot open project " + broken + ": /items/0: the member \"name\" is missing");
    fs::create_directory(dir.Path() / "folder.kstproj");
    const std::string folder = (dir.Path() / "folder.kstproj").string();
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({folder}))),
              "Cannot open project " + folder + ": it is a folder, not a project file");
    EXPECT_EQ(service->OpenProjectFiles().size(), 1u);

    Make("osprey");
    EXPECT_TRUE(Ask("OpenProject", Value::array({titles})).ok);
}

TEST_F(PeerServiceTest, OpeningSendsProgressToEveryRegisteredEndpoint) {
    ASSERT_TRUE(Ask("RegisterServerProgress", Value::array({"p1", Endpoint(kHostA)})).ok);
    Tell("RegisterServerProgress", Value::array({"p2", Endpoint(kHostB)}));  // hosts send it as a notification
    EXPECT_EQ(service->ProgressRegistrationCount(), 2u);
    const std::string demo = (ExamplesDir() / "demo.kstproj").string();
    ASSERT_TRUE(Ask("OpenProject", Value::array({demo})).ok);
    auto sent = sink->Take();
    ASSERT_EQ(sent.size(), 4u);
    for (const auto& [host, id] : {std::pair{kHostA, "p1"}, std::pair{kHostB, "p2"}}) {
        std::vector<Value> to;
        for (const auto& s : sent) {
            if (s.to == host) {
                EXPECT_EQ(s.name, id);
                to.push_back(s.args);
            }
        }
        ASSERT_EQ(to.size(), 2u);
        EXPECT_EQ(to[0], Value::array({"$$$/tidelinkpeer/OpeningProject=Opening @0...", -1.0, Value::array({demo})}));
        EXPECT_EQ(to[1], Value::array({"$$$/tidelinkpeer/ProjectOpened=Opened @0", 1.0, Value::array({"Demo"})}));
    }

    Tell("UnRegisterServerProgress", Value::array({"p2", Endpoint(kHostB)}));
    const std::string absent = (dir.Path() / "absent.kstproj").string();
    EXPECT_FALSE(Ask("OpenProject", Value::array({absent})).ok);
    sent = sink->Take();
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].to, kHostA);
    EXPECT_EQ(sent[1].args, Value::array({"$$$/tidelinkpeer/OpenProjectFailed=Cannot open @0", 0.0, Value::array({absent})}));

    // An endpoint that cannot be reached loses its registrations.
    service->ForgetEndpoint(kHostA);
    EXPECT_EQ(service->ProgressRegistrationCount(), 0u);
}

TEST_F(PeerServiceTest, OpenProjectWithJSONAppliesOverrides) {
    const fs::path demo = Copy("demo.kstproj");
    const auto o = Ask("OpenProjectWithJSON", Value::array({demo.string(), R"({"document": {"name": "Patched"},
        "items": {"Compositions/Demo 1080p25": {"frameRate": 50}}})"}));
    ASSERT_TRUE(o.ok) << Message(o);
    EXPECT_EQ(o.value["name"], "Patched");
    EXPECT_EQ(service->FindOpenProject(demo)->FindByPath("Compositions/Demo 1080p25")->composition->frameRate, Rational(50));
    // OpenProject of an open project answers it as it is open.
    EXPECT_EQ(Ask("OpenProject", Value::array({demo.string()})).value["name"], "Patched");
    // The JSON may come as an object, too; an empty text reads the file as it stands.
    EXPECT_EQ(Ask("OpenProjectWithJSON", Value::array({demo.string(), Value::object({{"document", {{"name", "Obj"}}}})}))
                  .value["name"],
              "Obj");
    EXPECT_EQ(Ask("OpenProjectWithJSON", Value::array({demo.string(), ""})).value["name"], "Demo");

    EXPECT_EQ(Message(Ask("OpenProjectWithJSON", Value::array({demo.string(), "{"}))).rfind(
                  "Cannot open project " + demo.string() + ": the JSON text is not valid JSON", 0),
              0u);
    EXPECT_EQ(Message(Ask("OpenProjectWithJSON", Value::array({demo.string(), R"({"items": {"Nope": {}}})"}))),
              "Cannot open project " + demo.string() + ": no item \"Nope\" to override");
    EXPECT_EQ(Message(Ask("OpenProjectWithJSON", Value::array({demo.string(), 3}))),
              "Bad arguments for OpenProjectWithJSON (project path, JSON text): argument 2 (the JSON text) must be a string");
    // A failed reopen leaves the open project as it was.
    EXPECT_EQ(service->FindOpenProject(demo)->Name(), "Demo");
}

TEST_F(PeerServiceTest, CreateProjectWritesAndOpensANewProject) {
    const auto o = Ask("CreateProject", Value::array({dir.Path().string(), "Fresh"}));
    ASSERT_TRUE(o.ok) << Message(o);
    const fs::path file = dir.Path() / "Fresh.kstproj";
    EXPECT_TRUE(fs::is_regular_file(file));
    EXPECT_EQ(o.value["name"], "Fresh");
    EXPECT_EQ(o.value["file"], file.string());
    EXPECT_EQ(Ask("GetOpenProject", Value::array({EmptyProductionRequest()})).value["file"], file.string());
    EXPECT_TRUE(service->FindOpenProject(file)->ChildrenOf(service->FindOpenProject(file)->Root()).empty());

    const std::string where = dir.Path().string();
    EXPECT_EQ(Message(Ask("CreateProject", Value::array({where, "Fresh"}))),
              "Cannot create project Fresh in " + where + ": a file of that name exists");
    const auto named = Ask("CreateProject", Value::array({where, "Show.KSTPROJ"}));
    ASSERT_TRUE(named.ok);
    EXPECT_EQ(named.value["file"], (dir.Path() / "Show.KSTPROJ").string());
    EXPECT_EQ(named.value["name"], "Show");
    for (const char* name : {"", ".", "..", "a/b"}) {
        EXPECT_EQ(Message(Ask("CreateProject", Value::array({where, name}))),
                  "Cannot create project " + std::string(name) + " in " + where + ": not a usable file name");
    }
    EXPECT_EQ(Message(Ask("CreateProject", Value::array({"projects", "X"}))),
              "Cannot create project X in projects: the folder path is not absolute");
    EXPECT_EQ(Message(Ask("CreateProject", Value::array({where + "/none", "X"}))),
              "Cannot create project X in " + where + "/none: no such folder");
}

TEST_F(PeerServiceTest, GetOpenProjectAnswersTheMostRecentlyOpened) {
    EXPECT_EQ(Message(Ask("GetOpenProject", Value::array())), "No project is open");
    const fs::path a = Copy("demo.kstproj", "a.kstproj");
    const fs::path b = Copy("missing-footage.kstproj", "b.kstproj");
    ASSERT_TRUE(Ask("OpenProject", Value::array({a.string()})).ok);
    ASSERT_TRUE(Ask("OpenProject", Value::array({b.string()})).ok);
    EXPECT_EQ(Ask("GetOpenProject", Value::array()).value["file"], b.string());
    ASSERT_TRUE(Ask("OpenProject", Value::array({a.string()})).ok);
    EXPECT_EQ(Ask("GetOpenProject", Value::array({EmptyProductionRequest()})).value["file"], a.string());
    ASSERT_TRUE(Ask("CloseProject", Value::array({a.string()})).ok);
    EXPECT_EQ(Ask("GetOpenProject", Value::array()).value["name"], "Missing footage");
    FarlandProductionRequestInfo production;
    production.mProductionIdentifier = "prod";
    EXPECT_EQ(Message(Ask("GetOpenProject", Value::array({Value(production)}))),
              "Cannot get the open project: this peer serves no Farland productions");
}

TEST_F(PeerServiceTest, ClosingAProjectTellsItsStatusRegistrations) {
    const fs::path a = Copy("demo.kstproj", "a.kstproj");
    const fs::path b = Copy("demo.kstproj", "b.kstproj");
    fs::create_directory_symlink(dir.Path(), dir.Path() / "link");
    ASSERT_TRUE(Ask("OpenProject", Value::array({a.string()})).ok);
    ASSERT_TRUE(Ask("OpenProject", Value::array({b.string()})).ok);
    Tell("RegisterServerStatusChange", Value::array({"s1", Endpoint(kHostA), a.string()}));
    Tell("RegisterServerStatusChange", Value::array({"s2", Endpoint(kHostA), b.string()}));
    // Another spelling of the same file is the same project.
    Tell("RegisterServerStatusChange", Value::array({"s3", Endpoint(kHostB), (dir.Path() / "link" / "a.kstproj").string()}));
    Tell("RegisterFarlandServerStatusChange",
         Value::array({"f1", Endpoint(kHostB), Value(FarlandAssetInfo{"prod", "1", "asset"})}));
    EXPECT_EQ(service->StatusRegistrationCount(), 4u);
    sink->Take();

    ASSERT_TRUE(Ask("CloseProject", Value::array({a.string()})).ok);
    auto sent = sink->Take();
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].to, kHostA);
    EXPECT_EQ(sent[0].name, "s1");
    EXPECT_EQ(sent[0].args, Value::array({2}));
    EXPECT_EQ(sent[1].to, kHostB);
    EXPECT_EQ(sent[1].name, "s3");
    EXPECT_EQ(service->FindOpenProject(a), nullptr);
    EXPECT_EQ(Message(Ask("CloseProject", Value::array({a.string()}))), "Project " + a.string() + " is not open");

    // Unregistered, not told; the registrations of a closed project stay for its next opening.
    Tell("UnRegisterServerStatusChange", Value::array({"s3", Endpoint(kHostB), a.string()}));
    ASSERT_TRUE(Ask("OpenProject", Value::array({a.string()})).ok);
    sink->Take();
    ASSERT_TRUE(Ask("CloseProject", Value::array({a.string()})).ok);
    sent = sink->Take();
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].name, "s1");
}

TEST_F(PeerServiceTest, ShutdownTellsEveryRegistrationAndRefusesMore) {
    Tell("RegisterServerStatusChange", Value::array({"s1", Endpoint(kHostA), "/some/where.kstproj"}));
    Tell("RegisterFarlandServerStatusChange",
         Value::array({"f1", Endpoint(kHostB), Value(FarlandAssetInfo{"prod", "1", "asset"})}));
    Tell("RegisterServerProgress", Value::array({"p1", Endpoint(kHostB)}));
    sink->Take();
    service->Shutdown(100);
    auto sent = sink->Take();
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].name, "s1");
    EXPECT_EQ(sent[0].args, Value::array({2}));
    EXPECT_EQ(sent[1].name, "f1");
    EXPECT_EQ(sent[1].to, kHostB);
    EXPECT_EQ(sink->flushes.load(), 1);
    EXPECT_TRUE(sink->closed.load());
    EXPECT_EQ(Message(Ask("OpenProject", Value::array({"/x.kstproj"}))), "The peer is shutting down");
    service->Shutdown(100);  // once only
    EXPECT_EQ(sink->flushes.load(), 1);
}

TEST_F(PeerServiceTest, RegistrationsAreBounded) {
    for (size_t i = 0; i < PeerService::kMaxRegistrations; ++i) {
        Tell("RegisterServerProgress", Value::array({"p" + std::to_string(i), Endpoint(kHostA)}));
    }
    EXPECT_EQ(Message(Ask("RegisterServerProgress", Value::array({"one more", Endpoint(kHostA)}))),
              "Too many progress registrations");
    // Registering the same id again replaces it.
    EXPECT_TRUE(Ask("RegisterServerProgress", Value::array({"p0", Endpoint(kHostA)})).ok);
    EXPECT_EQ(service->ProgressRegistrationCount(), PeerService::kMaxRegistrations);
}

TEST(PeerArguments, RolesAndOptions) {
    std::string error;
    auto o = ParsePeerArguments({"--role", "KESTREL", "-v", "debug"}, error);
    ASSERT_TRUE(o) << error;
    EXPECT_EQ(o->role.announceName, "Kestrel");
    EXPECT_EQ(o->role.ProjectExtension(), ".kstproj");
    EXPECT_TRUE(o->announce);
    EXPECT_EQ(o->traceLevel, 6);

    o = ParsePeerArguments({"--tidelink-named-server", "Plover", "m3", "--no-announce"}, error);
    ASSERT_TRUE(o) << error;
    EXPECT_EQ(o->role.announceName, "Plover");
    EXPECT_EQ(o->role.instance, "m3");
    EXPECT_TRUE(o->role.named);
    EXPECT_FALSE(o->announce);
    o = ParsePeerArguments({"--tidelink-named-server", "Plover", "--loglevel", "quiet"}, error);
    ASSERT_TRUE(o) << error;
    EXPECT_EQ(o->role.instance, "");
    EXPECT_EQ(o->traceLevel, -1);

    const std::pair<std::vector<std::string>, std::string> bad[] = {
        {{}, "give --role"},
        {{"--role"}, "--role needs a value"},
        {{"--role", "heron"}, "unknown role 'heron'"},
        {{"--tidelink-named-server"}, "needs a server name"},
        {{"--tidelink-named-server", "wrenserver"}, "serves no named server 'wrenserver'"},
        {{"--role", "osprey", "--fast"}, "unknown argument '--fast'"},
        {{"--role", "osprey", "-v", "loud"}, "unknown log level 'loud'"},
    };
    for (const auto& [args, expected] : bad) {
        error.clear();
        EXPECT_FALSE(ParsePeerArguments(args, error));
        EXPECT_NE(error.find(expected), std::string::npos) << error;
    }
}
