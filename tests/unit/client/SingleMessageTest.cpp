// Messages without a client object: what the log says when they fail, and how many may wait for their answers.
#include <atomic>

#include "client/ClientRuntime.h"
#include "client/LogTexts.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

class SingleMessageTest : public ::testing::Test {
 protected:
  using SingleMessages = FakeDaemon::SingleMessages;
  static constexpr std::string_view kFailedToConnect = "sendOneMessageWithSessionInfo: Failed to connect to daemon";
  static constexpr std::string_view kNoProxy = "sendOneMessageWithSessionInfo: Failed to get remote object proxy";

  /// No message is on its way to the daemon of another test.
  ~SingleMessageTest() override {
    awaitTurn();
    log::setSink(nullptr);
  }

  bool send() {
    return VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(), userInfo(), 1, 2, std::nullopt, &_error);
  }
  /// What was handed to their queue so far has run, and what it owned has ended.
  static void awaitTurn() {
    ClientRuntime::shared().oneMessageQueue()->sync([] {});
  }
  [[nodiscard]] bool waitForMessages(std::size_t count) const {
    return _daemon.waitForCalls("sendMessageWithSessionInfo", count);
  }

  RecordingLog _log;
  FakeDaemon _daemon;
  Error _error;
};

TEST_F(SingleMessageTest, SaysThatThereIsNoDaemon) {
  EXPECT_TRUE(send());
  awaitTurn();
  EXPECT_EQ(_log.count(log::Level::standard, kFailedToConnect), 1);
  EXPECT_EQ(_log.count(kNoProxy), 0) << "it never had a connection";
  for (const auto& line : _log.lines()) EXPECT_NE(line.level, log::Level::error) << line.text;
}

TEST_F(SingleMessageTest, HoldsNoPlaceWithoutADaemon) {
  for (int number = 1; number <= 257; ++number) {
    ASSERT_TRUE(send()) << number << ": " << _error.description;
    awaitTurn();
  }
  EXPECT_EQ(_log.count(kFailedToConnect), 257);
}

TEST_F(SingleMessageTest, SaysThatTheDaemonGaveItUp) {
  _daemon.setSingleMessages(SingleMessages::dropped);
  _daemon.start();
  EXPECT_TRUE(send());
  ASSERT_TRUE(_daemon.waitForEnds(1)) << "the connection was for this message alone";
  EXPECT_EQ(_log.count(log::Level::standard, kNoProxy), 1);
  EXPECT_EQ(_log.count(kFailedToConnect), 0);
  EXPECT_FALSE(_log.contains("sendOneMessageWithSessionInfo: finished"));
  EXPECT_EQ(_daemon.count("sendMessageWithSessionInfo"), 1U) << "it is not sent again";
}

TEST_F(SingleMessageTest, SaysThatTheDaemonWentAwayBeforeItsAnswer) {
  _daemon.setSingleMessages(SingleMessages::kept);
  _daemon.start();
  EXPECT_TRUE(send());
  ASSERT_TRUE(waitForMessages(1));
  auto failures = std::make_shared<std::atomic<int>>(0);
  auto failed = std::make_shared<Semaphore>();
  log::setSink(std::make_shared<Trigger>(kNoProxy, [failures, failed] {
    ++*failures;
    failed->signal();
  }));
  _daemon.stop();
  ASSERT_TRUE(failed->waitFor(kPatience));
  // Another one takes the same road behind it.
  _daemon.setSingleMessages(SingleMessages::answered);
  _daemon.start();
  EXPECT_TRUE(send());
  ASSERT_TRUE(_daemon.waitForEnds(1));
  EXPECT_EQ(failures->load(), 1);
  EXPECT_EQ(_daemon.count("sendMessageWithSessionInfo"), 2U);
}

TEST_F(SingleMessageTest, WaitsWithSoManyOthersAndNoMore) {
  constexpr std::size_t kMost = 256;
  _daemon.setSingleMessages(SingleMessages::kept);
  _daemon.start();
  for (std::size_t number = 1; number <= kMost; ++number) {
    ASSERT_TRUE(send()) << number << ": " << _error.description;
  }
  const auto expectRefusal = [this](const char* why) {
    EXPECT_FALSE(send()) << why;
    EXPECT_EQ(_error.domain, "VelkReportingErrorDomain");
    EXPECT_EQ(_error.code, 8);
  };
  expectRefusal("so many are there");
  ASSERT_TRUE(waitForMessages(kMost));
  expectRefusal("the daemon has them, but has not answered");
  auto ended = std::make_shared<Semaphore>();
  log::setSink(std::make_shared<Trigger>(texts::kOneMessageInvalidated, [ended] { ended->signal(); }));
  _daemon.answerKeptMessage();
  ASSERT_TRUE(ended->waitFor(kPatience));
  awaitTurn();  // the line is written while the connection still has its place
  EXPECT_TRUE(send()) << "in the place of the one that was answered: " << _error.description;
  EXPECT_EQ(_error, Error());
  expectRefusal("one was answered, not two");
  ASSERT_TRUE(waitForMessages(kMost + 1));
  for (std::size_t number = 1; number <= kMost; ++number) _daemon.answerKeptMessage();
  for (std::size_t number = 1; number <= kMost; ++number) ASSERT_TRUE(ended->waitFor(kPatience));
  awaitTurn();
  EXPECT_EQ(_daemon.count("sendMessageWithSessionInfo"), kMost + 1) << "none that was refused";
}

}  // namespace
}  // namespace velk::test
