#include "tidelink/render/RenderOptions.h"

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

bool operator==(const VideoRenderOptions& a, const VideoRenderOptions& b) {
    return a.mRenderQuality == b.mRenderQuality && a.mFieldType == b.mFieldType &&
           a.mRegionOfInterest.mTopLeft.mX == b.mRegionOfInterest.mTopLeft.mX &&
           a.mRegionOfInterest.mTopLeft.mY == b.mRegionOfInterest.mTopLeft.mY &&
           a.mRegionOfInterest.mSize.mX == b.mRegionOfInterest.mSize.mX &&
           a.mRegionOfInterest.mSize.mY == b.mRegionOfInterest.mSize.mY && a.mPixelFormats == b.mPixelFormats &&
           a.mTimeStep == b.mTimeStep && a.mColorSpace.ToGuid() == b.mColorSpace.ToGuid() &&
           a.mWidth == b.mWidth && a.mHeight == b.mHeight && a.mDownsampleX == b.mDownsampleX &&
           a.mDownsampleY == b.mDownsampleY && a.mRenderGuideLayers == b.mRenderGuideLayers &&
           a.mRenderBackgroundColor == b.mRenderBackgroundColor && a.mUsePreviewFiles == b.mUsePreviewFiles &&
           a.mAppSpecific == b.mAppSpecific && a.mCaptionStreamFormat == b.mCaptionStreamFormat &&
           a.mUseProxies == b.mUseProxies;
}

void to_json(Value& j, const VideoRenderOptions& o) {
    j = Value::object();
    j["renderquality"] = static_cast<int64_t>(o.GetRenderQuality());
    j["fieldtype"] = static_cast<int64_t>(o.GetFieldType());
    j["regionofinterest"] = Value(o.GetRegionOfInterest());
    Value formats = Value::array();
    for (const auto& f : o.GetPixelFormats()) {
        formats.push_back({{"fourcc", uint64_t{f.mFourCC}}, {"properties", uint64_t{f.mProperties}}});
    }
    j["pixelformatlist"] = std::move(formats);
    j["timestep"] = RatioTimeToValue(o.GetTimeStep());
    int w = 0, h = 0, dx = 1, dy = 1;
    o.GetBounds(w, h);
    o.GetDownsampleFactor(dx, dy);
    j["width"] = int64_t{w};
    j["height"] = int64_t{h};
    j["downsamplex"] = int64_t{dx};
    j["downsampley"] = int64_t{dy};
    j["renderguidelayers"] = o.GetRenderGuideLayers();
    j["renderbackgroundcolor"] = o.GetRenderBackgroundColor();
    j["usepreviewfiles"] = o.GetUsePreviewFiles();
    j["appspecificrenderoptionsstring"] = ToUTF8(o.GetAppSpecificRenderOptionsJSONString());
    j["colorSpace"] = Value(o.GetColorSpace());
    j["captionStreamFormat"] = static_cast<uint64_t>(static_cast<uint32_t>(o.GetCaptionStreamFormat()));
    j["useproxies"] = o.GetUseProxies();
}

void from_json(const Value& j, VideoRenderOptions& o) {
    RequireObject(j);
    VideoRenderOptions out;
    if (const Value* v = FindMember(j, "renderquality")) out.SetRenderQuality(ReadEnum<RenderQuality>(*v));
    if (const Value* v = FindMember(j, "fieldtype")) out.SetFieldType(ReadEnum<FieldType>(*v));
    if (const Value* v = FindMember(j, "regionofinterest")) out.SetRegionOfInterest(v->get<RectT<int>>());
    if (const Value* v = FindMember(j, "pixelformatlist")) out.SetPixelFormats(v->get<std::vector<PixelFormat>>());
    if (const Value* v = FindMember(j, "timestep")) out.SetTimeStep(RatioTimeFromValue(*v));
    int w = 0, h = 0, dx = 1, dy = 1;
    if (const Value* v = FindMember(j, "width")) w = ReadInteger<int>(*v);
    if (const Value* v = FindMember(j, "height")) h = ReadInteger<int>(*v);
    if (const Value* v = FindMember(j, "downsamplex")) dx = ReadInteger<int>(*v);
    if (const Value* v = FindMember(j, "downsampley")) dy = ReadInteger<int>(*v);
    out.SetBounds(w, h);
    out.SetDownsampleFactor(dx, dy);
    if (const Value* v = FindMember(j, "renderguidelayers")) out.SetRenderGuideLayers(ReadBool(*v));
    if (const Value* v = FindMember(j, "renderbackgroundcolor")) out.SetRenderBackgroundColor(ReadBool(*v));
    if (const Value* v = FindMember(j, "usepreviewfiles")) out.SetUsePreviewFiles(ReadBool(*v));
    if (const Value* v = FindMember(j, "appspecificrenderoptionsstring")) {
        out.SetAppSpecificRenderOptionsJSONString(ReadWString(*v));
    }
    if (const Value* v = FindMember(j, "colorSpace")) out.SetColorSpace(v->get<ColorSpace>());
    if (const Value* v = FindMember(j, "captionStreamFormat")) {
        out.SetCaptionStreamFormat(static_cast<StreamFormat>(ReadInteger<uint32_t>(*v)));
    }
    if (const Value* v = FindMember(j, "useproxies")) out.SetUseProxies(ReadBool(*v));
    o = std::move(out);
}

void to_json(Value& j, const AudioRenderOptions& o) {
    j = Value::object();
    j["audiosamplerate"] = {{"ticksperframe", o.GetSampleRate().TicksPerFrame()}};
    Value layout = Value::array();
    for (const auto& c : o.GetAudioChannelLayout()) layout.push_back(Value(c));
    j["audiochannellayout"] = std::move(layout);
    j["audiorenderquality"] = static_cast<int64_t>(o.GetRenderQuality());
}

void from_json(const Value& j, AudioRenderOptions& o) {
    RequireObject(j);
    AudioRenderOptions out;
    if (const Value* v = FindMember(j, "audiosamplerate")) out.SetSampleRate(v->get<FrameRate>());
    if (const Value* v = FindMember(j, "audiochannellayout")) {
        out.SetAudioChannelLayout(v->get<AudioChannelLayout>());
    }
    if (const Value* v = FindMember(j, "audiorenderquality")) out.SetRenderQuality(ReadEnum<RenderQuality>(*v));
    o = out;
}

}  // namespace tidelink
