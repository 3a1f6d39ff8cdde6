#include "daemon/ActiveClientCounter.h"

#include <gtest/gtest.h>

namespace velk {
namespace {

TEST(ActiveClientCounter, CountsEveryTypeOfTheTableItsFirstAndLastIncluded) {
  ActiveClientCounter counter;
  EXPECT_EQ(counter.increment(0), std::uint8_t{1});
  EXPECT_EQ(counter.increment(30), std::uint8_t{1});
  EXPECT_EQ(counter.count(29), 0);
}

TEST(ActiveClientCounter, NeitherCountsNorDecrementsTypesOutsideTheTable) {
  ActiveClientCounter counter;
  for (const std::int32_t type : {-1, 31, INT32_MAX, INT32_MIN}) {
    EXPECT_EQ(counter.increment(type), std::nullopt);
    EXPECT_EQ(counter.decrement(type), std::nullopt);
    EXPECT_FALSE(counter.isLimitReached(type));
  }
}

TEST(ActiveClientCounter, ReachesItsLimitAtFive) {
  ActiveClientCounter counter;
  for (int session = 0; session < 5; ++session) {
    EXPECT_FALSE(counter.isLimitReached(7));
    counter.increment(7);
  }
  EXPECT_TRUE(counter.isLimitReached(7));
  EXPECT_FALSE(counter.isLimitReached(8));
}

TEST(ActiveClientCounter, StaysAtZero) {
  ActiveClientCounter counter;
  EXPECT_EQ(counter.decrement(7), std::nullopt);
  EXPECT_EQ(counter.count(7), 0);
}

TEST(ActiveClientCounter, WrapsAtEightBits) {
  ActiveClientCounter counter;
  for (int session = 0; session < 255; ++session) counter.increment(7);
  EXPECT_TRUE(counter.isLimitReached(7));
  EXPECT_EQ(counter.increment(7), std::uint8_t{0});
  EXPECT_FALSE(counter.isLimitReached(7));
}

}  // namespace
}  // namespace velk
