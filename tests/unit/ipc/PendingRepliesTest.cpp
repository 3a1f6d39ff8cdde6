// The table of calls that wait for an answer, full and emptied again.
#include "ipc/PendingReplies.h"

#include "tests/unit/ipc/ConnectionFixture.h"

namespace velk {
namespace {

using namespace test;
using ipc::kMaximumPendingReplies;
using ipc::PendingReplies;

TEST(PendingReplies, TakesEachAnswerOnce) {
  PendingReplies table;
  int answered = 0;
  ReplyHandler handler = [&](const Result<PropertyArray>&) { ++answered; };
  const auto serial = table.add(handler);
  EXPECT_NE(serial, 0U);
  EXPECT_FALSE(handler);
  for (const std::uint64_t wrong :
       {std::uint64_t{0}, serial + 1, serial + (std::uint64_t{1} << 32), ~std::uint64_t{0}}) {
    EXPECT_FALSE(table.take(wrong)) << wrong;
  }
  table.take(serial)(PropertyArray());
  EXPECT_EQ(answered, 1);
  EXPECT_FALSE(table.take(serial));
  ReplyHandler next = [](const Result<PropertyArray>&) {};
  EXPECT_NE(table.add(next), serial) << "the slot serves again, the serial does not";
  EXPECT_EQ(table.size(), 1U);
}

TEST(PendingReplies, IsFullAtItsBoundAndLeavesTheHandlerAlone) {
  PendingReplies table;
  std::uint64_t first = 0;
  for (std::size_t count = 0; count < kMaximumPendingReplies; ++count) {
    ReplyHandler handler = [](const Result<PropertyArray>&) {};
    const auto serial = table.add(handler);
    ASSERT_NE(serial, 0U);
    if (first == 0) first = serial;
  }
  ReplyHandler refused = [](const Result<PropertyArray>&) {};
  EXPECT_EQ(table.add(refused), 0U);
  EXPECT_TRUE(refused) << "still the caller's";
  EXPECT_TRUE(table.take(first));
  EXPECT_NE(table.add(refused), 0U);
  EXPECT_EQ(table.takeAll().size(), kMaximumPendingReplies);
  EXPECT_EQ(table.size(), 0U);
}

class FullTableTest : public ConnectionTest {
 protected:
  /// A call whose answer, or failure, is counted.
  Result<void> callCounted(ReplyHandler& handler) {
    handler = [this](const Result<PropertyArray>& result) { ++(result ? answered : failed); };
    return connection->callOrKeep(kMethod, 0, encodeNothing, handler);
  }

  int answered = 0;
  int failed = 0;
};

TEST_F(FullTableTest, RefusesFurtherCallsUntilAnAnswerComesAndFailsAllAtTheEnd) {
  makeOpen(false);
  ReplyHandler handler;
  std::uint64_t serial = 0;
  constexpr std::size_t kCallsAtOnce = 64;
  static_assert(kMaximumPendingReplies % kCallsAtOnce == 0);
  for (std::size_t count = 0; count < kMaximumPendingReplies; count += kCallsAtOnce) {
    for (std::size_t call = 0; call < kCallsAtOnce; ++call) ASSERT_TRUE(callCounted(handler)) << count + call;
    // The peer reads its calls and answers none, so that the outbox is not what fills.
    for (std::size_t call = 0; call < kCallsAtOnce; ++call) {
      const auto frame = peer->receive();
      ASSERT_TRUE(frame);
      serial = frame->header.serial;
    }
  }
  const auto refused = callCounted(handler);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<int>(ConnectionError::outboxFull));
  EXPECT_EQ(refused.error().description, "too many calls wait for a reply");
  EXPECT_TRUE(handler) << "still the caller's";
  EXPECT_TRUE(connection->send(kMethod, 0, encodeNothing)) << "calls that want no answer go on";

  peer->send(frameBytes(ipc::FrameKind::reply, serial, body(0, encodeNothing)));
  queue->runUntil([&] { return answered == 1; });
  EXPECT_TRUE(callCounted(handler));
  EXPECT_FALSE(callCounted(handler));
  handler = {};

  peer->hangUp();
  queue->runUntil([&] { return failed == static_cast<int>(kMaximumPendingReplies); });
  EXPECT_EQ(answered, 1);
  connection->invalidate();
  runUntil("invalidated");
}

}  // namespace
}  // namespace velk
