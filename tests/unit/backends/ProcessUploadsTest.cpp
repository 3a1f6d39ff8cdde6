#include "backends/ProcessUploads.h"

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "platform/Semaphore.h"

namespace velk::test {
namespace {

using Turn = ProcessUploads::CompressionTurn;
constexpr auto kPatience = std::chrono::seconds(60);

/// Takes what the user can get.
std::size_t takeAll(ProcessUploads& uploads, ProcessUploads::User user) {
  std::size_t taken = 0;
  while (uploads.enter(user)) ++taken;
  return taken;
}

TEST(ProcessUploads, CountsWhatIsUnderWay) {
  ProcessUploads uploads;
  EXPECT_TRUE(uploads.waitUntilNone(std::chrono::seconds(0)));
  EXPECT_TRUE(uploads.enter(1));
  EXPECT_TRUE(uploads.enter(2));
  EXPECT_EQ(uploads.count(), 2U);
  EXPECT_FALSE(uploads.waitUntilNone(std::chrono::milliseconds(1)));
  uploads.leave(1);
  uploads.leave(2);
  EXPECT_TRUE(uploads.waitUntilNone(std::chrono::seconds(0)));
}

TEST(ProcessUploads, EveryUserLeavesAsManyPlacesAsItHolds) {
  ProcessUploads uploads;
  EXPECT_EQ(takeAll(uploads, 1), ProcessUploads::kMaximumUploads / 2);
  EXPECT_EQ(takeAll(uploads, 2), ProcessUploads::kMaximumUploads / 4);
  EXPECT_EQ(takeAll(uploads, 3), ProcessUploads::kMaximumUploads / 8);
  EXPECT_FALSE(uploads.enter(1));
  uploads.leave(1);
  EXPECT_FALSE(uploads.enter(1)) << "it still has more than its share";
  EXPECT_TRUE(uploads.enter(3));
}

TEST(ProcessUploads, UsersComeToEqualSharesWithOneToSpare) {
  ProcessUploads uploads;
  std::map<ProcessUploads::User, std::size_t> held;
  held[1] = takeAll(uploads, 1);
  held[2] = takeAll(uploads, 2);
  // Whose upload ends, the first user's, tries to take another at once; so does the other.
  for (int round = 0; round < 100; ++round) {
    uploads.leave(1);
    held[1] -= 1;
    held[2] += takeAll(uploads, 2);
    held[1] += takeAll(uploads, 1);
  }
  EXPECT_EQ(held[1], ProcessUploads::kMaximumUploads / 3);
  EXPECT_EQ(held[2], ProcessUploads::kMaximumUploads / 3 + 1);
  EXPECT_TRUE(uploads.enter(3));
}

TEST(ProcessUploads, TheLastOneThatLeavesIsWaitedFor) {
  ProcessUploads uploads;
  ASSERT_TRUE(uploads.enter(1));
  std::thread last([&] { uploads.leave(1); });
  EXPECT_TRUE(uploads.waitUntilNone(kPatience));
  last.join();
}

TEST(ProcessUploads, TwoCompressAtOnceAndTheOthersInOrder) {
  ProcessUploads uploads;
  std::optional<Turn> first(std::in_place, uploads);
  std::optional<Turn> second(std::in_place, uploads);
  // Each of those who wait stands in line before the next one comes: who comes later cannot be served before.
  Lock lock;
  std::vector<int> served;
  Semaphore mayEnd;
  Semaphore hasBegun;
  std::vector<std::thread> others;
  const auto come = [&](int number) {
    others.emplace_back([&, number] {
      const Turn turn(uploads);
      {
        Guard guard(lock);
        served.push_back(number);
      }
      hasBegun.signal();
      EXPECT_TRUE(mayEnd.waitFor(kPatience));
    });
  };
  come(0);
  come(1);
  EXPECT_FALSE(hasBegun.waitFor(std::chrono::milliseconds(50))) << "two are at it";
  first.reset();
  ASSERT_TRUE(hasBegun.waitFor(kPatience));
  EXPECT_FALSE(hasBegun.waitFor(std::chrono::milliseconds(50))) << "one has taken the place of one";
  second.reset();
  ASSERT_TRUE(hasBegun.waitFor(kPatience));
  mayEnd.signal();
  mayEnd.signal();
  for (auto& other : others) other.join();
  EXPECT_EQ(served.size(), 2U);
}

TEST(ProcessUploads, RemembersWhatTheEndLeftBehind) {
  ProcessUploads uploads;
  EXPECT_FALSE(uploads.isStopping());
  uploads.stop();
  EXPECT_TRUE(uploads.isStopping());
  EXPECT_EQ(uploads.leftBehind(), 0U);
  uploads.noteLeftBehind();
  EXPECT_EQ(uploads.leftBehind(), 1U);
}

}  // namespace
}  // namespace velk::test
