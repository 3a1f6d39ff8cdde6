#include "backends/ProcessUploads.h"

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <optional>
#include <string>
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

/// Threads that each want one turn, and say so when they have it.
class Line {
 public:
  explicit Line(ProcessUploads& uploads) : _uploads(uploads) {}
  ~Line() {
    for (auto& thread : _threads) thread.join();
  }

  /// Returns when that one stands in line behind all that came before.
  void come(ProcessUploads::User user, std::string name) {
    const std::size_t before = _uploads.waitingForTurns();
    _threads.emplace_back([this, user, name = std::move(name)] {
      const Turn turn(_uploads, user);
      {
        Guard guard(_lock);
        _served.push_back(name);
      }
      _hasBegun.signal();
      EXPECT_TRUE(_mayEnd.waitFor(kPatience));
    });
    while (_uploads.waitingForTurns() == before) std::this_thread::yield();
  }
  /// Waits until one more has a turn.
  [[nodiscard]] bool waitForOne() { return _hasBegun.waitFor(kPatience); }
  void letOneEnd() { _mayEnd.signal(); }
  [[nodiscard]] std::vector<std::string> served() {
    Guard guard(_lock);
    return _served;
  }

 private:
  ProcessUploads& _uploads;
  Semaphore _hasBegun;
  Semaphore _mayEnd;
  Lock _lock;
  std::vector<std::string> _served VELK_GUARDED_BY(_lock);
  std::vector<std::thread> _threads;
};

/// Serves all of them one after the other: who was served, in order.
std::vector<std::string> serveAll(Line& line, std::optional<Turn>& turn, std::size_t count) {
  turn.reset();
  for (std::size_t number = 0; number < count; ++number) {
    EXPECT_TRUE(line.waitForOne());
    line.letOneEnd();
  }
  return line.served();
}

TEST(ProcessUploads, TwoCompressAtOnceAndTheOthersInOrder) {
  ProcessUploads uploads;
  std::optional<Turn> first(std::in_place, uploads, 1);
  const Turn second(uploads, 1);
  Line line(uploads);
  for (const char* name : {"a", "b", "c"}) line.come(1, name);
  EXPECT_TRUE(line.served().empty()) << "two are at it";
  EXPECT_EQ(serveAll(line, first, 3), (std::vector<std::string>{"a", "b", "c"}));
}

TEST(ProcessUploads, UsersCompressInTurn) {
  ProcessUploads uploads;
  std::optional<Turn> first(std::in_place, uploads, 1);
  const Turn second(uploads, 1);
  Line line(uploads);
  for (const char* name : {"a", "b", "c"}) line.come(1, name);
  for (const char* name : {"x", "y"}) line.come(2, name);
  EXPECT_EQ(serveAll(line, first, 5), (std::vector<std::string>{"a", "x", "b", "y", "c"}));
}

using DiskRoom = ProcessUploads::DiskRoom;
constexpr std::uint64_t kMost = ProcessUploads::kMaximumDiskBytes;
constexpr std::uint64_t kSpare = ProcessUploads::kSpareDiskBytes;

TEST(ProcessUploads, EveryUserLeavesAsMuchOfTheDiskAsItTakes) {
  const auto uploads = std::make_shared<ProcessUploads>();
  DiskRoom first(uploads, 1);
  EXPECT_TRUE(first.grow(kMost / 4, UINT64_MAX));
  EXPECT_TRUE(first.grow(kMost / 4, UINT64_MAX));
  EXPECT_FALSE(first.grow(1, UINT64_MAX));
  {
    DiskRoom more(uploads, 1);
    EXPECT_FALSE(more.grow(1, UINT64_MAX)) << "it is the user's share, not the file's";
    DiskRoom second(uploads, 2);
    EXPECT_TRUE(second.grow(kMost / 4, UINT64_MAX));
    EXPECT_FALSE(second.grow(1, UINT64_MAX));
    EXPECT_FALSE(second.grow(UINT64_MAX, UINT64_MAX));
  }
  DiskRoom third(uploads, 3);
  EXPECT_TRUE(third.grow(kMost / 4, UINT64_MAX)) << "given back";
}

TEST(ProcessUploads, SmallDisksAreSharedWithOthers) {
  const auto uploads = std::make_shared<ProcessUploads>();
  constexpr std::uint64_t kFree = 4 * kSpare;
  DiskRoom room(uploads, 1);
  EXPECT_TRUE(room.grow(kFree / 4, kFree));
  EXPECT_FALSE(room.grow(1, kFree - kFree / 4)) << "what it took itself counts as found free";
  DiskRoom other(uploads, 2);
  EXPECT_TRUE(other.grow(1, kFree - kFree / 4));
}

TEST(ProcessUploads, SomeOfTheDiskIsKeptFree) {
  const auto uploads = std::make_shared<ProcessUploads>();
  DiskRoom room(uploads, 1);
  EXPECT_TRUE(room.grow(100, kSpare + 100));
  EXPECT_FALSE(room.grow(101, kSpare + 100));
  EXPECT_FALSE(room.grow(1, kSpare));
  EXPECT_FALSE(room.grow(1, 0));
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
