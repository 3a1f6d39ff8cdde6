// What a connection refuses, and when it stops reading or serving.
#include "tests/unit/ipc/ConnectionFixture.h"

namespace velk {
namespace {

using namespace test;
using ipc::FrameKind;

constexpr std::uint32_t kQuickMethod = 5;

using ConnectionBoundsTest = ConnectionTest;

TEST_F(ConnectionBoundsTest, RefusesWhatDoesNotFitIntoTheOutbox) {
  makeOpen();
  const PropertyArray large{std::string(400'000, 'x')};
  Result<void> sent;
  int count = 0;
  while (sent && count < 100) {
    sent = connection->callMethod(kMethod, large, {});
    if (sent) ++count;
  }
  ASSERT_FALSE(sent);
  EXPECT_EQ(sent.error().code, static_cast<int>(ConnectionError::outboxFull));
  // What was accepted arrives whole.
  for (int number = 0; number < count; ++number) EXPECT_EQ(peer->receive()->header.kind, FrameKind::call);
  EXPECT_TRUE(connection->waitUntilSent(kPatience));
  EXPECT_TRUE(connection->callMethod(kMethod, large, {}));
}

TEST_F(ConnectionBoundsTest, RefusesCallsThatCannotBeEncoded) {
  makeOpen();
  EXPECT_EQ(connection->callMethod(kMethod, {"\xFF"}, {}).error().code,
            static_cast<int>(ConnectionError::notEncodable));
  EXPECT_EQ(connection->callMethod(kMethod, {std::string(ipc::kMaximumFrameBytes, 'x')}, {}).error().code,
            static_cast<int>(ConnectionError::tooLarge));
  ASSERT_TRUE(connection->callMethod(kMethod, {"good"}, {}));
  EXPECT_EQ((*peer->receive()->body.array())[1], PropertyValue("good"));
}

TEST_F(ConnectionBoundsTest, StopsReadingUntilTheQueueCatchesUp) {
  makeOpen();
  const auto call = callBytes(1, 0, {std::string(100'000, 'x')});
  std::vector<std::uint8_t> stream;
  constexpr int kCalls = 100;
  for (int count = 0; count < kCalls; ++count) stream.insert(stream.end(), call.begin(), call.end());
  std::size_t sent = 0;
  // The queue does not run: the loop stops reading, and the peer can send no more.
  for (int idleTurns = 0; idleTurns < 50;) {
    const auto count = peer->sendSome(std::span(stream).subspan(sent));
    sent += count;
    if (count != 0) {
      idleTurns = 0;
      continue;
    }
    Event turned;
    loop.post([&] { turned.happen(); });
    ASSERT_TRUE(turned.wait());
    ++idleTurns;
  }
  EXPECT_LT(sent, ipc::kMaximumUnreadBytes + ipc::kMaximumFrameBytes + 1024 * 1024);
  std::thread rest([&] { peer->send({stream.begin() + static_cast<std::ptrdiff_t>(sent), stream.end()}); });
  queue->runUntil([&] { return events.size() == kCalls; });
  rest.join();
}

TEST_F(ConnectionBoundsTest, TellsOfAHangUpAlthoughTooMuchWaitsToBeRead) {
  makeOpen();
  std::vector<std::uint8_t> stream;
  while (stream.size() < ipc::kMaximumUnreadBytes + 64 * 1024) {
    const auto call = callBytes(kMethod, 0, {std::string(10'000, 'x')});
    stream.insert(stream.end(), call.begin(), call.end());
  }
  peer->send(stream);
  peer->hangUp();
  EXPECT_TRUE(departed.wait());
  EXPECT_TRUE(events.empty());
  runUntil("invalidated");
  EXPECT_GT(events.size(), 50U);
}

TEST_F(ConnectionBoundsTest, ServesNoCallsToAPeerThatDoesNotReadItsReplies) {
  makeOpen();
  dispatch = [](IncomingCall& call) {
    call.reply.sendValues({std::string(300'000, 'x')});
    return Result<void>();
  };
  constexpr std::size_t kCalls = 40;
  for (std::size_t count = 0; count < kCalls; ++count) peer->send(callBytes(kMethod, count + 1, {}));
  ASSERT_TRUE(queue->runOne());
  EXPECT_LT(events.size(), kCalls);
  std::thread reader([&] {
    for (std::size_t count = 0; count < kCalls; ++count) EXPECT_EQ(peer->receive()->header.serial, count + 1);
  });
  queue->runUntil([&] { return events.size() == kCalls; });
  reader.join();
}

}  // namespace
}  // namespace velk
