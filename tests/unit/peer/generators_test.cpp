#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <vector>

#include "Generators.h"
#include "PeerTestSupport.h"
#include "ProjectModel.h"

using namespace tidelink;
using namespace tidelink::peer;
using tidelink::peer::test::ExamplesDir;

namespace {

// A frame with padding at the end of each row, to catch confusions of width and row length.
struct Frame {
    Frame(int32_t w, int32_t h) : width(w), height(h), rowBytes(static_cast<size_t>(w) * 4 + 12), bytes(rowBytes * h, 0xEE) {}
    FrameView View() { return FrameView{bytes.data(), width, height, rowBytes}; }
    Color8 At(int32_t x, int32_t y) const {
        const uint8_t* p = bytes.data() + static_cast<size_t>(y) * rowBytes + static_cast<size_t>(x) * 4;
        return Color8{p[2], p[1], p[0], p[3]};
    }
    std::optional<int64_t> Decode() const { return DecodePatternFrame(bytes.data(), width, height, rowBytes); }
    bool PaddingUntouched() const {
        for (int32_t y = 0; y < height; ++y) {
            for (size_t i = static_cast<size_t>(width) * 4; i < rowBytes; ++i) {
                if (bytes[static_cast<size_t>(y) * rowBytes + i] != 0xEE) return false;
            }
        }
        return true;
    }
    int32_t width, height;
    size_t rowBytes;
    std::vector<uint8_t> bytes;
};

const Composition& DemoComp() {
    static const ProjectModel model = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    return *model.FindByPath("Compositions/Demo 1080p29.97")->composition;
}

Composition SmallComp() {
    Composition c;
    c.width = 100;
    c.height = 50;
    c.frameRate = Rational(25);
    c.duration = Rational(2);
    c.channels = platform::CreateStereoChannelLayout();
    return c;
}

Layer ToneOn(double frequency, double amplitude, std::vector<int32_t> channels = {}) {
    Layer l;
    l.content = ToneLayer{frequency, amplitude, std::move(channels)};
    return l;
}

}  // namespace

TEST(Generators, FrameTimesAreExact) {
    for (const Rational rate : {Rational(30000, 1001), Rational(25), Rational(24000, 1001), Rational(60)}) {
        for (int64_t n : {int64_t{0}, int64_t{1}, int64_t{29}, int64_t{30}, int64_t{1799}, int64_t{107892}}) {
            const Rational t = TimeOfFrame(rate, n);
            EXPECT_EQ(FrameAtTime(rate, t), n);
            EXPECT_EQ(FrameAtTime(rate, t + Rational(1, 1000000000)), n);
            if (n > 0) {
                EXPECT_EQ(FrameAtTime(rate, t - Rational(1, 1000000000)), n - 1);
            }
        }
    }
    EXPECT_EQ(TimeOfFrame(Rational(30000, 1001), 30), Rational(1001, 1000));
    EXPECT_EQ(FrameAtTime(Rational(25), Rational(-1)), 0);
    // Extreme host times neither overflow nor wrap.
    EXPECT_EQ(FrameAtTime(Rational(25), Rational(INT64_MAX, 2)), INT64_MAX);
    EXPECT_EQ(FrameAtTime(Rational(1, 1000), Rational(INT64_MAX)), INT64_MAX / 1000);
}

TEST(Generators, PatternCarriesItsFrameNumberAtAnySize) {
    const int64_t frames[] = {0, 1, 2, 29, 30, 1000, 123456, 0x7FFFFFFF, 0xFFFFFFFF};
    const std::pair<int32_t, int32_t> sizes[] = {{960, 540}, {1283, 721}, {42, 1}, {100, 17}};
    for (auto [w, h] : sizes) {
        for (int64_t n : frames) {
            Frame f(w, h);
            DrawPattern(f.View(), n);
            EXPECT_EQ(f.Decode(), n) << w << "x" << h << " frame " << n;
            EXPECT_TRUE(f.PaddingUntouched());
        }
    }
    // Too narrow to carry the code: drawn, but not decodable.
    Frame narrow(41, 30);
    DrawPattern(narrow.View(), 5);
    EXPECT_EQ(narrow.Decode(), std::nullopt);
    EXPECT_EQ(narrow.At(0, 0), PatternFieldColor(5, 0, 0, 41, 30));
}

TEST(Generators, PatternPixelsAreAFunctionOfFrameAndPlace) {
    Frame a(320, 180);
    DrawPattern(a.View(), 77);
    const int32_t band = 180 / 16;
    const int32_t cell = 320 / kCodeCells;
    for (int32_t y = band; y < 180; y += 7) {
        for (int32_t x = 0; x < 320; x += 5) ASSERT_EQ(a.At(x, y), PatternFieldColor(77, x, y, 320, 180));
    }
    EXPECT_EQ(a.At(0, 0), (Color8{255, 255, 255, 255}));          // white marker
    EXPECT_EQ(a.At(cell, 0), (Color8{0, 0, 0, 255}));             // black marker
    EXPECT_EQ(a.At(319, 0), (Color8{128, 128, 128, 255}));        // right of the cells
    // Neighbouring frames differ in the field as well as in the code.
    EXPECT_NE(PatternFieldColor(77, 10, 100, 320, 180), PatternFieldColor(78, 10, 100, 320, 180));
}

TEST(Generators, DecodingRejectsDamagedCodes) {
    Frame f(420, 64);
    DrawPattern(f.View(), 0x12345678);
    ASSERT_EQ(f.Decode(), 0x12345678);
    const int32_t cell = 420 / kCodeCells;
    const int32_t y = (64 / 16) / 2;
    for (int32_t c = 0; c < kCodeCells; ++c) {
        Frame damaged = f;
        uint8_t* p = damaged.bytes.data() + static_cast<size_t>(y) * damaged.rowBytes + static_cast<size_t>(c * cell + cell / 2) * 4;
        p[1] = p[1] >= 128 ? 0 : 255;
        EXPECT_EQ(damaged.Decode(), std::nullopt) << "cell " << c;
    }
    Frame black(420, 64);
    std::fill(black.bytes.begin(), black.bytes.end(), 0);
    EXPECT_EQ(black.Decode(), std::nullopt);
    EXPECT_EQ(DecodePatternFrame(nullptr, 420, 64, 420 * 4), std::nullopt);
    EXPECT_EQ(DecodePatternFrame(f.bytes.data(), 420, 64, 100), std::nullopt);  // rows shorter than the width
}

TEST(Generators, DemoFramesAreExact) {
    const Composition& comp = DemoComp();
    for (int64_t n : {0, 29, 30, 149, 150, 299}) {
        SCOPED_TRACE(n);
        Frame f(1920, 1080);
        const Rational t = TimeOfFrame(comp.frameRate, n);
        RenderCompositionFrame(comp, t, f.View());
        EXPECT_EQ(f.Decode(), n);
        // The box is shown from 1.001 s (frame 30) to before 5.005 s (frame 150).
        const bool box = n >= 30 && n < 150;
        const Color8 orange{255, 128, 0, 255};
        EXPECT_EQ(f.At(960, 540), box ? orange : PatternFieldColor(n, 960, 540, 1920, 1080));
        EXPECT_EQ(f.At(860, 440), box ? orange : PatternFieldColor(n, 860, 440, 1920, 1080));
        EXPECT_EQ(f.At(859, 440), PatternFieldColor(n, 859, 440, 1920, 1080));
        EXPECT_EQ(f.At(1060, 540), PatternFieldColor(n, 1060, 540, 1920, 1080));
        // The ramp across the bottom: black at the left edge, white at the right, exact between.
        EXPECT_EQ(f.At(0, 1000), (Color8{0, 0, 0, 255}));
        EXPECT_EQ(f.At(1919, 1079), (Color8{255, 255, 255, 255}));
        const uint8_t mid = static_cast<uint8_t>((255 * 960 + 1919 / 2) / 1919);
        EXPECT_EQ(f.At(960, 950), (Color8{mid, mid, mid, 255}));
        EXPECT_EQ(f.At(960, 899), PatternFieldColor(n, 960, 899, 1920, 1080));
        EXPECT_TRUE(f.PaddingUntouched());
    }
    // A half-size render scales the layer geometry and keeps the code readable.
    Frame half(960, 540);
    RenderCompositionFrame(comp, TimeOfFrame(comp.frameRate, 100), half.View());
    EXPECT_EQ(half.Decode(), 100);
    EXPECT_EQ(half.At(430, 220), (Color8{255, 128, 0, 255}));
    EXPECT_EQ(half.At(529, 319), (Color8{255, 128, 0, 255}));
    EXPECT_EQ(half.At(530, 319), PatternFieldColor(100, 530, 319, 960, 540));
}

TEST(Generators, LayersBlendOverTheBackground) {
    Composition c = SmallComp();
    c.background = Color8{0, 0, 0, 255};
    Layer half;
    half.content = SolidLayer{Color8{255, 100, 0, 128}, PixelRect{-10, -10, 20, 20}};
    c.layers.push_back(half);
    Layer later;
    later.start = Rational(1);
    later.content = SolidLayer{Color8{0, 0, 255, 255}, PixelRect{50, 0, 100, 50}};
    c.layers.push_back(later);
    Frame f(100, 50);
    RenderCompositionFrame(c, Rational(0), f.View());
    // (src * a + dst * (255 - a) + 127) / 255, alpha "over" an opaque background stays opaque.
    EXPECT_EQ(f.At(0, 0), (Color8{128, 50, 0, 255}));
    EXPECT_EQ(f.At(9, 9), (Color8{128, 50, 0, 255}));
    EXPECT_EQ(f.At(10, 10), (Color8{0, 0, 0, 255}));
    EXPECT_EQ(f.At(60, 10), (Color8{0, 0, 0, 255}));  // not yet
    RenderCompositionFrame(c, Rational(1), f.View());
    EXPECT_EQ(f.At(60, 10), (Color8{0, 0, 255, 255}));
    EXPECT_EQ(f.At(99, 49), (Color8{0, 0, 255, 255}));  // clipped at the frame's edge
    EXPECT_TRUE(f.PaddingUntouched());

    // Views that cannot be drawn into are left alone.
    RenderCompositionFrame(c, Rational(0), FrameView{nullptr, 100, 50, 400});
    Frame tiny(1, 1);
    RenderCompositionFrame(c, Rational(0), FrameView{tiny.bytes.data(), 1, 1, 2});
    EXPECT_EQ(tiny.bytes[0], 0xEE);
    // At 1x1 the 10x10 corner square maps to nothing: only the background remains.
    RenderCompositionFrame(c, Rational(0), tiny.View());
    EXPECT_EQ(tiny.At(0, 0), (Color8{0, 0, 0, 255}));
}

TEST(Generators, ToneSamplesFollowTheFormula) {
    for (double f : {440.0, 1000.0, 997.5, 23999.0}) {
        for (int64_t n : {int64_t{0}, int64_t{1}, int64_t{47999}, int64_t{48000}, int64_t{1234567}, int64_t{3000000000}}) {
            const long double expected = 0.25L * std::sin(2.0L * 3.14159265358979323846264338327950288L *
                                                          std::fmod(static_cast<long double>(f) * n, 48000.0L) / 48000.0L);
            EXPECT_NEAR(ToneSample(f, 0.25, 48000, n), static_cast<double>(expected), 1e-6) << f << " Hz, sample " << n;
        }
    }
    EXPECT_EQ(ToneSample(440, 0.5, 48000, 0), 0.0f);
    EXPECT_EQ(ToneSample(440, 0.5, 0, 10), 0.0f);
}

TEST(Generators, AudioIsTheSameHoweverItIsChunked) {
    Composition c = SmallComp();
    c.duration = Rational(3);
    c.layers.push_back(ToneOn(440, 0.1, {0}));
    c.layers.push_back(ToneOn(997.5, 0.2, {1}));
    const int64_t total = 3 * 48000;
    std::vector<float> whole(static_cast<size_t>(total) * 2);
    RenderCompositionAudio(c, 0, total, whole.data());

    std::vector<float> chunked(whole.size(), 99.0f);
    const int64_t sizes[] = {1, 7, 480, 1023, 4096, 1601};
    int64_t at = 0;
    for (size_t i = 0; at < total; ++i) {
        const int64_t n = std::min(sizes[i % std::size(sizes)], total - at);
        RenderCompositionAudio(c, at, n, chunked.data() + at * 2);
        at += n;
    }
    ASSERT_EQ(std::memcmp(whole.data(), chunked.data(), whole.size() * sizeof(float)), 0);
    for (int64_t n : {int64_t{0}, int64_t{12}, int64_t{48001}, total - 1}) {
        EXPECT_EQ(whole[static_cast<size_t>(n) * 2], ToneSample(440, 0.1, 48000, n));
        EXPECT_EQ(whole[static_cast<size_t>(n) * 2 + 1], ToneSample(997.5, 0.2, 48000, n));
    }
}

TEST(Generators, DemoAudioRoutesEachToneToItsChannel) {
    const Composition& comp = DemoComp();
    std::vector<float> out(2 * 1000);
    RenderCompositionAudio(comp, 24000, 1000, out.data());
    for (int64_t i = 0; i < 1000; i += 37) {
        EXPECT_EQ(out[static_cast<size_t>(i) * 2], ToneSample(440, std::pow(10.0, -1.0), 48000, 24000 + i));
        EXPECT_EQ(out[static_cast<size_t>(i) * 2 + 1], ToneSample(1000, std::pow(10.0, -1.0), 48000, 24000 + i));
    }
}

TEST(Generators, TonesKeepToTheirTimesAndTheDuration) {
    Composition c = SmallComp();  // 2 s
    Layer l = ToneOn(1000, 1.0);
    l.start = Rational(1, 2);
    l.end = Rational(1);
    c.layers.push_back(l);
    c.layers.push_back(ToneOn(1000, 1.0));  // the sum of two full-scale tones is clamped
    std::vector<float> out(2 * 200);
    const auto sample = [&](int64_t first, int64_t i, int ch) {
        RenderCompositionAudio(c, first, 100, out.data());
        return out[static_cast<size_t>(i) * 2 + ch];
    };
    // Before 0.5 s only the second tone sounds; from 0.5 s both (clamped); after 1 s one again.
    EXPECT_EQ(sample(23990, 5, 0), ToneSample(1000, 1.0, 48000, 23995));
    EXPECT_EQ(sample(23990, 12, 1), std::clamp(2 * ToneSample(1000, 1.0, 48000, 24002), -1.0f, 1.0f));
    EXPECT_EQ(sample(47990, 9, 0), std::clamp(2 * ToneSample(1000, 1.0, 48000, 47999), -1.0f, 1.0f));
    EXPECT_EQ(sample(47990, 10, 0), ToneSample(1000, 1.0, 48000, 48000));
    // Nothing before the start of the composition or after its end.
    RenderCompositionAudio(c, -50, 100, out.data());
    for (int i = 0; i < 50 * 2; ++i) ASSERT_EQ(out[static_cast<size_t>(i)], 0.0f);
    EXPECT_EQ(out[51 * 2], ToneSample(1000, 1.0, 48000, 1));
    RenderCompositionAudio(c, 2 * 48000 - 50, 100, out.data());
    EXPECT_EQ(out[49 * 2], ToneSample(1000, 1.0, 48000, 2 * 48000 - 1));
    for (int i = 50 * 2; i < 100 * 2; ++i) ASSERT_EQ(out[static_cast<size_t>(i)], 0.0f);
    for (float v : out) ASSERT_LE(std::fabs(v), 1.0f);
}
