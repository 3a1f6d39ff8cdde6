#include "backends/EventFilter.h"

#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

PropertyDictionary rule(const char* key, const char* action, PropertyValue value = nullptr) {
  return {{"key", key}, {"action", action}, {"value", std::move(value)}};
}

PropertyDictionary filtered(const PropertyArray& rules, PropertyDictionary event) {
  EventFilter filter;
  filter.createFiltersFromArray(rules);
  filter.apply(event);
  return event;
}

TEST(EventFilter, RemovesAKeyWhateverItsCase) {
  EXPECT_EQ(filtered({rule("Name", "remove")}, {{"name", "x"}, {"NAME2", 1}}), (PropertyDictionary{{"NAME2", 1}}));
}

TEST(EventFilter, RemovesAKeyWhateverTheCaseOfItsLetters) {
  EXPECT_TRUE(filtered({rule("GRÖSSE", "remove")}, {{"größe", "x"}}).empty());
  EXPECT_TRUE(filtered({rule("größe", "remove")}, {{"GRÖSSE", "x"}, {"Gro\u0308\u00dfe", 1}}).empty());
  EXPECT_TRUE(filtered({rule("\u212aelvin", "remove")}, {{"kelvin", 1}}).empty());
  EXPECT_EQ(filtered({rule("größe", "remove")}, {{"grosse", "x"}}).size(), 1U);
}

TEST(EventFilter, ComparesValuesWhateverTheCaseOfTheirLetters) {
  const PropertyArray blacklist{rule("place", "blacklistValues", PropertyArray{"ZÜRICH"})};
  EXPECT_TRUE(filtered(blacklist, {{"place", "in Zu\u0308rich"}}).empty());
  EXPECT_EQ(filtered(blacklist, {{"place", "Zurich"}}).size(), 1U);
  const PropertyArray whitelist{rule("place", "whitelistValues", PropertyArray{"zürich"})};
  EXPECT_EQ(filtered(whitelist, {{"place", "ZÜRICH"}}).size(), 1U);
  EXPECT_TRUE(filtered(whitelist, {{"place", "Zurich"}}).empty());
}

TEST(EventFilter, ComparesBytesOfTextThatIsNotUtf8) {
  EXPECT_TRUE(filtered({rule("A\xff", "remove")}, {{"a\xff", 1}}).empty());
  EXPECT_EQ(filtered({rule("a\xff", "remove")}, {{"a\xfe", 1}}).size(), 1U);
}

TEST(EventFilter, HashesText) {
  EXPECT_EQ(filtered({rule("id", "sha256")}, {{"id", "abc"}}),
            (PropertyDictionary{{"id", VelkReportingBackend::convertIntoSHA256("abc")}}));
}

TEST(EventFilter, NeverLeavesPlainWhatItCannotHash) {
  for (const PropertyValue& value : {PropertyValue(5), PropertyValue(PropertyArray{"abc"}), PropertyValue(true)}) {
    EXPECT_TRUE(filtered({rule("id", "sha256")}, {{"id", value}}).empty());
  }
}

TEST(EventFilter, RemovesBlacklistedValues) {
  const PropertyArray rules{rule("url", "blacklistValues", PropertyArray{5, "Secret", "x"})};
  EXPECT_TRUE(filtered(rules, {{"url", "my SECRET page"}}).empty());
  EXPECT_EQ(filtered(rules, {{"url", "page"}}).size(), 1U);
  EXPECT_EQ(filtered(rules, {{"url", 5}}).size(), 1U);
}

TEST(EventFilter, KeepsOnlyWhitelistedText) {
  const PropertyArray rules{rule("code", "whitelistValues", PropertyArray{"ok", "5"})};
  EXPECT_EQ(filtered(rules, {{"code", "All OK"}}).size(), 1U);
  EXPECT_TRUE(filtered(rules, {{"code", "bad"}}).empty());
  EXPECT_TRUE(filtered(rules, {{"code", 5}}).empty());
}

TEST(EventFilter, ReadsAListOfTheWrongTypeAsEmpty) {
  EXPECT_TRUE(filtered({rule("code", "whitelistValues", "ok")}, {{"code", "ok"}}).empty());
  EXPECT_EQ(filtered({rule("code", "blacklistValues", 5)}, {{"code", "5"}}).size(), 1U);
}

TEST(EventFilter, LetsTheFirstMatchingRuleActAlone) {
  EXPECT_EQ(filtered({rule("id", "keep"), rule("id", "remove")}, {{"id", "x"}}).size(), 1U);
  EXPECT_EQ(filtered({rule("id", "sha256"), rule("id", "sha256")}, {{"id", "abc"}}),
            (PropertyDictionary{{"id", VelkReportingBackend::convertIntoSHA256("abc")}}));
}

TEST(EventFilter, AppliesToItsMethodAndStatus) {
  PropertyDictionary restricted = rule("id", "remove");
  restricted.set("method", 7);
  restricted.set("status", "3");
  const PropertyArray rules{restricted};
  EXPECT_FALSE(filtered(rules, {{"id", 1}, {"_method", 7}, {"_status", 3}}).contains("id"));
  EXPECT_TRUE(filtered(rules, {{"id", 1}, {"_method", 7}, {"_status", 4}}).contains("id"));
  EXPECT_TRUE(filtered(rules, {{"id", 1}, {"_method", 8}, {"_status", 3}}).contains("id"));
  EXPECT_TRUE(filtered(rules, {{"id", 1}}).contains("id"));
}

TEST(EventFilter, ReadsAnAbsentMethodOfTheEventAsZero) {
  PropertyDictionary restricted = rule("id", "remove");
  restricted.set("method", 0);
  EXPECT_TRUE(filtered({restricted}, {{"id", 1}}).empty());
}

TEST(EventFilter, KeepsItsRulesWhenThereAreNoNewOnes) {
  EventFilter filter;
  filter.createFiltersFromArray({rule("id", "remove")});
  filter.createFiltersFromArray({});
  EXPECT_EQ(filter.size(), 1U);
  filter.createFiltersFromArray({rule("a", "remove"), rule("b", "remove")});
  EXPECT_EQ(filter.size(), 2U);
}

TEST(EventFilter, SurvivesRulesOfAnyType) {
  const PropertyArray rules{5,
                            "remove",
                            nullptr,
                            PropertyArray{},
                            PropertyDictionary{{"action", "remove"}},
                            PropertyDictionary{{"key", 5}, {"action", "remove"}},
                            PropertyDictionary{{"key", "a"}, {"action", 1}}};
  const PropertyDictionary event{{"a", 1}, {"5", 2}, {"", 3}};
  EXPECT_EQ(filtered(rules, event), event);
}

}  // namespace
}  // namespace velk::test
