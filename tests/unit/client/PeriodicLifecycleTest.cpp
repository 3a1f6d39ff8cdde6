// Periodic tasks of whole client objects: their threads, their daemon, and how they end.
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <thread>

#include "client/LogTexts.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

/// A tick at once, and no other one while the test runs.
constexpr std::uint32_t kOnce = 3600;

class PeriodicLifecycleTest : public VelkReportingTest {
 protected:
  using Service = std::function<void(PropertyDictionary*)>;

  /// A client with one module that has been called, and whose callback does not return before `leave`.
  struct Blocked {
    std::shared_ptr<VelkReporting> client;
    std::shared_ptr<Semaphore> leave = std::make_shared<Semaphore>();
    std::shared_ptr<std::atomic<bool>> hasLeft = std::make_shared<std::atomic<bool>>(false);
  };
  Blocked block() {
    Blocked blocked;
    blocked.client = makeClient();
    const auto entered = std::make_shared<Semaphore>();
    EXPECT_TRUE(blocked.client->registerPeriodicTaskForModule(
        1, true, true, [entered, leave = blocked.leave, hasLeft = blocked.hasLeft](PropertyDictionary* statistics) {
          entered->signal();
          leave->wait();
          if (statistics != nullptr) statistics->set("n", 1);
          *hasLeft = true;
        }));
    blocked.client->startLogTimerWithInterval(kOnce, 1, 3, 4);
    EXPECT_TRUE(entered->waitFor(kPatience));
    return blocked;
  }
  [[nodiscard]] std::vector<std::string> methods() const {
    std::vector<std::string> names;
    for (const auto& call : _daemon.calls()) names.push_back(call.method);
    return names;
  }
  /// The session has been described, its report sent, and it has been finished, once.
  void expectReportAndOneFinish() {
    ASSERT_TRUE(_daemon.waitForEnds(1));
    EXPECT_EQ(methods(),
              (std::vector<std::string>{"setSessionInfo", "sendMessageWithDictionary", "finishSessionGracefully"}));
  }
};

TEST_F(PeriodicLifecycleTest, AReportArrivesAsARealtimeEvent) {
  _daemon.start();
  const auto client = makeClient();
  EXPECT_FALSE(client->registerPeriodicTaskForModule(7, true, true, nullptr));
  EXPECT_TRUE(client->registerPeriodicTaskForModule(7, true, true,
                                                    [](PropertyDictionary* statistics) { statistics->set("n", 5); }));
  client->startLogTimerWithInterval(kOnce, 1, 3, 4);
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  EXPECT_EQ(_daemon.calls().back().arguments[0], PropertyValue(PropertyDictionary{
                                                     {"ParametersFlag", 1},
                                                     {"ParametersCategory", 3},
                                                     {"ParametersType", 4},
                                                     {"ParametersPayload", PropertyDictionary{{"n", 5}}},
                                                 }));
}

TEST_F(PeriodicLifecycleTest, AReportIsFilteredAndTheDelegateHearsOfIt) {
  struct Delegate : VelkReportingMessageSentDelegate {
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&,
                                          const PropertyDictionary& event) override {
      EXPECT_EQ(integerValue(event.find("ParametersFlag")), 1);
      heard.signal();
    }
    Semaphore heard;
  };
  _daemon.setConfiguration(PropertyArray{"splunk"}, PropertyArray{9}, std::nullopt);
  _daemon.start();
  const auto client = makeClient();
  const auto delegate = std::make_shared<Delegate>();
  client->setMessageSentDelegate(delegate);
  static_cast<void>(configure(*client));
  client->registerPeriodicTaskForModule(7, true, true, [](PropertyDictionary* statistics) { statistics->set("n", 5); });
  client->startLogTimerWithInterval(kOnce, 1, 3, 4);
  ASSERT_TRUE(delegate->heard.waitFor(kPatience));
  flush(*client);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 0U);
  EXPECT_EQ(_log.count("Event 3 is filtered by storebag"), 1);
}

TEST_F(PeriodicLifecycleTest, ReportsOfCategoryZeroGoNowhere) {
  _daemon.start();
  const auto client = makeClient();
  client->registerPeriodicTaskForModule(7, true, true, [](PropertyDictionary* statistics) { statistics->set("n", 5); });
  client->startLogTimerWithInterval(kOnce, 1, 0, 4);
  client->unregisterPeriodTaskForModule(7);
  flush(*client);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 0U);
}

TEST_F(PeriodicLifecycleTest, UnregisteringAnswersTrueAlways) {
  const auto client = makeClient();
  EXPECT_TRUE(client->unregisterPeriodTaskForModule(8));
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 8 doesn't exist"), 1);
  client->registerPeriodicTaskForModule(8, true, true, [](PropertyDictionary*) {});
  EXPECT_TRUE(client->unregisterPeriodTaskForModule(8));
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 8 removed"), 1);
}

TEST_F(PeriodicLifecycleTest, UnregisteringFromElsewhereWaitsForTheCallback) {
  auto blocked = block();
  std::thread leaving([leave = blocked.leave] {
    for (int turn = 0; turn < 100; ++turn) std::this_thread::yield();
    leave->signal();
  });
  EXPECT_TRUE(blocked.client->unregisterPeriodTaskForModule(1));
  EXPECT_TRUE(blocked.hasLeft->load());
  leaving.join();
}

TEST_F(PeriodicLifecycleTest, NoMoreThanFourCallbacksRunAtOnce) {
  const auto client = makeClient();
  const auto entered = std::make_shared<Semaphore>();
  const auto leave = std::make_shared<Semaphore>();
  const auto running = std::make_shared<std::atomic<int>>(0);
  const auto atOnce = std::make_shared<std::atomic<int>>(0);
  for (std::uint32_t module = 0; module < 12; ++module) {
    client->registerPeriodicTaskForModule(module, true, false, [=](PropertyDictionary*) {
      const int now = ++*running;
      for (int seen = *atOnce; seen < now && !atOnce->compare_exchange_weak(seen, now);) {
      }
      entered->signal();
      leave->wait();
      --*running;
    });
  }
  client->startLogTimerWithInterval(kOnce, 0, 3, 4);
  for (int call = 0; call < 4; ++call) ASSERT_TRUE(entered->waitFor(kPatience)) << "four do run at once";
  EXPECT_EQ(running->load(), 4);
  for (int call = 0; call < 12; ++call) leave->signal();
  for (int call = 4; call < 12; ++call) ASSERT_TRUE(entered->waitFor(kPatience));
  client->unregisterPeriodTaskForModule(0);  // waits for the tick's end
  EXPECT_EQ(running->load(), 0);
  EXPECT_EQ(atOnce->load(), 4);
}

TEST_F(PeriodicLifecycleTest, ACallbackMayWaitForAnswersToOtherCalls) {
  _daemon.start();
  const auto other = makeClient();
  const auto client = makeClient();
  _daemon.holdCalls(true);
  const auto configured = std::make_shared<Semaphore>();
  client->startConfigurationWithCompletionHandler([configured](auto&&) { configured->signal(); });
  const auto done = std::make_shared<Semaphore>();
  client->registerPeriodicTaskForModule(1, true, true, [=, this](PropertyDictionary*) {
    _daemon.holdCalls(false);
    EXPECT_TRUE(configured->waitFor(kPatience)) << "a call of the same client that was made before";
    EXPECT_FALSE(flush(*other)) << "and any of another one";
    done->signal();
  });
  client->startLogTimerWithInterval(kOnce, 1, 3, 4);
  EXPECT_TRUE(done->waitFor(kPatience));
  client->unregisterPeriodTaskForModule(1);
}

TEST_F(PeriodicLifecycleTest, ASlowModuleDelaysItsClientsCallsAlone) {
  _daemon.start();
  auto blocked = block();
  blocked.client->sendMessageWithCategory(9, 1);
  const auto other = makeClient();
  other->sendMessageWithCategory(8, 1);
  EXPECT_FALSE(flush(*other));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 1U);
  blocked.leave->signal();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 3));
  const auto categoryOf = [this](std::size_t call) {
    return integerValue(_daemon.calls()[call].arguments[0].dictionary()->find("ParametersCategory"));
  };
  const std::size_t calls = _daemon.calls().size();
  EXPECT_EQ(categoryOf(calls - 2), 9) << "it had been handed over before the report was";
  EXPECT_EQ(categoryOf(calls - 1), 3);
}

TEST_F(PeriodicLifecycleTest, TheLastReleaseDuringATickEndsTheSessionOnce) {
  _daemon.start();
  auto blocked = block();
  std::thread leaving([leave = blocked.leave] { leave->signal(); });
  blocked.client.reset();
  leaving.join();
  expectReportAndOneFinish();
}

TEST_F(PeriodicLifecycleTest, TheLastReleaseDoesNotWaitForEverForACallback) {
  _daemon.start();
  auto blocked = block();
  blocked.client.reset();
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U);
  EXPECT_FALSE(blocked.hasLeft->load());
  blocked.leave->signal();
  expectReportAndOneFinish();
}

TEST_F(PeriodicLifecycleTest, TheLastReleaseInACallbackEndsTheSessionOnce) {
  _daemon.start();
  struct Host {
    std::shared_ptr<VelkReporting> client;
    Semaphore ready;
  };
  const auto host = std::make_shared<Host>();
  host->client = makeClient();
  host->client->registerPeriodicTaskForModule(1, true, true,
                                              [weak = std::weak_ptr(host)](PropertyDictionary* statistics) {
                                                const auto strong = weak.lock();
                                                strong->ready.wait();
                                                strong->client.reset();
                                                statistics->set("n", 1);
                                              });
  host->client->startLogTimerWithInterval(kOnce, 1, 3, 4);
  host->ready.signal();
  expectReportAndOneFinish();
}

TEST_F(PeriodicLifecycleTest, TheLastReleaseOnTheReportingQueueEndsTheSessionOnce) {
  for (const std::string_view moment : {texts::kTimerStarted, texts::kTickStarted, texts::kCollectionFinished}) {
    FakeDaemon daemon;
    daemon.start();
    const auto ended = std::make_shared<Semaphore>();
    auto client = makeClient();
    const auto sink = std::make_shared<Trigger>(
        moment == texts::kTimerStarted ? "startLogTimerWithInterval: 3600, 1" : moment, [&client] { client.reset(); });
    log::setSink(sink);
    client->registerPeriodicTaskForModule(1, true, true,
                                          [owner = std::shared_ptr<void>(nullptr, [ended](void*) { ended->signal(); })](
                                              PropertyDictionary* statistics) { statistics->set("n", 1); });
    client->startLogTimerWithInterval(kOnce, 1, 3, 4);
    ASSERT_TRUE(daemon.waitForEnds(1)) << moment;
    EXPECT_EQ(daemon.count("finishSessionGracefully"), 1U);
    EXPECT_EQ(daemon.count("sendMessageWithDictionary"), moment == texts::kCollectionFinished ? 1U : 0U);
    EXPECT_EQ(daemon.calls().back().method, "finishSessionGracefully");
    EXPECT_TRUE(ended->waitFor(kPatience)) << "what the callback owned ends elsewhere";
    log::setSink(nullptr);
  }
}

TEST_F(PeriodicLifecycleTest, WhatACallbackOwnsEndsWithUnregisteringAndWithTheClient) {
  auto client = makeClient();
  const auto ends = std::make_shared<std::atomic<int>>(0);
  for (std::uint32_t module = 0; module < 3; ++module) {
    client->registerPeriodicTaskForModule(
        module, true, true,
        [owner = std::shared_ptr<void>(nullptr, [ends](void*) { ++*ends; })](PropertyDictionary*) {});
  }
  client->startLogTimerWithInterval(kOnce, 0, 3, 4);
  client->stopLogTimer();
  client->unregisterPeriodTaskForModule(0);  // also waits for a tick
  EXPECT_EQ(ends->load(), 1);
  client->unregisterPeriodTaskForModule(1);
  EXPECT_EQ(ends->load(), 2);
  client.reset();
  EXPECT_EQ(ends->load(), 3);
}

TEST_F(PeriodicLifecycleTest, WhatCallbacksOwnMayWaitForTheLibraryWhenItEnds) {
  _daemon.start();
  const auto other = makeClient();
  const auto ended = std::make_shared<Semaphore>();
  const auto owning = [this, other, ended]() -> Service {
    std::shared_ptr<void> owner(nullptr, [this, other, ended](void*) {
      EXPECT_FALSE(flush(*other));
      ended->signal();
    });
    return [owner = std::move(owner)](PropertyDictionary*) {};
  };
  auto client = makeClient();
  client->registerPeriodicTaskForModule(1, true, true, owning());
  client->registerPeriodicTaskForModule(1, true, true, owning());
  ASSERT_TRUE(ended->waitFor(kPatience)) << "the first was replaced on the library's thread";
  client.reset();
  ASSERT_TRUE(ended->waitFor(kPatience));
}

TEST_F(PeriodicLifecycleTest, AForkedChildHasNoPeriodicTasks) {
  _daemon.start();
  auto blocked = block();
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    alarm(20);
    auto client = std::move(blocked.client);
    bool isInert = !client->registerPeriodicTaskForModule(2, true, true, [](PropertyDictionary*) {});
    isInert = isInert && client->unregisterPeriodTaskForModule(1);
    client->startLogTimerWithInterval(1, 1, 3, 4);
    client->stopLogTimer();
    client.reset();
    _exit(isInert ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  blocked.leave->signal();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1)) << "the parent's tick goes on";
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U);
}

}  // namespace
}  // namespace velk::test
