// Single events that bring their session with them.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyDictionary kUser{{"_clientName", "Test"}, {"_serviceName", "unit"}};

PropertyDictionary oneShot(const PropertyDictionary& sessionInfo, const PropertyValue& payload,
                           const PropertyValue& userInfo = kUser, int category = 7) {
  return {{"method", "sendMessageWithSessionInfo"},
          {"sessionInfo", sessionInfo},
          {"userInfo", userInfo},
          {"category", category},
          {"type", 3},
          {"payload", payload}};
}

const PropertyDictionary kInfo{{"ComponentType", 9}, {"SessionID", 5}, {"ClientVersion", 2}};

struct OneShots {
  explicit OneShots(const char* device = kDeviceLines)
      : daemon(prepared(server), optionsFor(device)), session(daemon) {}
  static ReportingServer& prepared(ReportingServer& server) {
    server.setStorebag("heather", storebagWith(server));
    return server;
  }
  static Daemon::Options optionsFor(const char* device) {
    Daemon::Options options;
    options.deviceConfiguration = device;
    return options;
  }
  ReportingServer server;
  Daemon daemon;
  ControlledSession session;
};

const PropertyArray kFinished{"finished"};

TEST(OneShot, IsBuiltAndPosted) {
  OneShots one;
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"answer", 42}})), kFinished);
  ASSERT_TRUE(one.server.waitForEvents(1, {7}));
  const auto events = one.server.events();
  EXPECT_EQ(events.size(), 1U) << "no start message";
  EXPECT_EQ(integerValue(events[0].find("answer")), 42);
  EXPECT_EQ(integerValue(events[0].find("_eventNumber")), 1);
  EXPECT_EQ(*events[0].string("_clientName"), "Test");
  EXPECT_FALSE(events[0].contains("SerialNum"));
  EXPECT_TRUE(one.daemon.log().waitForPart("sendOneMessageWithSessionInfo: Sending single message with sessionID 5"));
  EXPECT_NE(one.daemon.messageLog().find("[splunk -> sendOneMessageWithSessionInfo] "), std::string::npos);
}

TEST(OneShot, OfAnInternalBuildShowsTheSerialNumber) {
  OneShots one(kInternalDeviceLines);
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"answer", 42}})), kFinished);
  ASSERT_TRUE(one.server.waitForEvents(1, {7}));
  EXPECT_EQ(*eventsOf(one.server, 7)[0].string("SerialNum"), "S123");
}

TEST(OneShot, BuildsItsBackendsAnewEachTime) {
  OneShots one;
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"number", i}})), kFinished);
  }
  ASSERT_TRUE(one.server.waitForEvents(3, {7}));
  for (const auto& event : eventsOf(one.server, 7)) EXPECT_EQ(integerValue(event.find("_eventNumber")), 1);
  EXPECT_EQ(one.daemon.log().countOnceThereAre(3, "createBackendsWithStorebag: Creating backends for session 5"), 3U);
}

TEST(OneShot, PayloadNamedClientDataIsUnwrapped) {
  OneShots one;
  EXPECT_EQ(one.session.call(
                oneShot(kInfo, PropertyDictionary{{"ClientData", PropertyDictionary{{"inner", 1}}}, {"outer", 2}})),
            kFinished);
  ASSERT_TRUE(one.server.waitForEvents(1, {7}));
  EXPECT_TRUE(eventsOf(one.server, 7)[0].contains("inner"));
  EXPECT_FALSE(eventsOf(one.server, 7)[0].contains("outer"));
}

TEST(OneShot, WithoutUserInfoSendsNothing) {
  OneShots one;
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"answer", 42}}, PropertyValue())), kFinished);
  EXPECT_TRUE(one.daemon.log().waitForPart(
      "<3>sendOneMessageWithSessionInfo: userInfo must be present and valid!!! Aborting method..."));
  EXPECT_TRUE(one.server.posts().empty());
}

TEST(OneShot, WithoutStorebagSaysSo) {
  OneShots one;
  EXPECT_EQ(one.session.call(oneShot({{"ComponentType", 3}, {"SessionID", 5}}, PropertyDictionary{{"answer", 42}})),
            PropertyArray{"storebag not available"});
}

TEST(OneShot, WithoutClientTypeNamesTheIdentifiersAndIsNotCounted) {
  OneShots one;
  EXPECT_EQ(one.session.call(oneShot({{"SessionID", 5}}, PropertyDictionary{{"answer", 42}})),
            PropertyArray{"Could not retrieve identifiers from sessionInfo"});
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"answer", 42}})), kFinished) << "it goes on";
  EXPECT_TRUE(one.server.waitForEvents(1, {7}));
}

TEST(OneShot, WithoutClientTypeOnACountedSessionNamesTheIdentifiers) {
  OneShots one;
  ASSERT_EQ(one.session.open(9, 5).size(), 3U);
  EXPECT_EQ(one.session.call(oneShot({{"SessionID", 5}}, PropertyDictionary{{"answer", 42}})),
            PropertyArray{"Could not retrieve identifiers from sessionInfo"});
}

TEST(OneShot, WithoutSessionNumberNamesTheIdentifiers) {
  OneShots one;
  EXPECT_EQ(one.session.call(oneShot({{"ComponentType", 9}}, PropertyDictionary{{"answer", 42}})),
            PropertyArray{"Could not retrieve identifiers from sessionInfo"});
  EXPECT_TRUE(
      one.daemon.log().waitForPart("<3>sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo"));
}

TEST(OneShot, OfTheSixthSessionGetsTheLimitsReply) {
  OneShots one;
  std::vector<std::unique_ptr<ControlledSession>> five;
  for (int i = 0; i < 5; ++i) {
    five.push_back(std::make_unique<ControlledSession>(one.daemon));
    ASSERT_EQ(five.back()->call(oneShot(kInfo, PropertyDictionary{{"number", i}})), kFinished);
  }
  const auto reply = one.session.call(oneShot(kInfo, PropertyDictionary{{"number", 6}}));
  ASSERT_EQ(reply.size(), 1U) << "the reply of the call in progress is delivered before the end";
  EXPECT_EQ(reply[0].string()->rfind("Exceeded maximum active reporting session limit for userInfo='", 0), 0U);
  EXPECT_FALSE(one.session.event("invalidated").empty());
  ASSERT_TRUE(one.server.waitForEvents(5, {7}));
  EXPECT_EQ(eventsOf(one.server, 7).size(), 5U);
}

TEST(OneShot, ListsApply) {
  OneShots one;
  one.server.setStorebag("heather", storebagWith(one.server, {{"event_blacklist", PropertyArray{8}},
                                                              {"event_whitelist", PropertyArray{7, 8}}}));
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"a", 1}}, kUser, 8)), kFinished);
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"a", 1}}, kUser, 9)), kFinished);
  EXPECT_EQ(one.session.call(oneShot(kInfo, PropertyDictionary{{"a", 1}}, kUser, 7)), kFinished);
  ASSERT_TRUE(one.server.waitForEvents(1, {7}));
  EXPECT_EQ(one.server.events().size(), 1U);
  EXPECT_TRUE(one.daemon.log().waitForPart(
      "sendOneMessageWithSessionInfo: Dropping event with category 8 as it is blacklisted for backend splunk"));
  EXPECT_TRUE(one.daemon.log().waitForPart(
      "sendOneMessageWithSessionInfo: Dropping event with category 9 as it is not whitelisted for backend splunk"));
}

TEST(OneShot, BatchedEventGoesWhenTheSessionEnds) {
  OneShots one;
  auto info = kInfo;
  info.set("BatchEvents", true);
  EXPECT_EQ(one.session.call(oneShot(info, PropertyDictionary{{"answer", 42}})), kFinished);
  EXPECT_EQ(one.session.finish(), 0);
  EXPECT_TRUE(one.server.waitForEvents(1, {7}));
}

}  // namespace
}  // namespace velk::test
