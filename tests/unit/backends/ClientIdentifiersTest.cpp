#include "backends/ClientIdentifiers.h"

#include <gtest/gtest.h>

#include "tests/support/FakeUserDefaults.h"
#include "tests/support/RecordingLog.h"

namespace velk::test {
namespace {

class ClientIdentifiersTest : public ::testing::Test {
 protected:
  std::string identifier(const std::string& prefix, const std::string& suffix) {
    return identifiers.getPersistentIdentifierForCustomClientIDSuffix(defaults, &prefix, &suffix);
  }
  [[nodiscard]] int errors() const {
    int count = 0;
    for (const auto& line : log.lines()) count += line.level == log::Level::error ? 1 : 0;
    return count;
  }

  RecordingLog log;
  FakeUserDefaults defaults;
  ClientIdentifiers identifiers;
};

bool isUuidText(const std::string& text) {
  return text.size() == 36 && text.find_first_not_of("0123456789ABCDEF-") == std::string::npos && text[14] == '4';
}

TEST_F(ClientIdentifiersTest, StaysTheSameForOneSuffix) {
  const auto first = identifier("abc", "def");
  EXPECT_TRUE(isUuidText(first)) << first;
  EXPECT_EQ(identifier("abc", "def"), first);
  EXPECT_NE(identifier("abc", "other"), first);
  EXPECT_NE(identifier("other", "def"), first);
  EXPECT_EQ(defaults.value("uuid:abc:def"), PropertyValue(first));
  EXPECT_EQ(log.count(log::Level::standard,
                      "getPersistentIdentifierForCustomClientIDSuffix: The value for uuid:abc:def: " + first),
            2);
}

TEST_F(ClientIdentifiersTest, TakesAbsentPartsForEmpty) {
  const auto absent = identifiers.getPersistentIdentifierForCustomClientIDSuffix(defaults, nullptr, nullptr);
  EXPECT_EQ(defaults.value("uuid::"), PropertyValue(absent));
  EXPECT_EQ(identifier("", ""), absent);
}

TEST_F(ClientIdentifiersTest, ChangesWhenTheStoredValueIsRemoved) {
  const auto first = identifier("a", "b");
  ASSERT_TRUE(defaults.remove("uuid:a:b"));
  EXPECT_NE(identifier("a", "b"), first);
}

TEST_F(ClientIdentifiersTest, KeepsNoneForNamesBeyondTheirBound) {
  const std::string longest(ClientIdentifiers::kMaximumNameBytes, 'x');
  identifier(longest, longest);
  EXPECT_EQ(defaults.allValues().size(), 1U);
  for (int again = 0; again < 2; ++again) {
    const auto passing = identifier(longest + "x", "b");
    EXPECT_TRUE(isUuidText(passing)) << passing;
    EXPECT_EQ(identifier(longest + "x", "b"), passing);
    EXPECT_NE(identifier("b", longest + "x"), passing);
  }
  EXPECT_EQ(defaults.allValues().size(), 1U);
  EXPECT_EQ(errors(), 1);
  EXPECT_FALSE(log.contains(longest + "x"));
}

TEST_F(ClientIdentifiersTest, KeepsAFixedNumber) {
  const auto early = identifier("early", "");
  for (std::size_t i = 1; i < ClientIdentifiers::kMaximumIdentifiers; ++i) {
    defaults.put("uuid:" + std::to_string(i) + ":", "value");
  }
  defaults.put("another setting", 1);
  const auto writes = defaults.writeCount();
  const auto passing = identifier("late", "");
  EXPECT_TRUE(isUuidText(passing)) << passing;
  EXPECT_EQ(identifier("late", ""), passing);
  EXPECT_NE(identifier("later", ""), passing);
  EXPECT_EQ(defaults.writeCount(), writes);
  EXPECT_EQ(errors(), 1);
  EXPECT_EQ(identifier("early", ""), early);
  ASSERT_TRUE(defaults.remove("uuid:1:"));
  EXPECT_NE(identifier("late", ""), passing);
  EXPECT_TRUE(defaults.value("uuid:late:"));
}

TEST_F(ClientIdentifiersTest, MakesOthersInEachProcess) {
  ClientIdentifiers other;
  const std::string name(ClientIdentifiers::kMaximumNameBytes + 1, 'x');
  EXPECT_NE(other.getPersistentIdentifierForCustomClientIDSuffix(defaults, &name, nullptr), identifier(name, ""));
}

}  // namespace
}  // namespace velk::test
