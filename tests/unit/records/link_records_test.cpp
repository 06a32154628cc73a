#include <gtest/gtest.h>

#include <cmath>

#include "RandomRecords.h"
#include "tidelink/peers/LinkRecords.h"

using namespace tidelink;
using namespace tidelink::platform;

namespace {

Value J(const char* text) { return ParseJSONText(text); }

Value ThroughWire(const Value& v) { return Value::from_msgpack(Value::to_msgpack(v)); }

}  // namespace

TEST(SourceInfo, EmptyObjectReadsTheDocumentedDefaults) {
    const auto s = J("{}").get<SourceInfo>();
    EXPECT_EQ(s.mFieldType, FieldType::Progressive);  // 0, not the constructor's 3
    EXPECT_EQ(SourceInfo().mFieldType, FieldType::AsSource);
    EXPECT_EQ(s.mAlphaChannelType, AlphaChannel::Straight);
    EXPECT_EQ(s.mNativeFieldType, FieldType::Unknown);
    EXPECT_EQ(s.mFrameRate.TicksPerFrame(), INT64_MAX);
    EXPECT_EQ(s.mAudioSampleRate.TicksPerFrame(), INT64_MAX);
    EXPECT_TRUE(s.mIsDropFrame);
    const RatioTime unset(-400000, 1);
    EXPECT_EQ(s.mInPoint, unset);
    EXPECT_EQ(s.mOutPoint, unset);
    EXPECT_EQ(s.mWorkInPoint, unset);
    EXPECT_EQ(s.mWorkOutPoint, unset);
    EXPECT_EQ(s.mDuration, RatioTime(0));
    EXPECT_EQ(s.mColorSpace, ColorSpace());
    EXPECT_TRUE(s.mID.IsNil());
    EXPECT_TRUE(s.mCapsuleParams.IsEmpty());
    EXPECT_EQ(s.mPixelAspectRatio, PixelAspectRatio());

    SourceInfo expected;
    expected.mFieldType = FieldType::Progressive;
    EXPECT_EQ(s, expected);
}

TEST(SourceInfo, WriterEmitsEveryKey) {
    const Value j = SourceInfo();
    EXPECT_EQ(j.size(), 37u);
    EXPECT_TRUE(j["farlandassetrequestinfo"].is_object());
    EXPECT_TRUE(j["farlandproductionrequestinfo"].is_object());
    EXPECT_EQ(j["capsuleparams"], J(R"({"capParams": []})"));
    EXPECT_EQ(j["colorSpace"], Value::object());
    EXPECT_EQ(j["workinpoint"], J(R"({"value": -400000, "scale": 1})"));
    EXPECT_EQ(j["framerate"], J(R"({"ticksperframe": 9223372036854775807})"));
    EXPECT_EQ(j["alphachanneltype"], 1);
    EXPECT_EQ(j["fieldtype"], 3);
    EXPECT_EQ(j["nativefieldtype"], 4);
    EXPECT_EQ(j["isdropframe"], true);
    EXPECT_EQ(j["id"], "00000000-0000-0000-0000-000000000000");
    EXPECT_EQ(j.get<SourceInfo>(), SourceInfo());
}

TEST(SourceInfo, ZeroTickRatesComeBackUnset) {
    SourceInfo s;
    s.mFrameRate = FrameRate(0);
    s.mAudioSampleRate = FrameRate(0);
    const auto back = Value(s).get<SourceInfo>();
    EXPECT_EQ(back.mFrameRate, FrameRate());
    EXPECT_EQ(back.mAudioSampleRate, FrameRate());
    EXPECT_EQ(J(R"({"framerate": {"ticksperframe": 0}})").get<SourceInfo>().mFrameRate,
              FrameRate());
    const auto pf = J(R"({"pixelformatlist": [{"fourcc": 7}, {"fourcc": 8, "properties": 1}]})")
                        .get<SourceInfo>()
                        .mPixelFormatList;
    ASSERT_EQ(pf.size(), 2u);
    EXPECT_EQ(pf[0].mProperties, 0x78000u);
    EXPECT_EQ(pf[1].mProperties, 1u);
}

TEST(SourceInfo, WrongKindsFailTheWholeRecord) {
    const char* bad[] = {
        "[]",
        "null",
        R"({"name": 5})",
        R"({"id": "not-a-guid"})",
        R"({"duration": {"value": 1, "scale": "1"}})",
        R"({"framesize": []})",
        R"({"pixelformatlist": {}})",
        R"({"fieldtype": 4294967296})",
        R"({"capsuleparams": {"capParams": 3}})",
        R"({"farlandassetrequestinfo": {"mServerConnectInfo": {}, "mAssetInfo": {}}})",
        R"({"colorSpace": {"baseColorProfile": {"colorProfileData": "!!!!"}}})",
        R"({"name": "x", "hasaudio": 1})",
    };
    for (const char* text : bad) {
        SourceInfo target;
        target.mName = u"kept";
        EXPECT_THROW(from_json(J(text), target), nlohmann::json::type_error) << text;
        EXPECT_EQ(target.mName, u"kept") << text;
    }
    SourceInfo target;
    EXPECT_THROW(from_json(J(R"({"name": "x", "inpoint": {"value": 1, "scale": 0}})"), target),
                 boost::bad_rational);
    EXPECT_THROW(from_json(J(R"({"starttime": {"value": 1, "scale": -2}})"), target),
                 boost::bad_rational);
    EXPECT_EQ(target, SourceInfo());
}

TEST(SourceInfo, EqualityCoversEveryFieldAndNaNNeverMatches) {
    tidelink::test::RandomRecords rnd(7);
    const SourceInfo base = rnd.Source();
    EXPECT_EQ(base, base);
    SourceInfo changed = base;
    changed.mCohortName += u"!";
    EXPECT_NE(changed, base);
    changed = base;
    changed.mColorSpace = ColorSpace(ColorProfile(u"other", {1}), 0, false);
    EXPECT_NE(changed, base);
    changed = base;
    changed.mCapsuleParams.AddBooleanParam("b", u"B", false, true);
    EXPECT_NE(changed, base);
    changed = base;
    changed.mFarlandAssetRequestInfo.mServerConnectInfo.mFlag = !base.mFarlandAssetRequestInfo
                                                                     .mServerConnectInfo.mFlag;
    EXPECT_NE(changed, base);
    changed = base;
    changed.mAlphaMatteColorG = std::nanf("");
    EXPECT_NE(changed, changed);
}

TEST(SourceInfo, RandomRecordsRoundTripThroughTheWireAndText) {
    tidelink::test::RandomRecords rnd(20240611);
    for (int i = 0; i < 300; ++i) {
        const SourceInfo s = rnd.Source();
        const Value tree = s;
        ASSERT_EQ(ThroughWire(tree).get<SourceInfo>(), s) << ToJSONText(tree);
        ASSERT_EQ(ParseJSONText(ToJSONText(tree)).get<SourceInfo>(), s) << ToJSONText(tree);
        const auto values = s.mCapsuleParams.GetParamValues();
        ASSERT_EQ(ThroughWire(Value(*values)).get<CapsuleParamValues>(), *values);
    }
}

TEST(SourceInfo, PassesAsRequestArgumentAndReplyValue) {
    tidelink::test::RandomRecords rnd(3);
    const SourceInfo s = rnd.Source();
    const Call call = BuildCall("com.quenlo.tidelink.CreateSource", Value::array({Value(s)}));
    EXPECT_EQ(ThroughWire(call.args)[0].get<SourceInfo>(), s);
    Value reply = Value::object();
    reply["value"] = s;
    EXPECT_EQ(ReplyValue<SourceInfo>(ThroughWire(reply)), s);
}

TEST(FarlandRecords, MinimalFormsAndEmptiness) {
    FarlandServerConnectInfo c;
    c.mEARPort = "4433";
    EXPECT_EQ(Value(c), J(R"({"mEARPort": "4433", "mUserName": "", "mAuthToken": ""})"));
    EXPECT_EQ(J(R"({"mEARPort": "4433", "mUserName": "", "mAuthToken": ""})")
                  .get<FarlandServerConnectInfo>(),
              c);
    c.mHeaders = {{"X-B", "2"}, {"X-A", "1"}};
    EXPECT_EQ(Value(c)["mHeaders"], J(R"([["X-A", "1"], ["X-B", "2"]])"));
    EXPECT_EQ(Value(c).get<FarlandServerConnectInfo>(), c);
    const auto repeated = J(R"({"mEARPort": "", "mUserName": "", "mAuthToken": "",
        "mHeaders": [["K", "first"], ["K", "second"]]})")
                              .get<FarlandServerConnectInfo>();
    EXPECT_EQ(repeated.mHeaders.at("K"), "first");
    EXPECT_THROW(J(R"({"mEARPort": "", "mUserName": "", "mAuthToken": "", "mHeaders": [["K"]]})")
                     .get<FarlandServerConnectInfo>(),
                 nlohmann::json::type_error);
    EXPECT_THROW(J(R"({"mUserName": "", "mAuthToken": ""})").get<FarlandServerConnectInfo>(),
                 nlohmann::json::type_error);

    FarlandProductionRequestInfo create;
    EXPECT_TRUE(create.IsEmpty());
    EXPECT_FALSE(Value(create).contains("mCreateNewProduction"));
    create.mCreateNewProduction = true;
    EXPECT_FALSE(create.IsEmpty());
    EXPECT_EQ(Value(create)["mCreateNewProduction"], true);
    EXPECT_EQ(Value(create).get<FarlandProductionRequestInfo>(), create);

    FarlandAssetRequestInfo asset;
    EXPECT_TRUE(asset.IsEmpty());
    asset.mProductionIdentifier = "p";
    EXPECT_TRUE(asset.IsEmpty());
    asset.mAssetIdentifier = "a";
    EXPECT_FALSE(asset.IsEmpty());
    EXPECT_EQ(Value(asset)["mAssetInfo"],
              J(R"({"mProductionIdentifier": "p", "mProductionRevision": "",
                    "mAssetIdentifier": "a"})"));
    EXPECT_TRUE(FarlandProductionInfo().IsEmpty());
    EXPECT_FALSE(FarlandProductionInfo("id", "", u"").IsEmpty());
}

TEST(FarlandRecords, GenericAssetNamesByFileOrByAsset) {
    const Guid id = Guid::New();
    const GenericAssetInfo byFile(File("/p/show.proj"), id);
    EXPECT_TRUE(byFile.IsProjectFileBased());
    EXPECT_TRUE(GenericAssetInfo(File("/p/show.proj")).IsProjectFileBased());
    FarlandAssetInfo a{"prod", "rev", "asset"};
    const GenericAssetInfo byAsset(a);
    EXPECT_FALSE(byAsset.IsProjectFileBased());
    EXPECT_TRUE(byAsset.mProjectFileSourceID.IsNil());

    const Value j = byFile;
    EXPECT_EQ(j["mProjectFile"], "/p/show.proj");
    EXPECT_EQ(j["mProjectFileSourceID"], id.ToString());
    EXPECT_EQ(j["mFarlandAssetInfo"]["mAssetIdentifier"], "");
    EXPECT_EQ(j.get<GenericAssetInfo>(), byFile);
    EXPECT_EQ(Value(byAsset).get<GenericAssetInfo>(), byAsset);
    EXPECT_NE(byAsset, byFile);

    GenericAssetRequestInfo request;
    request.mFarlandAssetInfo.mAssetIdentifier = "x";
    request.mFarlandAssetInfo.mServerConnectInfo.mAuthToken = "t";
    EXPECT_EQ(ThroughWire(Value(request)).get<GenericAssetRequestInfo>(), request);
}
