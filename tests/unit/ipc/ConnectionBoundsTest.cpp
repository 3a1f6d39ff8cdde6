// What a connection refuses, and when it stops reading or serving.
#include <thread>

#include "ipc/ConnectionCore.h"
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

/// Connections of one user that share rooms.
class SharingConnectionsTest : public ConnectionTest {
 protected:
  struct End {
    std::shared_ptr<Connection> connection;
    std::unique_ptr<RawPeer> peer;
  };

  End makeSharing() {
    auto ends = makeLocalSocketPair();
    auto core = std::make_shared<ipc::ConnectionCore>(std::move(ends->first), self(), true, loop, queue, Task());
    core->share(unread, unsent);
    End end{std::make_shared<Connection>(std::move(core)), std::make_unique<RawPeer>(std::move(ends->second))};
    end.connection->setExportedDispatcher(std::make_shared<FunctionDispatcher>([this](IncomingCall& call) {
      events.push_back("call " + std::to_string(call.method));
      call.reply.sendValues({std::string(900'000, 'x')});
      return Result<void>();
    }));
    end.connection->setInvalidationHandler([this] { events.push_back("invalidated"); });
    end.connection->resume();
    return end;
  }

  std::shared_ptr<ipc::SharedRoom> unread = std::make_shared<ipc::SharedRoom>(8'000'000, 1'000'000);
  std::shared_ptr<ipc::SharedRoom> unsent = std::make_shared<ipc::SharedRoom>(8'000'000, 1'000'000);
};

TEST_F(SharingConnectionsTest, AReplyBeyondTheRoomEndsTheOneThatHasNotReadForLongest) {
  const auto first = makeSharing();
  const auto second = makeSharing();
  first.peer->send(callBytes(kMethod, 1, {}));
  runUntil("call 2");
  events.clear();
  EXPECT_GT(unsent->taken(), 400'000U);
  second.peer->send(callBytes(kMethod, 1, {}));
  runUntil("call 2");
  runUntil("invalidated");
  EXPECT_EQ(
      recorded.count(log::Level::error, formatText(ipc::texts::kUnreadReplies, {first.connection->description()})), 1);
  EXPECT_EQ(second.peer->receive()->header.serial, 1U) << "who reads is served";
  EXPECT_FALSE(second.connection->hasEnded());
  queue->runUntil([&] { return unsent->taken() == 0; });
  second.connection->invalidate();
  runUntil("invalidated");
}

TEST_F(SharingConnectionsTest, AFrameWaitsUntilThereIsRoomForIt) {
  const auto first = makeSharing();
  const auto second = makeSharing();
  const auto whole = callBytes(kMethod, 0, {std::string(900'000, 'x')});
  const auto half = std::span(whole).first(whole.size() / 2);
  first.peer->send({half.begin(), half.end()});
  queue->runUntil([&] { return unread->taken() > 800'000; });
  std::thread sender([&] { second.peer->send(whole); });
  first.peer->send({whole.begin() + static_cast<std::ptrdiff_t>(half.size()), whole.end()});
  queue->runUntil([&] { return events.size() == 2; });
  sender.join();
  EXPECT_EQ(unread->taken(), 0U);
  events.clear();
  first.connection->invalidate();
  second.connection->invalidate();
  queue->runUntil([&] { return events.size() == 2; });
}

}  // namespace
}  // namespace velk
