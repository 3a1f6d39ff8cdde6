// How much one kind of client may take: five sessions of a client type, and what happens to the sixth.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

using Sessions = std::vector<std::unique_ptr<ControlledSession>>;

/// The session's number is stored only after the limit has been looked at, so the line shows none.
std::string limitLine(int clientType) {
  return "<3>isActiveClientLimitReachedForSession: session 0 exceeds number of allowed active connections for "
         "clientType " +
         std::to_string(clientType) + ". Session terminated...";
}

/// Opens five sessions of a client type, numbered from `firstID`.
Sessions openFive(const Daemon& daemon, int clientType, int firstID) {
  Sessions sessions;
  for (int i = 0; i < 5; ++i) {
    sessions.push_back(std::make_unique<ControlledSession>(daemon));
    EXPECT_EQ(sessions.back()->open(clientType, firstID + i).size(), 3U) << clientType;
  }
  return sessions;
}

class LimitOfType : public testing::TestWithParam<int> {};

TEST_P(LimitOfType, EndsTheSixthSessionAlone) {
  const int type = GetParam();
  ReportingServer server;
  for (const char* name : {"heather", "burdock"}) server.setStorebag(name, storebagWith(server));
  Daemon daemon(server);
  Sessions five = openFive(daemon, type, 1);
  ControlledSession sixth(daemon);

  sixth.sendOpening(type, 6);  // both calls are on their way before the first is refused

  EXPECT_FALSE(sixth.event("invalidated").empty());
  EXPECT_EQ(sixth.process().wait(), 69);
  EXPECT_TRUE(daemon.log().waitForPart(limitLine(type)));
  EXPECT_EQ(daemon.log().count("Starting configuration for session 6"), 0U);
  EXPECT_EQ(daemon.log().count("Creating backends for session 6"), 0U);
  for (auto& session : five) {
    EXPECT_EQ(session->call({{"method", "startConfigWithCompletionHandler"}}).size(), 3U);
    EXPECT_EQ(session->finish(), 0);
  }
  EXPECT_EQ(daemon.stop(), 0);
}

INSTANTIATE_TEST_SUITE_P(Counted, LimitOfType, testing::Values(0, 4, 9, 30));

TEST(Limits, TypesBeyondTheTableAreNotCounted) {
  ReportingServer server;
  Daemon daemon(server);
  for (const int type : {31, -1, 255, 256, 2000000000}) {
    Sessions five = openFive(daemon, type, 1);
    ControlledSession sixth(daemon);
    EXPECT_EQ(sixth.open(type, 6), noLists()) << type;
    EXPECT_EQ(sixth.finish(), 0);
  }
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(Limits, RoomIsMadeByTheSessionThatEnds) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  Sessions five = openFive(daemon, 9, 1);
  {
    ControlledSession sixth(daemon);
    sixth.sendOpening(9, 6);
    ASSERT_FALSE(sixth.event("invalidated").empty());
  }
  ASSERT_TRUE(daemon.log().waitForPart("invalidateReportingSession: ReportingdSession "));
  const std::size_t before = daemon.log().lines().size();

  EXPECT_EQ(five.back()->finish(), 0);
  ASSERT_TRUE(daemon.log().waitForPart("invalidateReportingSession: ReportingdSession ", before));
  ControlledSession seventh(daemon);

  EXPECT_EQ(seventh.open(9, 7)[0], PropertyValue(PropertyArray{"splunk"}));
}

TEST(Limits, OtherTypesAreUntouched) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  server.setStorebag("clover", storebagWith(server));
  Daemon daemon(server);
  Sessions five = openFive(daemon, 9, 1);
  Sessions others = openFive(daemon, 6, 11);
  Sessions more = openFive(daemon, 18, 21);

  EXPECT_EQ(daemon.log().count("exceeds number of allowed active connections"), 0U);
}

TEST(Limits, ASessionIsCountedOnce) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  Sessions five = openFive(daemon, 9, 1);

  for (int i = 0; i < 3; ++i) {
    for (auto& session : five) {
      const auto lists = session->call(
          {{"method", "fetchStatesWithUserInfo"}, {"userInfo", PropertyDictionary{{"_clientName", "Test"}}}});
      ASSERT_EQ(lists.size(), 3U);
      EXPECT_EQ(lists[0], PropertyValue(PropertyArray{"splunk"}));
    }
  }
  EXPECT_EQ(daemon.log().count("exceeds number of allowed active connections"), 0U);
}

TEST(Limits, ChangingTheTypeLowersTheNewTypesCount) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  server.setStorebag("clover", storebagWith(server));
  Daemon daemon(server);
  Sessions five = openFive(daemon, 6, 1);
  {
    ControlledSession turncoat(daemon);
    ASSERT_EQ(turncoat.open(9, 6).size(), 3U);
    ASSERT_EQ(turncoat.open(6, 6).size(), 3U) << "counted already: not asked again";
    const std::size_t before = daemon.log().lines().size();
    EXPECT_EQ(turncoat.finish(), 0);
    ASSERT_TRUE(daemon.log().waitForPart("invalidateReportingSession: ReportingdSession ", before));
  }

  ControlledSession sixth(daemon);
  EXPECT_EQ(sixth.open(6, 7)[0], PropertyValue(PropertyArray{"splunk"})) << "the end of the other made room";
}

TEST(Limits, HundredSessionsAtOnceAreServed) {
  ReportingServer server;
  const std::vector<std::pair<int, const char*>> types{
      {5, "bramble"},   {6, "clover"},   {8, "fennel"},  {9, "heather"},  {10, "juniper"},
      {12, "lavender"}, {14, "mallow"},  {15, "nettle"}, {16, "orchid"},  {17, "primrose"},
      {19, "rosemary"}, {21, "saffron"}, {22, "tansy"},  {23, "thistle"}, {25, "valerian"},
      {26, "verbena"},  {27, "willow"},  {28, "yarrow"}, {29, "comfrey"}, {30, "burdock"}};
  for (const auto& type : types) server.setStorebag(type.second, storebagWith(server));
  Daemon daemon(server);
  Sessions sessions;
  std::vector<std::size_t> lines;
  for (const auto& type : types) {
    for (int i = 0; i < 5; ++i) {
      sessions.push_back(std::make_unique<ControlledSession>(daemon));
      lines.push_back(sessions.back()->sendOpening(type.first, static_cast<int>(sessions.size())));
      sessions.back()->sendEvent(7, 1, PropertyDictionary{{"number", static_cast<int>(sessions.size())}});
    }
  }
  for (std::size_t i = 0; i < sessions.size(); ++i) {
    ASSERT_NE(sessions[i]->reply(lines[i], std::chrono::seconds(200)).array("reply"), nullptr) << i;
  }
  EXPECT_TRUE(server.waitForEvents(sessions.size(), {7}, std::chrono::seconds(200)));
  for (auto& session : sessions) EXPECT_EQ(session->finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
