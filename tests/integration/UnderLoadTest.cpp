// What befalls the daemon while several processes report to it, and the count of what they reported.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <set>
#include <thread>

#include "tests/integration/HostProcess.h"

namespace velk::test {
namespace {

constexpr int kClients = 4;
constexpr int kEventsAtOnce = 10;
constexpr int kNumbersOfOne = 1'000'000;

/// Counts the lives of the daemon: odd while it is being ended.
class Epoch {
 public:
  void next() {
    Guard guard(_lock);
    ++_number;
  }
  [[nodiscard]] int number() const {
    Guard guard(_lock);
    return _number;
  }
  /// A client was told that its events have been posted.
  void noteAnswer(int client) {
    Guard guard(_lock);
    ++_answers[{_number, client}];
    _changed.notifyAll();
  }
  /// Waits until each client has had so many such answers in this epoch.
  [[nodiscard]] bool waitForAnswers(int count) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    Guard guard(_lock);
    for (int client = 0; client < kClients; ++client) {
      const auto key = std::make_pair(_number, client);
      while (_answers.count(key) == 0 || _answers.at(key) < count) {
        if (!_changed.waitUntil(_lock, deadline)) return false;
      }
    }
    return true;
  }

 private:
  mutable Lock _lock;
  mutable Condition _changed;
  int _number VELK_GUARDED_BY(_lock) = 0;
  std::map<std::pair<int, int>, int> _answers VELK_GUARDED_BY(_lock);
};

/// A process that sends numbered events, flushes, and sends on, until it is told to stop.
class Reporter {
 public:
  Reporter(const Daemon& daemon, Epoch& epoch, int client) : _epoch(epoch), _client(client), _process(daemon) {
    _process.open(client + 1);
    _thread = std::thread([this] { report(); });
  }
  ~Reporter() { stop(); }

  void stop() {
    _stops = true;
    if (_thread.joinable()) _thread.join();
  }
  /// Behind `stop`: sends on until it is told that its events have been posted.
  [[nodiscard]] bool flush() {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (std::chrono::steady_clock::now() < deadline) {
      if (sendAndFlush() == " 0") return true;
    }
    return false;
  }
  // Behind `stop`.
  [[nodiscard]] HostProcess& process() { return _process; }
  [[nodiscard]] const std::set<std::int64_t>& sent() const { return _sent; }
  [[nodiscard]] const std::set<std::int64_t>& answered() const { return _answered; }

 private:
  void report() {
    while (!_stops) {
      const int before = _epoch.number();
      const int first = _next;
      const auto code = sendAndFlush();
      if (code == "no answer") return;
      if (code != " 0" || before % 2 != 0 || before != _epoch.number()) continue;
      for (int number = first; number < _next; ++number) _answered.insert(number);
      _epoch.noteAnswer(_client);
    }
  }
  /// The flush's code.
  std::string sendAndFlush() {
    EXPECT_EQ(_process.call("send " + std::to_string(_next) + " " + std::to_string(kEventsAtOnce)), "");
    for (const int end = _next + kEventsAtOnce; _next < end; ++_next) _sent.insert(_next);
    auto code = _process.call("flush");
    EXPECT_NE(code, "no answer") << "client " << _client;
    return code;
  }

  Epoch& _epoch;
  const int _client;
  HostProcess _process;
  int _next = _client * kNumbersOfOne;
  std::set<std::int64_t> _sent;
  std::set<std::int64_t> _answered;
  std::atomic<bool> _stops{false};
  std::thread _thread;
};

class UnderLoad : public HostProcessTest {
 protected:
  void startReporters() {
    daemon->start();
    for (int client = 0; client < kClients; ++client) {
      reporters.push_back(std::make_unique<Reporter>(*daemon, epoch, client));
    }
  }
  void stopReporters() {
    for (auto& reporter : reporters) reporter->stop();
    for (auto& reporter : reporters) EXPECT_TRUE(reporter->flush());
  }
  /// How often each number arrived.
  [[nodiscard]] std::map<std::int64_t, int> arrivals() const {
    std::map<std::int64_t, int> times;
    for (const auto number : arrived()) ++times[number];
    return times;
  }
  /// The first few that are missing.
  [[nodiscard]] static std::vector<std::int64_t> missing(const std::set<std::int64_t>& numbers,
                                                         const std::map<std::int64_t, int>& times) {
    std::vector<std::int64_t> found;
    for (const auto number : numbers) {
      if (!times.contains(number) && found.size() < 20) found.push_back(number);
    }
    return found;
  }

  Epoch epoch;
  std::vector<std::unique_ptr<Reporter>> reporters;
};

TEST_F(UnderLoad, KilledDaemonHasDeliveredWhatItAnsweredAndItsSuccessorGoesOn) {
  constexpr int kKills = 4;
  constexpr int kAnswersEach = 3;
  startReporters();
  for (int kill = 0; kill < kKills; ++kill) {
    ASSERT_TRUE(epoch.waitForAnswers(kAnswersEach)) << "events flow, before the first and after each kill";
    epoch.next();
    daemon->kill();
    epoch.next();
    daemon->start();
  }
  ASSERT_TRUE(epoch.waitForAnswers(kAnswersEach));
  stopReporters();
  const auto times = arrivals();
  for (auto& reporter : reporters) {
    EXPECT_GE(reporter->answered().size(), static_cast<std::size_t>((kKills + 1) * kAnswersEach * kEventsAtOnce));
    EXPECT_EQ(missing(reporter->answered(), times), std::vector<std::int64_t>());
    EXPECT_EQ(reporter->process().end("return"), 0);
  }
  for (const auto& [number, count] : times) EXPECT_EQ(count, 1) << number;
  EXPECT_EQ(daemon->stop(), 0);
}

TEST_F(UnderLoad, AHundredReloadsLoseNoEventAndEndNoSession) {
  constexpr int kReloads = 100;
  startReporters();
  ASSERT_TRUE(epoch.waitForAnswers(1));
  for (int reload = 0; reload < kReloads; ++reload) {
    const auto lines = daemon->log().lines().size();
    daemon->process().signal(SIGHUP);
    ASSERT_TRUE(daemon->log().waitForPart("storebags are fetched afresh", lines)) << reload;
  }
  epoch.next();
  epoch.next();
  EXPECT_TRUE(epoch.waitForAnswers(1)) << "events flow behind the last one";
  stopReporters();
  EXPECT_EQ(daemon->log().count("invalidateReportingSession: "), 0U);
  std::size_t sent = 0;
  for (auto& reporter : reporters) sent += reporter->sent().size();
  EXPECT_TRUE(server.waitForEvents(sent, {7}));
  const auto times = arrivals();
  for (auto& reporter : reporters) {
    EXPECT_EQ(missing(reporter->sent(), times), std::vector<std::int64_t>());
    EXPECT_EQ(reporter->process().log().count("interrupted"), 0U);
    EXPECT_EQ(reporter->process().end("return"), 0);
  }
  for (const auto& [number, count] : times) EXPECT_EQ(count, 1) << number;
  EXPECT_EQ(daemon->stop(), 0);
}

}  // namespace
}  // namespace velk::test
