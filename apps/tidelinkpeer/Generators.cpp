#include "Generators.h"

#include <algorithm>
#include <cmath>
#include <numeric>
#include <stdexcept>

namespace tidelink::peer {

namespace {

constexpr double kTwoPi = 6.283185307179586476925286766559;

uint64_t SplitMix64(uint64_t x) {
    x += 0x9E3779B97F4A7C15ull;
    x = (x ^ (x >> 30)) * 0xBF58476D1CE4E5B9ull;
    x = (x ^ (x >> 27)) * 0x94D049BB133111EBull;
    return x ^ (x >> 31);
}

Int128 FloorDiv(Int128 a, Int128 b) {
    Int128 q = a / b;
    if ((a % b != 0) && ((a < 0) != (b < 0))) --q;
    return q;
}

Int128 CeilDiv(Int128 a, Int128 b) { return -FloorDiv(-a, b); }

uint8_t CheckBits(uint32_t n) {
    return static_cast<uint8_t>((n ^ (n >> 8) ^ (n >> 16) ^ (n >> 24)) ^ 0xA5);
}

bool CodeBit(uint32_t n, int32_t cell) {
    if (cell == 0) return true;   // white marker
    if (cell == 1) return false;  // black marker
    if (cell < 34) return ((n >> (31 - (cell - 2))) & 1u) != 0;
    return ((CheckBits(n) >> (7 - (cell - 34))) & 1u) != 0;
}

int32_t BandHeight(int32_t height) { return std::max(1, height / 16); }

inline uint8_t* PixelAt(const FrameView& v, int32_t x, int32_t y) {
    return v.data + static_cast<size_t>(y) * v.rowBytes + static_cast<size_t>(x) * 4;
}

inline void Put(uint8_t* p, Color8 c) {
    p[0] = c.b;
    p[1] = c.g;
    p[2] = c.r;
    p[3] = c.a;
}

inline uint8_t Mix(uint32_t src, uint32_t dst, uint32_t a) {
    return static_cast<uint8_t>((src * a + dst * (255 - a) + 127) / 255);
}

inline void Over(uint8_t* p, Color8 c) {
    if (c.a == 255) return Put(p, c);
    if (c.a == 0) return;
    p[0] = Mix(c.b, p[0], c.a);
    p[1] = Mix(c.g, p[1], c.a);
    p[2] = Mix(c.r, p[2], c.a);
    p[3] = static_cast<uint8_t>((c.a * 255u + p[3] * (255u - c.a) + 127) / 255);
}

int32_t Scale(int64_t v, int32_t to, int32_t from) {
    return static_cast<int32_t>(FloorDiv(static_cast<Int128>(v) * to, from));
}

PixelSpan MapRect(const std::optional<PixelRect>& rect, const Composition& comp, const FrameView& view) {
    return LayerSpan(rect, comp, view.width, view.height);
}

void DrawSolid(const SolidLayer& s, const Composition& comp, const FrameView& view) {
    const PixelSpan span = MapRect(s.rect, comp, view);
    if (span.Empty()) return;
    for (int32_t y = span.y0; y < span.y1; ++y) {
        for (int32_t x = span.x0; x < span.x1; ++x) Over(PixelAt(view, x, y), s.color);
    }
}

void DrawGradient(const GradientLayer& g, const Composition& comp, const FrameView& view) {
    const PixelSpan span = MapRect(g.rect, comp, view);
    if (span.Empty()) return;
    const bool horizontal = g.direction == GradientLayer::Direction::Horizontal;
    const int64_t n = horizontal ? span.x1 - span.x0 : span.y1 - span.y0;
    for (int32_t y = span.y0; y < span.y1; ++y) {
        for (int32_t x = span.x0; x < span.x1; ++x) {
            const int64_t i = horizontal ? x - span.x0 : y - span.y0;
            const Color8 c{GradientComponent(g.from.r, g.to.r, i, n), GradientComponent(g.from.g, g.to.g, i, n),
                           GradientComponent(g.from.b, g.to.b, i, n), GradientComponent(g.from.a, g.to.a, i, n)};
            Over(PixelAt(view, x, y), c);
        }
    }
}

bool Usable(const FrameView& view) {
    return view.data != nullptr && view.width > 0 && view.height > 0 &&
           view.rowBytes >= static_cast<size_t>(view.width) * 4;
}

// Whole samples of |t| seconds at |rate|, rounded up.
int64_t SampleAt(const Rational& t, int32_t rate) {
    return static_cast<int64_t>(CeilDiv(static_cast<Int128>(t.numerator()) * rate, t.denominator()));
}

}  // namespace

int64_t FrameAtTime(const Rational& frameRate, const Rational& time) {
    const Int128 num = static_cast<Int128>(time.numerator()) * frameRate.numerator();
    const Int128 den = static_cast<Int128>(time.denominator()) * frameRate.denominator();
    const Int128 f = FloorDiv(num, den);
    if (f < 0) return 0;
    return f > INT64_MAX ? INT64_MAX : static_cast<int64_t>(f);
}

Rational TimeOfFrame(const Rational& frameRate, int64_t frame) {
    Int128 num = static_cast<Int128>(frame) * frameRate.denominator();
    Int128 den = frameRate.numerator();
    const int64_t g = std::gcd(static_cast<int64_t>(frame == INT64_MIN ? 1 : (frame < 0 ? -frame : frame)),
                               frameRate.numerator());
    num /= g;
    den /= g;
    if (num > INT64_MAX || num < INT64_MIN) throw std::overflow_error("frame time out of range");
    return Rational(static_cast<int64_t>(num), static_cast<int64_t>(den));
}

PixelSpan LayerSpan(const std::optional<PixelRect>& rect, const Composition& comp, int32_t width, int32_t height) {
    if (!rect) return {0, 0, width, height};
    PixelSpan s{Scale(rect->x, width, comp.width), Scale(rect->y, height, comp.height),
                Scale(int64_t{rect->x} + rect->width, width, comp.width),
                Scale(int64_t{rect->y} + rect->height, height, comp.height)};
    s.x0 = std::clamp(s.x0, 0, width);
    s.x1 = std::clamp(s.x1, 0, width);
    s.y0 = std::clamp(s.y0, 0, height);
    s.y1 = std::clamp(s.y1, 0, height);
    return s;
}

uint8_t GradientComponent(uint8_t from, uint8_t to, int64_t i, int64_t n) {
    if (n <= 1) return from;
    return static_cast<uint8_t>((from * (n - 1 - i) + to * i + (n - 1) / 2) / (n - 1));
}

int32_t PatternBandHeight(int32_t height) { return BandHeight(height); }

uint32_t PatternHash(int64_t frame) {
    return static_cast<uint32_t>(SplitMix64(static_cast<uint64_t>(frame)) & 0xFFFFFF);
}

bool PatternCellIsWhite(int64_t frame, int32_t cell) { return CodeBit(static_cast<uint32_t>(frame), cell); }

Color8 PatternFieldColor(int64_t frame, int32_t x, int32_t y, int32_t width, int32_t height) {
    const uint64_t h = SplitMix64(static_cast<uint64_t>(frame));
    const int64_t dx = width > 0 ? (int64_t{256} * x) / width : 0;
    const int64_t dy = height > 0 ? (int64_t{256} * y) / height : 0;
    return Color8{static_cast<uint8_t>((static_cast<int64_t>(h & 0xFF) + dx) & 0xFF),
                  static_cast<uint8_t>((static_cast<int64_t>((h >> 8) & 0xFF) + dy) & 0xFF),
                  static_cast<uint8_t>((h >> 16) & 0xFF), 255};
}

void DrawPattern(const FrameView& view, int64_t frame) {
    if (!Usable(view)) return;
    const int32_t band = BandHeight(view.height);
    const int32_t cell = view.width / kCodeCells;
    const uint32_t code = static_cast<uint32_t>(frame);
    const int64_t h = static_cast<int64_t>(SplitMix64(static_cast<uint64_t>(frame)) & 0xFFFFFF);
    const uint8_t b = static_cast<uint8_t>(h >> 16);
    for (int32_t y = 0; y < view.height; ++y) {
        uint8_t* row = PixelAt(view, 0, y);
        if (y < band && cell > 0) {
            for (int32_t x = 0; x < view.width; ++x) {
                const int32_t c = x / cell;
                const uint8_t v = c >= kCodeCells ? 128 : (CodeBit(code, c) ? 255 : 0);
                Put(row + static_cast<size_t>(x) * 4, Color8{v, v, v, 255});
            }
            continue;
        }
        // PatternFieldColor, with the hash taken once per frame.
        const uint8_t g = static_cast<uint8_t>((((h >> 8) & 0xFF) + (int64_t{256} * y) / view.height) & 0xFF);
        for (int32_t x = 0; x < view.width; ++x) {
            const uint8_t r = static_cast<uint8_t>(((h & 0xFF) + (int64_t{256} * x) / view.width) & 0xFF);
            Put(row + static_cast<size_t>(x) * 4, Color8{r, g, b, 255});
        }
    }
}

std::optional<int64_t> DecodePatternFrame(const uint8_t* bgra, int32_t width, int32_t height, size_t rowBytes) {
    if (bgra == nullptr || width < kCodeCells || height <= 0 || rowBytes < static_cast<size_t>(width) * 4) {
        return std::nullopt;
    }
    const int32_t cell = width / kCodeCells;
    const int32_t y = BandHeight(height) / 2;
    auto bit = [&](int32_t c) {
        const int32_t x = c * cell + cell / 2;
        const uint8_t* p = bgra + static_cast<size_t>(y) * rowBytes + static_cast<size_t>(x) * 4;
        return p[1] >= 128;
    };
    if (!bit(0) || bit(1)) return std::nullopt;
    uint32_t n = 0;
    for (int32_t c = 2; c < 34; ++c) n = (n << 1) | (bit(c) ? 1u : 0u);
    uint8_t check = 0;
    for (int32_t c = 34; c < 42; ++c) check = static_cast<uint8_t>((check << 1) | (bit(c) ? 1 : 0));
    if (check != CheckBits(n)) return std::nullopt;
    return static_cast<int64_t>(n);
}

void RenderCompositionFrame(const Composition& comp, const Rational& time, const FrameView& view) {
    if (!Usable(view)) return;
    for (int32_t y = 0; y < view.height; ++y) {
        for (int32_t x = 0; x < view.width; ++x) Put(PixelAt(view, x, y), comp.background);
    }
    const int64_t frame = FrameAtTime(comp.frameRate, time);
    for (const Layer& layer : comp.layers) {
        if (!layer.ActiveAt(time)) continue;
        if (std::holds_alternative<PatternLayer>(layer.content)) {
            DrawPattern(view, frame);
        } else if (const auto* s = std::get_if<SolidLayer>(&layer.content)) {
            DrawSolid(*s, comp, view);
        } else if (const auto* g = std::get_if<GradientLayer>(&layer.content)) {
            DrawGradient(*g, comp, view);
        }
    }
}

float ToneSample(double frequency, double amplitude, int32_t sampleRate, int64_t n) {
    if (sampleRate <= 0) return 0.0f;
    double phase = 0.0;  // in cycles, [0, 1)
    if (frequency == std::floor(frequency) && frequency >= 0 && frequency < 2147483648.0) {
        // Exact: (f * n) mod rate in integers.
        const int64_t rate = sampleRate;
        const int64_t f = static_cast<int64_t>(frequency) % rate;
        int64_t m = n % rate;
        if (m < 0) m += rate;
        phase = static_cast<double>((f * m) % rate) / static_cast<double>(rate);
    } else {
        long double cycles = std::fmod(static_cast<long double>(frequency) * static_cast<long double>(n),
                                       static_cast<long double>(sampleRate));
        if (cycles < 0) cycles += sampleRate;
        phase = static_cast<double>(cycles / sampleRate);
    }
    return static_cast<float>(amplitude * std::sin(kTwoPi * phase));
}

void RenderCompositionAudio(const Composition& comp, int64_t first, int64_t count, float* out) {
    const size_t channels = comp.channels.size();
    if (out == nullptr || count <= 0 || channels == 0) return;
    std::fill(out, out + static_cast<size_t>(count) * channels, 0.0f);
    const int64_t total = SampleAt(comp.duration, comp.sampleRate);
    const int64_t last = first > INT64_MAX - count ? INT64_MAX : first + count;
    bool touched = false;
    for (const Layer& layer : comp.layers) {
        const auto* tone = std::get_if<ToneLayer>(&layer.content);
        if (!tone) continue;
        const int64_t from = std::max({first, int64_t{0}, SampleAt(layer.start, comp.sampleRate)});
        const int64_t to = std::min({last, total, layer.end ? SampleAt(*layer.end, comp.sampleRate) : total});
        for (int64_t n = from; n < to; ++n) {
            const float v = ToneSample(tone->frequency, tone->amplitude, comp.sampleRate, n);
            float* frame = out + static_cast<size_t>(n - first) * channels;
            if (tone->channels.empty()) {
                for (size_t c = 0; c < channels; ++c) frame[c] += v;
            } else {
                for (int32_t c : tone->channels) {
                    if (c >= 0 && static_cast<size_t>(c) < channels) frame[c] += v;
                }
            }
            touched = true;
        }
    }
    if (!touched) return;
    for (size_t i = 0; i < static_cast<size_t>(count) * channels; ++i) out[i] = std::clamp(out[i], -1.0f, 1.0f);
}

}  // namespace tidelink::peer
