// Callbacks that are slower than what they are called with: what waits for them is bounded, and what is lost is told.
#include <atomic>
#include <thread>

#include "client/CallbackRoom.h"
#include "client/LogTexts.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

constexpr std::string_view kFull = "it is full";
constexpr std::string_view kOver = "%u were dropped";

TEST(CallbackRoom, TakesSoManyAndNoMoreUntilSomeAreGone) {
  const RecordingLog log;
  const auto room = std::make_shared<CallbackRoom>(kFull, kOver);
  {
    std::vector<CallbackRoom::Place> places;
    for (std::size_t place = 0; place < CallbackRoom::kMaximumWaiting; ++place) {
      places.push_back(room->reserve(1));
      ASSERT_TRUE(places.back());
    }
    for (int refused = 0; refused < 3; ++refused) EXPECT_FALSE(room->reserve(1));
    EXPECT_EQ(log.count(log::Level::error, kFull), 1);
    places.pop_back();
    EXPECT_TRUE(room->reserve(1)) << "there is room again";
    EXPECT_EQ(log.lines().size(), 1U) << "but it is not over yet";
  }
  EXPECT_EQ(log.count(log::Level::error, "3 were dropped"), 1);
  EXPECT_TRUE(room->reserve(1));
  EXPECT_EQ(log.lines().size(), 2U);
}

TEST(CallbackRoom, TakesSoManyBytesAndNoMore) {
  const auto room = std::make_shared<CallbackRoom>(kFull, kOver);
  const auto most = room->reserve(CallbackRoom::kMaximumBytes - 1);
  EXPECT_TRUE(most);
  EXPECT_FALSE(room->reserve(2));
  EXPECT_TRUE(room->reserve(1));
  EXPECT_FALSE(room->reserve(static_cast<std::size_t>(-1)));
}

class SlowCallback : public VelkReportingTest {
 protected:
  /// The line is written behind the last call.
  [[nodiscard]] bool waitForLine(const std::string& line) const {
    const auto deadline = std::chrono::steady_clock::now() + 2 * kPatience;
    while (_log.count(line) == 0) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }
};

TEST_F(SlowCallback, OfTheDelegateCostsMessagesButNoMemory) {
  class Delegate : public VelkReportingMessageSentDelegate {
   public:
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&, const PropertyDictionary&) override {
      if (heard++ == 0) leave.wait();
    }
    std::atomic<std::size_t> heard{0};
    Semaphore leave;
  };
  constexpr std::size_t kTooMany = 100;
  const auto client = makeClient();
  const auto delegate = std::make_shared<Delegate>();
  client->setMessageSentDelegate(delegate);
  for (std::size_t sent = 0; sent < CallbackRoom::kMaximumWaiting + kTooMany; ++sent) {
    client->sendMessageWithCategory(1, 1);
  }
  EXPECT_EQ(_log.count(log::Level::error, texts::kDelegateIsSlow), 1) << "at once: it may never catch up";
  delegate->leave.signal();
  EXPECT_TRUE(waitForLine("notifyMessageWasSent: 100 messages were dropped: the delegate is slower than they come"));
  EXPECT_EQ(delegate->heard.load(), CallbackRoom::kMaximumWaiting);
}

TEST_F(SlowCallback, OfTheLoggingBlockCostsTextsButNoMemory) {
  constexpr std::size_t kTooMany = 4;
  constexpr std::size_t kBytes = 900'000;
  constexpr std::size_t kFitting = CallbackRoom::kMaximumBytes / kBytes;
  _daemon.start();
  _daemon.setMessageReply(std::string(kBytes, 'x'));
  const auto client = makeClient();
  const auto leave = std::make_shared<Semaphore>();
  const auto heard = std::make_shared<std::atomic<std::size_t>>(0);
  client->setMessageLoggingBlock([leave, heard](const std::string&) {
    if ((*heard)++ == 0) leave->wait();
  });
  for (std::size_t sent = 0; sent < kFitting + kTooMany; ++sent) client->sendMessageWithCategory(1, 1);
  static_cast<void>(configure(*client));  // its answer comes behind those to the messages
  EXPECT_EQ(_log.count(log::Level::error, texts::kLoggingBlockIsSlow), 1);
  leave->signal();
  EXPECT_TRUE(waitForLine("setMessageLoggingBlock: 4 texts were dropped: the block is slower than they come"));
}

}  // namespace
}  // namespace velk::test
