#include "backends/ClientEntryMatching.h"

#include <gtest/gtest.h>

namespace velk::test {
namespace {

const std::string kRussia = "Russia";

TEST(ClientEntryMatching, AnswersTheFlagWithoutList) {
  const PropertyArray empty;
  for (const bool whitelist : {true, false}) {
    EXPECT_EQ(matchExactStringWithList(nullptr, &kRussia, whitelist), whitelist);
    EXPECT_EQ(matchStringWithList(&empty, &kRussia, whitelist), whitelist);
    EXPECT_EQ(matchStringWithList(nullptr, nullptr, whitelist), whitelist);
  }
}

TEST(ClientEntryMatching, AnswersTheOppositeWithoutText) {
  const PropertyArray list{"US"};
  for (const bool whitelist : {true, false}) {
    EXPECT_EQ(matchExactStringWithList(&list, nullptr, whitelist), !whitelist);
    EXPECT_EQ(matchStringWithList(&list, nullptr, whitelist), !whitelist);
  }
}

TEST(ClientEntryMatching, ComparesWithoutRegardToCase) {
  const PropertyArray list{"xx", "us"};
  const std::string upper = "US";
  EXPECT_TRUE(matchExactStringWithList(&list, &upper, true));
  EXPECT_TRUE(matchStringWithList(&list, &upper, false));
  EXPECT_FALSE(matchExactStringWithList(&list, &kRussia, true));
  EXPECT_TRUE(matchStringWithList(&list, &kRussia, false));
}

TEST(ClientEntryMatching, ComparesLettersOfAnyScriptWithoutRegardToCase) {
  const std::string client = "Me\u0301dia";
  const std::string service = "com.example.ПОЧТА";
  EXPECT_TRUE(matchClientNameAndServiceID({{"client", "a,M\u00c9DIA"}, {"service", "почта"}}, &client, &service));
  EXPECT_FALSE(matchClientNameAndServiceID({{"client", "media"}}, &client, &service));
  const PropertyArray devices{"GRÖSSE"};
  const std::string device = "Große Größe";
  EXPECT_TRUE(matchStringWithList(&devices, &device, false));
}

TEST(ClientEntryMatching, MatchesNothingWithElementsThatAreNoText) {
  const PropertyArray list{5, PropertyArray{"US"}, nullptr};
  const std::string text = "5";
  EXPECT_FALSE(matchExactStringWithList(&list, &text, true));
  EXPECT_FALSE(matchStringWithList(&list, &text, true));
}

TEST(ClientEntryMatching, KeepsBlanksInClientNames) {
  const std::string b = "b";
  const std::string upperB = "B";
  EXPECT_TRUE(matchClientNameAndServiceID({{"client", "A,B"}}, &b, nullptr));
  EXPECT_FALSE(matchClientNameAndServiceID({{"client", "A, B"}}, &upperB, nullptr));
}

TEST(ClientEntryMatching, TakesAPartOfTheServiceName) {
  const std::string client = "Media";
  const std::string service = "com.example.Calls";
  EXPECT_TRUE(matchClientNameAndServiceID({{"service", "mail,calls"}}, &client, &service));
  EXPECT_FALSE(matchClientNameAndServiceID({{"service", "mail"}}, &client, &service));
  EXPECT_FALSE(matchClientNameAndServiceID({{"service", "calls"}}, &client, nullptr));
  EXPECT_FALSE(matchClientNameAndServiceID({{"client", "other"}, {"service", "calls"}}, &client, &service));
}

TEST(ClientEntryMatching, IsForEverybodyWithoutNames) {
  const std::string client = "Media";
  EXPECT_TRUE(matchClientNameAndServiceID({}, &client, &client));
  EXPECT_TRUE(matchClientNameAndServiceID({}, nullptr, nullptr));
  EXPECT_FALSE(matchClientNameAndServiceID({{"client", "Media"}}, nullptr, nullptr));
}

TEST(ClientEntryMatching, ComparesVersionsPartByPart) {
  const PropertyDictionary entry{{"enabledSince", "8.1"}};
  EXPECT_TRUE(isFrameworkEnabledForClient(entry, {8, 1, 0}));
  EXPECT_TRUE(isFrameworkEnabledForClient(entry, {9, 0, 0}));
  EXPECT_FALSE(isFrameworkEnabledForClient(entry, {8, 0, 9}));
  EXPECT_TRUE(isFrameworkEnabledForClient({}, {0, 0, 0}));
  EXPECT_TRUE(isFrameworkEnabledForClient({{"enabledSince", "264.1"}}, {8, 1, 0}));
}

TEST(ClientEntryMatching, ReadsAVersionGivenAsANumber) {
  EXPECT_FALSE(isFrameworkEnabledForClient({{"enabledSince", 8.5}}, {8, 1, 0}));
  EXPECT_TRUE(isFrameworkEnabledForClient({{"enabledSince", 8}}, {8, 1, 0}));
}

TEST(ClientEntryMatching, IsForNobodyWithNamesOfTheWrongType) {
  const std::string client = "A";
  for (const PropertyValue& value :
       {PropertyValue(PropertyArray{"A", "B"}), PropertyValue(5), PropertyValue(nullptr)}) {
    EXPECT_FALSE(matchClientNameAndServiceID({{"client", value}}, &client, &client));
    EXPECT_FALSE(matchClientNameAndServiceID({{"client", value}}, nullptr, nullptr));
    EXPECT_FALSE(matchClientNameAndServiceID({{"service", value}}, &client, &client));
  }
  EXPECT_FALSE(isFrameworkEnabledForClient({{"enabledSince", PropertyArray{}}}, {8, 1, 0}));
  EXPECT_FALSE(isFrameworkEnabledForClient({{"enabledSince", true}}, {8, 1, 0}));
}

TEST(ClientEntryMatching, FindsExactTexts) {
  const PropertyArray list{1, "US"};
  const std::string us = "US";
  const std::string lower = "us";
  EXPECT_TRUE(containsText(&list, &us));
  EXPECT_FALSE(containsText(&list, &lower));
  EXPECT_FALSE(containsText(nullptr, &us));
  EXPECT_FALSE(containsText(&list, nullptr));
}

}  // namespace
}  // namespace velk::test
