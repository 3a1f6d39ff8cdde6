#include "unicode/CaseFolding.h"

#include <gtest/gtest.h>

namespace velk::test {
namespace {

bool foldable(std::string_view text, std::string_view other) { return Foldable(text).equals(FoldedText(other)); }

TEST(CaseFolding, EqualsWhateverTheCase) {
  for (const auto& [left, right] : {std::pair("", ""), std::pair("Name", "nAME"), std::pair("GRÖSSE", "größe"),
                                    std::pair("ΣΊΣΥΦΟΣ", "σίσυφος"), std::pair("Привет", "пРИВЕТ"), std::pair("ǅ", "ǆ"),
                                    std::pair("ﬁn", "FIN"), std::pair("K", "k"), std::pair("ẞ", "ss")}) {
    EXPECT_TRUE(equalsCaseFolded(left, right)) << left;
    EXPECT_TRUE(foldable(left, right)) << left;
    EXPECT_TRUE(foldable(right, left)) << left;
  }
}

TEST(CaseFolding, EqualsComposedAndDecomposed) {
  for (const auto& [left, right] :
       {std::pair("caf\u00e9", "CAFE\u0301"), std::pair("\u212b", "a\u030a"), std::pair("\u1e69", "S\u0307\u0323"),
        std::pair("\u1f80", "\u03b1\u0345\u0313"), std::pair("\uac01", "\u1100\u1161\u11a8")}) {
    EXPECT_TRUE(equalsCaseFolded(left, right)) << left;
    EXPECT_TRUE(foldable(left, right)) << left;
  }
}

TEST(CaseFolding, TellsDifferentTextsApart) {
  for (const auto& [left, right] : {std::pair("a", "b"), std::pair("a", "aa"), std::pair("größe", "grosse"),
                                    std::pair("\u00e9", "e"), std::pair("straße", "strase"), std::pair("", "é")}) {
    EXPECT_FALSE(equalsCaseFolded(left, right)) << left;
    EXPECT_FALSE(foldable(left, right)) << left;
    EXPECT_FALSE(foldable(right, left)) << left;
  }
}

TEST(CaseFolding, FindsParts) {
  for (const auto& [text, part] : {std::pair("anything", ""), std::pair("größe", ""), std::pair("Russia", "US"),
                                   std::pair("Die GRÖSSE hier", "größe"), std::pair("der Fluß", "USS"),
                                   std::pair("mein cafe\u0301", "É"), std::pair("größe", "GR")}) {
    EXPECT_TRUE(containsCaseFolded(text, part)) << part;
    EXPECT_TRUE(Foldable(text).contains(FoldedText(part))) << part;
  }
  for (const auto& [text, part] :
       {std::pair("", "a"), std::pair("größe", "rö ß"), std::pair("cafe\u0301", "fe"), std::pair("grosse", "größe")}) {
    EXPECT_FALSE(containsCaseFolded(text, part)) << part;
    EXPECT_FALSE(Foldable(text).contains(FoldedText(part))) << part;
  }
}

TEST(CaseFolding, ComparesBytesOfWhatIsNotUtf8) {
  EXPECT_TRUE(equalsCaseFolded("A\xff", "a\xff"));
  EXPECT_FALSE(equalsCaseFolded("a\xff", "a\xfe"));
  EXPECT_FALSE(equalsCaseFolded("\xff\xc3\x84", "\xff\xc3\xa4"));
  EXPECT_TRUE(containsCaseFolded("xA\xff", "a\xff"));
  EXPECT_EQ(caseFolded("A\xed\xa0\x80"), "a\xed\xa0\x80");
}

TEST(CaseFolding, KeepsNullBytes) {
  const std::string text("Ä\0B", 4);
  EXPECT_EQ(caseFolded(text), std::string("ä\0b", 4));
}

TEST(CaseFolding, LowersEachLetter) {
  EXPECT_EQ(lowerCasedText("Media"), "media");
  EXPECT_EQ(lowerCasedText("GRÖSSE, größe"), "grösse, größe");
  EXPECT_EQ(lowerCasedText("E\u0301\u00c9"), "e\u0301\u00e9");
  EXPECT_EQ(lowerCasedText("\U00010400"), "\U00010428");
  EXPECT_EQ(lowerCasedText("Ä\xff"), "Ä\xff");
}

}  // namespace
}  // namespace velk::test
