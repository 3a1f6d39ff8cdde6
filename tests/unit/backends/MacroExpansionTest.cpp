#include "backends/MacroExpansion.h"

#include <gtest/gtest.h>

#include "tests/support/RecordingLog.h"

namespace velk::test {
namespace {

const PropertyDictionary kDataSet{{"==countries", PropertyArray{"US", "CA"}},
                                  {"==again", "==countries"},
                                  {"==box", PropertyDictionary{{"inner", "==countries"}}},
                                  {"plain", "never"}};

TEST(MacroExpansion, ReplacesAWholeMacroText) {
  RecordingLog log;
  PropertyDictionary container{{"list", "==countries"}};
  expandMacroForDataSet(container, "list", kDataSet);
  EXPECT_EQ(container, (PropertyDictionary{{"list", PropertyArray{"US", "CA"}}}));
  EXPECT_EQ(
      log.count(log::Level::standard, "expandMacroForDataSet: Expanding macro '==countries' into '[\"US\",\"CA\"]'"),
      1);
}

TEST(MacroExpansion, LeavesTextThatIsNoMacro) {
  PropertyDictionary container{{"a", "plain"}, {"b", "=countries"}, {"c", "==unknown"}, {"d", "x==countries"}};
  const PropertyDictionary before = container;
  for (const char* key : {"a", "b", "c", "d"}) expandMacroForDataSet(container, key, kDataSet);
  EXPECT_EQ(container, before);
}

TEST(MacroExpansion, WalksEverythingBelow) {
  PropertyDictionary container{
      {"section",
       PropertyDictionary{{"clients", PropertyArray{PropertyDictionary{{"where", "==countries"}}, "==again"}}}},
      {"other", "==countries"}};
  expandMacroForDataSet(container, "section", kDataSet);
  const PropertyArray countries{"US", "CA"};
  EXPECT_EQ(*container.find("section"),
            PropertyValue(PropertyDictionary{
                {"clients", PropertyArray{PropertyDictionary{{"where", countries}}, "==countries"}}}));
  EXPECT_EQ(*container.string("other"), "==countries");
}

TEST(MacroExpansion, NeverExpandsWhatItPutIn) {
  PropertyDictionary container{{"text", "==again"}, {"box", "==box"}};
  expandMacroForDataSet(container, "text", kDataSet);
  expandMacroForDataSet(container, "box", kDataSet);
  EXPECT_EQ(*container.string("text"), "==countries");
  EXPECT_EQ(*container.dictionary("box")->string("inner"), "==countries");
}

TEST(MacroExpansion, WritesOnlyToItsOwnContainer) {
  const PropertyDictionary original{{"section", PropertyDictionary{{"list", "==countries"}}}};
  PropertyDictionary copy = original;
  expandMacroForDataSet(copy, "section", kDataSet);
  EXPECT_EQ(*original.dictionary("section")->string("list"), "==countries");
  EXPECT_NE(copy.dictionary("section")->array("list"), nullptr);
}

TEST(MacroExpansion, TakesAnIndexIntoAnArray) {
  PropertyArray container{"==countries", 5, nullptr};
  for (const std::size_t index : {0U, 1U, 2U, 3U}) expandMacroForDataSet(container, index, kDataSet);
  EXPECT_EQ(container, (PropertyArray{PropertyArray{"US", "CA"}, 5, nullptr}));
}

TEST(MacroExpansion, IgnoresAnElementThatIsNotThere) {
  PropertyDictionary container{{"a", 1}};
  expandMacroForDataSet(container, "b", kDataSet);
  EXPECT_EQ(container, (PropertyDictionary{{"a", 1}}));
}

}  // namespace
}  // namespace velk::test
