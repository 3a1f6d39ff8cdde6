#include "backends/ProcessUploads.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "platform/Semaphore.h"

namespace velk::test {
namespace {

using Turn = ProcessUploads::CompressionTurn;
constexpr auto kPatience = std::chrono::seconds(60);

TEST(ProcessUploads, CountsWhatIsUnderWay) {
  ProcessUploads uploads;
  EXPECT_TRUE(uploads.waitUntilNone(std::chrono::seconds(0)));
  for (std::size_t number = 0; number < ProcessUploads::kMaximumUploads; ++number) {
    EXPECT_FALSE(uploads.isFull());
    uploads.enter();
  }
  EXPECT_TRUE(uploads.isFull());
  EXPECT_FALSE(uploads.waitUntilNone(std::chrono::milliseconds(1)));
  uploads.leave();
  EXPECT_FALSE(uploads.isFull());
}

TEST(ProcessUploads, TheLastOneThatLeavesIsWaitedFor) {
  ProcessUploads uploads;
  uploads.enter();
  std::thread last([&] { uploads.leave(); });
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
