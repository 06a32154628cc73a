#include "FrameComposer.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <vector>

#include "Generators.h"

namespace tidelink::peer {

static_assert(std::endian::native == std::endian::little, "pixels are packed as little-endian words");

namespace {

// Where and what to draw: the window [wx, wx + ww) x [wy, wy + wh) of a fw x fh drawn frame, its
// rows firstRow, firstRow + rowStep, ... (window rows).
struct Target {
    uint8_t* data;
    size_t rowBytes;
    int32_t fw, fh;
    int32_t wx, wy, ww, wh;
    int32_t firstRow, rowStep;
    bool rgba;

    uint32_t* Row(int32_t j) const { return reinterpret_cast<uint32_t*>(data + static_cast<size_t>(j) * rowBytes); }
    // The first drawn window row at or after |j|.
    int32_t FirstDrawnAtOrAfter(int32_t j) const {
        if (j <= firstRow) return firstRow;
        const int32_t over = (j - firstRow) % rowStep;
        return over == 0 ? j : j + (rowStep - over);
    }
};

// Window columns [c0, c1) and rows [r0, r1) of a span of the drawn frame (empty when c0 >= c1).
struct Clip {
    int32_t c0, c1, r0, r1;
    bool Empty() const { return c0 >= c1 || r0 >= r1; }
};

Clip ClipToWindow(const PixelSpan& s, const Target& t) {
    return Clip{std::max(s.x0, t.wx) - t.wx, std::min(s.x1, t.wx + t.ww) - t.wx, std::max(s.y0, t.wy) - t.wy,
                std::min(s.y1, t.wy + t.wh) - t.wy};
}

bool Covers(const PixelSpan& s, const Target& t) {
    return s.x0 <= t.wx && s.x1 >= t.wx + t.ww && s.y0 <= t.wy && s.y1 >= t.wy + t.wh;
}

// A colour as the word its four bytes make in memory.
inline uint32_t Pack(Color8 c, bool rgba) {
    const uint32_t first = rgba ? c.r : c.b;
    const uint32_t third = rgba ? c.b : c.r;
    return first | (uint32_t{c.g} << 8) | (third << 16) | (uint32_t{c.a} << 24);
}

inline uint8_t AlphaOf(uint32_t packed) { return static_cast<uint8_t>(packed >> 24); }

// Straight-alpha "over" on one pixel, bytes in memory order (the colour channels blend alike, so
// the byte order does not matter).
inline void OverPixel(uint32_t* p, uint32_t src) {
    const uint32_t a = src >> 24;
    if (a == 255) {
        *p = src;
        return;
    }
    if (a == 0) return;
    const uint32_t ia = 255 - a;
    const uint32_t dst = *p;
    const uint32_t c0 = ((src & 0xFF) * a + (dst & 0xFF) * ia + 127) / 255;
    const uint32_t c1 = (((src >> 8) & 0xFF) * a + ((dst >> 8) & 0xFF) * ia + 127) / 255;
    const uint32_t c2 = (((src >> 16) & 0xFF) * a + ((dst >> 16) & 0xFF) * ia + 127) / 255;
    const uint32_t c3 = (a * 255 + (dst >> 24) * ia + 127) / 255;
    *p = c0 | (c1 << 8) | (c2 << 16) | (c3 << 24);
}

// |count| copies of |pixel|: one word, then doubling copies (fast in every build).
void FillPixels(uint32_t* dst, uint32_t pixel, size_t count) {
    if (count == 0) return;
    dst[0] = pixel;
    size_t done = 1;
    while (done < count) {
        const size_t n = std::min(done, count - done);
        std::memcpy(dst + done, dst, n * sizeof(uint32_t));
        done += n;
    }
}

// Writes |pixel| over columns [c0, c1) of the drawn rows in [r0, r1): fills the first, copies it.
void FillRows(const Target& t, const Clip& clip, uint32_t pixel) {
    const size_t count = static_cast<size_t>(clip.c1 - clip.c0);
    const uint32_t* first = nullptr;
    for (int32_t j = t.FirstDrawnAtOrAfter(clip.r0); j < clip.r1; j += t.rowStep) {
        uint32_t* row = t.Row(j) + clip.c0;
        if (first) {
            std::memcpy(row, first, count * sizeof(uint32_t));
        } else {
            FillPixels(row, pixel, count);
            first = row;
        }
    }
}

// Copies |pixels| (one per column of the clip) to every drawn row of the clip.
void CopyRows(const Target& t, const Clip& clip, const uint32_t* pixels) {
    const size_t count = static_cast<size_t>(clip.c1 - clip.c0);
    for (int32_t j = t.FirstDrawnAtOrAfter(clip.r0); j < clip.r1; j += t.rowStep) {
        std::memcpy(t.Row(j) + clip.c0, pixels, count * sizeof(uint32_t));
    }
}

void BlendRows(const Target& t, const Clip& clip, uint32_t pixel) {
    for (int32_t j = t.FirstDrawnAtOrAfter(clip.r0); j < clip.r1; j += t.rowStep) {
        uint32_t* row = t.Row(j);
        for (int32_t c = clip.c0; c < clip.c1; ++c) OverPixel(row + c, pixel);
    }
}

std::vector<uint32_t>& Scratch(size_t columns) {
    thread_local std::vector<uint32_t> scratch;
    if (scratch.size() < columns) scratch.resize(columns);
    return scratch;
}

void DrawBackground(const Target& t, Color8 color) {
    FillRows(t, Clip{0, t.ww, 0, t.wh}, Pack(color, t.rgba));
}

void DrawPatternWindow(const Target& t, int64_t frame) {
    const int32_t band = PatternBandHeight(t.fh);
    const int32_t cell = t.fw / kCodeCells;
    const uint32_t hash = PatternHash(frame);
    auto& row = Scratch(static_cast<size_t>(t.ww));
    int32_t j = t.firstRow;

    // The code band: every row alike.
    if (cell > 0 && t.wy + j < band) {
        for (int32_t c = 0; c < t.ww; ++c) {
            const int32_t index = (t.wx + c) / cell;
            const uint32_t v = index >= kCodeCells ? 128u : (PatternCellIsWhite(frame, index) ? 255u : 0u);
            row[static_cast<size_t>(c)] = v | (v << 8) | (v << 16) | 0xFF000000u;
        }
        for (; j < t.wh && t.wy + j < band; j += t.rowStep) {
            std::memcpy(t.Row(j), row.data(), static_cast<size_t>(t.ww) * sizeof(uint32_t));
        }
    }
    if (j >= t.wh) return;

    // The colour field: red by column, green by row, blue fixed.
    const uint32_t red0 = hash & 0xFF;
    const uint32_t green0 = (hash >> 8) & 0xFF;
    const uint32_t blue = (hash >> 16) & 0xFF;
    const int32_t redShift = t.rgba ? 0 : 16;
    const int32_t blueShift = t.rgba ? 16 : 0;
    for (int32_t c = 0; c < t.ww; ++c) {
        const uint32_t red = (red0 + static_cast<uint32_t>((int64_t{256} * (t.wx + c)) / t.fw)) & 0xFF;
        row[static_cast<size_t>(c)] = (red << redShift) | (blue << blueShift) | 0xFF000000u;
    }
    const uint32_t* base = row.data();
    const int32_t width = t.ww;
    for (; j < t.wh; j += t.rowStep) {
        const uint32_t green = ((green0 + static_cast<uint32_t>((int64_t{256} * (t.wy + j)) / t.fh)) & 0xFF) << 8;
        uint32_t* out = t.Row(j);
        for (int32_t c = 0; c < width; ++c) out[c] = base[c] | green;
    }
}

void DrawSolidWindow(const Target& t, const SolidLayer& s, const Composition& comp) {
    const Clip clip = ClipToWindow(LayerSpan(s.rect, comp, t.fw, t.fh), t);
    if (clip.Empty() || s.color.a == 0) return;
    const uint32_t pixel = Pack(s.color, t.rgba);
    if (s.color.a == 255) {
        FillRows(t, clip, pixel);
    } else {
        BlendRows(t, clip, pixel);
    }
}

void DrawGradientWindow(const Target& t, const GradientLayer& g, const Composition& comp) {
    const PixelSpan span = LayerSpan(g.rect, comp, t.fw, t.fh);
    const Clip clip = ClipToWindow(span, t);
    if (clip.Empty()) return;
    auto color = [&g](int64_t i, int64_t n) {
        return Color8{GradientComponent(g.from.r, g.to.r, i, n), GradientComponent(g.from.g, g.to.g, i, n),
                      GradientComponent(g.from.b, g.to.b, i, n), GradientComponent(g.from.a, g.to.a, i, n)};
    };
    const bool opaque = g.from.a == 255 && g.to.a == 255;
    if (g.direction == GradientLayer::Direction::Vertical) {
        const int64_t n = span.y1 - span.y0;
        for (int32_t j = t.FirstDrawnAtOrAfter(clip.r0); j < clip.r1; j += t.rowStep) {
            const uint32_t pixel = Pack(color(t.wy + j - span.y0, n), t.rgba);
            const Clip one{clip.c0, clip.c1, j, j + 1};
            if (AlphaOf(pixel) == 255) {
                FillPixels(t.Row(j) + clip.c0, pixel, static_cast<size_t>(clip.c1 - clip.c0));
            } else {
                BlendRows(t, one, pixel);
            }
        }
        return;
    }
    const int64_t n = span.x1 - span.x0;
    auto& row = Scratch(static_cast<size_t>(t.ww));
    for (int32_t c = clip.c0; c < clip.c1; ++c) {
        row[static_cast<size_t>(c - clip.c0)] = Pack(color(t.wx + c - span.x0, n), t.rgba);
    }
    if (opaque) return CopyRows(t, clip, row.data());
    for (int32_t j = t.FirstDrawnAtOrAfter(clip.r0); j < clip.r1; j += t.rowStep) {
        uint32_t* out = t.Row(j);
        for (int32_t c = clip.c0; c < clip.c1; ++c) OverPixel(out + c, row[static_cast<size_t>(c - clip.c0)]);
    }
}

// Whether |layer| hides everything under it in the window.
bool CoversOpaquely(const Layer& layer, const Composition& comp, const Target& t) {
    if (std::holds_alternative<PatternLayer>(layer.content)) return true;
    if (const auto* s = std::get_if<SolidLayer>(&layer.content)) {
        return s->color.a == 255 && Covers(LayerSpan(s->rect, comp, t.fw, t.fh), t);
    }
    if (const auto* g = std::get_if<GradientLayer>(&layer.content)) {
        return g->from.a == 255 && g->to.a == 255 && Covers(LayerSpan(g->rect, comp, t.fw, t.fh), t);
    }
    return false;
}

void Draw(const Composition& comp, const Rational& time, const Target& t) {
    const auto& layers = comp.layers;
    size_t first = layers.size();  // the bottom layer that shows; layers.size() when none covers
    bool covered = false;
    for (size_t i = layers.size(); i-- > 0;) {
        if (layers[i].ActiveAt(time) && CoversOpaquely(layers[i], comp, t)) {
            first = i;
            covered = true;
            break;
        }
    }
    if (!covered) {
        DrawBackground(t, comp.background);
        first = 0;
    }
    const int64_t frame = FrameAtTime(comp.frameRate, time);
    for (size_t i = first; i < layers.size(); ++i) {
        const Layer& layer = layers[i];
        if (!layer.ActiveAt(time)) continue;
        if (std::holds_alternative<PatternLayer>(layer.content)) {
            DrawPatternWindow(t, frame);
        } else if (const auto* s = std::get_if<SolidLayer>(&layer.content)) {
            DrawSolidWindow(t, *s, comp);
        } else if (const auto* g = std::get_if<GradientLayer>(&layer.content)) {
            DrawGradientWindow(t, *g, comp);
        }
    }
}

}  // namespace

Rational SecondFieldTime(const Rational& frameRate, const Rational& time) {
    // time + 1 / (2 * rate) = (tn * 2 * rn + td * rd) / (td * 2 * rn)
    const Int128 num = static_cast<Int128>(time.numerator()) * 2 * frameRate.numerator() +
                       static_cast<Int128>(time.denominator()) * frameRate.denominator();
    const Int128 den = static_cast<Int128>(time.denominator()) * 2 * frameRate.numerator();
    Int128 a = num < 0 ? -num : num, b = den;
    while (b != 0) {
        const Int128 r = a % b;
        a = b;
        b = r;
    }
    const Int128 g = a == 0 ? 1 : a;
    const Int128 n = num / g, d = den / g;
    if (n > INT64_MAX || n < -INT64_MAX || d > INT64_MAX) {
        throw RenderError("The time of the second field cannot be represented");
    }
    return Rational(static_cast<int64_t>(n), static_cast<int64_t>(d));
}

void ComposeFrame(const Composition& comp, const Rational& time, const FrameGeometry& g, uint8_t* out,
                  size_t rowBytes) {
    if (out == nullptr || g.width <= 0 || g.height <= 0 || rowBytes < static_cast<size_t>(g.width) * 4) return;
    Target t{out, rowBytes, g.frameWidth, g.frameHeight, g.x, g.y, g.width, g.height, 0, 1,
             g.pixelFormat == kPixelFormatRGBA};
    if (g.fieldType != platform::FieldType::UpperFirst && g.fieldType != platform::FieldType::LowerFirst) {
        return Draw(comp, time, t);
    }
    const Rational later = SecondFieldTime(comp.frameRate, time);
    // The first field is the drawn frame's even rows (upper first) or odd rows (lower first).
    const int32_t firstParity = g.fieldType == platform::FieldType::UpperFirst ? 0 : 1;
    const int32_t firstFieldRow = ((g.y % 2) == firstParity) ? 0 : 1;
    t.rowStep = 2;
    t.firstRow = firstFieldRow;
    if (t.firstRow < t.wh) Draw(comp, time, t);
    t.firstRow = 1 - firstFieldRow;
    if (t.firstRow < t.wh) Draw(comp, later, t);
}

}  // namespace tidelink::peer
