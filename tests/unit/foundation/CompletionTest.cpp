#include "foundation/Completion.h"

#include <gtest/gtest.h>

#include <array>
#include <memory>

namespace velk {
namespace {

TEST(UniqueFunction, OwnsWhatItCaptures) {
  auto owned = std::make_unique<int>(7);
  UniqueFunction<int()> function = [owned = std::move(owned)] { return *owned; };
  UniqueFunction<int()> moved = std::move(function);
  EXPECT_FALSE(function);  // NOLINT(bugprone-use-after-move): emptied by the move
  EXPECT_EQ(moved(), 7);
}

TEST(UniqueFunction, HoldsLargeCallables) {
  std::array<int, 100> numbers{};
  numbers[99] = 5;
  UniqueFunction<int(int)> function = [numbers](int index) { return numbers[static_cast<std::size_t>(index)]; };
  UniqueFunction<int(int)> moved;
  moved = std::move(function);
  EXPECT_EQ(moved(99), 5);
}

TEST(Completion, RunsOnceAtMost) {
  int calls = 0;
  Completion<int> completion = [&](int value) { calls += value; };
  completion(2);
  completion(2);
  EXPECT_EQ(calls, 2);
  EXPECT_FALSE(completion);
}

TEST(Completion, TellsOfItsAbandonment) {
  int abandoned = 0;
  {
    Completion<> completion([] {}, [&] { ++abandoned; });
  }
  EXPECT_EQ(abandoned, 1);
  {
    Completion<> completion([] {}, [&] { ++abandoned; });
    completion();
  }
  EXPECT_EQ(abandoned, 1);
}

TEST(Completion, AbandonmentMovesAlong) {
  int abandoned = 0;
  {
    Completion<> first([] {}, [&] { ++abandoned; });
    Completion<> second = std::move(first);
    EXPECT_EQ(abandoned, 0);
    second = Completion<>();
    EXPECT_EQ(abandoned, 1);
  }
  EXPECT_EQ(abandoned, 1);
}

TEST(Completion, EmptyOnesMayBeCalled) {
  Completion<int> none;
  none(3);
  Completion<int> null = nullptr;
  null(3);
  EXPECT_FALSE(none);
}

}  // namespace
}  // namespace velk
