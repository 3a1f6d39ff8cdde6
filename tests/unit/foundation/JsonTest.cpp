#include "foundation/Json.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace velk {
namespace {

std::string compact(const PropertyValue& value, json::Extensions extensions = json::Extensions::refuse) {
  std::string text;
  EXPECT_TRUE(json::write(value, text, extensions));
  return text;
}

bool isRefused(const PropertyValue& value) {
  std::string text;
  return !json::write(value, text);
}

TEST(JsonWriter, WritesCompactlyInInsertionOrder) {
  EXPECT_EQ(compact(PropertyDictionary{{"b", 1}, {"a", PropertyArray{true, nullptr, "x/y"}}}),
            R"({"b":1,"a":[true,null,"x/y"]})");
}

TEST(JsonWriter, WritesDoublesInTheirShortestForm) {
  EXPECT_EQ(compact(0.1), "0.1");
  EXPECT_EQ(compact(3.0), "3.0");
  EXPECT_EQ(compact(-0.0), "-0.0");
  EXPECT_EQ(compact(1600000000.0), "1600000000.0");
  EXPECT_EQ(compact(-1e20), "-100000000000000000000.0");
  EXPECT_EQ(compact(1e300), "1e+300");
  EXPECT_EQ(compact(1732161415.123456), "1732161415.123456");
  const auto back = json::parse(compact(5e-324));
  EXPECT_EQ(*back->real(), 5e-324);
}

TEST(JsonWriter, KeepsSixtyFourBitsOfIntegers) {
  EXPECT_EQ(compact(INT64_MIN), "-9223372036854775808");
  EXPECT_EQ(compact(UINT64_MAX), "18446744073709551615");
}

TEST(JsonWriter, RefusesWhatJsonCannotHold) {
  EXPECT_TRUE(isRefused(std::nan("")));
  EXPECT_TRUE(isRefused(std::numeric_limits<double>::infinity()));
  EXPECT_TRUE(isRefused(std::string("\xff")));
  EXPECT_TRUE(isRefused(Date{1}));
  EXPECT_TRUE(isRefused(ByteData{1}));
  EXPECT_TRUE(isRefused(PropertyDictionary{{"\xc0\x80", 1}}));
}

TEST(JsonWriter, EscapesControlCharacters) { EXPECT_EQ(compact("a\n\"\x01"), "\"a\\n\\\"\\u0001\""); }

TEST(JsonWriter, WritesEveryCharacterOfKeysAndTextsOnce) {
  PropertyDictionary value{
      {"q\"", "b\\"}, {"\u00e4", "\x7f"}, {"", ""}, {"plain /", PropertyArray{"a", -1, 18446744073709551615U}}};
  EXPECT_EQ(compact(value),
            "{\"q\\\"\":\"b\\\\\",\"\u00e4\":\"\x7f\",\"\":\"\",\"plain /\":[\"a\",-1,18446744073709551615]}");
}

TEST(JsonWriter, IndentsForPeople) {
  std::string text;
  ASSERT_TRUE(json::writePretty(PropertyDictionary{{"a", 1}}, text));
  EXPECT_EQ(text, "{\n  \"a\": 1\n}");
}

TEST(JsonWriter, CompactTextIsIndentedAsTheValueWouldBe) {
  const PropertyDictionary nested{
      {"empty", PropertyDictionary{}},
      {"none", PropertyArray{}},
      {"te\"xt", "{[,:]}\\\" \\"},
      {"list", PropertyArray{1, PropertyArray{true, nullptr}, PropertyDictionary{{"a", 0.5}}}},
      {"", "\n\u00e4"}};
  for (const PropertyValue& value : {PropertyValue(nested), PropertyValue(PropertyArray{}), PropertyValue("x"),
                                     PropertyValue(-1.5), PropertyValue(PropertyArray{nested, nested})}) {
    std::string walked;
    ASSERT_TRUE(json::writePretty(value, walked));
    std::string indented;
    json::appendPretty(compact(value), indented);
    EXPECT_EQ(indented, walked);
  }
}

TEST(Json, TaggedValuesReadBackAsWhatTheyWere) {
  const PropertyDictionary value{{"when", Date{12.5}}, {"bytes", ByteData{0, 255}}, {"text", "t"}};
  const auto back = json::parse(compact(value, json::Extensions::tagged), json::Extensions::tagged);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back->dictionary(), value);
}

TEST(JsonParser, TagsAreOrdinaryDictionariesUnlessAskedFor) {
  EXPECT_NE(json::parse(R"({"$date":1})")->dictionary(), nullptr);
}

TEST(JsonParser, NamesTheByteOfAnError) {
  const auto broken = json::parse("{\"a\": }");
  ASSERT_FALSE(broken);
  EXPECT_NE(broken.error().description.find("at byte 6"), std::string::npos) << broken.error().description;
}

TEST(JsonParser, RefusesWhatIsNotOneValue) {
  EXPECT_FALSE(json::parse(""));
  EXPECT_FALSE(json::parse("1 2"));
  EXPECT_FALSE(json::parse("{\"a\":1,}"));
  EXPECT_FALSE(json::parse("\"\xff\""));
}

TEST(JsonParser, BoundsTheDepth) {
  EXPECT_TRUE(json::parse(std::string(64, '[') + std::string(64, ']')));
  const auto deep = json::parse(std::string(100000, '['));
  ASSERT_FALSE(deep);
  EXPECT_NE(deep.error().description.find("too deep"), std::string::npos);
}

TEST(JsonParser, SurvivesNumbersFarOutOfRange) {
  const auto large = json::parse("[1844744073709595516150.0e301]");
  ASSERT_FALSE(large);
  EXPECT_NE(large.error().description.find("a number is too large"), std::string::npos) << large.error().description;
  EXPECT_FALSE(json::parse("-1e999"));
  EXPECT_EQ(*json::parse("1e-999")->real(), 0.0);
  EXPECT_EQ(*json::parse("-1e-99999")->real(), 0.0);
  EXPECT_EQ(*json::parse("1.7976931348623157e308")->real(), 1.7976931348623157e308);
  EXPECT_FALSE(json::parse("01"));
  EXPECT_FALSE(json::parse("+1"));
  EXPECT_FALSE(json::parse("1."));
}

TEST(JsonParser, LastOfEqualKeysCounts) {
  EXPECT_EQ(*json::parse(R"({"a":1,"a":2})")->dictionary(), (PropertyDictionary{{"a", 2}}));
}

TEST(JsonParser, KeepsTheKindsOfNumbers) {
  EXPECT_NE(json::parse("1")->integer(), nullptr);
  EXPECT_NE(json::parse("1.0")->real(), nullptr);
  EXPECT_NE(json::parse("18446744073709551615")->unsignedInteger(), nullptr);
  EXPECT_NE(json::parse("18446744073709551616")->real(), nullptr);
}

TEST(Json, RefusesHalvesOfSurrogatePairs) {
  for (const char* text : {R"("\udc00")", R"("\ud800")", R"("\ud800\ud800")", R"({"\udfff": 1})", R"(["a\udc00b"])"}) {
    EXPECT_FALSE(json::parse(text)) << text;
  }
  EXPECT_EQ(json::parse(R"("\udc00")").error().description, "half of a surrogate pair stands alone (at byte 8)");
  EXPECT_EQ(*json::parse(R"("\ud83d\ude00")")->string(), "\U0001f600");
}

}  // namespace
}  // namespace velk
