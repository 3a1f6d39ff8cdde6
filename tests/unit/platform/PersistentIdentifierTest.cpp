#include "platform/PersistentIdentifier.h"

#include <gtest/gtest.h>

#include "foundation/Format.h"
#include "platform/LogTexts.h"
#include "tests/support/FakeUserDefaults.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

class PersistentIdentifierTest : public testing::Test {
 protected:
  test::RecordingLog log;
  test::FakeUserDefaults defaults;
};

bool isUuidText(const std::string& text) {
  return text.size() == 36 && text.find_first_not_of("0123456789ABCDEF-") == std::string::npos && text[14] == '4';
}

TEST_F(PersistentIdentifierTest, KeepsOneForEachKindOfConsent) {
  const auto respecting = getPersistentIdentifierForDNU(defaults, true);
  const auto overriding = getPersistentIdentifierForDNU(defaults, false);
  EXPECT_TRUE(isUuidText(respecting));
  EXPECT_NE(respecting, overriding);
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, true), respecting);
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, false), overriding);
  EXPECT_EQ(defaults.value("uuidRespectDNU"), PropertyValue(respecting));
  EXPECT_EQ(defaults.value("uuidOverrideDNU"), PropertyValue(overriding));
  EXPECT_EQ(log.count(log::Level::standard,
                      formatText(logtexts::kPersistentIdentifierForDNU, {"uuidRespectDNU", respecting})),
            2);
}

TEST_F(PersistentIdentifierTest, RegeneratesOneAndLeavesTheOther) {
  const auto respecting = getPersistentIdentifierForDNU(defaults, true);
  const auto overriding = getPersistentIdentifierForDNU(defaults, false);
  regeneratePersistentIdentifierForDNU(defaults, true);
  const auto renewed = getPersistentIdentifierForDNU(defaults, true);
  EXPECT_NE(renewed, respecting);
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, false), overriding);
  EXPECT_EQ(log.count(log::Level::standard,
                      "regeneratePersistentIdentifierForDNU: Set new value for uuidRespectDNU: " + renewed),
            1);
}

TEST_F(PersistentIdentifierTest, AnswersEvenWhenNothingCanBeStored) {
  defaults.setFailsWrites(true);
  EXPECT_TRUE(isUuidText(getPersistentIdentifierForDNU(defaults, true)));
  regeneratePersistentIdentifierForDNU(defaults, true);
  EXPECT_TRUE(log.contains("persistentIdentifier: Cannot store uuidRespectDNU: "));
}

TEST_F(PersistentIdentifierTest, StaysTheSameWhileItCannotBeStored) {
  defaults.setFailsWrites(true);
  const auto first = getPersistentIdentifierForDNU(defaults, true);
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, true), first);
  defaults.setFailsWrites(false);
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, true), first);
  EXPECT_EQ(defaults.value("uuidRespectDNU"), PropertyValue(first));
}

TEST_F(PersistentIdentifierTest, ReplacesWhatIsNoIdentifier) {
  defaults.put("uuidRespectDNU", 7);
  const auto identifier = getPersistentIdentifierForDNU(defaults, true);
  EXPECT_TRUE(isUuidText(identifier));
  EXPECT_EQ(getPersistentIdentifierForDNU(defaults, true), identifier);
}

}  // namespace
}  // namespace velk
