// Periodic tasks of a real process that links the library, through the real daemon to the collector.

#include <gtest/gtest.h>

#include <algorithm>
#include <sstream>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

/// See clients/periodic_client.cpp.
class PeriodicClient {
 public:
  explicit PeriodicClient(const Daemon& daemon)
      : _process([&] {
          ChildProcess::Options options;
          options.command = {VELK_PERIODIC_CLIENT_PROGRAM, "42"};
          options.environment = daemon.environment();
          options.environment["VELKREPORTING_LOG"] = "default";
          return options;
        }()) {}

  [[nodiscard]] LineCollector& lines() { return _process.output(); }
  [[nodiscard]] ChildProcess& process() { return _process; }
  void write(const std::string& command) { _process.write(command + "\n"); }
  /// Waits until it is done.
  void call(const std::string& command) {
    const std::size_t from = lines().lines().size();
    write(command);
    EXPECT_TRUE(lines().waitFor([&](const std::string& line) { return line == command; }, from)) << command;
  }
  [[nodiscard]] std::size_t count(const std::string& line) {
    const auto all = lines().lines();
    return static_cast<std::size_t>(std::count(all.begin(), all.end(), line));
  }
  /// Waits for the line to come once more than it came before.
  [[nodiscard]] bool waitForLine(const std::string& line, std::size_t times = 1) {
    std::size_t seen = 0;
    return lines().waitFor([&](const std::string& each) { return each == line && ++seen == times; }).has_value();
  }
  [[nodiscard]] std::vector<std::string> threads() {
    const std::size_t from = lines().lines().size();
    write("threads");
    const auto line = lines().waitFor([](const std::string& each) { return each.starts_with("threads"); }, from);
    std::istringstream words(line.value_or(""));
    std::vector<std::string> names;
    for (std::string name; words >> name;) names.push_back(name);
    return names;
  }
  [[nodiscard]] int finish() {
    _process.closeInput();
    return _process.wait().value_or(-1);
  }

 private:
  ChildProcess _process;
};

class Periodic : public testing::Test {
 protected:
  void start() {
    server.setStorebag("heather", storebagWith(server));
    daemon = std::make_unique<Daemon>(server);
    client = std::make_unique<PeriodicClient>(*daemon);
    ASSERT_TRUE(client->lines().waitForPart("ready"));
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
  std::unique_ptr<PeriodicClient> client;
};

TEST_F(Periodic, AMergedReportReachesTheCollectorAtOnce) {
  start();
  client->call("register 2 b 2");
  client->call("register 1 a 1");
  client->call("start 3600 1 7 3");
  ASSERT_TRUE(server.waitForEvents(1, {7})) << "it is realtime: nobody flushed";
  const auto event = eventsOf(server, 7)[0];
  EXPECT_EQ(integerValue(event.find("a")), 1);
  EXPECT_EQ(integerValue(event.find("b")), 2);
  EXPECT_EQ(integerValue(event.find("_status")), 3);
  EXPECT_EQ(client->finish(), 0);
  EXPECT_EQ(daemon->stop(), 0);
}

TEST_F(Periodic, TicksGoOnUntilTheTimerIsStopped) {
  start();
  client->call("register 1 a 1");
  client->call("start 1 2 7 3");
  ASSERT_TRUE(server.waitForEvents(2, {7}));
  client->call("stop");
  client->call("unregister 1");
  EXPECT_TRUE(client->waitForLine("ended 1"));
  std::vector<std::string> calls;
  for (const auto& line : client->lines().lines()) {
    if (line == "update 1" || line == "report 1") calls.push_back(line);
  }
  ASSERT_GE(calls.size(), 4U);
  for (std::size_t call = 0; call < calls.size(); ++call) {
    EXPECT_EQ(calls[call], call % 2 == 0 ? "update 1" : "report 1");
  }
  EXPECT_EQ(client->finish(), 0);
}

TEST_F(Periodic, ItsThreadsAreThereOnlyWhileTheyAreNeeded) {
  start();
  client->call("register 1 a 1");
  client->call("block 1");
  client->call("start 3600 0 7 3");
  ASSERT_TRUE(client->waitForLine("update 1"));
  auto names = client->threads();
  EXPECT_EQ(std::count(names.begin(), names.end(), "PeriodicTask"), 1);
  EXPECT_EQ(std::count(names.begin(), names.end(), "velkreporting"), 1);
  client->call("unblock");
#if defined(__SANITIZE_THREAD__)
  constexpr std::size_t kThreads = 4;  // one is the sanitizer's own
#else
  constexpr std::size_t kThreads = 3;
#endif
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (names.size() != kThreads && std::chrono::steady_clock::now() < deadline) names = client->threads();
  EXPECT_EQ(std::count(names.begin(), names.end(), "velkreporting"), 1) << "the main thread and this one are left";
  EXPECT_EQ(names.size(), kThreads);
  EXPECT_EQ(client->finish(), 0);
}

TEST_F(Periodic, ABlockedModuleHoldsUpItsClientAlone) {
  start();
  ControlledSession other(*daemon);
  ASSERT_EQ(other.open(9, 43).size(), 3U);
  client->call("register 1 a 1");
  client->call("block 1");
  client->call("start 1 1 7 3");
  ASSERT_TRUE(client->waitForLine("report 1"));
  client->call("send 8 1");
  other.sendEvent(9, 1, PropertyDictionary{{"n", 1}});
  ASSERT_TRUE(server.waitForEvents(1, {9}));
  EXPECT_TRUE(eventsOf(server, 8).empty());
  client->call("unblock");
  client->call("stop");
  client->call("release");
  ASSERT_TRUE(server.waitForEvents(2, {7, 8}));
  EXPECT_FALSE(client->process().errors().waitForPart("Timeout", 0, std::chrono::milliseconds(0)));
  EXPECT_EQ(client->finish(), 0);
}

TEST_F(Periodic, TheLastReleaseInACallbackEndsTheSessionAndLosesNothing) {
  start();
  client->call("register 1 a 1");
  client->call("releasing 2");
  client->call("start 1 1 7 3");
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  EXPECT_TRUE(booleanValue(eventsOf(server, 7)[0].find("last")));
  EXPECT_TRUE(client->waitForLine("ended 1"));
  EXPECT_TRUE(client->waitForLine("ended 2"));
  ASSERT_TRUE(daemon->log().waitForPart("invalidateReportingSession: ReportingdSession"));
  EXPECT_EQ(client->process().errors().countOnceThereAre(1, "is about to dealloc"), 1U);
  EXPECT_EQ(client->finish(), 0);
  EXPECT_EQ(daemon->stop(), 0);
  EXPECT_EQ(daemon->log().countOnceThereAre(1, "invalidateReportingSession: ReportingdSession"), 1U);
}

TEST_F(Periodic, ReportsGoOnWhenTheDaemonComesBack) {
  start();
  client->call("register 1 a 1");
  client->call("start 1 1 7 3");
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  daemon->kill();
  daemon->start();
  const std::size_t before = eventsOf(server, 7).size();
  ASSERT_TRUE(server.waitForEvents(before + 2, {7}));
  client->call("unregister 1");
  EXPECT_EQ(client->count("ended 1"), 1U);
  EXPECT_EQ(client->finish(), 0);
}

}  // namespace
}  // namespace velk::test
