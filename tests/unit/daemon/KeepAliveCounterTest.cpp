#include "daemon/KeepAliveCounter.h"

#include <gtest/gtest.h>

#include "daemon/LogTexts.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

class KeepAliveCounterTest : public ::testing::Test {
 protected:
  void createSession() {
    counter.beginIfUnused("<session>");
    counter.retain();
  }

  test::RecordingLog log;
  test::FakeKeepAlive keepAlive;
  KeepAliveCounter counter{keepAlive};
};

TEST_F(KeepAliveCounterTest, BeginsTheTransactionWithTheFirstReferenceOnly) {
  createSession();
  EXPECT_EQ(keepAlive.begun, 1);
  createSession();
  EXPECT_EQ(keepAlive.begun, 1);
  EXPECT_EQ(counter.count(), 2);
  EXPECT_EQ(log.count("createReportingSessionWithDelegate: IPC transaction started with session <session>"), 1);
  EXPECT_EQ(log.count("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is 2"), 1);
}

TEST_F(KeepAliveCounterTest, DoesAndSaysNothingWhenNothingIsHeld) {
  counter.release(1);
  EXPECT_EQ(counter.count(), 0);
  EXPECT_EQ(keepAlive.ended, 0);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(KeepAliveCounterTest, GoesBelowZeroAndThenBeginsNothingUntilItIsZeroAgain) {
  createSession();
  createSession();
  counter.release(3);
  EXPECT_EQ(counter.count(), -1);
  EXPECT_EQ(keepAlive.ended, 1);
  EXPECT_EQ(log.count("releaseIPCTransactions: IPC transaction ref count is -1, decremented by 3"), 1);
  EXPECT_EQ(log.count(daemontexts::kTransactionEnded), 1);

  createSession();
  EXPECT_EQ(counter.count(), 0);
  EXPECT_EQ(keepAlive.begun, 1);
  createSession();
  EXPECT_EQ(keepAlive.begun, 2);
}

TEST_F(KeepAliveCounterTest, ReleasingNoneWhileSomeAreHeldEndsNothing) {
  createSession();
  counter.release(0);
  EXPECT_EQ(counter.count(), 1);
  EXPECT_EQ(keepAlive.open(), 1);
}

}  // namespace
}  // namespace velk
