// The last reference to a client object, wherever it goes: the session ends once, behind everything that was sent.
#include <atomic>
#include <thread>

#include "client/LogTexts.h"
#include "client/VelkReportingC.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

class LastReleaseTest : public VelkReportingTest {
 protected:
  /// More than the daemon's socket, its unread bytes and the connection's outbox hold together.
  static constexpr std::size_t kEvents = 120;

  /// What callbacks take the last reference from.
  struct Holder {
    std::shared_ptr<VelkReporting> client;
    Semaphore released;
    void release() {
      client.reset();
      released.signal();
    }
  };

  /// A client whose session is known to the daemon, and which may take its time in the end, however slow the machine.
  void SetUp() override {
    _daemon.start();
    _holder->client = makeClient([holder = _holder](auto&&...) { holder->release(); });
    ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
    _holder->client->setEndOfLifeBound(std::chrono::minutes(1));
  }

  void sendMoreThanFits() {
    _daemon.holdCalls(true);
    const PropertyDictionary payload{{"text", std::string(50'000, 'x')}};
    for (std::size_t event = 0; event < kEvents; ++event) {
      Error error;
      _holder->client->sendMessageWithCategory(1, 1, payload, &error);
      ASSERT_EQ(error, Error());
    }
  }

  void expectOneEndBehind(std::size_t events) {
    ASSERT_TRUE(_daemon.waitForEnds(1));
    EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), events);
    EXPECT_EQ(_daemon.count("finishSessionGracefully"), 1U);
    EXPECT_EQ(_daemon.calls().back().method, "finishSessionGracefully");
    EXPECT_EQ(_daemon.count("setSessionInfo"), 1U);
  }

  const std::shared_ptr<Holder> _holder = std::make_shared<Holder>();
};

TEST_F(LastReleaseTest, OnTheLibrarysThreadLosesNothingThatWaits) {
  sendMoreThanFits();
  log::setSink(std::make_shared<Trigger>(texts::kLoggingBlockSet, [holder = _holder] { holder->release(); }));
  _holder->client->setMessageLoggingBlock(nullptr);
  EXPECT_TRUE(_holder->released.waitFor(kPatience)) << "that thread waits for nothing";
  _daemon.holdCalls(false);
  expectOneEndBehind(kEvents);
  log::setSink(nullptr);
}

TEST_F(LastReleaseTest, OnTheLibrarysThreadEndsTheSessionWithoutAnotherThread) {
  constexpr int kAllThreads = 64;
  auto leave = std::make_shared<Semaphore>();
  auto entered = std::make_shared<Semaphore>();
  for (int number = 0; number < kAllThreads; ++number) {
    _holder->client->flushMessagesWithCompletion([entered, leave](const auto&) {
      entered->signal();
      leave->wait();
    });
  }
  for (int number = 0; number < kAllThreads; ++number) ASSERT_TRUE(entered->waitFor(kPatience));
  _holder->client->setEndOfLifeBound(std::chrono::milliseconds(100));
  log::setSink(std::make_shared<Trigger>(texts::kLoggingBlockSet, [holder = _holder] { holder->release(); }));
  _holder->client->setMessageLoggingBlock(nullptr);
  expectOneEndBehind(0);
  for (int number = 0; number < kAllThreads; ++number) leave->signal();
  log::setSink(nullptr);
}

TEST_F(LastReleaseTest, InAModulesCallbackLosesNothingThatWaits) {
  auto entered = std::make_shared<Semaphore>();
  auto leave = std::make_shared<Semaphore>();
  _holder->client->registerPeriodicTaskForModule(1, true, true, [holder = _holder, entered, leave](auto*) {
    entered->signal();
    leave->wait();
    holder->release();
  });
  _holder->client->startLogTimerWithInterval(3600, 0, 3, 4);
  ASSERT_TRUE(entered->waitFor(kPatience));
  sendMoreThanFits();
  leave->signal();
  EXPECT_TRUE(_holder->released.waitFor(kPatience)) << "the tick would wait for itself";
  _daemon.holdCalls(false);
  expectOneEndBehind(kEvents);
}

TEST_F(LastReleaseTest, InACallbackWaits) {
  auto entered = std::make_shared<Semaphore>();
  auto leave = std::make_shared<Semaphore>();
  _holder->client->flushMessagesWithCompletion([holder = _holder, entered, leave](const auto&) {
    entered->signal();
    leave->wait();
    holder->release();
  });
  ASSERT_TRUE(entered->waitFor(kPatience));
  sendMoreThanFits();
  leave->signal();
  _daemon.holdCalls(false);
  EXPECT_TRUE(_holder->released.waitFor(kPatience));
  expectOneEndBehind(kEvents);
}

TEST_F(LastReleaseTest, InTheAggregationBlock) {
  _holder->client->sendMessageWithCategory(1, 1);
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 1, 2, 3, std::nullopt);
  EXPECT_TRUE(_holder->released.waitFor(kPatience));
  expectOneEndBehind(1);
}

TEST_F(LastReleaseTest, InTheLoggingBlock) {
  _daemon.setMessageReply("sent");
  _holder->client->setMessageLoggingBlock([holder = _holder](const std::string&) { holder->release(); });
  _holder->client->sendMessageWithCategory(1, 1);
  EXPECT_TRUE(_holder->released.waitFor(kPatience));
  expectOneEndBehind(1);
}

TEST_F(LastReleaseTest, OfTheDelegatesOwnReference) {
  struct Delegate : VelkReportingMessageSentDelegate {
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&, const PropertyDictionary&) override {
      entered.signal();
      leave.wait();
    }
    Semaphore entered, leave;
  };
  const auto delegate = std::make_shared<Delegate>();
  _holder->client->setMessageSentDelegate(delegate);
  _holder->client->sendMessageWithCategory(1, 1);
  ASSERT_TRUE(delegate->entered.waitFor(kPatience));
  _holder->release();
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U) << "the delegate has the object in its hands";
  delegate->leave.signal();
  expectOneEndBehind(1);
}

TEST_F(LastReleaseTest, OfManyOwnersAtOnce) {
  constexpr int kThreads = 8;
  _holder->client = nullptr;
  ASSERT_TRUE(_daemon.waitForEnds(1));
  VelkReportingValue* const info =
      VelkReportingDictionaryCreateFromJSON(R"({"ComponentType": 9, "SessionID": 7})", nullptr);
  VelkReportingClient* const client = VelkReportingClientCreate(info, nullptr, nullptr);
  VelkReportingValueRelease(info);
  ASSERT_NE(client, nullptr);
  std::vector<std::thread> owners;
  for (int number = 0; number < kThreads; ++number) {
    VelkReportingClientRetain(client);
    owners.emplace_back([client] {
      for (int round = 0; round < 1000; ++round) {
        VelkReportingClientRelease(VelkReportingClientRetain(client));
      }
      VelkReportingSendMessageWithError(client, 1, 1, nullptr, nullptr);
      VelkReportingClientRelease(client);
    });
  }
  VelkReportingClientRelease(client);
  for (auto& owner : owners) owner.join();
  ASSERT_TRUE(_daemon.waitForEnds(2));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), std::size_t{kThreads});
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 2U);
  EXPECT_EQ(_daemon.calls().back().method, "finishSessionGracefully");
}

}  // namespace
}  // namespace velk::test
