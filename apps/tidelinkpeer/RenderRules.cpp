#include "RenderRules.h"

#include <algorithm>
#include <numeric>
#include <string>

namespace tidelink::peer {

using platform::FieldType;
using platform::FrameRate;
using platform::kTicksPerSecond;

namespace {

Int128 FloorDiv(Int128 a, Int128 b) {
    Int128 q = a / b;
    if ((a % b != 0) && ((a < 0) != (b < 0))) --q;
    return q;
}

Int128 Gcd(Int128 a, Int128 b) {
    if (a < 0) a = -a;
    if (b < 0) b = -b;
    while (b != 0) {
        const Int128 t = a % b;
        a = b;
        b = t;
    }
    return a;
}

// floor(v * to / from), for v in [0, from].
int32_t MapEdge(int64_t v, int32_t to, int32_t from) {
    return static_cast<int32_t>(FloorDiv(static_cast<Int128>(v) * to, from));
}

std::string Size(int64_t w, int64_t h) { return std::to_string(w) + "x" + std::to_string(h); }

// num/den reduced and brought within 32 bits (approximately, for absurd ratios).
void ReduceTo32(Int128 num, Int128 den, uint32_t& outNum, uint32_t& outDen) {
    if (num <= 0 || den <= 0) {
        outNum = outDen = 1;
        return;
    }
    const Int128 g = Gcd(num, den);
    num /= g;
    den /= g;
    while (num > UINT32_MAX || den > UINT32_MAX) {
        num = std::max<Int128>(1, num >> 1);
        den = std::max<Int128>(1, den >> 1);
    }
    outNum = static_cast<uint32_t>(num);
    outDen = static_cast<uint32_t>(den);
}

}  // namespace

uint32_t ChoosePixelFormat(const std::vector<platform::PixelFormat>& formats) {
    for (const auto& f : formats) {
        if (f.mFourCC == kPixelFormatBGRA || f.mFourCC == kPixelFormatRGBA) return f.mFourCC;
    }
    return kPixelFormatBGRA;
}

FrameGeometry ResolveFrameGeometry(const Composition& comp, const VideoRenderOptions& options) {
    const int32_t w = comp.width;
    const int32_t h = comp.height;
    FrameGeometry g;

    int bw = 0, bh = 0;
    options.GetBounds(bw, bh);
    if (bw < 0 || bh < 0 || bw > kMaxFrameSide || bh > kMaxFrameSide) {
        throw RenderError("The bounds " + Size(bw, bh) + " are out of range (0 to " + std::to_string(kMaxFrameSide) +
                          " pixels a side; 0 keeps the composition's size)");
    }
    int64_t fw = bw, fh = bh;
    if (bw == 0 && bh == 0) {
        fw = w;
        fh = h;
    } else if (bh == 0) {
        fh = std::max<int64_t>(1, static_cast<int64_t>(h) * bw / w);
    } else if (bw == 0) {
        fw = std::max<int64_t>(1, static_cast<int64_t>(w) * bh / h);
    }
    if (fw > kMaxFrameSide || fh > kMaxFrameSide) {
        throw RenderError("The bounds make a frame of " + Size(fw, fh) + ", larger than " +
                          std::to_string(kMaxFrameSide) + " pixels a side");
    }

    int dx = 1, dy = 1;
    options.GetDownsampleFactor(dx, dy);
    if (dx < 1 || dy < 1 || dx > kMaxFrameSide || dy > kMaxFrameSide) {
        throw RenderError("The downsample factors " + std::to_string(dx) + ", " + std::to_string(dy) +
                          " are out of range (1 to " + std::to_string(kMaxFrameSide) + ")");
    }
    g.frameWidth = static_cast<int32_t>(std::max<int64_t>(1, fw / dx));
    g.frameHeight = static_cast<int32_t>(std::max<int64_t>(1, fh / dy));

    // The region of interest in composition pixels, clipped to the composition.
    const auto roi = options.GetRegionOfInterest();
    int64_t rx0 = 0, ry0 = 0, rx1 = w, ry1 = h;
    const int64_t rw = roi.mSize.mX, rh = roi.mSize.mY;
    if (rw != 0 || rh != 0) {
        if (rw <= 0 || rh <= 0) {
            throw RenderError("The region of interest " + Size(rw, rh) + " has no area (give a positive width and height, "
                              "or 0x0 for the whole frame)");
        }
        rx0 = std::max<int64_t>(roi.mTopLeft.mX, 0);
        ry0 = std::max<int64_t>(roi.mTopLeft.mY, 0);
        rx1 = std::min<int64_t>(int64_t{roi.mTopLeft.mX} + rw, w);
        ry1 = std::min<int64_t>(int64_t{roi.mTopLeft.mY} + rh, h);
        if (rx0 >= rx1 || ry0 >= ry1) {
            throw RenderError("The region of interest (" + std::to_string(roi.mTopLeft.mX) + ", " +
                              std::to_string(roi.mTopLeft.mY) + ") " + Size(rw, rh) + " lies outside the " + Size(w, h) +
                              " frame");
        }
    }
    // Into the drawn frame; at least one pixel each way.
    const int32_t x0 = MapEdge(rx0, g.frameWidth, w);
    const int32_t y0 = MapEdge(ry0, g.frameHeight, h);
    const int32_t x1 = std::clamp(MapEdge(rx1, g.frameWidth, w), x0 + 1, g.frameWidth);
    const int32_t y1 = std::clamp(MapEdge(ry1, g.frameHeight, h), y0 + 1, g.frameHeight);
    g.x = x0;
    g.y = y0;
    g.width = x1 - x0;
    g.height = y1 - y0;

    g.pixelFormat = ChoosePixelFormat(options.GetPixelFormats());
    const FieldType field = options.GetFieldType();
    g.fieldType = field == FieldType::UpperFirst || field == FieldType::LowerFirst ? field : FieldType::Progressive;

    // An output pixel covers (w / frameWidth) x (h / frameHeight) composition pixels.
    const Int128 parNum = static_cast<Int128>(comp.pixelAspectRatio.Numerator()) * w * g.frameHeight;
    const Int128 parDen = static_cast<Int128>(comp.pixelAspectRatio.Denominator()) * h * g.frameWidth;
    ReduceTo32(parNum, parDen, g.pixelAspectNumerator, g.pixelAspectDenominator);
    return g;
}

FrameHeader HeaderFor(const FrameGeometry& geometry, const platform::RatioTime& time) {
    FrameHeader h;
    h.mWidth = static_cast<uint32_t>(geometry.width);
    h.mHeight = static_cast<uint32_t>(geometry.height);
    h.mRowBytes = geometry.RowBytes();
    h.mPixelFormat = geometry.pixelFormat;
    h.mFieldType = static_cast<int32_t>(geometry.fieldType);
    h.mTime = time;
    h.mPixelAspectNumerator = geometry.pixelAspectNumerator;
    h.mPixelAspectDenominator = geometry.pixelAspectDenominator;
    return h;
}

FrameRate TicksPerFrame(const Rational& rate) {
    if (rate <= 0) return FrameRate();
    const Int128 num = static_cast<Int128>(kTicksPerSecond) * rate.denominator();
    const Int128 den = rate.numerator();
    const Int128 ticks = (num + den / 2) / den;
    return FrameRate(ticks > INT64_MAX ? INT64_MAX - 1 : static_cast<int64_t>(ticks));
}

Rational RateOfTicks(const FrameRate& ticks) {
    if (!ticks.IsSet() || ticks.TicksPerFrame() <= 0) {
        throw RenderError("The rate is not set (ticks per frame: " + std::to_string(ticks.TicksPerFrame()) + ")");
    }
    return Rational(kTicksPerSecond, ticks.TicksPerFrame());
}

int32_t SampleRateOfTicks(const FrameRate& ticks) {
    const Rational rate = RateOfTicks(ticks);
    if (rate.denominator() != 1 || rate.numerator() > INT32_MAX) {
        throw RenderError(std::to_string(ticks.TicksPerFrame()) + " ticks per sample is not a whole number of "
                          "samples per second");
    }
    return static_cast<int32_t>(rate.numerator());
}

int64_t SampleAtOrBefore(const Rational& time, int32_t rate) {
    const Int128 s = FloorDiv(static_cast<Int128>(time.numerator()) * rate, time.denominator());
    return s > INT64_MAX ? INT64_MAX : (s < INT64_MIN ? INT64_MIN : static_cast<int64_t>(s));
}

AudioFormat ResolveAudioFormat(const Composition& comp, const AudioRenderOptions& options) {
    AudioFormat format;
    format.sampleRate = comp.sampleRate;
    const FrameRate ticks = options.GetSampleRate();
    if (ticks.IsSet()) {
        format.sampleRate = SampleRateOfTicks(ticks);
        if (format.sampleRate < 8000 || format.sampleRate > 384000) {
            throw RenderError("The sample rate " + std::to_string(format.sampleRate) +
                              " Hz is out of range (8000 to 384000 Hz)");
        }
    }
    const platform::AudioChannelLayout layout = options.GetAudioChannelLayout();
    if (layout.size() > kMaxAudioChannels) {
        throw RenderError("The channel layout has " + std::to_string(layout.size()) + " channels (at most " +
                          std::to_string(kMaxAudioChannels) + ")");
    }
    if (layout.empty()) {
        for (size_t i = 0; i < comp.channels.size(); ++i) format.sourceChannel.push_back(static_cast<int32_t>(i));
        return format;
    }
    for (const auto& wanted : layout) {
        int32_t source = -1;
        for (size_t i = 0; i < comp.channels.size(); ++i) {
            if (comp.channels[i] == wanted) {
                source = static_cast<int32_t>(i);
                break;
            }
        }
        format.sourceChannel.push_back(source);
    }
    return format;
}

Composition AtSampleRate(const Composition& comp, int32_t rate) {
    Composition out;
    out.width = comp.width;
    out.height = comp.height;
    out.frameRate = comp.frameRate;
    out.duration = comp.duration;
    out.sampleRate = rate;
    out.channels = comp.channels;
    for (const Layer& layer : comp.layers) {
        const auto* tone = std::get_if<ToneLayer>(&layer.content);
        if (tone && tone->frequency <= rate / 2.0) out.layers.push_back(layer);
    }
    return out;
}

}  // namespace tidelink::peer
