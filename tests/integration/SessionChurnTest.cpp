// Hundreds of sessions that do what sessions do, in any order, and end in any way: nothing of them is left behind.

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

/// Few, so that some sessions find their type full and are refused.
const std::vector<std::pair<int, const char*>> kTypes{{5, "bramble"}, {6, "clover"},    {8, "fennel"},
                                                      {9, "heather"}, {12, "lavender"}, {14, "mallow"}};

/// What of the events is certain to arrive.
class Ledger {
 public:
  [[nodiscard]] int nextNumber() { return ++_last; }
  void expect(const std::vector<int>& numbers) {
    Guard guard(_lock);
    _expected.insert(numbers.begin(), numbers.end());
  }
  [[nodiscard]] std::set<int> expected() const {
    Guard guard(_lock);
    return _expected;
  }

 private:
  std::atomic<int> _last{0};
  mutable Lock _lock;
  std::set<int> _expected VELK_GUARDED_BY(_lock);
};

/// Makes the same choices from the same seed.
class Choice {
 public:
  Choice(unsigned seed, unsigned worker) : _random(seed * 31 + worker) {}
  [[nodiscard]] int below(int bound) { return static_cast<int>(_random() % static_cast<unsigned>(bound)); }
  [[nodiscard]] bool oneIn(int chances) { return below(chances) == 0; }
  [[nodiscard]] PropertyDictionary user() {
    return {{"_clientName", "client" + std::to_string(below(4))}, {"_serviceName", "churn"}};
  }
  /// A place in one of three hierarchies, or none.
  void place(PropertyDictionary& sessionInfo) {
    sessionInfo.remove("HierarchyToken");
    if (oneIn(4)) return;
    sessionInfo.set("HierarchyToken",
                    PropertyDictionary{{"token", "tree" + std::to_string(below(3))}, {"level", below(3)}});
  }
  [[nodiscard]] PropertyDictionary sessionInfo(int clientType) {
    PropertyDictionary info{
        {"ComponentType", clientType}, {"ClientVersion", 3}, {"SessionID", below(100000)}, {"BatchEvents", oneIn(2)}};
    place(info);
    return info;
  }

 private:
  std::mt19937 _random;
};

PropertyDictionary description(const PropertyDictionary& info, const PropertyDictionary& user, bool aggregates) {
  return {{"method", "setSessionInfo"},
          {"sessionInfo", info},
          {"userInfo", user},
          {"frameworksToCheck", PropertyArray{}},
          {"hasAggregationBlock", aggregates}};
}

/// One session in a process of its own, to its end.
void liveInAProcess(const Daemon& daemon, Choice& choice, Ledger& ledger) {
  ControlledSession session(daemon);
  auto info = choice.sessionInfo(kTypes[static_cast<std::size_t>(choice.below(6))].first);
  session.send(description(info, choice.user(), choice.oneIn(3)));
  const auto configuration = session.send({{"method", "startConfigWithCompletionHandler"}});
  std::vector<int> numbers;
  std::vector<std::size_t> lines{configuration};
  for (int step = choice.below(8); step > 0; --step) {
    switch (choice.below(6)) {
      case 0:
        choice.place(info);
        session.send(description(info, choice.user(), choice.oneIn(3)));
        break;
      case 1:
        lines.push_back(session.send({{"method", "flushMessagesWithCompletion"}}));
        break;
      case 2:
        session.send({{"method", "updateSharedDataForKey"}, {"key", "shared"}, {"value", step}});
        break;
      case 3:
        lines.push_back(session.send({{"method", "fetchStatesWithUserInfo"}, {"userInfo", choice.user()}}));
        break;
      default:
        numbers.push_back(ledger.nextNumber());
        lines.push_back(session.sendEvent(7, 1, PropertyDictionary{{"number", numbers.back()}}));
        break;
    }
  }
  if (choice.oneIn(4)) return session.kill();  // whatever it may have said
  if (choice.oneIn(2)) session.send({{"method", "finishSessionGracefully"}});
  bool wasServed = true;
  for (const auto line : lines) wasServed = session.reply(line).contains("reply") && wasServed;
  if (choice.oneIn(4)) {
    session.kill();
  } else {
    wasServed = session.finish() == 0 && wasServed;
  }
  if (wasServed) ledger.expect(numbers);
}

/// One session of this process, which never waits for anything.
void liveInAHurry(const Daemon& daemon, EventLoop& loop, Choice& choice, Ledger& ledger) {
  WireSession session(daemon, loop);
  auto info = choice.sessionInfo(kTypes[static_cast<std::size_t>(choice.below(6))].first);
  if (choice.oneIn(8)) return;
  if (choice.oneIn(8)) {
    session.proxy().sendMessageWithSessionInfo(info, choice.user(), 7, 1,
                                               PropertyDictionary{{"number", ledger.nextNumber()}}, {});
  }
  session.describe(info, choice.user());
  session.startConfiguration();
  for (int step = choice.below(5); step > 0; --step) {
    session.send(7, 1, {{"number", ledger.nextNumber()}});
    if (choice.oneIn(3)) {
      choice.place(info);
      session.describe(info, choice.user());
    }
    if (choice.oneIn(3)) session.proxy().flushMessagesWithCompletion({});
  }
  if (choice.oneIn(2)) session.finish();
}

TEST(SessionChurn, LeavesNothingBehind) {
  constexpr unsigned kProcessWorkers = 6;
  constexpr unsigned kHurriedWorkers = 3;
  constexpr int kProcesses = 25;
  constexpr int kHurried = 80;
  const unsigned seed = testSeed();
  ReportingServer server;
  for (const auto& type : kTypes) {
    server.setStorebag(type.second, storebagOf({{"splunk", postBackend(server)}, {"release_timeout", 1}}));
  }
  Daemon::Options options;
  options.arguments = {"--idle-exit", "1"};
  Daemon daemon(server, options);
  EventLoop loop("wiresession");
  auto bystander = std::make_unique<WireSession>(daemon, loop);
  Ledger ledger;
  std::vector<std::thread> workers;
  for (unsigned worker = 0; worker < kProcessWorkers; ++worker) {
    workers.emplace_back([&, worker] {
      Choice choice(seed, worker);
      for (int session = 0; session < kProcesses; ++session) liveInAProcess(daemon, choice, ledger);
    });
  }
  for (unsigned worker = kProcessWorkers; worker < kProcessWorkers + kHurriedWorkers; ++worker) {
    workers.emplace_back([&, worker] {
      Choice choice(seed, worker);
      for (int session = 0; session < kHurried; ++session) liveInAHurry(daemon, loop, choice, ledger);
    });
  }
  for (auto& worker : workers) worker.join();

  EXPECT_EQ(whatIsLeft(daemon, 1), PropertyDictionary());
  std::map<int, int> arrived;
  for (const auto& event : eventsOf(server, 7)) ++arrived[static_cast<int>(integerValue(event.find("number")))];
  for (const auto& [number, times] : arrived) EXPECT_EQ(times, 1) << "event " << number;
  const auto expected = ledger.expected();
  EXPECT_FALSE(expected.empty());
  for (const int number : expected) EXPECT_TRUE(arrived.contains(number)) << "event " << number << " is lost";

  bystander.reset();
  EXPECT_EQ(daemon.process().wait(), 0) << "nothing holds the process any more";
  const auto& log = daemon.log();
  log.waitForEnd();
  const auto accepted = log.count("listener: Accepting new IPC connection");
  EXPECT_EQ(log.count("invalidateReportingSession: ReportingdSession"), accepted);
  EXPECT_EQ(log.count("dealloc: ReportingdSession dealloc: "), accepted) << "each is torn down, once";
  const auto made = log.count("ReportingSessionConnectivityHelper created with delegate");
  EXPECT_GE(log.count("ReportingSessionConnectivityHelper dealloced with ID") + 1, made)
      << "but for the one that fetches storebags";
}

}  // namespace
}  // namespace velk::test
