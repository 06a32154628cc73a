#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

#include "PeerTestSupport.h"
#include "ProjectModel.h"

using namespace tidelink;
using namespace tidelink::peer;
using tidelink::peer::test::ExamplesDir;
using tidelink::peer::test::TempDir;
namespace fs = std::filesystem;

namespace {

const fs::path kFile = "/projects/test.kstproj";

std::string Doc(const std::string& items) {
    return R"({"format": "tidelink-project", "version": 1, "name": "T", "items": )" + items + "}";
}

std::string Comp(const std::string& extra) {
    return R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 25, "duration": 2)" +
           (extra.empty() ? std::string() : ", " + extra) + "}]";
}

// The message of the ProjectError that |text| raises, or "" when it reads.
std::string ErrorOf(const std::string& text, const DocumentOverrides& overrides = {}) {
    try {
        ProjectModel::Parse(text, kFile, overrides);
    } catch (const ProjectError& e) {
        return e.what();
    }
    return "";
}

std::vector<std::string> MissingPaths(const ProjectModel& m) {
    std::vector<std::string> out;
    for (const auto& f : m.Missing().mMissingFootage) out.push_back(platform::ToUTF8(f.mPath));
    return out;
}

}  // namespace

TEST(ProjectModel, ReadsTheDemoProject) {
    const auto m = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    EXPECT_EQ(m.Name(), "Demo");
    EXPECT_TRUE(m.Missing().IsEmpty());
    const Item* comp = m.FindByPath("Compositions/Demo 1080p29.97");
    ASSERT_NE(comp, nullptr);
    EXPECT_EQ(comp->id.ToString(), "3f2a6c1e-8b4d-4e7a-9c21-5d0e6f7a8b90");
    EXPECT_EQ(comp->type, ItemType::Composition);
    ASSERT_TRUE(comp->composition);
    const Composition& c = *comp->composition;
    EXPECT_EQ(c.width, 1920);
    EXPECT_EQ(c.height, 1080);
    EXPECT_EQ(c.frameRate, Rational(30000, 1001));
    EXPECT_EQ(c.duration, Rational(300 * 1001, 30000));
    EXPECT_EQ(c.FrameCount(), 300);
    EXPECT_EQ(c.sampleRate, 48000);
    ASSERT_EQ(c.channels.size(), 2u);
    EXPECT_EQ(c.channels[0].mChannelLabel, platform::AudioChannelDescription::kLabelLeft);
    EXPECT_EQ(c.channels[1].mChannelLabel, platform::AudioChannelDescription::kLabelRight);
    EXPECT_TRUE(c.HasAudio());
    ASSERT_EQ(c.layers.size(), 5u);
    EXPECT_TRUE(std::holds_alternative<PatternLayer>(c.layers[0].content));
    const auto& box = std::get<SolidLayer>(c.layers[2].content);
    EXPECT_EQ(box.color, (Color8{255, 128, 0, 255}));
    EXPECT_EQ(box.rect, (PixelRect{860, 440, 200, 200}));
    EXPECT_EQ(c.layers[2].start, Rational(1001, 1000));
    EXPECT_EQ(*c.layers[2].end, Rational(5005, 1000));
    const auto& tone = std::get<ToneLayer>(c.layers[3].content);
    EXPECT_DOUBLE_EQ(tone.frequency, 440.0);
    EXPECT_NEAR(tone.amplitude, 0.1, 1e-12);
    EXPECT_EQ(tone.channels, std::vector<int32_t>{0});

    // The item tree as hosts see it: the root bin holds the top-level bins.
    const auto top = m.ChildrenOf(m.Root());
    ASSERT_EQ(top.size(), 2u);
    EXPECT_EQ(top[0].mName, u"Compositions");
    EXPECT_EQ(top[0].mType, 1);
    const auto comps = m.ChildrenOf(*m.Find(top[0].mID));
    ASSERT_EQ(comps.size(), 2u);
    EXPECT_EQ(comps[0].mType, 2);
    EXPECT_EQ(comps[0].mID, comp->id);
    EXPECT_EQ(m.Find(platform::Guid()), &m.Root());

    const auto info = m.Info();
    EXPECT_EQ(info.mName, u"Demo");
    EXPECT_EQ(info.mFile, ExamplesDir() / "demo.kstproj");
}

TEST(ProjectModel, EveryExampleReads) {
    for (const char* name : {"demo.kstproj", "titles.ospproj", "show.pufproj", "missing-footage.kstproj",
                             "library.plvcat"}) {
        SCOPED_TRACE(name);
        EXPECT_NO_THROW(ProjectModel::Load(ExamplesDir() / name));
    }
}

TEST(ProjectModel, IdsAreStableAcrossReadsAndPlaces) {
    const auto text = [] {
        std::ifstream in(ExamplesDir() / "show.pufproj");
        return std::string(std::istreambuf_iterator<char>(in), {});
    }();
    const auto a = ProjectModel::Parse(text, "/a/show.pufproj");
    const auto b = ProjectModel::Parse(text, "/elsewhere/renamed.pufproj");
    ASSERT_EQ(a.Items().size(), b.Items().size());
    std::set<platform::Guid> ids;
    for (size_t i = 0; i < a.Items().size(); ++i) {
        EXPECT_EQ(a.Items()[i].id, b.Items()[i].id);
        EXPECT_EQ(a.Items()[i].id, DeriveItemId(a.Items()[i].path)) << a.Items()[i].path;
        ids.insert(a.Items()[i].id);
    }
    EXPECT_EQ(ids.size(), a.Items().size());
    // Siblings of the same name get "#2", "#3"... in their paths, and so their own ids.
    const Item* first = a.FindByPath("Episode 1/Segments/Segment");
    const Item* second = a.FindByPath("Episode 1/Segments/Segment#2");
    ASSERT_TRUE(first && second);
    EXPECT_NE(first->id, second->id);
    EXPECT_EQ(second->composition->duration, Rational(45));
    EXPECT_EQ(a.Root().id, DeriveItemId(""));
    // Pinned: a change of the derivation would change every id hosts have kept (these are the
    // RFC 4122 version 5 GUIDs of the paths in the peer's namespace).
    EXPECT_EQ(DeriveItemId("Episode 1").ToString(), "6dafb8ea-5a12-5c56-a9f8-c4b97e472658");
    EXPECT_EQ(DeriveItemId("").ToString(), "b7e36163-6b58-59a1-9e4c-cb21bb3f2fa2");
}

TEST(ProjectModel, ExplicitIdsWinAndMustBeUnique) {
    const std::string id = "6f1c2a3e-5b7d-4e21-9a0c-1d2e3f405162";
    const auto m = ProjectModel::Parse(R"({"format": "tidelink-project", "version": 1, "id": "0b6c7b4e-1111-4a4a-8b8b-123456789abc",
        "items": [{"type": "bin", "name": "B", "id": ")" + id + R"("}]})", kFile);
    EXPECT_EQ(m.Root().id.ToString(), "0b6c7b4e-1111-4a4a-8b8b-123456789abc");
    ASSERT_NE(m.Find(*platform::Guid::Parse(std::string_view(id))), nullptr);
    EXPECT_EQ(m.Name(), "test");  // no name: the file's stem

    const std::string dup = ErrorOf(Doc(R"([{"type": "bin", "name": "A", "id": ")" + id +
                                        R"("}, {"type": "bin", "name": "B", "id": ")" + id + R"("}])"));
    EXPECT_NE(dup.find("/items/1: the id " + id + " is also the id of \"A\""), std::string::npos) << dup;
    // An explicit id equal to another item's derived id is caught the same way.
    const std::string clash = ErrorOf(Doc(R"([{"type": "bin", "name": "A"}, {"type": "bin", "name": "B", "id": ")" +
                                          DeriveItemId("A").ToString() + R"("}])"));
    EXPECT_NE(clash.find("is also the id of"), std::string::npos) << clash;
}

TEST(ProjectModel, MissingFootageIsReportedOncePerFile) {
    const auto m = ProjectModel::Load(ExamplesDir() / "missing-footage.kstproj");
    const std::vector<std::string> expected = {(ExamplesDir() / "media/interview.mov").string(),
                                               "/nonexistent/archive/b-roll.mov",
                                               (ExamplesDir() / "media/cutaway.mov").string()};
    EXPECT_EQ(MissingPaths(m), expected);
    const Item* interview = m.FindByPath("Footage/Interview");
    ASSERT_TRUE(interview && interview->footage);
    EXPECT_EQ(interview->type, ItemType::Footage);
    EXPECT_TRUE(interview->footage->missing);
    EXPECT_EQ(m.InfoOf(*interview).mType, 3);
    // The reply record carries them.
    EXPECT_EQ(m.Info().mMissingAssets.mMissingFootage.size(), 3u);

    TempDir dir;
    dir.Write("media/clip.mov", "not really a movie");
    const std::string gone = dir.Path().filename().string() + "-gone.mov";  // beside the folder
    const std::string text = Doc(R"([{"type": "footage", "name": "Clip", "path": "media/./clip.mov"},
                                     {"type": "footage", "name": "Gone", "path": "../)" + gone + R"("}])");
    const auto present = ProjectModel::Parse(text, dir.Path() / "p.kstproj");
    EXPECT_EQ(MissingPaths(present), std::vector<std::string>{(dir.Path().parent_path() / gone).string()});
    EXPECT_FALSE(present.FindByPath("Clip")->footage->missing);
    fs::remove(dir.Path() / "media/clip.mov");
    EXPECT_EQ(MissingPaths(ProjectModel::Parse(text, dir.Path() / "p.kstproj")).size(), 2u);
}

TEST(ProjectModel, MalformedDocumentsSayWhereAndWhat) {
    const struct {
        std::string text;
        std::string expected;
    } cases[] = {
        {"", "not a valid JSON document"},
        {"{\"format\": ", "not a valid JSON document"},
        {std::string(200, '[') + std::string(200, ']'), "not a valid JSON document"},
        {"[]", "/: expected an object, found an array"},
        {R"({"version": 1})", "/: the member \"format\" is missing"},
        {R"({"format": "other", "version": 1})", "/format: expected \"tidelink-project\""},
        {R"({"format": "tidelink-project", "version": 2})", "/version: version 2 is not supported"},
        {R"({"format": "tidelink-project", "version": "1"})", "/version: expected a whole number, found a string"},
        {Doc("{}"), "/items: expected an array of items, found an object"},
        {Doc("[1]"), "/items/0: expected an object, found a number"},
        {Doc(R"([{"type": "folder", "name": "x"}])"), "/items/0/type: unknown item type \"folder\""},
        {Doc(R"([{"type": "bin"}])"), "/items/0: the member \"name\" is missing"},
        {Doc(R"([{"type": "bin", "name": ""}])"), "/items/0/name: a name must not be empty"},
        {Doc(R"([{"type": "bin", "name": "a/b"}])"), "/items/0/name: a name must not contain \"/\""},
        {Doc(R"([{"type": "bin", "name": "b", "items": [{"type": "bin"}]}])"),
         "/items/0/items/0: the member \"name\" is missing"},
        {Doc(R"([{"type": "bin", "name": "b", "colour": 1}])"), "/items/0/colour: unknown member"},
        {Doc(R"([{"type": "bin", "name": "b", "id": "xyz"}])"), "/items/0/id: expected a GUID"},
        {Doc(R"([{"type": "bin", "name": "b", "id": "00000000-0000-0000-0000-000000000000"}])"),
         "/items/0/id: the nil GUID names the root"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "duration": 2}])"),
         "/items/0: the member \"frameRate\" is missing"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 25}])"),
         "/items/0: give exactly one of \"duration\" (seconds) and \"durationFrames\""},
        {Doc(Comp(R"("durationFrames": 10)")), "give exactly one of"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 0, "height": 48, "frameRate": 25, "duration": 1}])"),
         "/items/0/width: must be between 1 and 16384"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 1e300, "height": 48, "frameRate": 25, "duration": 1}])"),
         "/items/0/width: expected a whole number"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 18446744073709551615, "height": 48, "frameRate": 25, "duration": 1}])"),
         "/items/0/width: must be between 1 and 16384"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": [30000, 0], "duration": 1}])"),
         "/items/0/frameRate/1: must be between 1 and"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 29.97, "duration": 1}])"),
         "/items/0/frameRate: expected a rational such as 25, [30000, 1001]"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": [9223372036854775807, 1], "duration": 1}])"),
         "/items/0/frameRate/0: must be"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 0, "duration": 1}])"),
         "/items/0/frameRate: the frame rate must be above 0"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": {"value": 25}, "duration": 1}])"),
         "/items/0/frameRate: the member \"scale\" is missing"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 25, "duration": [-1, 2]}])"),
         "/items/0/duration: the duration must be above 0"},
        {Doc(R"([{"type": "composition", "name": "C", "width": 64, "height": 48, "frameRate": 25, "durationFrames": 0}])"),
         "/items/0/durationFrames: must be between 1"},
        {Doc(Comp(R"("audio": {"sampleRate": 7999})")), "/items/0/audio/sampleRate: must be between 8000 and 384000"},
        {Doc(Comp(R"("audio": {"channels": []})")), "/items/0/audio/channels: expected an array of 1 to 32 channels"},
        {Doc(Comp(R"("audio": {"channels": ["left", "up"]})")), "/items/0/audio/channels/1: unknown channel \"up\""},
        {Doc(Comp(R"("background": [1, 2, 0])")), "/items/0/background/1: colour components run from 0 to 1"},
        {Doc(Comp(R"("background": "#12345")")), "/items/0/background: expected a colour"},
        {Doc(Comp(R"("background": "#gg0000")")), "/items/0/background: expected a colour"},
        {Doc(Comp(R"("layers": {})")), "/items/0/layers: expected an array of layers"},
        {Doc(Comp(R"("layers": [{"type": "text"}])")), "/items/0/layers/0/type: unknown layer type \"text\""},
        {Doc(Comp(R"("layers": [{"type": "solid"}])")), "/items/0/layers/0: the member \"color\" is missing"},
        {Doc(Comp(R"("layers": [{"type": "solid", "color": "#fff000", "rect": [0, 0, 10]}])")),
         "/items/0/layers/0/rect: expected a rectangle [x, y, width, height]"},
        {Doc(Comp(R"("layers": [{"type": "solid", "color": "#fff000", "rect": [0, 0, -1, 5]}])")),
         "/items/0/layers/0/rect/2: must be between 0 and 16384"},
        {Doc(Comp(R"("layers": [{"type": "pattern", "start": 2, "end": 1}])")), "/items/0/layers/0/end: must be after \"start\""},
        {Doc(Comp(R"("layers": [{"type": "pattern", "start": -1}])")), "/items/0/layers/0/start: must not be negative"},
        {Doc(Comp(R"("layers": [{"type": "gradient", "direction": "diagonal"}])")),
         "/items/0/layers/0/direction: expected \"horizontal\" or \"vertical\""},
        {Doc(Comp(R"("layers": [{"type": "tone", "frequency": 30000}])")),
         "/items/0/layers/0/frequency: must be above 0 and at most half the sample rate (24000 Hz)"},
        {Doc(Comp(R"("layers": [{"type": "tone", "frequency": 440, "level": 3}])")),
         "/items/0/layers/0/level: the level is in dBFS"},
        {Doc(Comp(R"("layers": [{"type": "tone", "frequency": 440, "channels": [2]}])")),
         "/items/0/layers/0/channels/0: must be between 0 and 1"},
        {Doc(Comp(R"("layers": [{"type": "footage", "path": ""}])")), "/items/0/layers/0/path: expected a file path"},
        {Doc(R"([{"type": "footage", "name": "F"}])"), "/items/0: the member \"path\" is missing"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.text);
        const std::string error = ErrorOf(c.text);
        EXPECT_NE(error.find(c.expected), std::string::npos) << "got: " << error;
    }
}

TEST(ProjectModel, ValuesInEveryAcceptedSpelling) {
    const auto m = ProjectModel::Parse(
        Doc(R"([{"type": "composition", "name": "C", "width": 640.0, "height": 480, "frameRate": {"value": 24000, "scale": 1001},
                 "durationFrames": 48, "pixelAspectRatio": [10, 11], "background": "#10203080",
                 "audio": {"sampleRate": 44100, "channels": ["left", 7, "right"]},
                 "comment": "free text",
                 "layers": [{"type": "gradient", "from": [0, 0.5, 1], "to": [1, 1, 1, 0], "direction": "vertical"}]}])"),
        kFile);
    const Composition& c = *m.FindByPath("C")->composition;
    EXPECT_EQ(c.width, 640);
    EXPECT_EQ(c.frameRate, Rational(24000, 1001));
    EXPECT_EQ(c.duration, Rational(48 * 1001, 24000));
    EXPECT_EQ(c.FrameCount(), 48);
    EXPECT_EQ(c.pixelAspectRatio, platform::PixelAspectRatio(10, 11));
    EXPECT_EQ(c.background, (Color8{0x10, 0x20, 0x30, 0x80}));
    ASSERT_EQ(c.channels.size(), 3u);
    EXPECT_EQ(c.channels[1].mChannelLabel, 7);
    const auto& g = std::get<GradientLayer>(c.layers[0].content);
    EXPECT_EQ(g.from, (Color8{0, 128, 255, 255}));
    EXPECT_EQ(g.to, (Color8{255, 255, 255, 0}));
    EXPECT_EQ(g.direction, GradientLayer::Direction::Vertical);
    EXPECT_FALSE(c.HasAudio());
}

TEST(ProjectModel, OverridesPatchTheDocumentAndItems) {
    const fs::path demo = ExamplesDir() / "demo.kstproj";
    const auto renamed = ProjectModel::Load(demo, ParseOverrides(R"({"document": {"name": "Renamed"}})"));
    EXPECT_EQ(renamed.Name(), "Renamed");

    // By path, by explicit id and by derived id; ids do not change.
    const std::string derived = DeriveItemId("Elements/Colour bars").ToString();
    const auto patched = ProjectModel::Load(
        demo, ParseOverrides(R"({"items": {
            "Compositions/Demo 1080p25": {"frameRate": 50, "layers": [{"type": "pattern"}]},
            "3f2a6c1e-8b4d-4e7a-9c21-5d0e6f7a8b90": {"width": 1280, "height": 720},
            ")" + derived + R"(": {"duration": 1}}})"));
    const Item* p25 = patched.FindByPath("Compositions/Demo 1080p25");
    EXPECT_EQ(p25->composition->frameRate, Rational(50));
    EXPECT_EQ(p25->composition->layers.size(), 1u);
    EXPECT_EQ(p25->id, DeriveItemId("Compositions/Demo 1080p25"));
    EXPECT_EQ(patched.FindByPath("Compositions/Demo 1080p29.97")->composition->width, 1280);
    EXPECT_EQ(patched.FindByPath("Elements/Colour bars")->composition->duration, Rational(1));
    // Unpatched items are as in the file.
    EXPECT_EQ(patched.FindByPath("Elements/Vertical ramp")->composition->width, 1280);

    EXPECT_TRUE(ParseOverrides("  ").document.is_null());
    const auto text = [] {
        std::ifstream in(ExamplesDir() / "demo.kstproj");
        return std::string(std::istreambuf_iterator<char>(in), {});
    }();
    auto overrideError = [&](const std::string& json) {
        try {
            return ErrorOf(text, ParseOverrides(json));
        } catch (const ProjectError& e) {
            return std::string(e.what());
        }
    };
    EXPECT_NE(overrideError("{").find("the JSON text is not valid JSON"), std::string::npos);
    EXPECT_NE(overrideError("[]").find("/: expected an object"), std::string::npos);
    EXPECT_NE(overrideError(R"({"doc": {}})").find("/doc: unknown member"), std::string::npos);
    EXPECT_NE(overrideError(R"({"document": 3})").find("/document: expected an object"), std::string::npos);
    EXPECT_NE(overrideError(R"({"items": {"Nowhere": {}}})").find("no item \"Nowhere\" to override"), std::string::npos);
    EXPECT_NE(overrideError(R"({"items": {"Compositions": 1}})").find("/items/Compositions: expected an object"),
              std::string::npos);
    // A patch that breaks the document is reported as the document's error.
    EXPECT_NE(overrideError(R"({"items": {"Compositions/Demo 1080p25": {"frameRate": null}}})")
                  .find("/items/0/items/1: the member \"frameRate\" is missing"),
              std::string::npos);
}

TEST(ProjectModel, FilesThatCannotBeRead) {
    TempDir dir;
    const auto error = [](const fs::path& p) {
        try {
            ProjectModel::Load(p);
        } catch (const ProjectError& e) {
            return std::string(e.what());
        }
        return std::string();
    };
    EXPECT_EQ(error(dir.Path() / "none.kstproj"), "no such file");
    fs::create_directories(dir.Path() / "folder.kstproj");
    EXPECT_EQ(error(dir.Path() / "folder.kstproj"), "it is a folder, not a project file");
    const auto binary = dir.Write("binary.kstproj", std::string("\xff\xfe\x00\x01", 4));
    EXPECT_NE(error(binary).find("not a valid JSON document"), std::string::npos);

    const auto empty = ProjectModel::Parse(ProjectModel::EmptyDocument("Fresh"), dir.Path() / "Fresh.kstproj");
    EXPECT_EQ(empty.Name(), "Fresh");
    EXPECT_EQ(empty.Items().size(), 1u);
    EXPECT_TRUE(empty.ChildrenOf(empty.Root()).empty());
}
