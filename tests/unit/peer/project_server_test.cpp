// The peer's answers about items and sources, driven directly (no sockets): what hosts get back
// for the projects the peer service has open, and what created sources and items do to them.
#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "PeerRole.h"
#include "PeerService.h"
#include "PeerTestSupport.h"
#include "ProjectServer.h"
#include "tidelink/peers/ProjectProtocol.h"
#include "tidelink/peers/Source.h"

using namespace tidelink;
using namespace tidelink::peer;
using platform::Value;
using tidelink::peer::test::ExamplesDir;
using tidelink::peer::test::TempDir;
namespace fs = std::filesystem;

namespace {

std::string Text(const Outcome& o) { return platform::ToUTF8(o.message); }

class ProjectServerTest : public ::testing::Test {
protected:
    void SetUp() override {
        service = PeerService::Create(*RoleByName("kestrel"), platform::CreateCPUBoundExecutor(), nullptr);
        server = ProjectServer::Create(service, platform::MessageRegistrar::Create());
        demo = Open(ExamplesDir() / "demo.kstproj");
    }
    void TearDown() override {
        server->Stop();
        service->Shutdown(100);
    }

    // One request through |send|, waited for.
    static Outcome Wait(const std::function<void(ReplyFn)>& send) {
        auto promise = std::make_shared<std::promise<Outcome>>();
        auto future = promise->get_future();
        send([promise](Outcome o) { promise->set_value(std::move(o)); });
        if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
            ADD_FAILURE() << "not answered";
            return Outcome::Error("not answered");
        }
        return future.get();
    }
    Outcome Peer(const std::string& name, Value args) {
        return Wait([&](ReplyFn reply) { service->Handle("com.quenlo.tidelink." + name, args, std::move(reply)); });
    }
    Outcome Source(const std::string& name, Value args) {
        return Wait([&](ReplyFn r) { server->HandleSourceMessage("com.quenlo.tidelink." + name, args, std::move(r)); });
    }
    fs::path Open(const fs::path& file) {
        const Outcome o = Peer("OpenProject", Value::array({file.string()}));
        EXPECT_TRUE(o.ok) << Text(o);
        return o.ok ? o.value.get<projectprotocol::ProjectInfo>().mFile : fs::path();
    }
    const ProjectModel& Model() { return *service->OpenProject(demo.string()); }
    Guid Id(const char* path) { return Model().FindByPath(path)->id; }

    static SourceInfo Request(const char16_t* name, int w, int h) {
        SourceInfo info;
        info.mName = name;
        info.mDuration = Rational(2);
        info.mFrameRect.mSize = {w, h};
        info.mFrameRate = platform::FrameRate(platform::kTicksPerSecond / 25);
        return info;
    }

    std::shared_ptr<PeerService> service;
    std::shared_ptr<ProjectServer> server;
    fs::path demo;
};

}  // namespace

TEST_F(ProjectServerTest, ContainersAndSourcesOfAnOpenProject) {
    Outcome o = server->ContainerOf(demo, Guid());
    ASSERT_TRUE(o.ok) << Text(o);
    EXPECT_EQ(o.value.at("iteminfo").get<ItemInfo>().mName, u"Demo");
    const auto top = o.value.at("containeditems").get<std::vector<ItemInfo>>();
    ASSERT_EQ(top.size(), 2u);
    EXPECT_EQ(top[0].mName, u"Compositions");
    EXPECT_EQ(top[0].mType, 1);
    o = server->ContainerOf(demo, top[0].mID);
    ASSERT_TRUE(o.ok);
    EXPECT_EQ(o.value.at("containeditems").size(), 2u);

    // Another spelling of the same file is the same project.
    const fs::path other = ExamplesDir() / ".." / "projects" / "." / "demo.kstproj";
    EXPECT_TRUE(server->ContainerOf(other, Guid()).ok);

    const Guid comp = Id("Compositions/Demo 1080p25");
    EXPECT_NE(Text(server->ContainerOf(demo, comp)).find("is not a bin"), std::string::npos);
    EXPECT_NE(Text(server->ContainerOf(demo, Guid::New())).find("has no item"), std::string::npos);
    EXPECT_NE(Text(server->ContainerOf(ExamplesDir() / "titles.ospproj", Guid())).find("is not open"), std::string::npos);
    EXPECT_NE(Text(server->ContainerOf("relative.kstproj", Guid())).find("not absolute"), std::string::npos);

    o = server->SourceOf(demo, comp);
    ASSERT_TRUE(o.ok) << Text(o);
    const SourceInfo info = o.value.get<SourceInfo>();
    EXPECT_EQ(info.mID, comp);
    EXPECT_EQ(info.mFrameRect.mSize.mX, 1920);
    EXPECT_EQ(info.mMediaProducerDescription, u"Kestrel");
    EXPECT_NE(Text(server->SourceOf(demo, top[0].mID)).find("is a bin"), std::string::npos);

    EXPECT_EQ(server->Linked(demo, comp).value, true);
    EXPECT_EQ(server->Linked(demo, top[0].mID).value, false);
    EXPECT_EQ(server->Linked(demo, Guid::New()).value, false);

    o = server->Snapshot(demo, comp);
    ASSERT_TRUE(o.ok);
    EXPECT_EQ(o.value.at("project").get<projectprotocol::ProjectInfo>().mName, u"Demo");
    EXPECT_EQ(o.value.at("source").get<SourceInfo>(), info);

    // Closed: gone.
    ASSERT_TRUE(Peer("CloseProject", Value::array({demo.string()})).ok);
    EXPECT_NE(Text(server->SourceOf(demo, comp)).find("is not open"), std::string::npos);
}

TEST_F(ProjectServerTest, CreatedSourcesBecomeItemsOfTheOpenProject) {
    Outcome o = server->NewSource(demo, Request(u"Made here", 640, 360));
    ASSERT_TRUE(o.ok) << Text(o);
    const SourceInfo made = o.value.get<SourceInfo>();
    EXPECT_EQ(made.mName, u"Made here");
    EXPECT_EQ(made.mFrameRect.mSize.mX, 640);
    EXPECT_TRUE(made.mHasAudio);
    EXPECT_EQ(server->SourceOf(demo, made.mID).value.get<SourceInfo>(), made);
    const auto top = server->ContainerOf(demo, Guid()).value.at("containeditems").get<std::vector<ItemInfo>>();
    ASSERT_EQ(top.size(), 3u);
    EXPECT_EQ(top[2].mID, made.mID);
    EXPECT_EQ(top[2].mType, 2);
    EXPECT_TRUE(server->NewSource(demo, Request(u"Made here", 64, 64)).ok);
    EXPECT_NE(Model().FindByPath("Made here#2"), nullptr);

    // From our XML: what it states wins; another application's XML leaves the request as it is.
    o = server->NewSourceFromXml(demo,
                                 "<tidelink-items><composition name=\"From XML\" width=\"320\"><solid "
                                 "color=\"#ff0000\"/></composition></tidelink-items>",
                                 Request(u"Asked", 640, 360), {});
    ASSERT_TRUE(o.ok) << Text(o);
    EXPECT_EQ(o.value.get<SourceInfo>().mName, u"From XML");
    EXPECT_EQ(o.value.get<SourceInfo>().mFrameRect.mSize.mX, 320);
    EXPECT_EQ(o.value.get<SourceInfo>().mFrameRect.mSize.mY, 360);
    EXPECT_FALSE(o.value.get<SourceInfo>().mHasAudio);  // its layers replaced the tone
    o = server->NewSourceFromXml(demo, "<items/>", Request(u"Foreign", 640, 360), {});
    ASSERT_TRUE(o.ok) << Text(o);
    EXPECT_EQ(o.value.get<SourceInfo>().mName, u"Foreign");
    EXPECT_TRUE(o.value.get<SourceInfo>().mHasAudio);

    EXPECT_NE(Text(server->NewSourceFromXml(demo, "<items>", Request(u"x", 64, 64), {})).find("not closed"),
              std::string::npos);
    EXPECT_NE(Text(server->NewSource(demo, Request(u"x", 0, 64))).find("Cannot create the source: the frame rectangle"),
              std::string::npos);
    SourceInfo farland = Request(u"x", 64, 64);
    farland.mFarlandProductionRequestInfo.mCreateNewProduction = true;
    EXPECT_NE(Text(server->NewSource(demo, farland)).find("Farland"), std::string::npos);
    EXPECT_NE(Text(server->NewSourceFromXml(demo, "<items/>", Request(u"x", 64, 64), {"p", "1", u"P"})).find("Farland"),
              std::string::npos);

    // Created items live with the open project only.
    ASSERT_TRUE(Peer("CloseProject", Value::array({demo.string()})).ok);
    Open(demo);
    EXPECT_EQ(Model().FindByPath("Made here"), nullptr);
}

TEST_F(ProjectServerTest, ItemsFromXmlGoWhereTheTextSays) {
    // Copies of a bin within the project: taken ids are replaced, paths numbered.
    const Guid bin = Id("Compositions");
    const Outcome xml = server->ItemsAsXml(demo, {bin});
    ASSERT_TRUE(xml.ok);
    EXPECT_TRUE(server->AddItemsFromXml(xml.value.get<std::string>()).ok);
    const Item* copy = Model().FindByPath("Compositions#2/Demo 1080p25");
    ASSERT_NE(copy, nullptr);
    EXPECT_NE(copy->id, Id("Compositions/Demo 1080p25"));
    EXPECT_EQ(copy->composition->layers.size(), Model().FindByPath("Compositions/Demo 1080p25")->composition->layers.size());

    // Into a bin named by path; without "project" into the most recently opened project.
    TempDir dir;
    const fs::path other = Open(dir.Write("Other.kstproj", ProjectModel::EmptyDocument("Other")));
    ASSERT_TRUE(server
                    ->AddItemsFromXml("<tidelink-items project=\"" + demo.string() +
                                      "\" parent=\"Elements\"><bin name=\"New\"/></tidelink-items>")
                    .ok);
    EXPECT_NE(Model().FindByPath("Elements/New"), nullptr);
    ASSERT_TRUE(server->AddItemsFromXml("<tidelink-items><footage name=\"F\" path=\"f.mov\"/></tidelink-items>").ok);
    const auto otherModel = service->OpenProject(other.string());
    ASSERT_NE(otherModel->FindByPath("F"), nullptr);
    EXPECT_EQ(otherModel->Missing().mMissingFootage.size(), 1u);

    // What cannot be used adds nothing, and says why.
    EXPECT_FALSE(server->AddItemsFromXml("<tidelink-items parent=\"Nowhere\"><bin name=\"B\"/></tidelink-items>").ok);
    EXPECT_FALSE(server->AddItemsFromXml("<items/>").ok);
    const auto events = server->Events();
    ASSERT_GE(events.size(), 2u);
    EXPECT_FALSE(events.back().ok);
    EXPECT_NE(events.back().detail.find("nothing added"), std::string::npos);
    EXPECT_NE(events[events.size() - 2].detail.find("no bin \"Nowhere\""), std::string::npos);

    // The whole project, and ids it does not have.
    const Outcome all = server->ItemsAsXml(demo, {});
    ASSERT_TRUE(all.ok);
    EXPECT_NE(all.value.get<std::string>().find("name=\"Elements\""), std::string::npos);
    EXPECT_NE(Text(server->ItemsAsXml(demo, {Guid::New()})).find("has no item"), std::string::npos);
}

TEST_F(ProjectServerTest, SourceRequestsAnswerFromTheProject) {
    const Guid comp = Id("Compositions/Demo 1080p25");
    const Guid bars = Id("Elements/Colour bars");
    const Value args = Value::array({demo.string(), comp.ToString()});

    Outcome o = Source("GetXMLDescription", args);
    ASSERT_TRUE(o.ok) << Text(o);
    EXPECT_NE(o.value.get<std::string>().find(comp.ToString()), std::string::npos);
    EXPECT_FALSE(Source("DoesSourceContainLink", args).value.get<bool>());
    EXPECT_EQ(Source("GetCaptionData", args).value.get<CaptionData>().mVersion, 1u);
    EXPECT_TRUE(Source("SetCaptionSelectionData", Value::array({demo.string(), comp.ToString(),
                                                                Value(CaptionSelectionData{1, 0, {2}})}))
                    .ok);

    // Runtime GUIDs: stable while the peer runs, one per source, new for a new run.
    const Guid runtime = Source("GetRuntimeGuid", args).value.get<Guid>();
    EXPECT_EQ(Source("GetRuntimeGuid", args).value.get<Guid>(), runtime);
    EXPECT_NE(Source("GetRuntimeGuid", Value::array({demo.string(), bars.ToString()})).value.get<Guid>(), runtime);
    auto again = ProjectServer::Create(service, platform::MessageRegistrar::Create());
    EXPECT_NE(Wait([&](ReplyFn r) { again->HandleSourceMessage("com.quenlo.tidelink.GetRuntimeGuid", args, std::move(r)); })
                  .value.get<Guid>(),
              runtime);
    again->Stop();

    // Metadata: made from the source until a host sets the project's.
    o = Source("RenderXMP", Value::array({demo.string(), comp.ToString(), Value({{"value", 0}, {"scale", 1}}),
                                          Value({{"value", 1}, {"scale", 1}})}));
    ASSERT_TRUE(o.ok) << Text(o);
    EXPECT_NE(o.value.get<std::string>().find(">Demo 1080p25<"), std::string::npos);
    EXPECT_TRUE(Source("SetXMP", Value::array({demo.string(), "<x/>"})).ok);
    o = Source("RenderXMP", Value::array({demo.string(), bars.ToString(), Value({{"value", 0}, {"scale", 1}}),
                                          Value({{"value", 1}, {"scale", 1}})}));
    EXPECT_EQ(o.value, "<x/>");
    EXPECT_NE(Text(Source("SetXMP", Value::array({demo.string(), std::string(ProjectServer::kMaxMetadataBytes + 1, 'x')})))
                  .find("larger than 1 MiB"),
              std::string::npos);

    // Refusals.
    EXPECT_NE(Text(Source("farland.GetXMLDescription", Value::array({Value::object()}))).find("Farland"),
              std::string::npos);
    EXPECT_NE(Text(Source("GetRuntimeGuid", Value::array({demo.string(), "nope"}))).find("Bad arguments for GetRuntimeGuid"),
              std::string::npos);
    EXPECT_NE(Text(Source("GetXMLDescription", Value::array({demo.string()}))).find("argument 2"), std::string::npos);
    EXPECT_NE(Text(Source("RenderXMP", Value::array({demo.string(), comp.ToString(), Value({{"value", 2}, {"scale", 1}}),
                                                     Value({{"value", 1}, {"scale", 1}})})))
                  .find("before the start"),
              std::string::npos);
    EXPECT_NE(Text(Source("GetXMLDescription", Value::array({demo.string(), Id("Compositions").ToString()})))
                  .find("is a bin"),
              std::string::npos);
}

TEST_F(ProjectServerTest, ShownSourcesAndSentFilesAreRecorded) {
    EXPECT_TRUE(server->Show(demo, Id("Elements/Colour bars")).ok);
    EXPECT_FALSE(server->Show(demo, Guid::New()).ok);
    server->SendFile(demo, "/tmp/some file.mov");
    const auto events = server->Events();
    ASSERT_EQ(events.size(), 3u);
    EXPECT_EQ(events[0].what, "ShowSource");
    EXPECT_NE(events[0].detail.find("\"Elements/Colour bars\""), std::string::npos);
    EXPECT_FALSE(events[1].ok);
    EXPECT_EQ(events[2].what, "SendFile");
    EXPECT_EQ(events[2].detail, "/tmp/some file.mov");
}
