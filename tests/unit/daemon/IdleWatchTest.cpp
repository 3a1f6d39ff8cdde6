#include "daemon/IdleWatch.h"

#include <gtest/gtest.h>

#include "tests/support/ManualScheduler.h"

namespace velk {
namespace {

using namespace std::chrono_literals;

class IdleWatchTest : public ::testing::Test {
 protected:
  std::unique_ptr<IdleWatch> make(std::optional<Duration> limit) {
    return std::make_unique<IdleWatch>(
        scheduler, limit, [this] { return occupied; }, [this] { ++idle; });
  }

  test::ManualScheduler scheduler;
  bool occupied = false;
  int idle = 0;
};

TEST_F(IdleWatchTest, SaysSoWhenNothingHeldTheProcessForTheLimit) {
  const auto watch = make(30s);
  watch->start();
  scheduler.advance(29s);
  EXPECT_EQ(idle, 0);
  scheduler.advance(2s);
  EXPECT_EQ(idle, 1);
}

TEST_F(IdleWatchTest, StaysSilentWithoutALimit) {
  const auto watch = make(std::nullopt);
  watch->start();
  watch->beginTransaction();
  watch->endTransaction();
  scheduler.advance(24h);
  EXPECT_EQ(idle, 0);
}

TEST_F(IdleWatchTest, CountsFromTheEndOfTheTransaction) {
  const auto watch = make(30s);
  watch->start();
  scheduler.advance(20s);
  watch->beginTransaction();
  scheduler.advance(100s);
  EXPECT_EQ(idle, 0);
  watch->endTransaction();
  scheduler.advance(29s);
  EXPECT_EQ(idle, 0);
  scheduler.advance(2s);
  EXPECT_EQ(idle, 1);
}

TEST_F(IdleWatchTest, LooksAgainWhileSomebodyIsAtTheDoor) {
  const auto watch = make(30s);
  watch->start();
  occupied = true;
  scheduler.advance(40s);
  EXPECT_EQ(idle, 0);
  occupied = false;
  scheduler.advance(40s);
  EXPECT_EQ(idle, 1);
}

TEST_F(IdleWatchTest, CallsNobodyBeforeItWasStartedOrAfterItWasStopped) {
  const auto watch = make(30s);
  watch->beginTransaction();
  watch->endTransaction();
  scheduler.advance(60s);
  EXPECT_EQ(idle, 0);
  watch->start();
  watch->stop();
  scheduler.advance(60s);
  EXPECT_EQ(idle, 0);
}

TEST_F(IdleWatchTest, TellsWhetherTheTransactionIsHeld) {
  const auto watch = make(std::nullopt);
  EXPECT_TRUE(watch->waitUntilReleased(0s));
  watch->beginTransaction();
  EXPECT_FALSE(watch->isReleased());
  EXPECT_FALSE(watch->waitUntilReleased(0s));
  watch->endTransaction();
  EXPECT_TRUE(watch->waitUntilReleased(0s));
}

}  // namespace
}  // namespace velk
