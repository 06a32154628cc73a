#include <gtest/gtest.h>

#include "tidelink/core/Brokering.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/Server.h"
#include "tidelink/peers/ProjectProtocol.h"

using namespace tidelink;
using namespace tidelink::platform;

namespace {

Value J(const char* text) { return ParseJSONText(text); }
Value ThroughWire(const Value& v) { return Value::from_msgpack(Value::to_msgpack(v)); }

}  // namespace

TEST(ProjectProtocol, ProjectInfoSurvivesTheWireWithItsKeys) {
    projectprotocol::ProjectInfo info;
    info.mName = u"Démo ✓";
    info.mFile = "/tmp/a b/démo.kstproj";
    info.mMissingAssets.mMissingFonts.push_back({"Family", "Bold", "Family-Bold", "Family Bold", 3});
    info.mMissingAssets.mMissingPlugins.push_back({"ADBE Blur"});
    info.mMissingAssets.mMissingFootage.push_back({u"/media/missing clip.mov"});
    info.mFarlandProductionInfo = {"prod", "7", u"Production"};
    const Value v = ThroughWire(Value(info));
    EXPECT_EQ(v.get<projectprotocol::ProjectInfo>(), info);
    EXPECT_EQ(v["missing"]["missAssetsPropMissingFootage"][0]["missAssetPropFootagePath"], "/media/missing clip.mov");
    EXPECT_EQ(v["missing"]["missAssetsPropMissingFonts"][0]["missAssetPropFontPostScript"], "Family-Bold");
    EXPECT_EQ(v["file"], "/tmp/a b/démo.kstproj");
}

TEST(ProjectProtocol, MissingPartsReadAsEmptyAndWrongKindsThrow) {
    const auto empty = J("{}").get<projectprotocol::ProjectInfo>();
    EXPECT_TRUE(empty.mName.empty());
    EXPECT_TRUE(empty.mMissingAssets.IsEmpty());
    EXPECT_TRUE(empty.mFarlandProductionInfo.IsEmpty());
    // Font types come signed or unsigned.
    const auto fonts = J(R"({"missAssetsPropMissingFonts": [{"missAssetPropFontType": 4294967295},
                                                            {"missAssetPropFontType": -2}]})")
                           .get<MissingAssets>();
    ASSERT_EQ(fonts.mMissingFonts.size(), 2u);
    EXPECT_EQ(fonts.mMissingFonts[0].mFontType, 4294967295);
    EXPECT_EQ(fonts.mMissingFonts[1].mFontType, -2);
    EXPECT_THROW(J(R"("a project")").get<projectprotocol::ProjectInfo>(), nlohmann::json::exception);
    EXPECT_THROW(J(R"({"name": 3})").get<projectprotocol::ProjectInfo>(), nlohmann::json::exception);
    EXPECT_THROW(J(R"({"missing": {"missAssetsPropMissingFootage": [7]}})").get<projectprotocol::ProjectInfo>(),
                 nlohmann::json::exception);
    EXPECT_THROW(J(R"({"name": "x", "id": "not-a-guid", "type": 1})").get<ItemInfo>(), nlohmann::json::exception);
    EXPECT_THROW(J(R"({"type": 4294967296})").get<ItemInfo>(), nlohmann::json::exception);
}

TEST(ProjectProtocol, ItemInfoKeepsIdAndType) {
    ItemInfo item{u"Main", Guid::New(), 2};
    EXPECT_EQ(ThroughWire(Value(item)).get<ItemInfo>(), item);
}

TEST(ServerRecords, DescriptionAndAddressRead) {
    const auto d = J(R"({"servername": "Kestrel", "serverapiversion": 1, "serverappversion": "1.0",
                         "sourcetypes": {"Kestrel Project": ".kstproj"}})")
                       .get<ServerDescription>();
    EXPECT_EQ(d.mName, u"Kestrel");
    EXPECT_EQ(d.mSourceTypes.at(u"Kestrel Project"), u".kstproj");
    EXPECT_FALSE(d.mSupportsRemoteLinking);  // absent means false
    EXPECT_EQ(ThroughWire(Value(d))["sourcetypes"]["Kestrel Project"], ".kstproj");
    EXPECT_THROW(J(R"(["Kestrel"])").get<ServerDescription>(), nlohmann::json::exception);
    EXPECT_THROW(J(R"({"sourcetypes": {"a": 1}})").get<ServerDescription>(), nlohmann::json::exception);

    const auto c = J(R"({"address": "127.0.0.1", "port": 4242})").get<ServerConnection>();
    EXPECT_EQ(c.mPort, 4242);
    EXPECT_THROW(J(R"({"address": "127.0.0.1", "port": 70000})").get<ServerConnection>(), nlohmann::json::exception);
    EXPECT_THROW(J(R"({"port": -1})").get<ServerConnection>(), nlohmann::json::exception);

    const Value identity(ClientIdentity{u"host", u"2.0", u"26.0"});
    EXPECT_EQ(identity, J(R"({"name": "host", "appVersion": "2.0", "protoVersion": "26.0"})"));
}
