// Backends that become enabled after the configuration: what they post arrives.

#include <gtest/gtest.h>

#include "tests/integration/Relatives.h"

namespace velk::test {
namespace {

const PropertyDictionary kSampledOut{{"sampling_threshold", 0}, {"override_sampling", 0}};
const PropertyDictionary kUser{{"_clientName", "Test"}, {"_serviceName", "unit"}};

PropertyDictionary oneShot(int clientType, int number) {
  return {{"method", "sendMessageWithSessionInfo"},
          {"sessionInfo", PropertyDictionary{{"ComponentType", clientType}, {"SessionID", 5}}},
          {"userInfo", kUser},
          {"category", 7},
          {"type", 3},
          {"payload", PropertyDictionary{{"n", number}}}};
}

TEST(Enabling, ByAFlagDeliversTheNextEvent) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"sampling_threshold", 0}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 1)[0], PropertyValue(PropertyArray())) << "it waits";
  session.sendEvent(7, 1, PropertyDictionary{{"n", 1}}, 2);
  session.sendEvent(7, 1, PropertyDictionary{{"n", 2}});
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  EXPECT_EQ(integerValue(eventsOf(server, 7)[0].find("n")), 2);
  EXPECT_EQ(session.finish(), 0);
  ASSERT_TRUE(server.waitForEvents(2, {7}));
  EXPECT_EQ(integerValue(eventsOf(server, 7)[1].find("n")), 1) << "what waited goes at the end";
}

TEST(Enabling, SessionDescribedAgainWithAnotherUserDelivers) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 1)[0], PropertyValue(PropertyArray{"splunk"}));
  session.send({{"method", "setSessionInfo"},
                {"sessionInfo", PropertyDictionary{{"ComponentType", 9}, {"SessionID", 2}}},
                {"userInfo", PropertyDictionary{{"_clientName", "Another"}, {"_serviceName", "one"}}},
                {"frameworksToCheck", PropertyArray{}},
                {"hasAggregationBlock", false}});
  session.sendEvent(7, 1, PropertyDictionary{{"n", 1}});
  EXPECT_TRUE(server.waitForEvents(1, {7}));
}

TEST(Enabling, ByTheParentDelivers) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  server.setStorebag("clover", storebagWith(server, kSampledOut));
  Daemon daemon(server);
  ControlledSession parent(daemon);
  ASSERT_EQ(openRelative(parent, 9, 1, "parent", inTree(0)).size(), 3U);
  ControlledSession child(daemon);
  EXPECT_EQ(openRelative(child, 6, 2, "child", inTree(1))[0], PropertyValue(PropertyArray{"splunk"}));
  ASSERT_TRUE(sendNumber(child, 7, 1));
  EXPECT_TRUE(server.waitForEvents(1, {7}));
}

TEST(Enabling, OneShotSampledInAfterOneSampledOutDelivers) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  server.setStorebag("clover", storebagWith(server, kSampledOut));
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.call(oneShot(6, 1)), PropertyArray{"finished"});
  EXPECT_EQ(session.call(oneShot(9, 2)), PropertyArray{"finished"});
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  EXPECT_EQ(integerValue(eventsOf(server, 7)[0].find("n")), 2);
}

TEST(Enabling, OneShotsThatReplaceABatchDeliverIt) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}}).size(), 3U);
  session.sendEvent(7, 1, PropertyDictionary{{"n", 1}});
  EXPECT_EQ(session.call(oneShot(9, 2)), PropertyArray{"finished"});
  EXPECT_TRUE(server.waitForEvents(2, {7}));
  EXPECT_TRUE(daemon.log().waitForPart("internalFlushMessagesWithCompletion: splunk"));
}

}  // namespace
}  // namespace velk::test
