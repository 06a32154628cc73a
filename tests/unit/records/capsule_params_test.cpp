#include <gtest/gtest.h>

#include "tidelink/templates/CapsuleParams.h"

using namespace tidelink;
using tidelink::platform::ParseJSONText;

namespace {

TextEditInfo SomeTextEdit() {
    TextEditInfo t;
    t.ConvertIntoSingleTextRun(u"Title");
    t.mRuns[0].mFontName = u"Serif";
    t.mFontEdit = true;
    return t;
}

SpreadsheetValue SomeSheet() {
    SpreadsheetValue v;
    v.mActiveRows = 1;
    v.mColumns.emplace_back(kSpreadsheetColumnDataType_Number, std::vector<SpreadsheetCell>{4.0});
    return v;
}

// One parameter of every kind.
CapsuleParams AllKinds() {
    CapsuleParams p;
    p.AddTextParam("title", u"Title", true, u"Hello", SomeTextEdit());
    p.AddFloatParam("opacity", u"Opacity", true, 50.0, 0.0, 100.0, 1);
    p.AddBooleanParam("shadow", u"Shadow", false, true);
    p.AddColorParam("tint", u"Tint", true, ColorRGBA{0.25f, 0.5f, 0.75f, 1.0f});
    p.AddCommentParam("note", u"Note", false, u"Keep it short");
    p.AddAngleParam("tilt", u"Tilt", true, -12.5);
    p.AddPoint2DParam("anchor", u"Anchor", true, CapsulePoint{960.0, 540.0});
    p.AddScaleParam("size", u"Size", true, {100.0, 90.0}, true, 2);
    p.AddGroupParam("group", u"Group", false, {u"title", u"tint"}, true);
    p.AddSpreadsheetParam("table", u"Table", false, SomeSheet(), 1, 20,
                          {{kSpreadsheetColumnDataType_Number, u"Score", 0.0, 10.0},
                           {kSpreadsheetColumnDataType_Text, u"Team", 0.0, 0.0}});
    p.AddMenuParam("style", u"Style", false, 2, {u"Plain", u"Bold", u"Neon"});
    MediaReplacementInfo media;
    media.mProperties.mWidth = 1920;
    p.AddMediaParam("logo", u"Logo", false, true, u"logo.png", media);
    return p;
}

template <class F>
std::string WhatOf(F&& f) {
    try {
        f();
    } catch (const std::exception& e) {
        return e.what();
    }
    return "(no exception)";
}

}  // namespace

TEST(CapsuleParams, EveryKindRoundTripsThroughJSON) {
    const auto params = AllKinds();
    const Value j = params;
    ASSERT_EQ(j["capParams"].size(), 12u);
    EXPECT_EQ(j["capParams"][0]["textEditValue"], "Title");
    EXPECT_EQ(j["capParams"][0]["capPropDefault"], "Hello");
    EXPECT_FALSE(j["capParams"][4].contains("textEditValue"));  // comments carry no text edit
    EXPECT_EQ(j["capParams"][3]["capPropDefault"], ParseJSONText("[0.25, 0.5, 0.75, 1.0]"));
    EXPECT_EQ(j["capParams"][9]["capPropSpreadsheetMaxRows"], 20);
    EXPECT_EQ(j["capParams"][11]["mediareplacementversion"], 1);
    EXPECT_EQ(j["capParams"][11]["width"], 1920);
    EXPECT_EQ(j.get<CapsuleParams>(), params);
    EXPECT_EQ(ParseJSONText(platform::ToJSONText(j)).get<CapsuleParams>(), params);

    // Spreadsheet rows share the property slots of the float bounds, with their own types.
    const auto& sheet = params.GetParams()[9].GetProperties();
    EXPECT_EQ(boost::get<unsigned int>(sheet.at(kCapsuleParamProperty_Min)), 1u);
    EXPECT_EQ(boost::get<double>(params.GetParams()[1].GetProperties().at(
                  kCapsuleParamProperty_Max)),
              100.0);

    CapsuleParams other = params;
    other.AddBooleanParam("extra", u"Extra", false, false);
    EXPECT_NE(other, params);
}

TEST(CapsuleParams, GettersReportMissingOrMistypedProperties) {
    const auto params = AllKinds();
    const auto& text = params.GetParams()[0];
    ImmutableString name;
    WString ui;
    bool animatable = false;
    double d = 0, mn = 0, mx = 0;
    int decimals = 0;
    EXPECT_EQ(WhatOf([&] { text.GetFloatProperties(name, ui, animatable, d, mn, mx, decimals); }),
              "boost::bad_get: failed value get using boost::get");
    CapsuleParam bare;
    EXPECT_EQ(WhatOf([&] { bare.GetType(); }), "invalid map<K, T> key");
    EXPECT_THROW(bare.GetBasicProperties(name, ui, animatable), std::out_of_range);

    std::vector<WString> group;
    params.GetParams()[8].GetGroupDropZoneProperties(name, ui, animatable, group);
    EXPECT_EQ(name, "group");
    EXPECT_EQ(group.size(), 2u);
}

TEST(CapsuleParams, LocalisationReplacesDefaultsOnlyOfTexts) {
    auto list = AllKinds().GetParams();
    for (auto& p : list) p.SetLocalizedNamesAndValues(u"Localised", u"Texte");
    ImmutableString name;
    WString ui, text;
    bool animatable = false;
    TextEditInfo edit;
    list[0].GetTextProperties(name, ui, animatable, text, edit);
    EXPECT_EQ(ui, u"Localised");
    EXPECT_EQ(text, u"Texte");
    list[4].GetCommentProperties(name, ui, animatable, text);
    EXPECT_EQ(text, u"Texte");
    bool expanded = false;
    MediaReplacementInfo media;
    list[11].GetMediaProperties(name, ui, animatable, expanded, text, media);
    EXPECT_EQ(text, u"logo.png");
}

TEST(CapsuleParamValues, DefaultsCollectByNameAndAddNeverReplaces) {
    const auto values = AllKinds().GetParamValues();
    const auto& map = values->GetParamValues();
    ASSERT_EQ(map.size(), 12u);
    EXPECT_EQ(map.at("opacity").GetFloatValue(), 50.0);
    EXPECT_EQ(map.at("style").GetMenuValue(), 2);
    EXPECT_EQ(map.at("logo").GetMediaValue(), u"logo.png");
    EXPECT_EQ(map.at("note").GetTextValue(), u"Keep it short");
    EXPECT_EQ(map.at("logo").GetTextValue(), u"");  // neither Text nor Comment
    EXPECT_EQ(WhatOf([&] { map.at("shadow").GetFloatValue(); }),
              "boost::bad_get: failed value get using boost::get");

    CapsuleParamValues v;
    v.AddValue("a", kCapsuleParamType_Float, 1.0);
    v.AddValue("a", kCapsuleParamType_Float, 2.0);
    EXPECT_EQ(v.GetParamValues().at("a").GetFloatValue(), 1.0);
    v.UpdateValue("a", kCapsuleParamType_Boolean, true);
    EXPECT_TRUE(v.GetParamValues().at("a").GetBooleanValue());
    EXPECT_FALSE(v.IsEmpty());
    v.Clear();
    EXPECT_TRUE(v.IsEmpty());
}

TEST(CapsuleParamValues, JSONFormKeepsTheFirstOfARepeatedName) {
    const auto values = AllKinds().GetParamValues();
    const Value j = *values;
    const auto& list = j["capParamValues"];
    ASSERT_EQ(list.size(), 12u);
    EXPECT_EQ(list[0][0], "anchor");  // name order
    EXPECT_EQ(list[0][1], ParseJSONText(R"({"capValueType": 6, "capValueValue": [960.0, 540.0]})"));
    EXPECT_EQ(j.get<CapsuleParamValues>(), *values);

    const auto read = ParseJSONText(R"({"capParamValues": [
        ["x", {"capValueType": 1, "capValueValue": 1.5}],
        ["x", {"capValueType": 1, "capValueValue": 9}],
        ["y", {"capValueType": 40}]]})")
                          .get<CapsuleParamValues>();
    EXPECT_EQ(read.GetParamValues().at("x").GetFloatValue(), 1.5);
    EXPECT_EQ(read.GetParamValues().at("y").GetType(), static_cast<CapsuleParamType>(40));
    EXPECT_FALSE(Value(read)["capParamValues"][1][1].contains("capValueValue"));
}

TEST(CapsuleParams, WrongKindsAndUnknownTypesOnRead) {
    const char* bad[] = {
        R"([])",
        R"({})",
        R"({"capParams": {}})",
        R"({"capParams": [{"capPropMatchName": "a", "capPropUIName": "A",
            "capPropAnimatable": "yes", "capPropType": 2, "capPropDefault": true}]})",
        R"({"capParams": [{"capPropMatchName": "a", "capPropUIName": "A",
            "capPropAnimatable": true, "capPropType": 3, "capPropDefault": [1, 2, 3]}]})",
        R"({"capParams": [{"capPropMatchName": "a", "capPropUIName": "A",
            "capPropAnimatable": true, "capPropType": 1, "capPropDefault": 1}]})",
    };
    for (const char* text : bad) {
        CapsuleParams p = AllKinds();
        EXPECT_THROW(FromJSON(ParseJSONText(text), p), nlohmann::json::type_error) << text;
        EXPECT_EQ(p, AllKinds());
    }
    // A kind from a newer peer keeps its shared keys, writes them back and has no default.
    const auto newer = ParseJSONText(R"({"capParams": [{"capPropMatchName": "n",
        "capPropUIName": "N", "capPropAnimatable": false, "capPropType": 12, "extra": 1}]})")
                           .get<CapsuleParams>();
    ASSERT_EQ(newer.GetParams().size(), 1u);
    EXPECT_EQ(newer.GetParams()[0].GetType(), static_cast<CapsuleParamType>(12));
    EXPECT_EQ(Value(newer).get<CapsuleParams>(), newer);
    EXPECT_TRUE(newer.GetParamValues()->IsEmpty());
}
