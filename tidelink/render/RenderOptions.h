// What to render: the options of a video render (quality, size, region, pixel formats, time
// step, colour space, captions and flags) and of an audio render (rate, layout, quality). Both
// travel to the peer as objects (docs/rendering.md lists the keys).
#pragma once

#include <cstdint>
#include <vector>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"
#include "platform/media/MediaTypes.h"

namespace tidelink {

using platform::WString;

class TIDELINK_EXPORT VideoRenderOptions {
public:
    VideoRenderOptions() = default;

    platform::RenderQuality GetRenderQuality() const { return mRenderQuality; }
    void SetRenderQuality(platform::RenderQuality q) { mRenderQuality = q; }
    platform::FieldType GetFieldType() const { return mFieldType; }
    void SetFieldType(platform::FieldType f) { mFieldType = f; }
    platform::RectT<int> GetRegionOfInterest() const { return mRegionOfInterest; }
    void SetRegionOfInterest(const platform::RectT<int>& r) { mRegionOfInterest = r; }
    std::vector<platform::PixelFormat> GetPixelFormats() const { return mPixelFormats; }
    void SetPixelFormats(std::vector<platform::PixelFormat> formats) { mPixelFormats = std::move(formats); }
    platform::RatioTime GetTimeStep() const { return mTimeStep; }
    void SetTimeStep(const platform::RatioTime& t) { mTimeStep = t; }
    platform::ColorSpace GetColorSpace() const { return mColorSpace; }
    void SetColorSpace(const platform::ColorSpace& c) { mColorSpace = c; }
    void GetBounds(int& width, int& height) const {
        width = mWidth;
        height = mHeight;
    }
    void SetBounds(int width, int height) {
        mWidth = width;
        mHeight = height;
    }
    void GetDownsampleFactor(int& x, int& y) const {
        x = mDownsampleX;
        y = mDownsampleY;
    }
    void SetDownsampleFactor(int x, int y) {
        mDownsampleX = x;
        mDownsampleY = y;
    }
    bool GetRenderGuideLayers() const { return mRenderGuideLayers; }
    void SetRenderGuideLayers(bool b) { mRenderGuideLayers = b; }
    bool GetRenderBackgroundColor() const { return mRenderBackgroundColor; }
    void SetRenderBackgroundColor(bool b) { mRenderBackgroundColor = b; }
    bool GetUsePreviewFiles() const { return mUsePreviewFiles; }
    void SetUsePreviewFiles(bool b) { mUsePreviewFiles = b; }
    WString GetAppSpecificRenderOptionsJSONString() const { return mAppSpecific; }
    void SetAppSpecificRenderOptionsJSONString(const WString& s) { mAppSpecific = s; }
    platform::StreamFormat GetCaptionStreamFormat() const { return mCaptionStreamFormat; }
    void SetCaptionStreamFormat(platform::StreamFormat f) { mCaptionStreamFormat = f; }
    bool GetUseProxies() const { return mUseProxies; }
    void SetUseProxies(bool b) { mUseProxies = b; }

    friend TIDELINK_EXPORT bool operator==(const VideoRenderOptions& a, const VideoRenderOptions& b);
    friend bool operator!=(const VideoRenderOptions& a, const VideoRenderOptions& b) { return !(a == b); }

private:
    platform::RenderQuality mRenderQuality = platform::RenderQuality::Max;
    platform::FieldType mFieldType = static_cast<platform::FieldType>(-1);
    platform::RectT<int> mRegionOfInterest;
    std::vector<platform::PixelFormat> mPixelFormats;
    platform::RatioTime mTimeStep{0, 1};
    platform::ColorSpace mColorSpace;
    int mWidth = 0;
    int mHeight = 0;
    int mDownsampleX = 1;
    int mDownsampleY = 1;
    bool mRenderGuideLayers = false;
    bool mRenderBackgroundColor = false;
    bool mUsePreviewFiles = false;
    WString mAppSpecific;
    platform::StreamFormat mCaptionStreamFormat = platform::StreamFormat::None;
    bool mUseProxies = false;
};

TIDELINK_EXPORT void to_json(platform::Value& j, const VideoRenderOptions& o);
// Members missing from |j| keep their defaults; wrong kinds throw the serializer's type_error.
TIDELINK_EXPORT void from_json(const platform::Value& j, VideoRenderOptions& o);

class TIDELINK_EXPORT AudioRenderOptions {
public:
    AudioRenderOptions() = default;
    virtual ~AudioRenderOptions() = default;
    AudioRenderOptions(const AudioRenderOptions&) = default;
    AudioRenderOptions& operator=(const AudioRenderOptions&) = default;

    virtual void SetSampleRate(const platform::FrameRate& rate) { mSampleRate = rate; }
    virtual platform::FrameRate GetSampleRate() const { return mSampleRate; }
    virtual void SetAudioChannelLayout(const platform::AudioChannelLayout& layout) { mLayout = layout; }
    virtual platform::AudioChannelLayout GetAudioChannelLayout() const { return mLayout; }
    platform::RenderQuality GetRenderQuality() const { return mRenderQuality; }
    void SetRenderQuality(platform::RenderQuality q) { mRenderQuality = q; }

private:
    platform::FrameRate mSampleRate;
    platform::AudioChannelLayout mLayout;
    platform::RenderQuality mRenderQuality = platform::RenderQuality::Max;
};

TIDELINK_EXPORT void to_json(platform::Value& j, const AudioRenderOptions& o);
TIDELINK_EXPORT void from_json(const platform::Value& j, AudioRenderOptions& o);

}  // namespace tidelink
