#include <gtest/gtest.h>

#include "client/LogTexts.h"
#include "client/VelkReporting.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/client/FakeDaemon.h"

namespace velk::test {
namespace {

PropertyDictionary token(const std::optional<PropertyValue>& parent) {
  const auto made = VelkReporting::newHierarchyTokenFromParentToken(parent);
  EXPECT_TRUE(made);
  return made.value_or(PropertyDictionary());
}

TEST(HierarchyToken, LevelsGrowAndTheTokenStays) {
  const auto root = token(std::nullopt);
  EXPECT_EQ(integerValue(root.find("level")), 0);
  EXPECT_EQ(root.string("token")->size(), 36U);
  const auto child = token(root);
  EXPECT_EQ(*child.string("token"), *root.string("token"));
  EXPECT_EQ(integerValue(child.find("level")), 1);
  EXPECT_EQ(integerValue(token(child).find("level")), 2);
  EXPECT_NE(token(std::nullopt), root);
}

TEST(HierarchyToken, ParentsThatAreNoneYieldNothing) {
  EXPECT_FALSE(VelkReporting::newHierarchyTokenFromParentToken(PropertyValue(PropertyArray{1})));
  EXPECT_FALSE(VelkReporting::newHierarchyTokenFromParentToken(PropertyValue(PropertyDictionary{{"level", 3}})));
  EXPECT_EQ(integerValue(token(PropertyDictionary{{"token", "t"}}).find("level")), 1) << "a missing level counts as 0";
}

class PersistentIdentifiers : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("HOME", _home.path().c_str(), 1);
    unsetenv("XDG_STATE_HOME");
    unsetenv("XDG_CONFIG_HOME");
  }
  TemporaryDirectory _home;
};

TEST_F(PersistentIdentifiers, LastUntilTheyAreRegenerated) {
  const auto respecting = VelkReporting::getPersistentIdentifierForDNU(true);
  const auto overriding = VelkReporting::getPersistentIdentifierForDNU(false);
  EXPECT_EQ(respecting.size(), 36U);
  EXPECT_NE(respecting, overriding);
  EXPECT_EQ(VelkReporting::getPersistentIdentifierForDNU(true), respecting);
  VelkReporting::regeneratePersistentIdentifierForDNU(true);
  EXPECT_NE(VelkReporting::getPersistentIdentifierForDNU(true), respecting);
  EXPECT_EQ(VelkReporting::getPersistentIdentifierForDNU(false), overriding);
}

class OneMessage : public ::testing::Test {
 protected:
  bool send(const std::optional<PropertyDictionary>& sessionInfo, std::uint16_t category) {
    return VelkReporting::sendOneMessageWithSessionInfo(sessionInfo, PropertyDictionary{{"_clientName", "x"}}, category,
                                                        2, PropertyDictionary{{"a", 1}}, &_error);
  }
  RecordingLog _log;
  FakeDaemon _daemon;
  Error _error;
};

TEST_F(OneMessage, RefusesWhatCannotBeReported) {
  _daemon.start();
  EXPECT_FALSE(send(std::nullopt, 1));
  EXPECT_EQ(_error, (Error{"VelkReportingErrorDomain", 2, "validateSessionInfo: sessionInfo is nil"}));
  EXPECT_FALSE(send(PropertyDictionary{{"ComponentType", 31}}, 1));
  EXPECT_EQ(_error.code, 3);
  EXPECT_FALSE(send(PropertyDictionary{{"ComponentType", 9}}, 0));
  EXPECT_EQ(_error.code, 4);
  EXPECT_EQ(_daemon.calls().size(), 0U);
}

TEST_F(OneMessage, IsNeverBatchedAndClosesItsConnection) {
  _daemon.start();
  EXPECT_TRUE(send(PropertyDictionary{{"ComponentType", 9}, {"BatchEvents", true}, {"EnableFlag", 0}}, 5));
  ASSERT_TRUE(_daemon.waitForEnds(1));
  const auto calls = _daemon.calls();
  ASSERT_EQ(calls.size(), 1U);
  EXPECT_EQ(calls[0].arguments[0].dictionary()->find("BatchEvents")->boolean()[0], false);
  EXPECT_EQ(calls[0].arguments[2], PropertyValue(5));
  EXPECT_EQ(_log.count("sendOneMessageWithSessionInfo: finished"), 1);
}

TEST_F(OneMessage, WithoutADaemonIsLost) {
  EXPECT_TRUE(send(PropertyDictionary{{"ComponentType", 9}}, 5));
  _daemon.start();
  // One that follows on the same queue is answered, so the first has been given up by then.
  EXPECT_TRUE(send(PropertyDictionary{{"ComponentType", 9}}, 6));
  ASSERT_TRUE(_daemon.waitForEnds(1));
}

}  // namespace
}  // namespace velk::test
