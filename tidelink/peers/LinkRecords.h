// Value records that describe linked things: a source (SourceInfo) and the addressing of assets
// and productions of the remote collaborative-production service (the Farland records).
//
// All are plain values: copyable, compared field by field in declaration order, and converted to
// and from the serialization tree with to_json/from_json, so they pass directly as request
// arguments and come back from replies. A reader either returns the whole record or throws:
// the serializer's type_error for a value of the wrong kind, boost::bad_rational for a time with
// a zero or negative scale. Missing keys never fail (see docs/records.md for each default).
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"
#include "platform/media/MediaTypes.h"
#include "tidelink/templates/CapsuleParams.h"

namespace tidelink {

using platform::Guid;
using File = std::filesystem::path;

struct TIDELINK_EXPORT FarlandServerConnectInfo {
    std::string mServerDiscoveryURL;
    std::string mEARPort;
    std::string mUserName;
    std::string mAuthToken;
    std::string mAuthTokenType;
    // Set and read by the code that fills the record; here it is only copied and compared.
    bool mFlag = false;
    std::map<ImmutableString, ImmutableString> mHeaders;

    friend bool operator==(const FarlandServerConnectInfo& a, const FarlandServerConnectInfo& b) {
        return a.mServerDiscoveryURL == b.mServerDiscoveryURL && a.mEARPort == b.mEARPort &&
               a.mUserName == b.mUserName && a.mAuthToken == b.mAuthToken &&
               a.mAuthTokenType == b.mAuthTokenType && a.mFlag == b.mFlag &&
               a.mHeaders == b.mHeaders;
    }
    friend bool operator!=(const FarlandServerConnectInfo& a, const FarlandServerConnectInfo& b) {
        return !(a == b);
    }
};

struct TIDELINK_EXPORT FarlandAssetInfo {
    std::string mProductionIdentifier;
    std::string mProductionRevision;
    std::string mAssetIdentifier;

    bool IsEmpty() const { return mAssetIdentifier.empty(); }
    friend bool operator==(const FarlandAssetInfo& a, const FarlandAssetInfo& b) {
        return a.mProductionIdentifier == b.mProductionIdentifier &&
               a.mProductionRevision == b.mProductionRevision &&
               a.mAssetIdentifier == b.mAssetIdentifier;
    }
    friend bool operator!=(const FarlandAssetInfo& a, const FarlandAssetInfo& b) {
        return !(a == b);
    }
};

struct TIDELINK_EXPORT FarlandAssetRequestInfo {
    FarlandServerConnectInfo mServerConnectInfo;
    std::string mProductionIdentifier;
    std::string mProductionRevision;
    std::string mAssetIdentifier;

    bool IsEmpty() const { return mAssetIdentifier.empty(); }
    FarlandAssetInfo GetAssetInfo() const {
        return {mProductionIdentifier, mProductionRevision, mAssetIdentifier};
    }
    friend bool operator==(const FarlandAssetRequestInfo& a, const FarlandAssetRequestInfo& b) {
        return a.mServerConnectInfo == b.mServerConnectInfo &&
               a.mProductionIdentifier == b.mProductionIdentifier &&
               a.mProductionRevision == b.mProductionRevision &&
               a.mAssetIdentifier == b.mAssetIdentifier;
    }
    friend bool operator!=(const FarlandAssetRequestInfo& a, const FarlandAssetRequestInfo& b) {
        return !(a == b);
    }
};

struct TIDELINK_EXPORT FarlandProductionInfo {
    FarlandProductionInfo() = default;
    FarlandProductionInfo(std::string identifier, std::string revision, WString displayName)
        : mProductionIdentifier(std::move(identifier)), mRevision(std::move(revision)),
          mDisplayName(std::move(displayName)) {}

    std::string mProductionIdentifier;
    std::string mRevision;
    WString mDisplayName;

    bool IsEmpty() const { return mProductionIdentifier.empty(); }
    friend bool operator==(const FarlandProductionInfo& a, const FarlandProductionInfo& b) {
        return a.mProductionIdentifier == b.mProductionIdentifier && a.mRevision == b.mRevision &&
               a.mDisplayName == b.mDisplayName;
    }
    friend bool operator!=(const FarlandProductionInfo& a, const FarlandProductionInfo& b) {
        return !(a == b);
    }
};

struct TIDELINK_EXPORT FarlandProductionRequestInfo {
    FarlandServerConnectInfo mServerConnectInfo;
    std::string mProductionIdentifier;
    std::string mRevision;
    WString mDisplayName;
    bool mCreateNewProduction = false;

    bool IsEmpty() const { return mProductionIdentifier.empty() && !mCreateNewProduction; }
    FarlandProductionInfo GetProductionInfo() const {
        return {mProductionIdentifier, mRevision, mDisplayName};
    }
    friend bool operator==(const FarlandProductionRequestInfo& a,
                           const FarlandProductionRequestInfo& b) {
        return a.mServerConnectInfo == b.mServerConnectInfo &&
               a.mProductionIdentifier == b.mProductionIdentifier && a.mRevision == b.mRevision &&
               a.mDisplayName == b.mDisplayName && a.mCreateNewProduction == b.mCreateNewProduction;
    }
    friend bool operator!=(const FarlandProductionRequestInfo& a,
                           const FarlandProductionRequestInfo& b) {
        return !(a == b);
    }
};

// Names a source either by project file and source ID, or by an asset of the service.
template <class T>
struct GenericAssetInfoT {
    GenericAssetInfoT() = default;
    explicit GenericAssetInfoT(const T& asset) : mFarlandAssetInfo(asset) {}
    explicit GenericAssetInfoT(const File& projectFile) : mProjectFile(projectFile) {}
    GenericAssetInfoT(const File& projectFile, const Guid& sourceID)
        : mProjectFile(projectFile), mProjectFileSourceID(sourceID) {}

    bool IsProjectFileBased() const { return mFarlandAssetInfo.mAssetIdentifier.empty(); }

    friend bool operator==(const GenericAssetInfoT& a, const GenericAssetInfoT& b) {
        return a.mProjectFile == b.mProjectFile &&
               a.mProjectFileSourceID == b.mProjectFileSourceID &&
               a.mFarlandAssetInfo == b.mFarlandAssetInfo;
    }
    friend bool operator!=(const GenericAssetInfoT& a, const GenericAssetInfoT& b) {
        return !(a == b);
    }

    File mProjectFile;
    Guid mProjectFileSourceID;
    T mFarlandAssetInfo;
};

using GenericAssetInfo = GenericAssetInfoT<FarlandAssetInfo>;
using GenericAssetRequestInfo = GenericAssetInfoT<FarlandAssetRequestInfo>;

struct TIDELINK_EXPORT SourceInfo {
    using RatioTime = platform::RatioTime;

    File mParentProjectFile;
    FarlandAssetRequestInfo mFarlandAssetRequestInfo;
    FarlandProductionRequestInfo mFarlandProductionRequestInfo;
    WString mName;
    WString mMediaProducerDescription;
    Guid mID;
    RatioTime mDuration{0, 1};
    platform::PixelAspectRatio mPixelAspectRatio;
    platform::AlphaChannel mAlphaChannelType = platform::AlphaChannel::Straight;
    platform::RectT<int> mFrameRect;
    platform::FrameRate mFrameRate;
    std::vector<platform::PixelFormat> mPixelFormatList;
    platform::FieldType mFieldType = platform::FieldType::AsSource;
    platform::FieldType mNativeFieldType = platform::FieldType::Unknown;
    platform::AudioChannelLayout mAudioChannelLayout;
    platform::FrameRate mAudioSampleRate;
    Guid mInitialContentState;
    bool mHasAudio = false;
    bool mHasVideo = false;
    RatioTime mCurrentTime{0, 1};
    RatioTime mWorkInPoint = platform::TimeToRatioTime(platform::kUnsetTickTime);
    RatioTime mWorkOutPoint = platform::TimeToRatioTime(platform::kUnsetTickTime);
    float mAlphaMatteColorR = 0.0f;
    float mAlphaMatteColorG = 0.0f;
    float mAlphaMatteColorB = 0.0f;
    RatioTime mStartTime{0, 1};
    bool mIsDropFrame = true;
    bool mIsXMPWritable = false;
    RatioTime mInPoint = platform::TimeToRatioTime(platform::kUnsetTickTime);
    RatioTime mOutPoint = platform::TimeToRatioTime(platform::kUnsetTickTime);
    bool mIsMedia = false;
    bool mSupportsVideoRenderingSessions = false;
    std::string mAppSpecificSourceInfo;
    CapsuleParams mCapsuleParams;
    platform::ColorSpace mColorSpace;
    bool mHasFrozenUnstretchableRegions = false;
    WString mCohortName;

    // Field by field in declaration order; matte colours compare as floats (NaN never equal).
    friend TIDELINK_EXPORT bool operator==(const SourceInfo& a, const SourceInfo& b);
    friend bool operator!=(const SourceInfo& a, const SourceInfo& b) { return !(a == b); }
};

TIDELINK_EXPORT void to_json(Value& j, const FarlandServerConnectInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, FarlandServerConnectInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const FarlandAssetInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, FarlandAssetInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const FarlandAssetRequestInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, FarlandAssetRequestInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const FarlandProductionInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, FarlandProductionInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const FarlandProductionRequestInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, FarlandProductionRequestInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const GenericAssetInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, GenericAssetInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const GenericAssetRequestInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, GenericAssetRequestInfo& r);
TIDELINK_EXPORT void to_json(Value& j, const SourceInfo& r);
TIDELINK_EXPORT void from_json(const Value& j, SourceInfo& r);

}  // namespace tidelink
