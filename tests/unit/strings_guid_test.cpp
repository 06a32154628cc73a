#include <gtest/gtest.h>

#include <set>

#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

using namespace tidelink::platform;

TEST(Strings, RoundTripsAllPlanesAndReplacesBadInput) {
    const std::u16string wide = u"abc \u00e9\u4e2d \U0001F600";
    EXPECT_EQ(ToUTF16(ToUTF8(wide)), wide);
    EXPECT_EQ(ToUTF8(wide), "abc \xc3\xa9\xe4\xb8\xad \xf0\x9f\x98\x80");
    // Truncated sequence, overlong form, lone surrogate, bare continuation byte.
    EXPECT_EQ(ToUTF16("\xe4\xb8"), u"\uFFFD\uFFFD");
    EXPECT_EQ(ToUTF16("\xc0\xaf"), u"\uFFFD\uFFFD");
    EXPECT_EQ(ToUTF16("\xed\xa0\x80"), u"\uFFFD\uFFFD\uFFFD");
    EXPECT_EQ(ToUTF16("a\x80z"), u"a\uFFFDz");
    EXPECT_EQ(ToUTF8(std::u16string(1, char16_t(0xD800))), "\xef\xbf\xbd");
    EXPECT_TRUE(IsValidUTF8("plain \xef\xbf\xbd ok"));
    EXPECT_FALSE(IsValidUTF8("bad \xff"));
}

TEST(Guid, TextFormIsStrict) {
    const auto g = Guid::New();
    const auto text = g.ToString();
    ASSERT_EQ(text.size(), 36u);
    EXPECT_EQ(text[14], '4');  // version 4
    EXPECT_EQ(Guid::Parse(text), g);
    std::string upper = text;
    for (auto& c : upper) c = static_cast<char>(toupper(c));
    EXPECT_EQ(Guid::Parse(upper), g);
    EXPECT_FALSE(Guid::Parse("{" + text + "}"));
    EXPECT_FALSE(Guid::Parse(text.substr(1)));
    std::string badHex = text;
    badHex[0] = 'g';
    EXPECT_FALSE(Guid::Parse(badHex));
    std::string badHyphen = text;
    badHyphen[8] = '0';
    EXPECT_FALSE(Guid::Parse(badHyphen));
    EXPECT_TRUE(Guid().IsNil());
    EXPECT_EQ(Guid().ToString(), "00000000-0000-0000-0000-000000000000");
}

TEST(Guid, NewIsUnique) {
    std::set<Guid> seen;
    for (int i = 0; i < 20000; ++i) ASSERT_TRUE(seen.insert(Guid::New()).second);
}

TEST(Serialization, WideStringsAndGuidsTravelAsText) {
    const auto g = Guid::New();
    Value v = Value::array({std::u16string(u"n\u00e4me"), g});
    EXPECT_EQ(v[0], "n\xc3\xa4me");
    EXPECT_EQ(v[1].get<Guid>(), g);
    EXPECT_EQ(v[0].get<std::u16string>(), u"n\u00e4me");
    EXPECT_THROW(Value("nope").get<Guid>(), nlohmann::json::exception);
    EXPECT_THROW(Value(3).get<std::u16string>(), nlohmann::json::exception);
}

TEST(Serialization, JSONTextKeepsOrderAndLimitsDepth) {
    Value v = ParseJSONText(R"({"z":1,"a":[true,2.5,-3,18446744073709551615],"m":"x"})");
    EXPECT_EQ(ToJSONText(v), R"({"z":1,"a":[true,2.5,-3,18446744073709551615],"m":"x"})");
    EXPECT_TRUE(v["a"][3].is_number_unsigned());
    EXPECT_THROW(ParseJSONText("{\"a\":"), nlohmann::json::parse_error);
    std::string deep(kMaxValueDepth, '[');
    deep += std::string(kMaxValueDepth, ']');
    EXPECT_NO_THROW(ParseJSONText(deep));
    std::string tooDeep(100000, '[');
    EXPECT_THROW(ParseJSONText(tooDeep), nlohmann::json::out_of_range);
}

TEST(Serialization, BuildCallAndReplyValue) {
    EXPECT_TRUE(BuildCall("x").args.is_array());
    EXPECT_EQ(BuildCall("x", Value(5)).args, Value::array({5}));
    EXPECT_EQ(ReplyValue<int>(Value{{"value", 7}}), 7);
    EXPECT_EQ(ReplyValue<int>(Value::object()), 0);
    EXPECT_EQ(ReplyValue<std::string>(Value()), "");
}
