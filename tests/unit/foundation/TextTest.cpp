#include "foundation/Text.h"

#include <gtest/gtest.h>

#include <set>

#include "foundation/Base64.h"
#include "foundation/Format.h"
#include "foundation/Uuid.h"

namespace velk {
namespace {

ByteData bytes(std::string_view text) { return {text.begin(), text.end()}; }

TEST(FormatText, FillsPlaceholdersOfEveryKind) {
  EXPECT_EQ(formatText("%d %u %s '%@' 100%%", {-3, 7U, "text", std::string("object")}), "-3 7 text 'object' 100%");
  EXPECT_EQ(formatText("Task_%08x", {255U}), "Task_000000ff");
  EXPECT_EQ(formatText("%.02f%%|%5d|%-4s|%f", {12.345, 42, "ab", 0.5}), "12.35%|   42|ab  |0.500000");
  EXPECT_EQ(formatText("%lld of %llu, %ld", {std::int64_t{-1}, std::uint64_t{UINT64_MAX}, 5L}),
            "-1 of 18446744073709551615, 5");
}

TEST(FormatText, AbsentValuesReadNull) {
  EXPECT_EQ(formatText("%s %@ %@", {nullptr, std::optional<std::string>(), static_cast<const PropertyValue*>(nullptr)}),
            "(null) (null) (null)");
}

TEST(FormatText, NeverFailsOnMismatches) {
  EXPECT_EQ(formatText("%d %s", {1}), "1 %s");
  EXPECT_EQ(formatText("%s", {12}), "12");
  EXPECT_EQ(formatText("%d", {2.7}), "2");
  EXPECT_EQ(formatText("%d", {"text"}), "text");
  EXPECT_EQ(formatText("plain", {1, 2}), "plain");
  EXPECT_EQ(formatText("%", {1}), "1");
}

TEST(FormatText, DescribesValuesOnOneLine) {
  const PropertyDictionary value{{"b", "line\nbreak"}, {"a", PropertyArray{1, Date{2}}}};
  EXPECT_EQ(formatText("%@", {value}), R"({"b":"line\nbreak","a":[1,{"$date":2.0}]})");
}

TEST(Description, ShowsEvenWhatJsonRefuses) {
  const PropertyValue value(PropertyDictionary{{"bad\xff\n", PropertyArray{std::string("\x01")}}});
  EXPECT_EQ(description(&value), R"({"bad\xff\n":["\u0001"]})");
}

TEST(WithoutControlCharacters, LeavesNothingThatBeginsALine) {
  EXPECT_EQ(withoutControlCharacters("a\nb\rc\x1b[31m\x7f"), "a\\nb\\rc\\x1b[31m\\x7f");
  EXPECT_EQ(withoutControlCharacters("x\u2028y\u0085z\u00e4"), "x\\u2028y\\u0085z\u00e4");
  EXPECT_EQ(withoutControlCharacters("\u20ac \u00a9 \U0001f600"), "\u20ac \u00a9 \U0001f600");
  EXPECT_EQ(withoutControlCharacters(""), "");
}

TEST(WithoutControlCharacters, LeavesNothingThatIsNoText) {
  EXPECT_EQ(withoutControlCharacters("a\xff\xc3\xa4\xe2\x82"), "a\\xff\xc3\xa4\\xe2\\x82");
  EXPECT_EQ(withoutControlCharacters("\x9b"
                                     "31m\xed\xa0\x80"),
            "\\x9b31m\\xed\\xa0\\x80")
      << "a terminal's own bytes";
  EXPECT_EQ(withoutControlCharacters("\xc2"), "\\xc2");
}

TEST(Split, KeepsBlanksAndEmptyParts) {
  EXPECT_EQ(split("A, B,,", ','), (std::vector<std::string_view>{"A", " B", "", ""}));
  EXPECT_EQ(split("", ','), (std::vector<std::string_view>{""}));
}

TEST(Text, ComparesWithoutCase) {
  EXPECT_TRUE(equalsIgnoringCase("HtTpS", "https"));
  EXPECT_FALSE(equalsIgnoringCase("https", "http"));
  EXPECT_TRUE(containsIgnoringCase("Russia", "US"));
  EXPECT_TRUE(containsIgnoringCase("anything", ""));
  EXPECT_TRUE(containsIgnoringCase("", ""));
  EXPECT_FALSE(containsIgnoringCase("", "a"));
  EXPECT_EQ(lowerCased("ÄBC"), "Äbc");
}

TEST(Utf8, AcceptsTheStandardAndNothingElse) {
  EXPECT_TRUE(isUtf8("plain, \u00e4, \u20ac, \U0001F600"));
  for (const char* bad : {"\xc0\x80", "\xe0\x80\x80", "\xed\xa0\x80", "\xf4\x90\x80\x80", "\xf5\x80\x80\x80", "\x80",
                          "\xc3", "\xe2\x82", "\xf0\x9f\x98"}) {
    EXPECT_FALSE(isUtf8(bad)) << hexadecimal(bytes(bad));
  }
  EXPECT_EQ(utf16Length("a\u00e4\U0001F600"), 4U);
}

TEST(Utf8, PrefixEndsWithAWholeCharacter) {
  const std::string_view text = "a\xC3\xA9\xF0\x9F\x98\x80z";
  const std::size_t expected[] = {0, 1, 1, 3, 3, 3, 3, 7, 8, 8};
  for (std::size_t most = 0; most < std::size(expected); ++most) {
    EXPECT_EQ(utf8Prefix(text, most), text.substr(0, expected[most])) << most;
  }
  EXPECT_EQ(utf8Prefix("", 5), "");
}

TEST(Base64, EncodesAndDecodesEveryRemainder) {
  EXPECT_EQ(base64Encoded(bytes("")), "");
  EXPECT_EQ(base64Encoded(bytes("f")), "Zg==");
  EXPECT_EQ(base64Encoded(bytes("fo")), "Zm8=");
  EXPECT_EQ(base64Encoded(bytes("foobar")), "Zm9vYmFy");
  EXPECT_EQ(base64Decoded("Zm8="), bytes("fo"));
  EXPECT_EQ(base64Decoded("Zm9v\nYm Fy!"), bytes("foobar"));
  EXPECT_FALSE(base64Decoded("Z"));
}

TEST(Uuid, IsRandomOfVersionFour) {
  std::set<std::string> seen;
  for (int round = 0; round < 100; ++round) {
    const std::string text = randomUuidText();
    ASSERT_EQ(text.size(), 36U);
    EXPECT_EQ(text[14], '4');
    EXPECT_NE(std::string_view("89AB").find(text[19]), std::string_view::npos);
    EXPECT_TRUE(seen.insert(text).second);
  }
}

}  // namespace
}  // namespace velk
