#include <gtest/gtest.h>

#include "tidelink/templates/EditRecords.h"

using namespace tidelink;
using tidelink::platform::ParseJSONText;

namespace {

TextRunFontEditInfo MakeRun(int32_t length, const char16_t* font, bool bold = false) {
    return TextRunFontEditInfo(length, font, 12.0f, bold, false, false, false);
}

// "Hello World" as Hello | space | World in three fonts.
TextEditInfo ThreeRuns() {
    TextEditInfo t;
    t.mText = u"Hello World";
    t.mRuns = {MakeRun(5, u"A"), MakeRun(1, u"B"), MakeRun(5, u"C")};
    t.mRunCount = 3;
    return t;
}

std::vector<std::u16string> Fonts(const std::vector<TextRunFontEditInfo>& runs) {
    std::vector<std::u16string> out;
    for (const auto& r : runs) out.push_back(r.mFontName);
    return out;
}

}  // namespace

TEST(TextEditInfo, VerifyNeedsMatchingCountRunsAndLength) {
    TextEditInfo empty;
    EXPECT_FALSE(empty.Verify());  // zero runs fail even for empty text
    auto t = ThreeRuns();
    EXPECT_TRUE(t.Verify());
    t.mRunCount = 2;
    EXPECT_FALSE(t.Verify());
    t = ThreeRuns();
    t.mRuns[2].mRunLength = 4;
    EXPECT_FALSE(t.Verify());
}

TEST(TextEditInfo, RepairKeepsRunsWhenOnlyTheCountWasWrong) {
    auto t = ThreeRuns();
    t.mRunCount = 7;
    t.FixMismatchedTextRuns();
    EXPECT_EQ(t.mRunCount, 3);
    EXPECT_EQ(t.mRuns.size(), 3u);

    t.mRuns[0].mRunLength = 9;  // lengths no longer add up: one run in the first run's font
    t.FixMismatchedTextRuns();
    EXPECT_TRUE(t.Verify());
    EXPECT_EQ(t.mText, u"Hello World");
    ASSERT_EQ(t.mRuns.size(), 1u);
    EXPECT_EQ(t.mRuns[0].mFontName, u"A");
    EXPECT_EQ(t.mRuns[0].mRunLength, 11);

    TextEditInfo bare;
    bare.ConvertIntoSingleTextRun(u"abc");
    EXPECT_TRUE(bare.Verify());
    EXPECT_EQ(bare.mRuns[0], TextRunFontEditInfo(3, u"", 0.0f, false, false, false, false));
}

TEST(TextEditInfo, RunsAtSelectionsAndBoundaries) {
    const auto t = ThreeRuns();
    EXPECT_EQ(t.GetTextRunInfoAt(-1, -1).size(), 3u);
    using V = std::vector<std::u16string>;
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(0, 0)), V{u"A"});
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(5, 5)), V{u"A"});  // boundary: the run before
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(6, 6)), V{u"B"});
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(7, 7)), V{u"C"});
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(5, 6)), V{u"B"});
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(8, 3)), (V{u"A", u"B", u"C"}));
    EXPECT_EQ(Fonts(t.GetTextRunInfoAt(0, 5)), V{u"A"});
    EXPECT_TRUE(TextEditInfo().GetTextRunInfoAt(0, 0).empty());
}

TEST(TextEditInfo, InsertSplitsAtTheSelectionAndMergesAlikeNeighbours) {
    TextEditInfo t;
    t.mText = u"abcdefgh";
    t.mRuns = {MakeRun(4, u"A"), MakeRun(4, u"B")};
    t.mRunCount = 2;
    t.InsertTextRun(MakeRun(0, u"ignored", true), 2, 6, TextEditInfo::kChangeBold);
    ASSERT_EQ(t.mRunCount, 4);
    ASSERT_EQ(t.mRuns.size(), 4u);
    const TextRunFontEditInfo expected[] = {MakeRun(2, u"A"), MakeRun(2, u"A", true),
                                            MakeRun(2, u"B", true), MakeRun(2, u"B")};
    for (size_t i = 0; i < 4; ++i) EXPECT_EQ(t.mRuns[i], expected[i]) << i;
    EXPECT_TRUE(t.Verify());

    // Giving the whole text one font makes bold and plain neighbours alike: they fold together.
    t.InsertTextRun(MakeRun(0, u"Z"), 8, 0, TextEditInfo::kChangeFontName);
    ASSERT_EQ(t.mRuns.size(), 3u);
    EXPECT_EQ(t.mRuns[0], MakeRun(2, u"Z"));
    EXPECT_EQ(t.mRuns[1], MakeRun(4, u"Z", true));
    EXPECT_EQ(t.mRuns[2], MakeRun(2, u"Z"));
    t.InsertTextRun(MakeRun(0, u"Z"), 0, 8, TextEditInfo::kChangeBold);
    ASSERT_EQ(t.mRuns.size(), 1u);
    EXPECT_EQ(t.mRuns[0].mRunLength, 8);
    EXPECT_EQ(t.mRunCount, 1);

    // An empty text keeps its format in one empty run; a change at the caret applies to it.
    TextEditInfo empty(SourceTextFontEditInfo{});
    empty.InsertTextRun(MakeRun(0, u"", true), 0, 0, TextEditInfo::kChangeBold);
    ASSERT_EQ(empty.mRuns.size(), 1u);
    EXPECT_TRUE(empty.mRuns[0].mBold);

    TextRunFontEditInfo to = MakeRun(1, u"A");
    TextEditInfo::CopyChangeTypeSpecificValue(
        TextRunFontEditInfo(9, u"X", 30.0f, true, true, true, true), to,
        static_cast<TextEditInfo::TextRunChangeType>(6));
    EXPECT_EQ(to, MakeRun(1, u"A"));
}

TEST(TextEditInfo, ColumnarFormRoundTripsAndReadsTheOlderForm) {
    auto t = ThreeRuns();
    t.mFontEdit = true;
    t.mRuns[1].mItalic = true;
    const Value j = t;
    EXPECT_EQ(j["capPropTextRunCount"], 3);
    EXPECT_EQ(j["fontTextRunLength"], ParseJSONText("[5, 1, 5]"));
    EXPECT_EQ(j["fontFSItalicValue"], ParseJSONText("[false, true, false]"));
    EXPECT_EQ(j.get<TextEditInfo>(), t);
    EXPECT_EQ(TextEditInfo(t.AsString()), t);
    EXPECT_EQ(TextEditInfo(std::string()), TextEditInfo());

    // A count beyond the runs that exist writes the runs that exist, and never reads past them.
    t.mRunCount = 9;
    const Value over = t;
    EXPECT_EQ(over["fontEditValue"].size(), 3u);
    const auto back = over.get<TextEditInfo>();
    EXPECT_EQ(back.mRuns, t.mRuns);
    EXPECT_EQ(back.mRunCount, 9);

    const auto legacy = ParseJSONText(R"({"textEditValue": "Hi",
        "fonteditinfo": {"capPropFontEdit": true, "fontEditValue": "Serif",
                         "fontSizeEditValue": 18, "fontFSBoldValue": true}})")
                            .get<TextEditInfo>();
    EXPECT_EQ(legacy.mText, u"Hi");
    EXPECT_TRUE(legacy.mFontEdit);
    EXPECT_EQ(legacy.mRunCount, 1);
    ASSERT_EQ(legacy.mRuns.size(), 1u);
    EXPECT_EQ(legacy.mRuns[0], TextRunFontEditInfo(0, u"Serif", 18.0f, true, false, false, false));
}

TEST(TextEditInfo, BadInputLeavesTheRecordAlone) {
    auto t = ThreeRuns();
    const auto before = t;
    EXPECT_THROW(t.ExtractProperties(ParseJSONText(R"({"textEditValue": "x",
        "fontTextRunLength": [1, "two"]})")),
                 nlohmann::json::type_error);
    EXPECT_THROW(t.ExtractProperties(ParseJSONText(R"({"capPropTextRunCount": -1})")),
                 nlohmann::json::type_error);
    EXPECT_EQ(t, before);
    EXPECT_THROW(TextEditInfo(std::string("{\"textEditValue\": ")), nlohmann::json::parse_error);
    EXPECT_THROW(TextEditInfo(std::string("[1]")), nlohmann::json::type_error);
    // Keys that are absent keep what the record had.
    t.ExtractProperties(ParseJSONText(R"({"textEditValue": "Hello World"})"));
    EXPECT_EQ(t, before);
}

TEST(MediaReplacementInfo, DefaultsAndTextForms) {
    const Value j = MediaReplacementInfo();
    EXPECT_EQ(j, ParseJSONText(R"({"mediareplacementversion": 1, "width": 0, "height": 0,
        "starttime": 0, "endtime": 0, "timescale": 1, "thumbnail": "", "scale": 2})"));
    MediaReplacementInfo m(std::string(R"({"width": 640, "starttime": -3, "thumbnail": "t.png"})"));
    EXPECT_EQ(m.mVersion, 1u);
    EXPECT_EQ(m.mProperties.mWidth, 640u);
    EXPECT_EQ(m.mProperties.mStartTime, -3);
    EXPECT_EQ(m.mProperties.mTimescale, 1u);
    EXPECT_EQ(m.mProperties.mThumbnail, u"t.png");
    m.mVersion = 3;
    m.mProperties.mScale = static_cast<EMediaReplacementDefaultScale>(17);
    EXPECT_EQ(MediaReplacementInfo(m.AsString()), m);
    EXPECT_EQ(MediaReplacementInfo(m.AsUTF8String()), m);
    EXPECT_EQ(MediaReplacementInfo(std::u16string()), MediaReplacementInfo());
    EXPECT_THROW(MediaReplacementInfo(std::string(R"({"width": -1})")),
                 nlohmann::json::type_error);
}

TEST(Spreadsheet, ColumnFormsFollowTheDataType) {
    SpreadsheetValue v;
    v.mActiveRows = 2;
    v.mColumns.emplace_back(kSpreadsheetColumnDataType_Number,
                            std::vector<SpreadsheetCell>{1.5, WString(u"stray"), -2.0});
    v.mColumns.emplace_back(kSpreadsheetColumnDataType_Text,
                            std::vector<SpreadsheetCell>{WString(u"a"), 3.0});
    v.mColumns.emplace_back(7, std::vector<SpreadsheetCell>{});
    const Value j = v;
    EXPECT_EQ(j, ParseJSONText(R"({"activeRows": 2, "columnValues": [
        {"numberValues": [1.5, 0.0, -2.0]}, {"textValues": ["a", ""]}, {}]})"));
    const auto back = j.get<SpreadsheetValue>();
    EXPECT_EQ(back.mColumns[0].GetValues().size(), 3u);  // rows stay aligned
    EXPECT_EQ(back.mColumns[1].GetDataType(), kSpreadsheetColumnDataType_Text);
    EXPECT_EQ(back.mColumns[2].GetDataType(), 0u);  // untyped columns come back as type 0

    SpreadsheetColumnInfo number{kSpreadsheetColumnDataType_Number, u"Score", -1.0, 10.0};
    SpreadsheetColumnInfo text{kSpreadsheetColumnDataType_Text, u"Name", 0.0, 0.0};
    EXPECT_EQ(Value(number).get<SpreadsheetColumnInfo>(), number);
    EXPECT_EQ(Value(text).get<SpreadsheetColumnInfo>(), text);
    EXPECT_FALSE(Value(text).contains("capPropSpreadsheetColumnMinValue"));
    EXPECT_THROW(ParseJSONText(R"({"columnValues": [{"numberValues": ["1"]}]})")
                     .get<SpreadsheetValue>(),
                 nlohmann::json::type_error);
}
