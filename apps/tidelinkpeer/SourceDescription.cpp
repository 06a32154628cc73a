#include "SourceDescription.h"

#include <cmath>
#include <cstdio>

#include "RenderRules.h"
#include "tidelink/render/FrameLayout.h"

namespace tidelink::peer {

using platform::FrameRate;
using platform::RatioTime;
using platform::ToUTF16;

namespace {

// The bounds the project reader keeps rationals in, so that products fit in 128 bits.
constexpr int64_t kMaxRationalPart = int64_t{1} << 40;
constexpr int64_t kMaxSeconds = 7 * 24 * 3600;

bool InBounds(const Rational& r) {
    return r.numerator() <= kMaxRationalPart && r.numerator() >= -kMaxRationalPart &&
           r.denominator() <= kMaxRationalPart;
}

std::string Text(const Rational& r) {
    return r.denominator() == 1 ? std::to_string(r.numerator())
                                : std::to_string(r.numerator()) + "/" + std::to_string(r.denominator());
}

[[noreturn]] void Refuse(const std::string& why) { throw ProjectError(why); }

void CheckRect(const std::optional<PixelRect>& rect, const std::string& layer) {
    if (!rect) return;
    const int32_t m = ProjectModel::kMaxDimension;
    if (rect->x < -m || rect->x > m || rect->y < -m || rect->y > m || rect->width < 0 || rect->width > m ||
        rect->height < 0 || rect->height > m) {
        Refuse("the rectangle of layer \"" + layer + "\" is out of range");
    }
}

}  // namespace

std::string EscapeXml(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (char ch : text) {
        const auto c = static_cast<unsigned char>(ch);
        switch (c) {
            case '&': out += "&amp;"; break;
            case '<': out += "&lt;"; break;
            case '>': out += "&gt;"; break;
            case '"': out += "&quot;"; break;
            case '\'': out += "&apos;"; break;
            default:
                if (c < 0x20) {
                    out += "&#" + std::to_string(c) + ";";
                } else {
                    out += ch;
                }
        }
    }
    return out;
}

SourceInfo DescribeSource(const ProjectModel& model, const Item& item, const std::string& producer) {
    SourceInfo info;
    info.mParentProjectFile = model.File();
    info.mName = ToUTF16(item.name);
    info.mMediaProducerDescription = ToUTF16(producer);
    info.mID = item.id;
    info.mAlphaChannelType = platform::AlphaChannel::Straight;
    info.mFieldType = platform::FieldType::Progressive;
    info.mNativeFieldType = platform::FieldType::Progressive;
    info.mIsDropFrame = false;
    info.mSupportsVideoRenderingSessions = true;
    platform::Value app = platform::Value::object();
    app["itemPath"] = item.path;
    if (item.type == ItemType::Composition && item.composition) {
        const Composition& c = *item.composition;
        info.mDuration = c.duration;
        info.mPixelAspectRatio = c.pixelAspectRatio;
        info.mFrameRect.mTopLeft = {0, 0};
        info.mFrameRect.mSize = {c.width, c.height};
        info.mFrameRate = TicksPerFrame(c.frameRate);
        info.mPixelFormatList = {platform::PixelFormat{kPixelFormatBGRA}, platform::PixelFormat{kPixelFormatRGBA}};
        info.mAudioChannelLayout = c.channels;
        info.mAudioSampleRate = TicksPerFrame(Rational(c.sampleRate));
        info.mHasVideo = c.HasVideo();
        info.mHasAudio = c.HasAudio();
        info.mWorkInPoint = RatioTime(0);
        info.mWorkOutPoint = c.duration;
        app["type"] = "composition";
        app["frameRate"] = Text(c.frameRate);
        app["sampleRate"] = c.sampleRate;
    } else if (item.type == ItemType::Footage && item.footage) {
        // The peer does not decode media: footage is described, never rendered.
        info.mIsMedia = true;
        info.mDuration = RatioTime(0);
        info.mHasVideo = false;
        info.mHasAudio = false;
        info.mSupportsVideoRenderingSessions = false;
        app["type"] = "footage";
        app["path"] = item.footage->resolved.string();
        app["missing"] = item.footage->missing;
    } else {
        throw ProjectError("\"" + item.path + "\" is a bin, not a source");
    }
    info.mAppSpecificSourceInfo = platform::ToJSONText(app);
    return info;
}

void ApplySourceInfo(const SourceInfo& info, Composition& comp) {
    if (info.mFrameRect.mSize.mX != 0 || info.mFrameRect.mSize.mY != 0) {
        comp.width = info.mFrameRect.mSize.mX;
        comp.height = info.mFrameRect.mSize.mY;
    }
    if (info.mFrameRate.IsSet()) {
        if (info.mFrameRate.TicksPerFrame() <= 0) Refuse("the frame rate is not positive");
        comp.frameRate = Rational(platform::kTicksPerSecond, info.mFrameRate.TicksPerFrame());
    }
    if (info.mDuration > 0) comp.duration = info.mDuration;
    if (info.mPixelAspectRatio.Numerator() != 0 && info.mPixelAspectRatio.Denominator() != 0) {
        comp.pixelAspectRatio = info.mPixelAspectRatio;
    }
    if (info.mAudioSampleRate.IsSet()) {
        try {
            comp.sampleRate = SampleRateOfTicks(info.mAudioSampleRate);
        } catch (const RenderError& e) {
            Refuse(std::string("the audio rate: ") + e.what());
        }
    }
    if (!info.mAudioChannelLayout.empty()) comp.channels = info.mAudioChannelLayout;
}

void ValidateComposition(const Composition& c) {
    const int32_t m = ProjectModel::kMaxDimension;
    if (c.width < 1 || c.width > m || c.height < 1 || c.height > m) {
        Refuse("the frame size " + std::to_string(c.width) + "x" + std::to_string(c.height) + " is out of range (1 to " +
               std::to_string(m) + " pixels a side)");
    }
    if (!InBounds(c.frameRate) || c.frameRate <= 0 || c.frameRate > 1000) {
        Refuse("the frame rate " + Text(c.frameRate) + " is out of range (above 0, at most 1000 frames per second)");
    }
    if (!InBounds(c.duration) || c.duration <= 0 || c.duration > kMaxSeconds) {
        Refuse("the duration " + Text(c.duration) + " s is out of range (above 0, at most 7 days)");
    }
    if (c.pixelAspectRatio.Numerator() == 0 || c.pixelAspectRatio.Denominator() == 0 ||
        c.pixelAspectRatio.Numerator() > static_cast<uint64_t>(kMaxRationalPart) ||
        c.pixelAspectRatio.Denominator() > static_cast<uint64_t>(kMaxRationalPart)) {
        Refuse("the pixel aspect ratio is out of range");
    }
    if (c.sampleRate < 8000 || c.sampleRate > 384000) {
        Refuse("the audio rate " + std::to_string(c.sampleRate) + " Hz is out of range (8000 to 384000)");
    }
    if (c.channels.empty() || c.channels.size() > 32) {
        Refuse("the audio has " + std::to_string(c.channels.size()) + " channels (1 to 32)");
    }
    if (c.layers.size() > ProjectModel::kMaxLayers) Refuse("a composition holds at most 1000 layers");
    for (const Layer& layer : c.layers) {
        if (!InBounds(layer.start) || layer.start < 0) Refuse("layer \"" + layer.name + "\" starts before 0");
        if (layer.end && (!InBounds(*layer.end) || *layer.end <= layer.start)) {
            Refuse("layer \"" + layer.name + "\" ends before it starts");
        }
        if (const auto* s = std::get_if<SolidLayer>(&layer.content)) CheckRect(s->rect, layer.name);
        if (const auto* g = std::get_if<GradientLayer>(&layer.content)) CheckRect(g->rect, layer.name);
        if (const auto* t = std::get_if<ToneLayer>(&layer.content)) {
            if (!std::isfinite(t->frequency) || t->frequency <= 0 || t->frequency > c.sampleRate / 2.0) {
                Refuse("the tone of layer \"" + layer.name + "\" must be above 0 and at most half the sample rate");
            }
            if (!std::isfinite(t->amplitude) || t->amplitude < 0 || t->amplitude > 1) {
                Refuse("the tone of layer \"" + layer.name + "\" must have an amplitude from 0 to 1");
            }
            for (int32_t ch : t->channels) {
                if (ch < 0 || static_cast<size_t>(ch) >= c.channels.size()) {
                    Refuse("the tone of layer \"" + layer.name + "\" names channel " + std::to_string(ch) +
                           ", which the composition does not have");
                }
            }
        }
    }
}

Composition CompositionFromSourceInfo(const SourceInfo& info, bool strict) {
    if (strict && (info.mFrameRect.mSize.mX <= 0 || info.mFrameRect.mSize.mY <= 0)) {
        Refuse("the frame rectangle has no size (" + std::to_string(info.mFrameRect.mSize.mX) + "x" +
               std::to_string(info.mFrameRect.mSize.mY) + ")");
    }
    if (strict && !info.mFrameRate.IsSet()) Refuse("the frame rate is not set");
    if (strict && info.mDuration <= 0) Refuse("the duration is not positive");
    Composition c;
    c.channels = platform::CreateStereoChannelLayout();
    ApplySourceInfo(info, c);
    Layer pattern;
    pattern.name = "Test pattern";
    pattern.content = PatternLayer{};
    c.layers.push_back(pattern);
    Layer tone;
    tone.name = "1 kHz";
    tone.content = ToneLayer{1000.0, std::pow(10.0, -20.0 / 20.0), {}};
    c.layers.push_back(tone);
    if (strict) ValidateComposition(c);
    return c;
}

std::string MetadataPacket(const ProjectModel& model, const Item& item, const RatioTime& start, const RatioTime& end) {
    std::string x;
    x += "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
    x += "<rdf:RDF xmlns:rdf=\"http://www.w3.org/1999/02/22-rdf-syntax-ns#\">\n";
    x += " <rdf:Description rdf:about=\"\" xmlns:dc=\"http://purl.org/dc/elements/1.1/\"";
    x += " xmlns:tl=\"http://ns.quenlo.com/tidelink/1.0/\">\n";
    x += "  <dc:title><rdf:Alt><rdf:li xml:lang=\"x-default\">" + EscapeXml(item.name) + "</rdf:li></rdf:Alt></dc:title>\n";
    x += "  <tl:project>" + EscapeXml(model.Name()) + "</tl:project>\n";
    x += "  <tl:itemPath>" + EscapeXml(item.path) + "</tl:itemPath>\n";
    x += "  <tl:rangeStart>" + Text(start) + "</tl:rangeStart>\n";
    x += "  <tl:rangeEnd>" + Text(end) + "</tl:rangeEnd>\n";
    if (item.composition) {
        const Composition& c = *item.composition;
        x += "  <tl:duration>" + Text(c.duration) + "</tl:duration>\n";
        x += "  <tl:frameSize>" + std::to_string(c.width) + "x" + std::to_string(c.height) + "</tl:frameSize>\n";
        x += "  <tl:frameRate>" + Text(c.frameRate) + "</tl:frameRate>\n";
        x += "  <tl:sampleRate>" + std::to_string(c.sampleRate) + "</tl:sampleRate>\n";
        x += "  <tl:channels>" + std::to_string(c.channels.size()) + "</tl:channels>\n";
    }
    x += " </rdf:Description>\n";
    x += "</rdf:RDF>\n";
    return x;
}

}  // namespace tidelink::peer
