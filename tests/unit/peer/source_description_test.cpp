// What the peer tells hosts about its sources, and the compositions hosts ask it to create.
#include <gtest/gtest.h>

#include "PeerTestSupport.h"
#include "ProjectModel.h"
#include "RenderRules.h"
#include "SourceDescription.h"
#include "tidelink/render/FrameLayout.h"

using namespace tidelink;
using namespace tidelink::peer;
using platform::FrameRate;
using platform::kTicksPerSecond;
using tidelink::peer::test::ExamplesDir;
using tidelink::peer::test::TempDir;

namespace {

const ProjectModel& Demo() {
    static const ProjectModel model = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    return model;
}

// What Project::CreateSource sends for a 1280x720 source at 30000/1001 of 10 s with 48 kHz stereo.
SourceInfo Request() {
    SourceInfo info;
    info.mName = u"New";
    info.mDuration = Rational(10);
    info.mFrameRect.mSize = {1280, 720};
    info.mFrameRate = FrameRate(8475667200);
    info.mAudioChannelLayout = platform::CreateStereoChannelLayout();
    info.mAudioSampleRate = FrameRate(5292000);
    return info;
}

std::string RefusalOf(const SourceInfo& info) {
    try {
        CompositionFromSourceInfo(info);
    } catch (const ProjectError& e) {
        return e.what();
    }
    return "(accepted)";
}

}  // namespace

TEST(SourceDescriptionTest, CompositionIsDescribedForRendering) {
    const Item& item = *Demo().FindByPath("Compositions/Demo 1080p29.97");
    const SourceInfo info = DescribeSource(Demo(), item, "Kestrel");
    EXPECT_EQ(info.mParentProjectFile, Demo().File());
    EXPECT_EQ(info.mName, u"Demo 1080p29.97");
    EXPECT_EQ(info.mMediaProducerDescription, u"Kestrel");
    EXPECT_EQ(info.mID, item.id);
    EXPECT_EQ(info.mDuration, Rational(300 * 1001, 30000));
    EXPECT_EQ(info.mFrameRect.mTopLeft.mX, 0);
    EXPECT_EQ(info.mFrameRect.mSize.mX, 1920);
    EXPECT_EQ(info.mFrameRect.mSize.mY, 1080);
    EXPECT_EQ(info.mFrameRate.TicksPerFrame(), 8475667200);
    ASSERT_EQ(info.mPixelFormatList.size(), 2u);
    EXPECT_EQ(info.mPixelFormatList[0].mFourCC, kPixelFormatBGRA);
    EXPECT_EQ(info.mPixelFormatList[1].mFourCC, kPixelFormatRGBA);
    EXPECT_EQ(info.mFieldType, platform::FieldType::Progressive);
    EXPECT_EQ(info.mAudioSampleRate.TicksPerFrame(), 5292000);
    EXPECT_EQ(info.mAudioChannelLayout, platform::CreateStereoChannelLayout());
    EXPECT_TRUE(info.mHasVideo);
    EXPECT_TRUE(info.mHasAudio);
    EXPECT_TRUE(info.mSupportsVideoRenderingSessions);
    EXPECT_FALSE(info.mIsMedia);
    EXPECT_EQ(info.mWorkOutPoint, info.mDuration);
    // It survives the wire unchanged, so a host's reconnection finds nothing changed.
    EXPECT_EQ(platform::Value(info).get<SourceInfo>(), info);
    EXPECT_FALSE(DescribeSource(Demo(), *Demo().FindByPath("Elements/Colour bars"), "Kestrel").mHasAudio);
}

TEST(SourceDescriptionTest, FootageIsMediaThatIsNotRendered) {
    const ProjectModel model = ProjectModel::Load(ExamplesDir() / "missing-footage.kstproj");
    const Item* footage = nullptr;
    for (const Item& item : model.Items()) {
        if (item.type == ItemType::Footage) footage = &item;
    }
    ASSERT_NE(footage, nullptr);
    const SourceInfo info = DescribeSource(model, *footage, "Kestrel");
    EXPECT_TRUE(info.mIsMedia);
    EXPECT_FALSE(info.mHasVideo);
    EXPECT_FALSE(info.mHasAudio);
    EXPECT_FALSE(info.mSupportsVideoRenderingSessions);
    const platform::Value app = platform::ParseJSONText(info.mAppSpecificSourceInfo);
    EXPECT_EQ(app.at("type"), "footage");
    EXPECT_EQ(app.at("missing"), true);
    EXPECT_THROW(DescribeSource(model, model.Root(), "Kestrel"), ProjectError);
}

TEST(SourceDescriptionTest, CreatedCompositionTakesTheRequestedFormat) {
    const Composition c = CompositionFromSourceInfo(Request());
    EXPECT_EQ(c.width, 1280);
    EXPECT_EQ(c.height, 720);
    EXPECT_EQ(c.frameRate, Rational(30000, 1001));
    EXPECT_EQ(c.duration, Rational(10));
    EXPECT_EQ(c.sampleRate, 48000);
    EXPECT_TRUE(c.HasAudio());
    ASSERT_FALSE(c.layers.empty());
    EXPECT_TRUE(std::holds_alternative<PatternLayer>(c.layers[0].content));
    // Describing it again gives back what was asked for.
    SourceInfo mono = Request();
    mono.mAudioChannelLayout = {platform::AudioChannelDescription{1}};
    mono.mAudioSampleRate = FrameRate(kTicksPerSecond / 44100);
    mono.mPixelAspectRatio = platform::PixelAspectRatio(0, 0);  // unset: square
    const Composition m = CompositionFromSourceInfo(mono);
    EXPECT_EQ(m.sampleRate, 44100);
    EXPECT_EQ(m.channels.size(), 1u);
    EXPECT_EQ(m.pixelAspectRatio, platform::PixelAspectRatio(1, 1));
}

TEST(SourceDescriptionTest, CreateSourceRefusesFormatsItCannotMake) {
    SourceInfo info = Request();
    info.mFrameRect.mSize = {0, 720};
    EXPECT_NE(RefusalOf(info).find("no size"), std::string::npos);
    info = Request();
    info.mFrameRect.mSize = {20000, 720};
    EXPECT_NE(RefusalOf(info).find("frame size"), std::string::npos);
    info = Request();
    info.mFrameRate = FrameRate();
    EXPECT_NE(RefusalOf(info).find("frame rate is not set"), std::string::npos);
    info.mFrameRate = FrameRate(kTicksPerSecond / 2000);
    EXPECT_NE(RefusalOf(info).find("frame rate"), std::string::npos);
    info.mFrameRate = FrameRate(-1);
    EXPECT_NE(RefusalOf(info).find("not positive"), std::string::npos);
    info = Request();
    info.mDuration = Rational(0);
    EXPECT_NE(RefusalOf(info).find("duration"), std::string::npos);
    info.mDuration = Rational(8 * 24 * 3600);
    EXPECT_NE(RefusalOf(info).find("7 days"), std::string::npos);
    info = Request();
    info.mAudioSampleRate = FrameRate(5292001);
    EXPECT_NE(RefusalOf(info).find("whole number"), std::string::npos);
    info.mAudioSampleRate = FrameRate(kTicksPerSecond / 4000);
    EXPECT_NE(RefusalOf(info).find("audio rate"), std::string::npos);
    info = Request();
    info.mAudioChannelLayout.assign(33, platform::AudioChannelDescription{1});
    EXPECT_NE(RefusalOf(info).find("channels"), std::string::npos);
}

TEST(SourceDescriptionTest, AudioFormatFollowsTheRequestedLayoutByLabel) {
    const Composition& c = *Demo().FindByPath("Compositions/Demo 1080p29.97")->composition;
    AudioRenderOptions o;
    AudioFormat f = ResolveAudioFormat(c, o);
    EXPECT_EQ(f.sampleRate, 48000);
    EXPECT_EQ(f.sourceChannel, (std::vector<int32_t>{0, 1}));
    o.SetAudioChannelLayout({platform::AudioChannelDescription{2}, platform::AudioChannelDescription{7},
                             platform::AudioChannelDescription{1}});
    o.SetSampleRate(FrameRate(kTicksPerSecond / 96000));
    f = ResolveAudioFormat(c, o);
    EXPECT_EQ(f.sampleRate, 96000);
    EXPECT_EQ(f.sourceChannel, (std::vector<int32_t>{1, -1, 0}));
    o.SetSampleRate(FrameRate(kTicksPerSecond / 4000));
    EXPECT_THROW(ResolveAudioFormat(c, o), RenderError);
    o.SetSampleRate(FrameRate(7));
    EXPECT_THROW(ResolveAudioFormat(c, o), RenderError);
    o.SetSampleRate(FrameRate());
    o.SetAudioChannelLayout(platform::AudioChannelLayout(33));
    EXPECT_THROW(ResolveAudioFormat(c, o), RenderError);
    // Tones that a lower rate cannot carry are left out.
    EXPECT_EQ(AtSampleRate(c, 8000).layers.size(), 2u);
    EXPECT_EQ(AtSampleRate(c, 1000).layers.size(), 1u);
}

TEST(SourceDescriptionTest, MetadataNamesTheItemEscaped) {
    TempDir dir;
    const auto file = dir.Write("m.kstproj", R"({"format": "tidelink-project", "version": 1, "name": "A & B",
        "items": [{"type": "composition", "name": "<Intro>", "width": 64, "height": 36, "frameRate": 25,
                   "duration": 2}]})");
    const ProjectModel model = ProjectModel::Load(file);
    const std::string x = MetadataPacket(model, *model.FindByPath("<Intro>"), Rational(1, 2), Rational(1));
    EXPECT_NE(x.find("<rdf:li xml:lang=\"x-default\">&lt;Intro&gt;</rdf:li>"), std::string::npos) << x;
    EXPECT_NE(x.find("<tl:project>A &amp; B</tl:project>"), std::string::npos);
    EXPECT_NE(x.find("<tl:rangeStart>1/2</tl:rangeStart>"), std::string::npos);
    EXPECT_NE(x.find("<tl:frameSize>64x36</tl:frameSize>"), std::string::npos);
}
