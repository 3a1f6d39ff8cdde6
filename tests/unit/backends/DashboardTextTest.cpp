// The words of the dashboard.
#include <limits>

#include "backends/DashboardText.h"
#include "tests/unit/backends/DashboardFixture.h"

namespace velk::test {
namespace {

TEST(DashboardText, DescribesTextsAndNumbersAlone) {
  EXPECT_EQ(descriptionForObject("words"), "words");
  EXPECT_EQ(descriptionForObject(-17), "-17");
  EXPECT_EQ(descriptionForObject(std::numeric_limits<std::uint64_t>::max()), "18446744073709551615");
  EXPECT_EQ(descriptionForObject(1.5), "1.5");
  EXPECT_EQ(descriptionForObject(2.0), "2");
  EXPECT_EQ(descriptionForObject(true), "1");
  EXPECT_EQ(descriptionForObject(false), "0");
  EXPECT_EQ(descriptionForObject(PropertyArray{1}), "null");
  EXPECT_EQ(descriptionForObject(PropertyDictionary{{"a", 1}}), "null");
  EXPECT_EQ(descriptionForObject(Date{5}), "null");
  EXPECT_EQ(descriptionForObject(ByteData{1, 2}), "null");
  EXPECT_EQ(descriptionForObject(PropertyValue()), "null");
}

TEST(DashboardText, EscapesWhatWouldEndAValue) {
  EXPECT_EQ(sanitize("x=y\\z\n"), "x\\=y\\\\z");
  EXPECT_EQ(sanitize("\\="), "\\\\\\=");
  EXPECT_EQ(sanitize("a\nb\n"), "ab");
  EXPECT_EQ(sanitize(""), "empty");
  EXPECT_EQ(sanitize("\n\n"), "empty");
}

TEST(DashboardText, PutsShortValuesFirst) {
  EXPECT_EQ(keyValueText({{"long", "abcdef"}, {"number", 12345}, {"short", "a"}, {"flag", true}, {"two", 10}}),
            " short=a flag=1 two=10 number=12345 long=abcdef");
  EXPECT_EQ(keyValueText({}), "");
}

TEST(DashboardText, SortsByWhatAValueIsNotByWhatItIsSentAs) {
  // Two characters against three, though the first is sent as five ("empty") and the second as four.
  EXPECT_EQ(keyValueText({{"a", "=="}, {"b", "x"}, {"c", "\n\n\n"}, {"d", ""}}), " d=empty b=x a=\\=\\= c=empty");
}

TEST(DashboardText, SendsContainersAsNull) {
  const auto text = keyValueText({{"array", PropertyArray{1, 2}}, {"dictionary", PropertyDictionary{{"x", "y"}}}});
  EXPECT_TRUE(text == " array=null dictionary=null" || text == " dictionary=null array=null") << text;
}

TEST(DashboardText, LeavesKeysAsTheyAre) { EXPECT_EQ(keyValueText({{"k=\\", "v"}}), " k=\\=v"); }

TEST(DashboardText, EndsAtAZeroByteAsItsReadersDo) {
  EXPECT_EQ(keyValueText({{std::string_view("k\0x", 3), PropertyValue(std::string("v\0w", 3))}, {"next", "long"}}),
            " k=v next=long");
}

TEST(DashboardText, IsCutWhereTheLongestValueStands) {
  const std::string long_(2000, 'z');
  const auto text = keyValueText({{"long", long_}, {"short", "a"}, {"longer", long_ + "z"}});
  EXPECT_EQ(text.size(), 1023U);
  EXPECT_EQ(text.substr(0, 17), " short=a long=zzz");
  EXPECT_EQ(text.back(), 'z');
  EXPECT_EQ(keyValueText({{"k", std::string(1020, 'z')}}).size(), 1023U);
  EXPECT_EQ(keyValueText({{"k", std::string(1019, 'z')}}).size(), 1022U);
}

/// A header whose numbers are all different, complements applied by hand.
ByteData handmade(const std::string& text) {
  ByteData bytes{8,    20,   1,    12,     //
                 0x5F, 0x5E, 0x10, 0x00,   // seconds
                 0xFF, 0xFF, 0xEF, 0x6D,   // session 4242, complemented
                 0xFF, 0xF3,               // version 12, complemented
                 0xFF, 0xBC,               // length
                 0x00, 0x07, 0x01, 0x02};  // method 7, response code 258
  for (const char letter : std::string(kUdid)) bytes.push_back(static_cast<std::uint8_t>(letter));
  bytes.insert(bytes.end(), {0xFF, 0xFE, 0x00, 0x01});
  for (const char letter : text) bytes.push_back(static_cast<std::uint8_t>(letter));
  return bytes;
}

TEST(DashboardLocalLog, ShowsPlainValuesInColumns) {
  EXPECT_EQ(writeLocalLog(handmade(" a=1")), "1600000000.048 0123456789abcdef0123456789abcdef01234567 127.0.0.1 " +
                                                 std::string(componentShortCode(20)) +
                                                 "    12  4242 65534     7   258  a=1");
}

TEST(DashboardLocalLog, NamesComponentsOutsideTheTableByAFixedText) {
  auto bytes = handmade("");
  bytes[1] = 31;
  EXPECT_NE(writeLocalLog(bytes).find(" 127.0.0.1 Unknown    12 "), std::string::npos);
  bytes[1] = 255;
  EXPECT_NE(writeLocalLog(bytes).find(" 127.0.0.1 Unknown    12 "), std::string::npos);
}

TEST(DashboardLocalLog, KeepsWithin1151Bytes) {
  auto bytes = handmade(std::string(1023, 'x'));
  for (std::size_t at = 4; at < 20; ++at) bytes[at] = 0;
  for (const std::size_t at : {4, 5, 6, 7}) bytes[at] = 0xFF;
  bytes[60] = bytes[61] = bytes[16] = bytes[17] = bytes[18] = bytes[19] = 0xFF;
  EXPECT_LE(writeLocalLog(bytes).size(), 1151U);
  bytes.insert(bytes.end(), 5000, 'y');
  EXPECT_EQ(writeLocalLog(bytes).size(), 1151U);
}

TEST(DashboardLocalLog, OfWhatIsNoDatagramIsEmpty) {
  EXPECT_EQ(writeLocalLog({}), "");
  EXPECT_EQ(writeLocalLog(ByteData(63)), "");
  EXPECT_NE(writeLocalLog(ByteData(64)), "");
}

}  // namespace
}  // namespace velk::test
