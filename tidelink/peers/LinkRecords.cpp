#include "tidelink/peers/LinkRecords.h"

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

namespace {

std::string FileToWire(const File& f) { return f.string(); }
File FileFromWire(const Value& v) { return File(ReadString(v)); }

Guid GuidFromWire(const Value& v) {
    Guid g;
    from_json(v, g);  // the serializer's GUID reader: a string of exactly 36 characters
    return g;
}

template <class T>
std::vector<T> ReadList(const Value& v) {
    RequireArray(v);
    std::vector<T> out;
    out.reserve(v.size());
    for (const auto& e : v) out.push_back(e.get<T>());
    return out;
}

template <class T>
Value WriteList(const std::vector<T>& list) {
    Value out = Value::array();
    for (const auto& e : list) out.push_back(Value(e));
    return out;
}

}  // namespace

// ---- Farland records -----------------------------------------------------------------------

void to_json(Value& j, const FarlandServerConnectInfo& r) {
    j = Value::object();
    if (!r.mServerDiscoveryURL.empty()) j["mServerDiscoveryURL"] = r.mServerDiscoveryURL;
    j["mEARPort"] = r.mEARPort;
    j["mUserName"] = r.mUserName;
    j["mAuthToken"] = r.mAuthToken;
    if (!r.mAuthTokenType.empty()) j["mAuthTokenType"] = r.mAuthTokenType;
    if (!r.mHeaders.empty()) {
        Value headers = Value::array();
        for (const auto& [name, value] : r.mHeaders) {
            headers.push_back(Value::array({Value(name), Value(value)}));
        }
        j["mHeaders"] = std::move(headers);
    }
}

void from_json(const Value& j, FarlandServerConnectInfo& r) {
    RequireObject(j);
    FarlandServerConnectInfo out;
    if (const Value* v = FindMember(j, "mServerDiscoveryURL")) {
        out.mServerDiscoveryURL = ReadString(*v);
    }
    out.mEARPort = ReadString(MemberOrNull(j, "mEARPort"));
    out.mUserName = ReadString(MemberOrNull(j, "mUserName"));
    out.mAuthToken = ReadString(MemberOrNull(j, "mAuthToken"));
    if (const Value* v = FindMember(j, "mAuthTokenType")) out.mAuthTokenType = ReadString(*v);
    if (const Value* headers = FindMember(j, "mHeaders")) {
        RequireArray(*headers);
        for (const auto& pair : *headers) {
            RequireArray(pair);
            if (pair.size() != 2) ThrowTypeError(pair, "[name, value] pair");
            // A repeated name keeps its first value.
            out.mHeaders.try_emplace(ReadString(pair[0]), ReadString(pair[1]));
        }
    }
    r = std::move(out);
}

void to_json(Value& j, const FarlandAssetInfo& r) {
    j = Value::object();
    j["mProductionIdentifier"] = r.mProductionIdentifier;
    j["mProductionRevision"] = r.mProductionRevision;
    j["mAssetIdentifier"] = r.mAssetIdentifier;
}

void from_json(const Value& j, FarlandAssetInfo& r) {
    RequireObject(j);
    FarlandAssetInfo out;
    out.mProductionIdentifier = ReadString(MemberOrNull(j, "mProductionIdentifier"));
    out.mProductionRevision = ReadString(MemberOrNull(j, "mProductionRevision"));
    out.mAssetIdentifier = ReadString(MemberOrNull(j, "mAssetIdentifier"));
    r = std::move(out);
}

void to_json(Value& j, const FarlandAssetRequestInfo& r) {
    j = Value::object();
    j["mServerConnectInfo"] = r.mServerConnectInfo;
    j["mAssetInfo"] = r.GetAssetInfo();
}

void from_json(const Value& j, FarlandAssetRequestInfo& r) {
    RequireObject(j);
    FarlandAssetRequestInfo out;
    out.mServerConnectInfo = RequireObject(MemberOrNull(j, "mServerConnectInfo"))
                                 .get<FarlandServerConnectInfo>();
    const auto asset = RequireObject(MemberOrNull(j, "mAssetInfo")).get<FarlandAssetInfo>();
    out.mProductionIdentifier = asset.mProductionIdentifier;
    out.mProductionRevision = asset.mProductionRevision;
    out.mAssetIdentifier = asset.mAssetIdentifier;
    r = std::move(out);
}

void to_json(Value& j, const FarlandProductionInfo& r) {
    j = Value::object();
    j["mProductionIdentifier"] = r.mProductionIdentifier;
    j["mRevision"] = r.mRevision;
    j["mDisplayName"] = ToUTF8(r.mDisplayName);
}

void from_json(const Value& j, FarlandProductionInfo& r) {
    RequireObject(j);
    r = FarlandProductionInfo(ReadString(MemberOrNull(j, "mProductionIdentifier")),
                              ReadString(MemberOrNull(j, "mRevision")),
                              ReadWString(MemberOrNull(j, "mDisplayName")));
}

void to_json(Value& j, const FarlandProductionRequestInfo& r) {
    j = Value::object();
    j["mServerConnectInfo"] = r.mServerConnectInfo;
    j["mProductionInfo"] = r.GetProductionInfo();
    if (r.mCreateNewProduction) j["mCreateNewProduction"] = true;
}

void from_json(const Value& j, FarlandProductionRequestInfo& r) {
    RequireObject(j);
    FarlandProductionRequestInfo out;
    out.mServerConnectInfo = RequireObject(MemberOrNull(j, "mServerConnectInfo"))
                                 .get<FarlandServerConnectInfo>();
    auto production =
        RequireObject(MemberOrNull(j, "mProductionInfo")).get<FarlandProductionInfo>();
    out.mProductionIdentifier = std::move(production.mProductionIdentifier);
    out.mRevision = std::move(production.mRevision);
    out.mDisplayName = std::move(production.mDisplayName);
    if (const Value* v = FindMember(j, "mCreateNewProduction")) {
        out.mCreateNewProduction = ReadBool(*v);
    }
    r = std::move(out);
}

namespace {

template <class T>
void GenericToJSON(Value& j, const GenericAssetInfoT<T>& r) {
    j = Value::object();
    j["mProjectFile"] = FileToWire(r.mProjectFile);
    j["mProjectFileSourceID"] = r.mProjectFileSourceID;
    j["mFarlandAssetInfo"] = r.mFarlandAssetInfo;
}

template <class T>
void GenericFromJSON(const Value& j, GenericAssetInfoT<T>& r) {
    RequireObject(j);
    GenericAssetInfoT<T> out;
    out.mProjectFile = FileFromWire(MemberOrNull(j, "mProjectFile"));
    out.mProjectFileSourceID = GuidFromWire(MemberOrNull(j, "mProjectFileSourceID"));
    out.mFarlandAssetInfo = RequireObject(MemberOrNull(j, "mFarlandAssetInfo")).get<T>();
    r = std::move(out);
}

}  // namespace

void to_json(Value& j, const GenericAssetInfo& r) { GenericToJSON(j, r); }
void from_json(const Value& j, GenericAssetInfo& r) { GenericFromJSON(j, r); }
void to_json(Value& j, const GenericAssetRequestInfo& r) { GenericToJSON(j, r); }
void from_json(const Value& j, GenericAssetRequestInfo& r) { GenericFromJSON(j, r); }

// ---- SourceInfo ----------------------------------------------------------------------------

bool operator==(const SourceInfo& a, const SourceInfo& b) {
    return a.mParentProjectFile == b.mParentProjectFile &&
           a.mFarlandAssetRequestInfo == b.mFarlandAssetRequestInfo &&
           a.mFarlandProductionRequestInfo == b.mFarlandProductionRequestInfo &&
           a.mName == b.mName && a.mMediaProducerDescription == b.mMediaProducerDescription &&
           a.mID == b.mID && a.mDuration == b.mDuration &&
           a.mPixelAspectRatio == b.mPixelAspectRatio &&
           a.mAlphaChannelType == b.mAlphaChannelType && a.mFrameRect == b.mFrameRect &&
           a.mFrameRate == b.mFrameRate && a.mPixelFormatList == b.mPixelFormatList &&
           a.mFieldType == b.mFieldType && a.mNativeFieldType == b.mNativeFieldType &&
           a.mAudioChannelLayout == b.mAudioChannelLayout &&
           a.mAudioSampleRate == b.mAudioSampleRate &&
           a.mInitialContentState == b.mInitialContentState && a.mHasAudio == b.mHasAudio &&
           a.mHasVideo == b.mHasVideo && a.mCurrentTime == b.mCurrentTime &&
           a.mWorkInPoint == b.mWorkInPoint && a.mWorkOutPoint == b.mWorkOutPoint &&
           a.mAlphaMatteColorR == b.mAlphaMatteColorR &&
           a.mAlphaMatteColorG == b.mAlphaMatteColorG &&
           a.mAlphaMatteColorB == b.mAlphaMatteColorB && a.mStartTime == b.mStartTime &&
           a.mIsDropFrame == b.mIsDropFrame && a.mIsXMPWritable == b.mIsXMPWritable &&
           a.mInPoint == b.mInPoint && a.mOutPoint == b.mOutPoint && a.mIsMedia == b.mIsMedia &&
           a.mSupportsVideoRenderingSessions == b.mSupportsVideoRenderingSessions &&
           a.mAppSpecificSourceInfo == b.mAppSpecificSourceInfo &&
           !(a.mCapsuleParams != b.mCapsuleParams) && a.mColorSpace == b.mColorSpace &&
           a.mHasFrozenUnstretchableRegions == b.mHasFrozenUnstretchableRegions &&
           a.mCohortName == b.mCohortName;
}

void to_json(Value& j, const SourceInfo& r) {
    j = Value::object();
    j.get_ref<Value::object_t&>().reserve(40);  // every key is written: grow once
    j["parentprojectfile"] = FileToWire(r.mParentProjectFile);
    j["farlandassetrequestinfo"] = r.mFarlandAssetRequestInfo;
    j["farlandproductionrequestinfo"] = r.mFarlandProductionRequestInfo;
    j["name"] = ToUTF8(r.mName);
    j["mediaproducerdescription"] = ToUTF8(r.mMediaProducerDescription);
    j["id"] = r.mID;
    j["duration"] = RatioTimeToValue(r.mDuration);
    j["pixelaspectratio"] = r.mPixelAspectRatio;
    j["alphachanneltype"] = EnumToWire(r.mAlphaChannelType);
    j["framesize"] = r.mFrameRect;
    j["framerate"] = r.mFrameRate;
    j["pixelformatlist"] = WriteList(r.mPixelFormatList);
    j["fieldtype"] = EnumToWire(r.mFieldType);
    j["nativefieldtype"] = EnumToWire(r.mNativeFieldType);
    j["audiochannellayout"] = WriteList(r.mAudioChannelLayout);
    j["audiosamplerate"] = r.mAudioSampleRate;
    j["initialcontentstate"] = r.mInitialContentState;
    j["hasaudio"] = r.mHasAudio;
    j["hasvideo"] = r.mHasVideo;
    j["currenttime"] = RatioTimeToValue(r.mCurrentTime);
    j["workinpoint"] = RatioTimeToValue(r.mWorkInPoint);
    j["workoutpoint"] = RatioTimeToValue(r.mWorkOutPoint);
    j["alphamattecolorr"] = static_cast<double>(r.mAlphaMatteColorR);
    j["alphamattecolorg"] = static_cast<double>(r.mAlphaMatteColorG);
    j["alphamattecolorb"] = static_cast<double>(r.mAlphaMatteColorB);
    j["starttime"] = RatioTimeToValue(r.mStartTime);
    j["isdropframe"] = r.mIsDropFrame;
    j["isxmpwritable"] = r.mIsXMPWritable;
    j["inpoint"] = RatioTimeToValue(r.mInPoint);
    j["outpoint"] = RatioTimeToValue(r.mOutPoint);
    j["ismedia"] = r.mIsMedia;
    j["supportsvideorenderingsessions"] = r.mSupportsVideoRenderingSessions;
    j["appspecificsourceinfo"] = r.mAppSpecificSourceInfo;
    j["capsuleparams"] = ToJSON(r.mCapsuleParams);
    j["colorSpace"] = r.mColorSpace;
    j["hasFrozenUnstretchableRegions"] = r.mHasFrozenUnstretchableRegions;
    j["cohortName"] = ToUTF8(r.mCohortName);
}

void from_json(const Value& j, SourceInfo& r) {
    SourceInfo out;
    RequireObject(j);
    auto each = [&j](const char* key, auto&& read) {
        if (const Value* v = FindMember(j, key)) read(*v);
    };
    each("parentprojectfile", [&](const Value& v) { out.mParentProjectFile = FileFromWire(v); });
    each("farlandassetrequestinfo", [&](const Value& v) {
        out.mFarlandAssetRequestInfo = v.get<FarlandAssetRequestInfo>();
    });
    each("farlandproductionrequestinfo", [&](const Value& v) {
        out.mFarlandProductionRequestInfo = v.get<FarlandProductionRequestInfo>();
    });
    each("name", [&](const Value& v) { out.mName = ReadWString(v); });
    each("mediaproducerdescription",
         [&](const Value& v) { out.mMediaProducerDescription = ReadWString(v); });
    each("id", [&](const Value& v) { out.mID = GuidFromWire(v); });
    each("duration", [&](const Value& v) { out.mDuration = RatioTimeFromValue(v); });
    each("pixelaspectratio",
         [&](const Value& v) { out.mPixelAspectRatio = v.get<PixelAspectRatio>(); });
    each("alphachanneltype",
         [&](const Value& v) { out.mAlphaChannelType = ReadEnum<AlphaChannel>(v); });
    each("framesize", [&](const Value& v) { out.mFrameRect = v.get<RectT<int>>(); });
    // A missing rate reads as unset, the same as an object without "ticksperframe".
    each("framerate", [&](const Value& v) { out.mFrameRate = v.get<FrameRate>(); });
    each("pixelformatlist",
         [&](const Value& v) { out.mPixelFormatList = ReadList<PixelFormat>(v); });
    // Unlike its neighbours, a missing field type reads as 0 rather than the default.
    out.mFieldType = FieldType::Progressive;
    each("fieldtype", [&](const Value& v) { out.mFieldType = ReadEnum<FieldType>(v); });
    each("nativefieldtype", [&](const Value& v) { out.mNativeFieldType = ReadEnum<FieldType>(v); });
    each("audiochannellayout", [&](const Value& v) {
        out.mAudioChannelLayout = ReadList<AudioChannelDescription>(v);
    });
    each("audiosamplerate", [&](const Value& v) { out.mAudioSampleRate = v.get<FrameRate>(); });
    each("initialcontentstate",
         [&](const Value& v) { out.mInitialContentState = GuidFromWire(v); });
    each("hasaudio", [&](const Value& v) { out.mHasAudio = ReadBool(v); });
    each("hasvideo", [&](const Value& v) { out.mHasVideo = ReadBool(v); });
    each("currenttime", [&](const Value& v) { out.mCurrentTime = RatioTimeFromValue(v); });
    each("workinpoint", [&](const Value& v) { out.mWorkInPoint = RatioTimeFromValue(v); });
    each("workoutpoint", [&](const Value& v) { out.mWorkOutPoint = RatioTimeFromValue(v); });
    each("alphamattecolorr", [&](const Value& v) { out.mAlphaMatteColorR = ReadFloat(v); });
    each("alphamattecolorg", [&](const Value& v) { out.mAlphaMatteColorG = ReadFloat(v); });
    each("alphamattecolorb", [&](const Value& v) { out.mAlphaMatteColorB = ReadFloat(v); });
    each("starttime", [&](const Value& v) { out.mStartTime = RatioTimeFromValue(v); });
    each("isdropframe", [&](const Value& v) { out.mIsDropFrame = ReadBool(v); });
    each("isxmpwritable", [&](const Value& v) { out.mIsXMPWritable = ReadBool(v); });
    each("inpoint", [&](const Value& v) { out.mInPoint = RatioTimeFromValue(v); });
    each("outpoint", [&](const Value& v) { out.mOutPoint = RatioTimeFromValue(v); });
    each("ismedia", [&](const Value& v) { out.mIsMedia = ReadBool(v); });
    each("supportsvideorenderingsessions",
         [&](const Value& v) { out.mSupportsVideoRenderingSessions = ReadBool(v); });
    each("appspecificsourceinfo",
         [&](const Value& v) { out.mAppSpecificSourceInfo = ReadString(v); });
    each("capsuleparams", [&](const Value& v) { FromJSON(v, out.mCapsuleParams); });
    each("colorSpace", [&](const Value& v) { out.mColorSpace = v.get<ColorSpace>(); });
    each("hasFrozenUnstretchableRegions",
         [&](const Value& v) { out.mHasFrozenUnstretchableRegions = ReadBool(v); });
    each("cohortName", [&](const Value& v) { out.mCohortName = ReadWString(v); });
    r = std::move(out);
}

}  // namespace tidelink
