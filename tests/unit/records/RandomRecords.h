// Random records for round-trip tests: every field set, every kind of parameter present.
#pragma once

#include <random>

#include "tidelink/peers/LinkRecords.h"

namespace tidelink::test {

class RandomRecords {
public:
    explicit RandomRecords(uint32_t seed) : mRng(seed) {}

    int64_t Int(int64_t lo, int64_t hi) {
        return std::uniform_int_distribution<int64_t>(lo, hi)(mRng);
    }
    bool Bool() { return Int(0, 1) == 1; }
    double Double() { return std::uniform_real_distribution<double>(-1e6, 1e6)(mRng); }
    float Float() { return static_cast<float>(Double()); }

    std::string Utf8() { return platform::ToUTF8(Wide()); }
    WString Wide() {
        static const char16_t kPool[] = u"abcXYZ 019_-/\u00e9\u4e2d\"\\\n";
        WString s;
        const auto n = Int(0, 12);
        for (int64_t i = 0; i < n; ++i) s.push_back(kPool[Int(0, sizeof(kPool) / 2 - 2)]);
        if (Int(0, 5) == 0) s += u"\U0001F600";
        return s;
    }
    platform::Guid RandomGuid() { return Bool() ? platform::Guid::New() : platform::Guid(); }
    platform::RatioTime Time() { return {Int(INT64_MIN, INT64_MAX), Int(1, INT64_MAX)}; }

    FarlandServerConnectInfo Connect() {
        FarlandServerConnectInfo c;
        c.mServerDiscoveryURL = Utf8();
        c.mEARPort = Utf8();
        c.mUserName = Utf8();
        c.mAuthToken = Utf8();
        c.mAuthTokenType = Utf8();
        for (int64_t i = Int(0, 3); i > 0; --i) c.mHeaders[Utf8()] = Utf8();
        return c;
    }

    TextEditInfo TextEdit() {
        TextEditInfo t;
        t.mText = Wide();
        t.mFontEdit = Bool();
        t.mFontSizeEdit = Bool();
        t.mFauxStyleEdit = Bool();
        for (int64_t i = Int(0, 4); i > 0; --i) {
            t.mRuns.emplace_back(static_cast<int32_t>(Int(0, 50)), Wide(), Float(), Bool(), Bool(),
                                 Bool(), Bool());
        }
        t.mRunCount = static_cast<int32_t>(t.mRuns.size());
        return t;
    }

    SpreadsheetValue Sheet() {
        SpreadsheetValue v;
        v.mActiveRows = static_cast<uint32_t>(Int(0, UINT32_MAX));
        for (int64_t c = Int(0, 3); c > 0; --c) {
            const uint32_t type = static_cast<uint32_t>(Int(0, 2));
            std::vector<SpreadsheetCell> cells;
            for (int64_t r = type == 0 ? 0 : Int(0, 4); r > 0; --r) {
                if (type == kSpreadsheetColumnDataType_Number) cells.emplace_back(Double());
                else cells.emplace_back(Wide());
            }
            v.mColumns.emplace_back(type, std::move(cells));
        }
        return v;
    }

    CapsuleParams Params() {
        CapsuleParams p;
        for (int64_t i = Int(0, 14); i > 0; --i) {
            const std::string name = Utf8();
            const WString ui = Wide();
            const bool anim = Bool();
            switch (Int(0, 11)) {
            case 0: p.AddTextParam(name, ui, anim, Wide(), TextEdit()); break;
            case 1:
                p.AddFloatParam(name, ui, anim, Double(), Double(), Double(), int(Int(-9, 9)));
                break;
            case 2: p.AddBooleanParam(name, ui, anim, Bool()); break;
            case 3: p.AddColorParam(name, ui, anim, {Float(), Float(), Float(), Float()}); break;
            case 4: p.AddCommentParam(name, ui, anim, Wide()); break;
            case 5: p.AddAngleParam(name, ui, anim, Double()); break;
            case 6: p.AddPoint2DParam(name, ui, anim, {Double(), Double()}); break;
            case 7:
                p.AddScaleParam(name, ui, anim, {Double(), Double(), Double()}, Bool(), 3);
                break;
            case 8: p.AddGroupParam(name, ui, anim, {Wide(), Wide()}, Bool()); break;
            case 9: {
                std::vector<SpreadsheetColumnInfo> infos;
                infos.push_back({kSpreadsheetColumnDataType_Number, Wide(), Double(), Double()});
                infos.push_back({kSpreadsheetColumnDataType_Text, Wide(), 0.0, 0.0});
                p.AddSpreadsheetParam(name, ui, anim, Sheet(), uint32_t(Int(0, 99)),
                                      uint32_t(Int(0, UINT32_MAX)), infos);
                break;
            }
            case 10:
                p.AddMenuParam(name, ui, anim, int(Int(INT32_MIN, INT32_MAX)), {Wide()});
                break;
            default: {
                MediaReplacementInfo m;
                m.mVersion = uint32_t(Int(0, UINT32_MAX));
                m.mProperties.mWidth = uint32_t(Int(0, UINT32_MAX));
                m.mProperties.mHeight = uint32_t(Int(0, UINT32_MAX));
                m.mProperties.mStartTime = int32_t(Int(INT32_MIN, INT32_MAX));
                m.mProperties.mEndTime = int32_t(Int(INT32_MIN, INT32_MAX));
                m.mProperties.mTimescale = uint32_t(Int(0, UINT32_MAX));
                m.mProperties.mThumbnail = Wide();
                m.mProperties.mScale = EMediaReplacementDefaultScale(Int(INT32_MIN, INT32_MAX));
                p.AddMediaParam(name, ui, anim, Bool(), Wide(), m);
                break;
            }
            }
        }
        return p;
    }

    SourceInfo Source() {
        using namespace platform;
        SourceInfo s;
        s.mParentProjectFile = "/projects/" + Utf8() + ".proj";
        s.mFarlandAssetRequestInfo.mServerConnectInfo = Connect();
        s.mFarlandAssetRequestInfo.mProductionIdentifier = Utf8();
        s.mFarlandAssetRequestInfo.mProductionRevision = Utf8();
        s.mFarlandAssetRequestInfo.mAssetIdentifier = Utf8();
        s.mFarlandProductionRequestInfo.mServerConnectInfo = Connect();
        s.mFarlandProductionRequestInfo.mProductionIdentifier = Utf8();
        s.mFarlandProductionRequestInfo.mRevision = Utf8();
        s.mFarlandProductionRequestInfo.mDisplayName = Wide();
        s.mFarlandProductionRequestInfo.mCreateNewProduction = Bool();
        s.mName = Wide();
        s.mMediaProducerDescription = Wide();
        s.mID = RandomGuid();
        s.mDuration = Time();
        s.mPixelAspectRatio = PixelAspectRatio(uint64_t(Int(0, INT64_MAX)), uint64_t(Int(0, 9)));
        s.mAlphaChannelType = AlphaChannel(Int(INT32_MIN, INT32_MAX));
        s.mFrameRect.mTopLeft = {int(Int(INT32_MIN, INT32_MAX)), int(Int(-5, 5))};
        s.mFrameRect.mSize = {int(Int(0, 8192)), int(Int(0, 8192))};
        s.mFrameRate = FrameRate(Bool() ? FrameRate::kUnset : Int(INT64_MIN, INT64_MAX));
        for (int64_t i = Int(0, 4); i > 0; --i) {
            s.mPixelFormatList.push_back(
                {uint32_t(Int(0, UINT32_MAX)), uint32_t(Int(0, UINT32_MAX))});
        }
        s.mFieldType = FieldType(Int(INT32_MIN, INT32_MAX));
        s.mNativeFieldType = FieldType(Int(0, 4));
        for (int64_t i = Int(0, 8); i > 0; --i) {
            s.mAudioChannelLayout.push_back({int32_t(Int(INT32_MIN, INT32_MAX))});
        }
        s.mAudioSampleRate = FrameRate(Int(1, 1000000000));
        s.mInitialContentState = RandomGuid();
        s.mHasAudio = Bool();
        s.mHasVideo = Bool();
        s.mCurrentTime = Time();
        s.mWorkInPoint = Time();
        s.mWorkOutPoint = Time();
        s.mAlphaMatteColorR = Float();
        s.mAlphaMatteColorG = Float();
        s.mAlphaMatteColorB = Float();
        s.mStartTime = Time();
        s.mIsDropFrame = Bool();
        s.mIsXMPWritable = Bool();
        s.mInPoint = Time();
        s.mOutPoint = Time();
        s.mIsMedia = Bool();
        s.mSupportsVideoRenderingSessions = Bool();
        s.mAppSpecificSourceInfo = Utf8();
        s.mCapsuleParams = Params();
        if (Bool()) {
            std::vector<uint8_t> bytes(size_t(Int(0, 40)));
            for (auto& b : bytes) b = uint8_t(Int(0, 255));
            s.mColorSpace = ColorSpace(ColorProfile(Wide(), bytes), uint32_t(Int(0, 3)), Bool());
        }
        s.mHasFrozenUnstretchableRegions = Bool();
        s.mCohortName = Wide();
        return s;
    }

private:
    std::mt19937 mRng;
};

}  // namespace tidelink::test
