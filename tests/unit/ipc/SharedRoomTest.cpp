#include "ipc/SharedRoom.h"

#include <gtest/gtest.h>

#include <string>

namespace velk::ipc {
namespace {

using std::chrono::seconds;

class SharedRoomTest : public testing::Test {
 protected:
  std::unique_ptr<SharedRoom::Part> part(std::uint32_t user, const std::string& name = "") {
    return std::make_unique<SharedRoom::Part>(room, user, [this, name] { ended += name; });
  }
  static bool take(SharedRoom::Part& part, std::size_t bytes) {
    return part.tryResize([bytes] { return bytes; });
  }

  std::shared_ptr<SharedRoom> room = std::make_shared<SharedRoom>(100, 60);
  std::string ended;
};

TEST_F(SharedRoomTest, IsBoundedForAUserAndForAll) {
  const auto first = part(1);
  const auto second = part(1);
  const auto other = part(2);
  EXPECT_TRUE(take(*first, 40));
  EXPECT_FALSE(take(*second, 21));
  EXPECT_EQ(second->bytes(), 0U);
  EXPECT_TRUE(take(*second, 20));
  EXPECT_FALSE(take(*other, 41));
  EXPECT_TRUE(take(*other, 40));
  EXPECT_TRUE(take(*first, 10)) << "less always fits";
  EXPECT_EQ(room->taken(), 70U);
}

TEST_F(SharedRoomTest, IsGivenBackWithThePart) {
  const auto stays = part(1);
  EXPECT_TRUE(take(*part(1), 60));
  EXPECT_EQ(room->taken(), 0U);
  EXPECT_TRUE(take(*stays, 60));
}

TEST_F(SharedRoomTest, CallsBackWhenAPartBecomesSmaller) {
  const auto first = part(1);
  const auto second = part(1);
  int calls = 0;
  second->whenThereIsRoom(60, [&] { ++calls; });
  EXPECT_EQ(calls, 1) << "there is room";
  EXPECT_TRUE(take(*first, 60));
  second->whenThereIsRoom(1, [&] { ++calls; });
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(take(*first, 59));
  EXPECT_EQ(calls, 2);
  EXPECT_TRUE(take(*first, 0));
  EXPECT_EQ(calls, 2) << "once";
}

TEST_F(SharedRoomTest, EndsThoseOfTheUserWhoseRoomIsFull) {
  const auto first = part(1, "a");
  const auto second = part(1, "b");
  const auto other = part(2, "c");
  const auto late = part(1, "d");
  first->owesSince(SteadyTime(seconds(20)));
  second->owesSince(SteadyTime(seconds(10)));
  other->owesSince(SteadyTime(seconds(5)));
  late->owesSince(SteadyTime(seconds(90)));
  EXPECT_TRUE(take(*first, 60));
  EXPECT_FALSE(take(*second, 1));
  second->endOverdue(SteadyTime(seconds(30)), true);
  EXPECT_EQ(ended, "b");
  second->endOverdue(SteadyTime(seconds(30)), false);
  EXPECT_EQ(ended, "ba") << "each is asked once";
}

TEST_F(SharedRoomTest, EndsThoseOfAllWhenTheRoomOfAllIsFull) {
  const auto first = part(1, "a");
  const auto second = part(2, "b");
  const auto third = part(3, "c");
  first->owesSince(SteadyTime(seconds(20)));
  second->owesSince(SteadyTime(seconds(10)));
  second->owesNothing();
  EXPECT_TRUE(take(*first, 60));
  EXPECT_TRUE(take(*second, 40));
  EXPECT_FALSE(take(*third, 1));
  third->endOverdue(SteadyTime(seconds(30)), true);
  EXPECT_EQ(ended, "a");
}

}  // namespace
}  // namespace velk::ipc
