// What a video render holds: the geometry rules (bounds, downsampling, region of interest, pixel
// format, field order, pixel shape) and the row-wise composer, checked byte for byte against the
// reference generators.
#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <vector>

#include "FrameComposer.h"
#include "Generators.h"
#include "PeerTestSupport.h"
#include "ProjectModel.h"
#include "RenderRules.h"

using namespace tidelink;
using namespace tidelink::peer;
using platform::FieldType;
using platform::PixelFormat;
using tidelink::peer::test::ExamplesDir;

namespace {

VideoRenderOptions Options(int width = 0, int height = 0, int dx = 1, int dy = 1) {
    VideoRenderOptions o;
    o.SetBounds(width, height);
    o.SetDownsampleFactor(dx, dy);
    return o;
}

platform::RectT<int> Rect(int x, int y, int w, int h) {
    platform::RectT<int> r;
    r.mTopLeft = {x, y};
    r.mSize = {w, h};
    return r;
}

Composition Comp(int32_t w, int32_t h) {
    Composition c;
    c.width = w;
    c.height = h;
    c.frameRate = Rational(25);
    c.duration = Rational(4);
    c.channels = platform::CreateStereoChannelLayout();
    return c;
}

// Composes into rows with padding (filled with a marker that must survive) and compares.
void ExpectSameAsReference(const Composition& comp, const Rational& time, const FrameGeometry& g,
                           const std::string& what) {
    const size_t rowBytes = g.RowBytes() + 20;
    std::vector<uint8_t> rows(rowBytes * static_cast<size_t>(g.height), 0xC3);
    ComposeFrame(comp, time, g, rows.data(), rowBytes);
    const auto expected = test::ExpectedFrame(comp, time, g);
    for (int32_t j = 0; j < g.height; ++j) {
        const uint8_t* got = rows.data() + static_cast<size_t>(j) * rowBytes;
        const uint8_t* want = expected.data() + static_cast<size_t>(j) * g.RowBytes();
        for (uint32_t b = 0; b < g.RowBytes(); ++b) {
            if (got[b] != want[b]) {
                FAIL() << what << ": row " << j << ", byte " << b << " (pixel " << b / 4 << ") is "
                       << int(got[b]) << ", the generators give " << int(want[b]);
            }
        }
        for (size_t b = g.RowBytes(); b < rowBytes; ++b) {
            ASSERT_EQ(got[b], 0xC3) << what << ": wrote past the row at row " << j;
        }
    }
}

Color8 RandomColor(std::mt19937& rng, bool opaque) {
    std::uniform_int_distribution<int> byte(0, 255);
    auto b = [&] { return static_cast<uint8_t>(byte(rng)); };
    return Color8{b(), b(), b(), opaque ? uint8_t{255} : b()};
}

std::optional<PixelRect> RandomRect(std::mt19937& rng, const Composition& c) {
    std::uniform_int_distribution<int> pick(0, 3);
    if (pick(rng) == 0) return std::nullopt;
    std::uniform_int_distribution<int> x(-c.width / 2, c.width), y(-c.height / 2, c.height);
    std::uniform_int_distribution<int> w(0, c.width * 3 / 2), h(0, c.height * 3 / 2);
    return PixelRect{x(rng), y(rng), w(rng), h(rng)};
}

Composition RandomComposition(std::mt19937& rng) {
    std::uniform_int_distribution<int> side(1, 160), kind(0, 3), count(0, 5), coin(0, 1);
    Composition c = Comp(side(rng), side(rng));
    c.background = RandomColor(rng, coin(rng) == 0);
    const int n = count(rng);
    for (int i = 0; i < n; ++i) {
        Layer layer;
        layer.name = "layer " + std::to_string(i);
        if (coin(rng) == 0) {
            layer.start = Rational(i % 3, 2);
            if (coin(rng) == 0) layer.end = layer.start + Rational(1, 2);
        }
        switch (kind(rng)) {
            case 0: layer.content = PatternLayer{}; break;
            case 1: layer.content = SolidLayer{RandomColor(rng, coin(rng) == 0), RandomRect(rng, c)}; break;
            case 2: {
                GradientLayer g;
                const bool opaque = coin(rng) == 0;
                g.from = RandomColor(rng, opaque);
                g.to = RandomColor(rng, opaque);
                g.direction = coin(rng) ? GradientLayer::Direction::Vertical : GradientLayer::Direction::Horizontal;
                g.rect = RandomRect(rng, c);
                layer.content = g;
                break;
            }
            default: layer.content = ToneLayer{440, 0.1, {}}; break;
        }
        c.layers.push_back(layer);
    }
    return c;
}

}  // namespace

// ---- geometry ----

TEST(FrameGeometryTest, DefaultsDrawTheWholeCompositionAtItsSizeInBGRA) {
    const Composition c = Comp(1920, 1080);
    const FrameGeometry g = ResolveFrameGeometry(c, Options());
    EXPECT_EQ(g, (FrameGeometry{1920, 1080, 0, 0, 1920, 1080, kPixelFormatBGRA, FieldType::Progressive, 1, 1}));
    EXPECT_EQ(g.RowBytes(), 7680u);
    EXPECT_EQ(g.FrameBytes(), 128u + 7680u * 1080u);
}

TEST(FrameGeometryTest, BoundsScaleTheFrameAndOneBoundKeepsTheShape) {
    const Composition c = Comp(1920, 1080);
    auto g = ResolveFrameGeometry(c, Options(640, 360));
    EXPECT_EQ(g.frameWidth, 640);
    EXPECT_EQ(g.width, 640);
    EXPECT_EQ(g.height, 360);
    g = ResolveFrameGeometry(c, Options(1000, 0));
    EXPECT_EQ(g.frameHeight, 562);  // floor(1080 * 1000 / 1920)
    g = ResolveFrameGeometry(c, Options(0, 100));
    EXPECT_EQ(g.frameWidth, 177);
    // Unequal scaling makes pixels that are not square.
    g = ResolveFrameGeometry(c, Options(960, 1080));
    EXPECT_EQ(g.pixelAspectNumerator, 2u);
    EXPECT_EQ(g.pixelAspectDenominator, 1u);
}

TEST(FrameGeometryTest, DownsamplingDividesTheDrawnFrameAndShapesPixels) {
    Composition c = Comp(1920, 1080);
    c.pixelAspectRatio = platform::PixelAspectRatio(10, 11);
    auto g = ResolveFrameGeometry(c, Options(0, 0, 2, 2));
    EXPECT_EQ(g.width, 960);
    EXPECT_EQ(g.height, 540);
    EXPECT_EQ(g.pixelAspectNumerator, 10u);
    EXPECT_EQ(g.pixelAspectDenominator, 11u);
    g = ResolveFrameGeometry(c, Options(640, 360, 4, 1));
    EXPECT_EQ(g.width, 160);
    EXPECT_EQ(g.height, 360);
    EXPECT_EQ(g.pixelAspectNumerator, 40u);  // 10/11 * 4
    EXPECT_EQ(g.pixelAspectDenominator, 11u);
    // Never below one pixel.
    g = ResolveFrameGeometry(Comp(3, 3), Options(0, 0, 100, 100));
    EXPECT_EQ(g.width, 1);
    EXPECT_EQ(g.height, 1);
}

TEST(FrameGeometryTest, RegionOfInterestIsCutFromTheScaledFrame) {
    const Composition c = Comp(1920, 1080);
    VideoRenderOptions o = Options(960, 540);
    o.SetRegionOfInterest(Rect(100, 50, 300, 200));
    auto g = ResolveFrameGeometry(c, o);
    EXPECT_EQ(g.frameWidth, 960);
    EXPECT_EQ(g.x, 50);
    EXPECT_EQ(g.y, 25);
    EXPECT_EQ(g.width, 150);
    EXPECT_EQ(g.height, 100);
    // Clipped to the frame.
    o = Options();
    o.SetRegionOfInterest(Rect(-100, 1000, 300, 500));
    g = ResolveFrameGeometry(c, o);
    EXPECT_EQ(g.x, 0);
    EXPECT_EQ(g.y, 1000);
    EXPECT_EQ(g.width, 200);
    EXPECT_EQ(g.height, 80);
    // A sliver too thin for the scaled frame still makes one pixel.
    o = Options(192, 108);
    o.SetRegionOfInterest(Rect(5, 5, 1, 1));
    g = ResolveFrameGeometry(c, o);
    EXPECT_EQ(g.width, 1);
    EXPECT_EQ(g.height, 1);
}

TEST(FrameGeometryTest, RefusesWhatCannotBeDrawn) {
    const Composition c = Comp(1920, 1080);
    auto refuses = [&](const VideoRenderOptions& o, const char* words) {
        try {
            ResolveFrameGeometry(c, o);
            ADD_FAILURE() << "accepted; expected an error with: " << words;
        } catch (const RenderError& e) {
            EXPECT_NE(std::string(e.what()).find(words), std::string::npos) << e.what();
        }
    };
    refuses(Options(-1, 10), "bounds");
    refuses(Options(20000, 10), "bounds");
    refuses(Options(0, 0, 0, 1), "downsample");
    refuses(Options(0, 0, 1, -2), "downsample");
    VideoRenderOptions o;
    o.SetRegionOfInterest(Rect(0, 0, 100, 0));
    refuses(o, "no area");
    o.SetRegionOfInterest(Rect(1920, 0, 100, 100));
    refuses(o, "outside");
    o.SetRegionOfInterest(Rect(-200, -200, 100, 100));
    refuses(o, "outside");
}

TEST(FrameGeometryTest, PixelFormatIsTheFirstOneWeMake) {
    const PixelFormat bgra{kPixelFormatBGRA}, rgba{kPixelFormatRGBA};
    const PixelFormat other{platform::MakeFourCC('Y', 'U', 'V', '2')};
    EXPECT_EQ(ChoosePixelFormat({}), kPixelFormatBGRA);
    EXPECT_EQ(ChoosePixelFormat({rgba, bgra}), kPixelFormatRGBA);
    EXPECT_EQ(ChoosePixelFormat({bgra, rgba}), kPixelFormatBGRA);
    EXPECT_EQ(ChoosePixelFormat({other, rgba}), kPixelFormatRGBA);
    EXPECT_EQ(ChoosePixelFormat({other}), kPixelFormatBGRA);
}

TEST(FrameGeometryTest, OnlyTheTwoFieldOrdersInterlace) {
    const Composition c = Comp(64, 64);
    VideoRenderOptions o;
    for (int f : {-1, 0, 3, 4, 7}) {
        o.SetFieldType(static_cast<FieldType>(f));
        EXPECT_EQ(ResolveFrameGeometry(c, o).fieldType, FieldType::Progressive) << f;
    }
    o.SetFieldType(FieldType::LowerFirst);
    EXPECT_EQ(ResolveFrameGeometry(c, o).fieldType, FieldType::LowerFirst);
    EXPECT_EQ(HeaderFor(ResolveFrameGeometry(c, o), Rational(1, 25)).mFieldType, 2);
}

TEST(FrameGeometryTest, OneBoundThatMakesTheOtherSideTooLargeIsRefused) {
    EXPECT_THROW(ResolveFrameGeometry(Comp(100, 1000), Options(16384, 0)), RenderError);
    EXPECT_NO_THROW(ResolveFrameGeometry(Comp(1000, 100), Options(16384, 0)));
}

// ---- rates ----

TEST(RateTest, TicksAndRatesConvertExactlyWhereTheyCan) {
    EXPECT_EQ(TicksPerFrame(Rational(30000, 1001)).TicksPerFrame(), 8475667200);
    EXPECT_EQ(TicksPerFrame(Rational(25)).TicksPerFrame(), 10160640000);
    EXPECT_EQ(RateOfTicks(platform::FrameRate(8475667200)), Rational(30000, 1001));
    EXPECT_EQ(SampleRateOfTicks(platform::FrameRate(5292000)), 48000);
    EXPECT_THROW(SampleRateOfTicks(platform::FrameRate(5292001)), RenderError);
    EXPECT_THROW(RateOfTicks(platform::FrameRate()), RenderError);
    EXPECT_THROW(RateOfTicks(platform::FrameRate(-5)), RenderError);
    EXPECT_EQ(SampleAtOrBefore(Rational(1, 3), 48000), 16000);
    EXPECT_EQ(SampleAtOrBefore(Rational(1, 96001), 48000), 0);
    EXPECT_EQ(SampleAtOrBefore(Rational(-1, 96001), 48000), -1);
}

// ---- composing ----

TEST(FrameComposerTest, FillOnlyCompositionIsOneColour) {
    Composition c = Comp(1920, 1080);
    c.background = Color8{1, 2, 3, 255};
    c.layers.push_back(Layer{"fill", Rational(0), std::nullopt, SolidLayer{Color8{10, 20, 30, 255}, std::nullopt}});
    for (uint32_t format : {kPixelFormatBGRA, kPixelFormatRGBA}) {
        VideoRenderOptions o;
        o.SetPixelFormats({PixelFormat{format}});
        const FrameGeometry g = ResolveFrameGeometry(c, o);
        std::vector<uint8_t> rows(g.RowBytes() * 1080u);
        ComposeFrame(c, Rational(0), g, rows.data(), g.RowBytes());
        const uint8_t expected[4] = {uint8_t(format == kPixelFormatRGBA ? 10 : 30), 20,
                                     uint8_t(format == kPixelFormatRGBA ? 30 : 10), 255};
        for (size_t i = 0; i < rows.size(); i += 4) {
            ASSERT_EQ(std::memcmp(rows.data() + i, expected, 4), 0) << "pixel " << i / 4;
        }
    }
}

TEST(FrameComposerTest, DemoCompositionsMatchTheGeneratorsInEveryWindowAndFormat) {
    const ProjectModel model = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    for (const Item& item : model.Items()) {
        if (!item.composition) continue;
        const Composition& c = *item.composition;
        for (const Rational& t : {Rational(0), Rational(2), Rational(1001, 1000), Rational(7, 3)}) {
            VideoRenderOptions o = Options(c.width / 8, c.height / 8);
            ExpectSameAsReference(c, t, ResolveFrameGeometry(c, o), item.path + " at 1/8");
            o.SetRegionOfInterest(Rect(c.width / 3, c.height / 5, c.width / 2, c.height / 3));
            o.SetPixelFormats({PixelFormat{kPixelFormatRGBA}});
            ExpectSameAsReference(c, t, ResolveFrameGeometry(c, o), item.path + " window in RGBA");
            o.SetFieldType(FieldType::UpperFirst);
            ExpectSameAsReference(c, t, ResolveFrameGeometry(c, o), item.path + " upper field first");
        }
    }
}

TEST(FrameComposerTest, RandomCompositionsMatchTheGenerators) {
    std::mt19937 rng(20261206);
    for (int round = 0; round < 400; ++round) {
        const Composition c = RandomComposition(rng);
        std::uniform_int_distribution<int> side(0, 200), down(1, 3), pick(0, 4);
        VideoRenderOptions o = Options(pick(rng) == 0 ? 0 : side(rng), pick(rng) == 0 ? 0 : side(rng), down(rng),
                                       down(rng));
        if (pick(rng) < 2) {
            std::uniform_int_distribution<int> x(0, c.width - 1), y(0, c.height - 1);
            const int rx = x(rng), ry = y(rng);
            o.SetRegionOfInterest(Rect(rx, ry, 1 + x(rng), 1 + y(rng)));
        }
        if (pick(rng) == 0) o.SetPixelFormats({PixelFormat{kPixelFormatRGBA}});
        if (pick(rng) == 0) o.SetFieldType(pick(rng) < 2 ? FieldType::UpperFirst : FieldType::LowerFirst);
        const Rational t(round % 7, 4);
        const FrameGeometry g = ResolveFrameGeometry(c, o);
        ExpectSameAsReference(c, t, g, "round " + std::to_string(round));
        if (HasFatalFailure()) return;
    }
}

TEST(FrameComposerTest, FieldsShowTwoMomentsOfThePattern) {
    // 32 rows: the code band is rows 0 and 1, one row of each field.
    Composition c = Comp(84, 32);
    c.layers.push_back(Layer{"p", Rational(0), std::nullopt, PatternLayer{}});
    VideoRenderOptions o;
    o.SetFieldType(FieldType::UpperFirst);
    const FrameGeometry g = ResolveFrameGeometry(c, o);
    std::vector<uint8_t> rows(g.RowBytes() * 32u);
    auto codeOfRow = [&](int row) { return DecodePatternFrame(rows.data() + g.RowBytes() * row, 84, 1, g.RowBytes()); };
    // At the start of frame 3 both fields show frame 3 (the second half a frame later).
    ComposeFrame(c, Rational(3, 25), g, rows.data(), g.RowBytes());
    EXPECT_EQ(codeOfRow(0), 3);
    EXPECT_EQ(codeOfRow(1), 3);
    // Half way through frame 3 the second field shows frame 4.
    ComposeFrame(c, Rational(7, 50), g, rows.data(), g.RowBytes());
    EXPECT_EQ(codeOfRow(0), 3);
    EXPECT_EQ(codeOfRow(1), 4);
    // Lower field first: the odd rows come first.
    o.SetFieldType(FieldType::LowerFirst);
    ComposeFrame(c, Rational(7, 50), ResolveFrameGeometry(c, o), rows.data(), g.RowBytes());
    EXPECT_EQ(codeOfRow(0), 4);
    EXPECT_EQ(codeOfRow(1), 3);
    EXPECT_EQ(SecondFieldTime(Rational(30000, 1001), Rational(0)), Rational(1001, 60000));
}
