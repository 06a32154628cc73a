// How the reference peer turns render options into what it draws (docs/frames.md): the size a
// composition is drawn at, the window of it a frame holds, its pixel format, field order and
// pixel shape; the format of an audio render; and conversions between the time base of records
// (ticks) and the exact rates of compositions.
//
// Every function is pure and thread-safe. Refusals throw RenderError with a sentence for the host.
#pragma once

#include <cstdint>
#include <stdexcept>
#include <vector>

#include "ProjectModel.h"
#include "tidelink/render/FrameLayout.h"
#include "tidelink/render/RenderOptions.h"

namespace tidelink::peer {

class RenderError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

// What one video frame holds. The composition is drawn at frameWidth x frameHeight (the "drawn
// frame"); the output is the window [x, x + width) x [y, y + height) of it.
struct FrameGeometry {
    int32_t frameWidth = 0;
    int32_t frameHeight = 0;
    int32_t x = 0;
    int32_t y = 0;
    int32_t width = 0;
    int32_t height = 0;
    uint32_t pixelFormat = kPixelFormatBGRA;
    // Progressive, UpperFirst or LowerFirst (as their numbers in the frame header).
    platform::FieldType fieldType = platform::FieldType::Progressive;
    // The shape of an output pixel.
    uint32_t pixelAspectNumerator = 1;
    uint32_t pixelAspectDenominator = 1;

    uint32_t RowBytes() const { return static_cast<uint32_t>(width) * 4; }
    uint64_t FrameBytes() const { return kFrameHeaderBytes + uint64_t{RowBytes()} * static_cast<uint64_t>(height); }
    friend bool operator==(const FrameGeometry&, const FrameGeometry&) = default;
};

// Largest side of a drawn frame.
inline constexpr int32_t kMaxFrameSide = 16384;

// The first format of |formats| the peer makes (BGRA or RGBA, 8 bits); BGRA when none is.
uint32_t ChoosePixelFormat(const std::vector<platform::PixelFormat>& formats);

// The frame a render of |comp| with |options| makes. Throws RenderError for bounds or downsample
// factors out of range and for a region of interest that is malformed or outside the frame.
FrameGeometry ResolveFrameGeometry(const Composition& comp, const VideoRenderOptions& options);

// The header of a frame of |geometry| rendered for |time|.
FrameHeader HeaderFor(const FrameGeometry& geometry, const platform::RatioTime& time);

// ---- rates ----

// Ticks per frame of |rate| frames per second, to the nearest tick.
platform::FrameRate TicksPerFrame(const Rational& rate);
// The exact rate of |ticks| per frame (frames per second). Throws RenderError for an unset or
// non-positive tick count.
Rational RateOfTicks(const platform::FrameRate& ticks);
// A whole sample rate from ticks per sample; throws RenderError when it is not a whole number
// of samples per second.
int32_t SampleRateOfTicks(const platform::FrameRate& ticks);

// The sample at or before |time| at |rate| samples per second (floor).
int64_t SampleAtOrBefore(const Rational& time, int32_t rate);

// ---- audio ----

// What an audio render of a composition makes.
struct AudioFormat {
    int32_t sampleRate = 48000;
    // Per output channel: the composition channel it carries, or -1 for silence.
    std::vector<int32_t> sourceChannel;
    uint32_t Channels() const { return static_cast<uint32_t>(sourceChannel.size()); }
};

inline constexpr uint32_t kMaxAudioChannels = 32;
inline constexpr uint32_t kMaxSamplesPerBuffer = 1u << 20;

// The audio format of a render of |comp| with |options|: the options' rate (the composition's when
// unset) and layout (the composition's when empty); each output channel carries the first
// composition channel with the same label. Throws RenderError for a rate that is not a whole
// number of samples per second or lies outside 8000 to 384000, or a layout of more than 32
// channels.
AudioFormat ResolveAudioFormat(const Composition& comp, const AudioRenderOptions& options);

// |comp| as it sounds at |rate|: the same tones, sample positions and duration taken at that rate;
// tones above half the rate are left out (they cannot be represented).
Composition AtSampleRate(const Composition& comp, int32_t rate);

}  // namespace tidelink::peer
