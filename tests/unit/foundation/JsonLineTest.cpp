#include "foundation/JsonLine.h"

#include <gtest/gtest.h>

#include <limits>

#include "foundation/Json.h"

namespace velk {
namespace {

TEST(JsonLine, WritesInInsertionOrder) {
  EXPECT_EQ(json::line({{"b", 1}, {"a", PropertyArray{true, nullptr, 2.5, "x"}}}),
            R"({"b":1,"a":[true,null,2.5,"x"]})");
  EXPECT_EQ(json::line({}), "{}");
}

TEST(JsonLine, TagsDatesAndData) {
  EXPECT_EQ(json::line({{"when", Date{1.5}}, {"bytes", ByteData{1, 2}}}),
            R"({"when":{"$date":1.5},"bytes":{"$data":"AQI="}})");
}

TEST(JsonLine, GivesUpWhatHasNoFormAndKeepsTheRest) {
  const double none = std::numeric_limits<double>::quiet_NaN();
  const double endless = std::numeric_limits<double>::infinity();
  EXPECT_EQ(json::line({{"nan", none},
                        {"kept", 1},
                        {"inside", PropertyArray{endless, PropertyDictionary{{"text", "\xff"}, {"y", 2}}}},
                        {"when", Date{none}},
                        {"\xff key", 3}}),
            R"({"nan":null,"kept":1,"inside":[null,{"text":null,"y":2}],"when":null})");
}

TEST(JsonLine, HoldsNoControlCharacterAndNoLineSeparator) {
  const std::string evil("a\n\r\t\x1b\x7f\0z \xc2\x85\xc2\x9b \xe2\x80\xa8\xe2\x80\xa9", 20);
  const auto line = json::line({{evil, evil}});
  for (const char character : line) EXPECT_GE(static_cast<unsigned char>(character), 0x20) << line;
  for (const char* part : {"\x7f", "\xc2\x85", "\xc2\x9b", "\xe2\x80\xa8", "\xe2\x80\xa9"}) {
    EXPECT_EQ(line.find(part), std::string::npos) << line;
  }
  const auto read = json::parse(line);
  ASSERT_TRUE(read) << line;
  EXPECT_EQ(*read, PropertyValue(PropertyDictionary{{evil, evil}})) << "nothing is lost by it";
}

TEST(JsonLine, LeavesOtherTextAsItIs) {
  EXPECT_EQ(json::line({{"t\xc3\xa9xt", "\xc2\xa0\xe2\x80\xa6\xf0\x9f\x98\x80"}}),
            "{\"t\xc3\xa9xt\":\"\xc2\xa0\xe2\x80\xa6\xf0\x9f\x98\x80\"}");
}

}  // namespace
}  // namespace velk
