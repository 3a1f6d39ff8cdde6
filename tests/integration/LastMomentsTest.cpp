// What is lost when sessions end in a hurry, all at once, or come back just when their transport goes: nothing.

#include <gtest/gtest.h>
#include <signal.h>

#include <map>
#include <random>
#include <set>
#include <thread>

#include "tests/integration/Scenario.h"
#include "tests/integration/WireSession.h"

namespace velk::test {
namespace {

/// Client types, each with a storebag of its own.
const std::vector<std::pair<int, const char*>> kTypes{
    {5, "bramble"},   {6, "clover"},   {8, "fennel"},  {9, "heather"},  {10, "juniper"},
    {12, "lavender"}, {14, "mallow"},  {15, "nettle"}, {16, "orchid"},  {17, "primrose"},
    {19, "rosemary"}, {21, "saffron"}, {22, "tansy"},  {23, "thistle"}, {25, "valerian"},
    {26, "verbena"},  {27, "willow"},  {28, "yarrow"}, {29, "comfrey"}, {30, "burdock"}};

void serveStorebags(ReportingServer& server, const PropertyDictionary& section) {
  for (const auto& type : kTypes) server.setStorebag(type.second, storebagOf(section));
}

PropertyDictionary sessionInfo(int clientType, int sessionID, bool batches = false) {
  return {{"ComponentType", clientType}, {"ClientVersion", 3}, {"SessionID", sessionID}, {"BatchEvents", batches}};
}

PropertyDictionary user(const std::string& name) { return {{"_clientName", name}, {"_serviceName", "unit"}}; }

/// What a session says first that is not to count among those of its type: it is counted once, under the type that it
/// names first, and types outside the table have no limit.
const PropertyDictionary kOfNoKnownType{{"ComponentType", 100}};

bool isHealth(const PropertyDictionary& event) {
  return integerValue(event.find("_method")) == 0 && integerValue(event.find("_status")) == 1;
}

std::size_t healthMessages(const ReportingServer& server) {
  std::size_t count = 0;
  for (const auto& event : server.events()) count += isHealth(event) ? 1 : 0;
  return count;
}

/// Every session leaves a start and a health message.
bool waitForStartsAndHealth(const ReportingServer& server, std::size_t sessions) {
  return server.waitForEvents(2 * sessions, {0});
}

TEST(LastMoments, TwoHundredClientsKilledTogetherAllLeaveAHealthMessage) {
  constexpr std::size_t kClients = 200;
  ReportingServer server;
  serveStorebags(server, {{"splunk", postBackend(server)}, {"release_timeout", 1}});
  Daemon daemon(server);
  std::vector<std::unique_ptr<ControlledSession>> clients;
  std::vector<std::size_t> lines;
  for (std::size_t number = 0; number < kClients; ++number) {
    const auto& type = kTypes[number % kTypes.size()];
    const auto name = user("client" + std::to_string(number % 32));
    auto& client = *clients.emplace_back(std::make_unique<ControlledSession>(daemon));
    client.send({{"method", "setSessionInfo"},
                 {"sessionInfo", kOfNoKnownType},
                 {"userInfo", PropertyValue()},
                 {"frameworksToCheck", PropertyArray{}},
                 {"hasAggregationBlock", false}});
    lines.push_back(client.sendOpening(type.first, static_cast<int>(number), {}, name));
  }
  for (std::size_t number = 0; number < kClients; ++number) {
    ASSERT_FALSE(clients[number]->reply(lines[number]).empty()) << "client " << number;
  }
  EXPECT_EQ(integerValue(statusOf(daemon).find("keepAliveCount")), static_cast<std::int64_t>(kClients));
  for (auto& client : clients) client->process().signal(SIGKILL);

  EXPECT_TRUE(waitForStartsAndHealth(server, kClients));
  EXPECT_EQ(whatIsLeft(daemon), PropertyDictionary());
  std::set<std::string> gone;
  for (const auto& event : server.events()) {
    if (!isHealth(event)) continue;
    gone.insert(*event.string("_sessionID"));
    EXPECT_EQ(*event.find("GracefulTermination"), PropertyValue(false));
  }
  EXPECT_EQ(gone.size(), kClients);
  EXPECT_EQ(healthMessages(server), kClients);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(LastMoments, SendFinishAndCloseAtOnceIsAGracefulEndThatLosesNothing) {
  ReportingServer server;
  serveStorebags(server, {{"splunk", postBackend(server)}, {"release_timeout", 1}});
  Daemon daemon(server);
  EventLoop loop("wiresession");
  constexpr int kSessions = 40;
  for (int number = 0; number < kSessions; ++number) {
    const bool batches = number % 2 == 0;
    WireSession session(daemon, loop);
    session.describe(sessionInfo(kTypes[static_cast<std::size_t>(number) % kTypes.size()].first, number, batches),
                     user("hasty"));
    session.startConfiguration();
    session.send(7, 1, {{"number", number}});
    session.finish();
  }
  ASSERT_TRUE(server.waitForEvents(kSessions, {7}));
  EXPECT_TRUE(waitForStartsAndHealth(server, kSessions));
  for (const auto& event : server.events()) {
    if (isHealth(event)) {
      EXPECT_EQ(*event.find("GracefulTermination"), PropertyValue(true));
    }
  }
  EXPECT_EQ(eventsOf(server, 7).size(), static_cast<std::size_t>(kSessions));
  EXPECT_EQ(whatIsLeft(daemon), PropertyDictionary());
}

TEST(LastMoments, PeerThatIsGoneBeforeItsFramesAreReadLosesNothing) {
  ReportingServer server;
  serveStorebags(server, {{"splunk", postBackend(server)}, {"release_timeout", 1}});
  server.setStorebagDelay(std::chrono::seconds(1));  // its frames wait behind a cold fetch
  Daemon daemon(server);
  constexpr int kEvents = 50;
  EventLoop loop("wiresession");
  {
    WireSession session(daemon, loop);
    session.describe(sessionInfo(9, 1), user("abrupt"));
    session.startConfiguration();
    for (int number = 0; number < kEvents; ++number) session.send(7, 1, {{"number", number}});
    ASSERT_TRUE(session.waitUntilSent());
    loop.stop();  // with it every socket goes, without a goodbye
  }
  EXPECT_TRUE(server.waitForEvents(kEvents, {7}));
  ASSERT_TRUE(waitForStartsAndHealth(server, 1));
  EXPECT_EQ(*eventsOf(server, 0)[1].find("GracefulTermination"), PropertyValue(false));
}

/// Opens one session after the other, each when the transport of the one before is about to be let go.
void comeBackAgainAndAgain(const Daemon& daemon, EventLoop& loop, std::size_t lane, int rounds, unsigned seed) {
  std::mt19937 random(seed + static_cast<unsigned>(lane));
  const auto name = user("lane" + std::to_string(lane));
  for (int round = 0; round < rounds; ++round) {
    {
      WireSession session(daemon, loop);
      session.describe(kOfNoKnownType, std::nullopt);
      session.describe(sessionInfo(kTypes[lane % kTypes.size()].first, static_cast<int>(lane), random() % 2 == 0),
                       name);
      session.startConfiguration();
      session.send(7, 1, {{"lane", lane}, {"round", round}});
      session.finish();
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(900 + random() % 201));
  }
}

TEST(LastMoments, SessionsThatComeBackJustWhenTheirTransportGoesLoseNothing) {
  const std::size_t lanes = 2 * kTypes.size();
  constexpr int kRounds = 8;
  const unsigned seed = testSeed();
  ReportingServer server;
  serveStorebags(server, {{"splunk", postBackend(server)}, {"release_timeout", 1}});
  Daemon daemon(server);
  EventLoop loop("wiresession");
  std::vector<std::thread> threads;
  for (std::size_t lane = 0; lane < lanes; ++lane) {
    threads.emplace_back([&, lane] { comeBackAgainAndAgain(daemon, loop, lane, kRounds, seed); });
  }
  for (auto& thread : threads) thread.join();

  const std::size_t sessions = lanes * kRounds;
  EXPECT_TRUE(server.waitForEvents(sessions, {7}));
  EXPECT_TRUE(waitForStartsAndHealth(server, sessions));
  std::map<std::pair<std::int64_t, std::int64_t>, int> arrived;
  for (const auto& event : eventsOf(server, 7)) {
    ++arrived[{integerValue(event.find("lane")), integerValue(event.find("round"))}];
  }
  EXPECT_EQ(arrived.size(), sessions);
  for (const auto& [event, times] : arrived) EXPECT_EQ(times, 1) << "lane " << event.first << " round " << event.second;
  EXPECT_EQ(healthMessages(server), sessions);
  EXPECT_EQ(daemon.log().count("exceeds number of allowed active connections"), 0U);
  EXPECT_EQ(whatIsLeft(daemon), PropertyDictionary());
}

TEST(LastMoments, EverLastingTransportsHoldNothingOfTheProcess) {
  ReportingServer server;
  serveStorebags(server, {{"splunk", postBackend(server)}, {"release_timeout", 0}});
  Daemon::Options options;
  options.arguments = {"--idle-exit", "2"};
  Daemon daemon(server, options);
  EventLoop loop("wiresession");
  for (int number = 0; number < 12; ++number) {
    WireSession session(daemon, loop);
    session.describe(sessionInfo(kTypes[static_cast<std::size_t>(number)].first, number), user("lasting"));
    EXPECT_TRUE(session.configure());
  }
  EXPECT_EQ(daemon.process().wait(), 0);
  EXPECT_TRUE(waitForStartsAndHealth(server, 12));
  EXPECT_GE(daemon.log().countOnceThereAre(1, "Special case of dealing with ever-lasting connectivity helper"), 1U);
}

}  // namespace
}  // namespace velk::test
