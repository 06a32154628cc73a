// Media-type values that travel inside records: rates, times, picture and sound formats, colour.
//
// Each type converts to and from the serialization tree in the one form every peer uses (see
// docs/records.md). Enumerations keep any value of their 32-bit underlying type, so a value that
// a newer peer sends passes through unchanged.
#pragma once

#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include <boost/rational.hpp>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

namespace tidelink::platform {

// ---- Time ----------------------------------------------------------------------------------

// Every rate and tick count is on this time base.
inline constexpr int64_t kTicksPerSecond = 254016000000;

// A time in ticks of kTicksPerSecond.
using TickTime = int64_t;
inline constexpr TickTime kUnsetTickTime = -101606400000000000;  // -400000 s

// Seconds as a fraction; always normalised (positive denominator, lowest terms).
using RatioTime = boost::rational<int64_t>;

TIDELINK_EXPORT RatioTime TimeToRatioTime(TickTime ticks);

// {"value": numerator, "scale": denominator}
TIDELINK_EXPORT Value RatioTimeToValue(const RatioTime& t);
// Throws boost::bad_rational for a zero or negative scale, the serializer's type_error for a
// value of the wrong kind.
TIDELINK_EXPORT RatioTime RatioTimeFromValue(const Value& v);

// A frame or sample rate as ticks per frame (or per sample).
class TIDELINK_EXPORT FrameRate {
public:
    static constexpr int64_t kUnset = std::numeric_limits<int64_t>::max();

    constexpr FrameRate() = default;
    constexpr explicit FrameRate(int64_t ticksPerFrame) : mTicksPerFrame(ticksPerFrame) {}

    constexpr int64_t TicksPerFrame() const { return mTicksPerFrame; }
    constexpr bool IsSet() const { return mTicksPerFrame != kUnset; }

    friend constexpr bool operator==(FrameRate a, FrameRate b) {
        return a.mTicksPerFrame == b.mTicksPerFrame;
    }
    friend constexpr bool operator!=(FrameRate a, FrameRate b) { return !(a == b); }

private:
    int64_t mTicksPerFrame = kUnset;
};

// {"ticksperframe": int64}; a missing member or 0 reads as the unset rate.
TIDELINK_EXPORT void to_json(Value& j, const FrameRate& r);
TIDELINK_EXPORT void from_json(const Value& j, FrameRate& r);

// ---- Geometry and colour -------------------------------------------------------------------

template <class T>
struct PointT {
    T mX{};
    T mY{};
    friend bool operator==(const PointT& a, const PointT& b) {
        return a.mX == b.mX && a.mY == b.mY;
    }
    friend bool operator!=(const PointT& a, const PointT& b) { return !(a == b); }
};

template <class T>
struct RectT {
    PointT<T> mTopLeft;
    PointT<T> mSize;
    friend bool operator==(const RectT& a, const RectT& b) {
        return a.mTopLeft == b.mTopLeft && a.mSize == b.mSize;
    }
    friend bool operator!=(const RectT& a, const RectT& b) { return !(a == b); }
};

// {"topleft": {"x", "y"}, "size": {"x", "y"}}
TIDELINK_EXPORT void to_json(Value& j, const RectT<int>& r);
TIDELINK_EXPORT void from_json(const Value& j, RectT<int>& r);

struct ColorRGBA {
    float mRed = 0.0f;
    float mGreen = 0.0f;
    float mBlue = 0.0f;
    float mAlpha = 1.0f;
    friend bool operator==(const ColorRGBA& a, const ColorRGBA& b) {
        return a.mRed == b.mRed && a.mGreen == b.mGreen && a.mBlue == b.mBlue &&
               a.mAlpha == b.mAlpha;
    }
    friend bool operator!=(const ColorRGBA& a, const ColorRGBA& b) { return !(a == b); }
};

// Pixel aspect ratio as given (not reduced); the default is square pixels.
class TIDELINK_EXPORT PixelAspectRatio {
public:
    constexpr PixelAspectRatio() = default;
    constexpr PixelAspectRatio(uint64_t numerator, uint64_t denominator)
        : mNumerator(numerator), mDenominator(denominator) {}
    constexpr uint64_t Numerator() const { return mNumerator; }
    constexpr uint64_t Denominator() const { return mDenominator; }
    friend constexpr bool operator==(PixelAspectRatio a, PixelAspectRatio b) {
        return a.mNumerator == b.mNumerator && a.mDenominator == b.mDenominator;
    }
    friend constexpr bool operator!=(PixelAspectRatio a, PixelAspectRatio b) { return !(a == b); }

private:
    uint64_t mNumerator = 1;
    uint64_t mDenominator = 1;
};

// {"numerator": uint64, "denominator": uint64}; each missing member reads as 0.
TIDELINK_EXPORT void to_json(Value& j, const PixelAspectRatio& r);
TIDELINK_EXPORT void from_json(const Value& j, PixelAspectRatio& r);

struct PixelFormat {
    static constexpr uint32_t kDefaultProperties = 0x78000;
    uint32_t mFourCC = 0;
    uint32_t mProperties = kDefaultProperties;
    friend bool operator==(const PixelFormat& a, const PixelFormat& b) {
        return a.mFourCC == b.mFourCC && a.mProperties == b.mProperties;
    }
    friend bool operator!=(const PixelFormat& a, const PixelFormat& b) { return !(a == b); }
};

constexpr uint32_t MakeFourCC(char a, char b, char c, char d) {
    return (uint32_t(uint8_t(a)) << 24) | (uint32_t(uint8_t(b)) << 16) |
           (uint32_t(uint8_t(c)) << 8) | uint32_t(uint8_t(d));
}

// {"fourcc": uint64, "properties": uint64}; missing "fourcc" reads as 0, missing "properties" as
// kDefaultProperties.
TIDELINK_EXPORT void to_json(Value& j, const PixelFormat& f);
TIDELINK_EXPORT void from_json(const Value& j, PixelFormat& f);

enum class FieldType : int32_t {
    Progressive = 0,
    UpperFirst = 1,
    LowerFirst = 2,
    AsSource = 3,
    Unknown = 4,
};

enum class AlphaChannel : int32_t {
    None = 0,
    Straight = 1,
    Premultiplied = 2,
    Ignore = 3,
};

enum class RenderQuality : int32_t {
    Draft = 0,
    Low = 1,
    Medium = 2,
    High = 3,
    Max = 4,
};

// Caption stream formats; values pass between peers unchanged.
enum class StreamFormat : int32_t {
    None = 0,
};

// ---- Sound ---------------------------------------------------------------------------------

struct AudioChannelDescription {
    static constexpr int32_t kLabelLeft = 1;
    static constexpr int32_t kLabelRight = 2;
    int32_t mChannelLabel = 0;
    friend bool operator==(const AudioChannelDescription& a, const AudioChannelDescription& b) {
        return a.mChannelLabel == b.mChannelLabel;
    }
    friend bool operator!=(const AudioChannelDescription& a, const AudioChannelDescription& b) {
        return !(a == b);
    }
};

using AudioChannelLayout = std::vector<AudioChannelDescription>;

// Left, right.
TIDELINK_EXPORT AudioChannelLayout CreateStereoChannelLayout();

// {"channellabel": int64}
TIDELINK_EXPORT void to_json(Value& j, const AudioChannelDescription& d);
TIDELINK_EXPORT void from_json(const Value& j, AudioChannelDescription& d);

// ---- Colour management ---------------------------------------------------------------------

// A named colour profile and its bytes. Its GUID is a name-based (version 5) GUID of the name and
// the bytes, the same in every process.
class TIDELINK_EXPORT ColorProfile {
public:
    ColorProfile() = default;
    ColorProfile(WString name, std::vector<uint8_t> data)
        : mName(std::move(name)), mData(std::move(data)) {}

    const WString& GetName() const { return mName; }
    const std::vector<uint8_t>& GetData() const { return mData; }
    void SetName(WString name) { mName = std::move(name); }
    void SetData(std::vector<uint8_t> data) { mData = std::move(data); }

    Guid GetGuid() const;
    // Same answer as comparing GetGuid() with a default profile's, without hashing.
    bool IsDefault() const { return mName.empty() && mData.empty(); }

    // Same answer as comparing GetGuid(): the GUID is a function of exactly these two fields.
    friend bool operator==(const ColorProfile& a, const ColorProfile& b) {
        return a.mName == b.mName && a.mData == b.mData;
    }
    friend bool operator!=(const ColorProfile& a, const ColorProfile& b) { return !(a == b); }

private:
    WString mName;
    std::vector<uint8_t> mData;
};

// {"colorProfileName": string, "colorProfileData": base64}; each member read only when present.
// Data that is not valid base64 fails with the serializer's type_error.
TIDELINK_EXPORT void to_json(Value& j, const ColorProfile& p);
TIDELINK_EXPORT void from_json(const Value& j, ColorProfile& p);

class TIDELINK_EXPORT ColorSpace {
public:
    ColorSpace() = default;
    ColorSpace(ColorProfile baseProfile, uint32_t baseProfileType, bool linearized)
        : mBaseProfile(std::move(baseProfile)), mBaseProfileType(baseProfileType),
          mLinearized(linearized) {}

    const ColorProfile& GetBaseProfile() const { return mBaseProfile; }
    uint32_t GetBaseProfileType() const { return mBaseProfileType; }
    bool IsLinearized() const { return mLinearized; }

    // Name-based (version 5) GUID of the base profile's GUID, the type and the flag.
    Guid ToGuid() const;

    // Same answer as comparing ToGuid().
    friend bool operator==(const ColorSpace& a, const ColorSpace& b) {
        return a.mBaseProfileType == b.mBaseProfileType && a.mLinearized == b.mLinearized &&
               a.mBaseProfile == b.mBaseProfile;
    }
    friend bool operator!=(const ColorSpace& a, const ColorSpace& b) { return !(a == b); }

private:
    ColorProfile mBaseProfile;
    uint32_t mBaseProfileType = 0;
    bool mLinearized = false;
};

// {"baseColorProfile", "baseProfileType", "colorSpaceLinearized"}, each written only when it
// differs from the default and read only when present.
TIDELINK_EXPORT void to_json(Value& j, const ColorSpace& c);
TIDELINK_EXPORT void from_json(const Value& j, ColorSpace& c);

}  // namespace tidelink::platform
