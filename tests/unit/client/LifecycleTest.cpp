// Daemons that come, go and are slow; the last reference; forks.
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "client/LogTexts.h"
#include "platform/LocalSocket.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

/// In place of the fixture's log while one lives: a log whose lines can be waited for.
class WaitedForLog {
 public:
  WaitedForLog() { log::setSink(_sink); }
  ~WaitedForLog() { log::setSink(nullptr); }
  WaitedForLog(const WaitedForLog&) = delete;
  WaitedForLog& operator=(const WaitedForLog&) = delete;

  [[nodiscard]] std::size_t count(std::string_view part) const {
    Guard guard(_sink->lock);
    return _sink->countLocked(part);
  }
  /// Waits until `count` lines hold `part`; false when they did not in time. Looks at each line once: whoever writes
  /// one waits meanwhile, and there may be tens of thousands.
  [[nodiscard]] bool waitFor(std::string_view part, std::size_t count = 1) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    std::size_t at = 0;
    std::size_t found = 0;
    Guard guard(_sink->lock);
    for (;;) {
      for (; at < _sink->lines.size(); ++at) found += Sink::holds(_sink->lines[at], part) ? 1 : 0;
      if (found >= count) return true;
      if (!_sink->changed.waitUntil(_sink->lock, deadline) && at == _sink->lines.size()) return false;
    }
  }

 private:
  struct Sink : log::Sink {
    void write(log::Level, std::string_view line) override {
      Guard guard(lock);
      lines.emplace_back(line);
      changed.notifyAll();
    }
    [[nodiscard]] std::size_t countLocked(std::string_view part) const VELK_REQUIRES(lock) {
      std::size_t found = 0;
      for (const auto& line : lines) found += holds(line, part) ? 1 : 0;
      return found;
    }
    static bool holds(const std::string& line, std::string_view part) { return line.find(part) != std::string::npos; }
    Lock lock;
    Condition changed;
    std::vector<std::string> lines VELK_GUARDED_BY(lock);
  };
  const std::shared_ptr<Sink> _sink = std::make_shared<Sink>();
};

using LifecycleTest = VelkReportingTest;

TEST_F(LifecycleTest, IsInertInAForkedChild) {
  _daemon.start();
  auto client = makeClient();
  static_cast<void>(configure(*client));
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    alarm(20);
    Error error;
    bool isInert = !client->sendMessageWithDictionary(message(1), &error) && error.code == 9;
    isInert = isInert && client->isWhitelistedEvent(1) && !client->isBlacklistedEvent(1);
    isInert = isInert && !client->serverSupportsFileUpload() && !client->messageSentDelegate();
    client->finishSession();
    client.reset();
    _exit(isInert ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_TRUE(client->sendMessageWithDictionary(message(1)));
  EXPECT_FALSE(flush(*client)) << "the parent's connection is whole";
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 1U);
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U);
}

TEST_F(LifecycleTest, UnreachableDaemonAnswersCallbacksWithNothing) {
  const auto client = makeClient();
  auto answered = std::make_shared<Semaphore>();
  client->startConfigurationWithCompletionHandler([answered](const std::optional<PropertyArray>& enabled) {
    EXPECT_FALSE(enabled);
    answered->signal();
  });
  EXPECT_TRUE(answered->waitFor(kPatience));
  EXPECT_TRUE(flush(*client));
  EXPECT_TRUE(_log.contains("startConfigurationWithCompletionHandler: Failed to get remote object proxy: "));
}

TEST_F(LifecycleTest, LastReferenceSendsFinishesAndCloses) {
  _daemon.start();
  auto client = makeClient();
  auto second = client;
  for (int event = 0; event < 100; ++event) client->sendMessageWithCategory(1, 1);
  client.reset();
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U) << "a reference is left";
  second.reset();
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  EXPECT_TRUE(_daemon.waitForEnds(1));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 100U);
  EXPECT_EQ(_daemon.calls().back().method, "finishSessionGracefully");
  EXPECT_TRUE(_log.contains("is about to dealloc"));
}

TEST_F(LifecycleTest, FinishSessionOvertakesQueuedSends) {
  _daemon.start();
  const auto client = makeClient();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  // A callback of the queue's own keeps it busy until the session has been finished from here.
  auto entered = std::make_shared<Semaphore>();
  auto leave = std::make_shared<Semaphore>();
  struct Blocking : log::Sink {
    std::shared_ptr<Semaphore> entered, leave;
    void write(log::Level, std::string_view line) override {
      if (line != texts::kLoggingBlockSet) return;
      entered->signal();
      leave->wait();
    }
  };
  auto sink = std::make_shared<Blocking>();
  sink->entered = entered;
  sink->leave = leave;
  log::setSink(sink);
  client->setMessageLoggingBlock(nullptr);
  ASSERT_TRUE(entered->waitFor(kPatience));
  client->sendMessageWithCategory(1, 1);
  client->finishSession();
  leave->signal();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  log::setSink(nullptr);
  const auto calls = _daemon.calls();
  ASSERT_EQ(calls.size(), 3U);
  EXPECT_EQ(calls[1].method, "finishSessionGracefully");
  EXPECT_EQ(calls[2].method, "sendMessageWithDictionary");
}

TEST_F(LifecycleTest, EventsWaitForADaemonThatComesLater) {
  const auto client = makeClient();
  for (int event = 0; event < 50; ++event) EXPECT_TRUE(client->sendMessageWithDictionary(message(1, event)));
  _daemon.start();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 50));
  EXPECT_EQ(_daemon.calls().front().method, "setSessionInfo");
}

TEST_F(LifecycleTest, TellsADaemonThatComesLaterWhatWasSaidBefore) {
  const auto client = makeClient();
  client->setDigestKey(ByteData{9}, 0);
  client->startConfigurationWithCompletionHandler(nullptr);
  EXPECT_TRUE(flush(*client)) << "nobody is there";
  _daemon.start();
  client->sendMessageWithCategory(1, 1);
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  std::vector<std::string> methods;
  for (const auto& call : _daemon.calls()) methods.push_back(call.method);
  EXPECT_EQ(methods, (std::vector<std::string>{"setSessionInfo", "startConfigWithCompletionHandler", "setDigestKey",
                                               "sendMessageWithDictionary"}));
}

TEST_F(LifecycleTest, ReconnectsAndDescribesTheSessionAgain) {
  _daemon.start();
  const auto client = makeClient();
  std::atomic<int> answers{0};
  client->startConfigurationWithCompletionHandler([&answers](const auto&) { ++answers; });
  client->setDigestKey(ByteData{9}, 0);
  flush(*client);
  _daemon.stop();
  _daemon.start();
  // The client may still believe in the old connection: events are sent until one arrives over the new one.
  while (_daemon.count("setSessionInfo") < 2) {
    static_cast<void>(flush(*client));
  }
  client->sendMessageWithCategory(1, 1);
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  std::vector<std::string> again;
  for (const auto& call : _daemon.calls()) {
    if (call.connection == 2 && call.method != "flushMessagesWithCompletion") again.push_back(call.method);
  }
  EXPECT_EQ(again, (std::vector<std::string>{"setSessionInfo", "startConfigWithCompletionHandler", "setDigestKey",
                                             "sendMessageWithDictionary"}));
  EXPECT_EQ(answers.load(), 1) << "callbacks do not fire twice";
}

TEST_F(LifecycleTest, ReconnectsAlthoughThereIsNothingToSay) {
  _daemon.start();
  auto heard = std::make_shared<Semaphore>();
  const auto client = makeClient([heard](auto&&...) { heard->signal(); });
  EXPECT_TRUE(configure(*client));
  _daemon.stop();
  _daemon.start();
  ASSERT_TRUE(_daemon.waitForCalls("startConfigWithCompletionHandler", 2));
  EXPECT_EQ(_daemon.count("setSessionInfo"), 2U);
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 1, 2, 3, std::nullopt);
  EXPECT_TRUE(heard->waitFor(kPatience));
}

TEST_F(LifecycleTest, ReachesADaemonThatComesLaterAlthoughThereIsNothingMoreToSay) {
  const auto client = makeClient();
  client->startConfigurationWithCompletionHandler(nullptr);
  EXPECT_TRUE(flush(*client)) << "nobody is there";
  _daemon.start();
  EXPECT_TRUE(_daemon.waitForCalls("startConfigWithCompletionHandler", 1));
}

TEST_F(LifecycleTest, ReachesADaemonThatComesLaterBecauseItListens) {
  auto heard = std::make_shared<Semaphore>();
  const auto client = makeClient([heard](auto&&...) { heard->signal(); });
  _daemon.start();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 1, 2, 3, std::nullopt);
  EXPECT_TRUE(heard->waitFor(kPatience));
}

TEST_F(LifecycleTest, ReconnectsAfterAGoodbyeToo) {
  _daemon.start();
  const auto client = makeClient();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.endConnections();
  EXPECT_TRUE(_daemon.waitForCalls("setSessionInfo", 2));
  EXPECT_FALSE(flush(*client));
}

TEST_F(LifecycleTest, DaemonsThatHangUpAtOnceFindTheLinkWhole) {
  const TemporaryDirectory directory;
  const std::string path = directory.path() + "/socket";
  auto bound = bindLocalSocket(path, "the test");
  ASSERT_TRUE(bound);
  setenv("VELKREPORTING_SOCKET", path.c_str(), 1);
  std::atomic<bool> ends{false};
  std::thread daemon([&] {
    while (!ends) {
      pollfd wanted{bound->socket.get(), POLLIN, 0};
      if (poll(&wanted, 1, 10) > 0) static_cast<void>(acceptLocalSocket(bound->socket.get()));  // closed at once
    }
  });
  // Each connects on this thread, and hears on the library's that it is over, perhaps while this one is still at it.
  for (int round = 0; round < 300; ++round) {
    const auto client = makeClient();
    client->setEndOfLifeBound(std::chrono::milliseconds(0));
  }
  ends = true;
  daemon.join();
}

TEST_F(LifecycleTest, DaemonThatEndsEveryConnectionIsNotAskedForOneWithEveryCall) {
  _daemon.refuseSessions();
  _daemon.start();
  const auto client = makeClient();
  for (int call = 0; call < 1000; ++call) {
    client->sendMessageWithCategory(1, 1);
    flush(*client);
  }
  EXPECT_LT(_daemon.count("setSessionInfo"), 300U);
}

TEST_F(LifecycleTest, DescribesTheSessionWithItsLatestUserInfo) {
  _daemon.start();
  const auto fetch = [](VelkReporting& client, const std::optional<PropertyDictionary>& userInfo) {
    auto answered = std::make_shared<Semaphore>();
    client.fetchReportingStatesWithUserInfo(userInfo, [answered](const auto&) { answered->signal(); });
    EXPECT_TRUE(answered->waitFor(kPatience));
  };
  const auto requiring = makeClient();
  const auto notRequiring = VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", 9}, {"RequireUserDict", false}}, userInfo(), {}, nullptr);
  for (const auto& client : {requiring, notRequiring}) {
    fetch(*client, PropertyDictionary{{"_clientName", "Later"}});
    fetch(*client, std::nullopt);
  }
  _daemon.stop();
  _daemon.start();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 4));
  for (const auto& call : _daemon.calls()) {
    if (call.method != "setSessionInfo" || call.connection <= 2) continue;
    const bool needsNone = call.arguments[0].dictionary()->contains("RequireUserDict");
    EXPECT_EQ(call.arguments[1],
              needsNone ? PropertyValue() : PropertyValue(PropertyDictionary{{"_clientName", "Later"}}));
  }
}

TEST_F(LifecycleTest, WhatCallbacksOwnMayWaitForTheLibraryWhenItEnds) {
  _daemon.start();
  const auto other = makeClient();
  auto ended = std::make_shared<Semaphore>();
  const auto owned = [this, other, ended] {
    return std::shared_ptr<void>(nullptr, [this, other, ended](void*) {
      flush(*other);
      ended->signal();
    });
  };
  auto client = makeClient([owner = owned()](auto&&...) {});
  client->setMessageLoggingBlock([owner = owned()](const std::string&) {});
  client->setMessageLoggingBlock([owner = owned()](const std::string&) {});
  ASSERT_TRUE(ended->waitFor(kPatience));
  client.reset();
  ASSERT_TRUE(ended->waitFor(kPatience));
  ASSERT_TRUE(ended->waitFor(kPatience));
}

TEST_F(LifecycleTest, FullOutboxRefusesAndSaysSo) {
  const auto client = makeClient();  // nobody listens
  Error error;
  bool refused = false;
  for (int event = 0; event < 20000 && !refused; ++event) {
    refused = !client->sendMessageWithDictionary(message(1), &error);
  }
  EXPECT_TRUE(refused);
  EXPECT_EQ(error.code, 8);
  EXPECT_TRUE(client->sendMessageWithCategory(1, 1)) << "the category form answers true all the same";
}

TEST_F(LifecycleTest, OverflowIsToldOnceADaemonIsThereHoweverOftenItGoes) {
  const WaitedForLog log;
  const auto client = makeClient();
  std::size_t refusedBefore = 0;
  std::size_t taken = 0;
  for (const std::size_t refused : {5U, 3U, 8U}) {
    std::size_t left = refused;
    while (left != 0) {
      Error error;
      client->sendMessageWithCategory(1, 1, std::nullopt, &error);
      error.code == 8 ? --left : ++taken;
    }
    EXPECT_EQ(log.count("events were refused"), refusedBefore) << "nobody is there yet";
    _daemon.start();
    EXPECT_TRUE(log.waitFor(std::to_string(refused) + " events were refused while the daemon was away or slow"));
    EXPECT_EQ(log.count("events were refused"), ++refusedBefore);
    ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", taken)) << "what had not left would come back";
    _daemon.stop();
    ASSERT_TRUE(log.waitFor(texts::kConnectionInterrupted, refusedBefore));
    awaitTurn();  // what had not left the connection takes its room again, before new events do
  }
}

TEST_F(LifecycleTest, OverflowIsToldAtTheEndAlthoughNoDaemonComes) {
  auto client = makeClient();
  // What is told of here is what is said, however slow the machine.
  client->setEndOfLifeBound(std::chrono::minutes(1));
  Error error;
  while (error.code != 8) client->sendMessageWithCategory(1, 1, std::nullopt, &error);
  client.reset();
  EXPECT_TRUE(_log.contains(": 1 events were refused while the daemon was away or slow"));
  EXPECT_TRUE(_log.contains("aboutToDealloc: 16384 events are lost"));
}

TEST_F(LifecycleTest, FinishSessionAwaitsNothing) {
  auto client = makeClient();
  client->finishSession();
  flush(*client);  // which has its turn later
  EXPECT_TRUE(_log.contains("finishSession: Failed to get remote object proxy: no daemon answers"));
  _daemon.start();
  flush(*client);
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.holdCalls(true);
  client->sendMessageWithCategory(1, 1);
  client->finishSession();  // returns although the daemon takes nothing
  _daemon.holdCalls(false);
  EXPECT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
}

TEST_F(LifecycleTest, LastReferenceWaitsForRoomAndKeepsTheOrder) {
  _daemon.start();
  auto client = makeClient();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  // What is told of here is the order, however slow the machine.
  client->setEndOfLifeBound(std::chrono::minutes(1));
  _daemon.holdCalls(true);
  // More than the daemon's socket, its unread bytes and the connection's outbox hold together.
  constexpr std::size_t kEvents = 120;
  const PropertyDictionary payload{{"text", std::string(50'000, 'x')}};
  for (std::size_t event = 0; event < kEvents; ++event) {
    Error error;
    client->sendMessageWithCategory(1, 1, payload, &error);
    ASSERT_EQ(error, Error());
  }
  client->updateSharedDataWithDictionary({{"a", 1}});
  std::thread releasing([this] { _daemon.holdCalls(false); });
  client.reset();
  releasing.join();
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), kEvents);
  const auto calls = _daemon.calls();
  EXPECT_EQ(calls[calls.size() - 2].method, "updateSharedDataWithDictionary") << "it overtakes no event";
  EXPECT_FALSE(_log.contains("are lost"));
}

TEST_F(LifecycleTest, LastReferenceDoesNotWaitForAnAttemptThatIsDueMuchLater) {
  const WaitedForLog log;
  auto client = makeClient();
  client->setEndOfLifeBound(std::chrono::minutes(1));
  for (int event = 0; event < 50; ++event) client->sendMessageWithCategory(1, 1);
  // Each pause is twice as long as the one before it.
  ASSERT_TRUE(log.waitFor(texts::kFailedToConnect, 5));
  _daemon.start();
  client.reset();
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 50U);
  EXPECT_EQ(log.count("are lost"), 0U);
}

TEST_F(LifecycleTest, LastReferenceWaitsForADaemonThatWasThereAMomentAgo) {
  const WaitedForLog log;
  _daemon.start();
  auto client = makeClient();
  client->setEndOfLifeBound(std::chrono::minutes(1));
  EXPECT_TRUE(configure(*client));
  _daemon.stop();
  ASSERT_TRUE(log.waitFor(texts::kConnectionInterrupted));
  for (int event = 0; event < 50; ++event) client->sendMessageWithCategory(1, 1);
  const std::size_t before = log.count(texts::kFailedToConnect);
  std::thread releasing([released = std::move(client)]() mutable { released.reset(); });
  EXPECT_TRUE(log.waitFor(texts::kFailedToConnect, before + 5));
  _daemon.start();
  releasing.join();
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 50U);
  EXPECT_EQ(log.count("are lost"), 0U);
}

TEST_F(LifecycleTest, LastReferenceDoesNotWaitForADaemonThatWasNeverThere) {
  auto client = makeClient();
  client->setEndOfLifeBound(std::chrono::hours(1));
  for (int event = 0; event < 50; ++event) client->sendMessageWithCategory(1, 1);
  client.reset();
  EXPECT_TRUE(_log.contains("aboutToDealloc: 50 events are lost"));
}

}  // namespace
}  // namespace velk::test
