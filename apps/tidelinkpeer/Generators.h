// Pure pixel and sample generators of the reference peer: every frame and every audio sample of a
// composition is a function of the composition and the time alone, so that tests can compute
// what a render must contain and compare it byte for byte (docs/projects.md, "Rendering").
//
// Frames are 8-bit BGRA (bytes B, G, R, A in memory), rows |rowBytes| apart. Audio is 32-bit float,
// interleaved by channel. Every function is thread-safe and allocation-free unless stated.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>

#include "ProjectModel.h"

namespace tidelink::peer {

// A frame buffer the generators draw into.
struct FrameView {
    uint8_t* data = nullptr;
    int32_t width = 0;
    int32_t height = 0;
    size_t rowBytes = 0;  // at least 4 * width
};

// The frame shown at |time| (seconds): floor(time * frameRate); negative times give frame 0.
int64_t FrameAtTime(const Rational& frameRate, const Rational& time);
// The time at which frame |frame| starts: frame / frameRate.
Rational TimeOfFrame(const Rational& frameRate, int64_t frame);

// ---- the test pattern ----

// Layout of the frame code: a band across the top of the frame, split into kCodeCells equal
// cells: a white and a black marker, the 32 bits of the frame number (most significant first),
// then 8 check bits (the four bytes of the number XOR-ed together, XOR 0xA5). A set bit is white,
// a clear bit black. The band is height / 16 rows high (at least 1); the cells are
// width / kCodeCells pixels wide, the remainder on the right is mid grey.
inline constexpr int32_t kCodeCells = 42;

// The colour field under the code band for frame |frame| at pixel (x, y) of a width x height
// frame: R = (base.r + 256 * x / width) mod 256, G = (base.g + 256 * y / height) mod 256,
// B = base.b, A = 255, where base is a hash of the frame number.
Color8 PatternFieldColor(int64_t frame, int32_t x, int32_t y, int32_t width, int32_t height);

// Draws the pattern of |frame| over the whole view (opaque).
void DrawPattern(const FrameView& view, int64_t frame);

// The pieces of the pattern, for renderers that draw it row by row: the rows of the code band
// of a frame |height| rows high, the 24-bit colour hash of |frame| (R base in bits 0-7, G base
// in 8-15, B in 16-23), and whether code cell |cell| (0 to kCodeCells - 1) of |frame| is white.
int32_t PatternBandHeight(int32_t height);
uint32_t PatternHash(int64_t frame);
bool PatternCellIsWhite(int64_t frame, int32_t cell);

// Reads the frame number back from a frame drawn with DrawPattern (at any size with
// width >= kCodeCells). Samples the middle of each cell; nullopt when the markers or the check
// bits do not match.
std::optional<int64_t> DecodePatternFrame(const uint8_t* bgra, int32_t width, int32_t height,
                                          size_t rowBytes);

// ---- compositions ----

// The pixels [x0, x1) x [y0, y1) of a width x height frame that a layer's rectangle covers (the
// whole frame when it has none), clipped to the frame. Edges land at floor(p * size / compSize).
struct PixelSpan {
    int32_t x0 = 0;
    int32_t y0 = 0;
    int32_t x1 = 0;
    int32_t y1 = 0;
    bool Empty() const { return x0 >= x1 || y0 >= y1; }
};
PixelSpan LayerSpan(const std::optional<PixelRect>& rect, const Composition& comp, int32_t width, int32_t height);

// Component |i| of |n| of a gradient from |from| to |to|.
uint8_t GradientComponent(uint8_t from, uint8_t to, int64_t i, int64_t n);

// Renders |comp| at |time| into |view|. The view may be of any size: layer geometry given in
// composition pixels is scaled to it; the pattern is laid out relative to the view. The
// background is filled first, then each layer active at |time| is drawn over it in order
// (straight-alpha "over": out = (src * a + dst * (255 - a) + 127) / 255 per component).
// Footage layers draw nothing (the peer does not decode media).
void RenderCompositionFrame(const Composition& comp, const Rational& time, const FrameView& view);

// One tone sample: amplitude * sin(2 pi frequency n / sampleRate), with the phase reduced
// exactly (modulo the sample rate) before the sine, so sample n is the same however the
// samples are chunked.
float ToneSample(double frequency, double amplitude, int32_t sampleRate, int64_t n);

// Writes |count| frames of interleaved audio (comp.channels.size() floats each) starting at
// composition sample |first| into |out|: the sum of the tone layers active at each sample
// (a tone layer covers samples n with start <= n / sampleRate < end), clamped to [-1, 1].
// Samples before 0 or at or after the duration are silent.
void RenderCompositionAudio(const Composition& comp, int64_t first, int64_t count, float* out);

}  // namespace tidelink::peer
