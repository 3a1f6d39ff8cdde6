#include "platform/Platform.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <array>

#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

TEST(RandomSource, StaysBelowTheBound) {
  const auto random = makeRandomSource();
  for (int round = 0; round < 100; ++round) {
    EXPECT_EQ(random->below(1), 0U);
    EXPECT_LT(random->below(7), 7U);
    EXPECT_LT(random->below(0x80000001U), 0x80000001U);
  }
}

TEST(RandomSource, ReachesEveryNumber) {
  const auto random = makeRandomSource();
  std::array<int, 5> seen{};
  for (int round = 0; round < 2000; ++round) ++seen[random->below(5)];
  for (const int count : seen) EXPECT_GT(count, 200);
}

TEST(ProcessStatistics, TellsAnonymousMemory) {
  const auto memory = makeProcessStatistics()->anonymousMemory();
  EXPECT_GT(memory, 4096U);
  EXPECT_EQ(memory % 1024, 0U);
}

TEST(LogSubmission, TakesNothingWithoutASpool) {
  const test::TemporaryDirectory directory;
  const auto submission = makeLogSubmission("");
  const auto path = directory / "log";
  ASSERT_TRUE(submission->createSubmittableLog(path, "224"));
  EXPECT_FALSE(submission->moveForSubmission(path, "224"));
  EXPECT_TRUE(files::exists(path));
}

TEST(LogSubmission, MovesIntoItsSpool) {
  const test::TemporaryDirectory directory;
  const auto submission = makeLogSubmission(directory / "spool");
  for (const auto* name : {"224-log", "224-log.1"}) {
    const auto path = directory.write("log", name);
    EXPECT_TRUE(submission->moveForSubmission(path, "224"));
    EXPECT_FALSE(files::exists(path));
    EXPECT_EQ(directory.read(std::string("spool/") + name), name);
  }
}

TEST(LogSubmission, RefusesWhatIsNotThere) {
  const test::RecordingLog log;
  const test::TemporaryDirectory directory;
  EXPECT_FALSE(makeLogSubmission(directory / "spool")->moveForSubmission(directory / "none", "224"));
  EXPECT_TRUE(log.contains("LogSubmission: Cannot take "));
}

TEST(FileDescriptor, ClosesWhatItOwns) {
  int number = -1;
  {
    FileDescriptor first(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    number = first.get();
    FileDescriptor second(std::move(first));
    EXPECT_FALSE(first);
    EXPECT_TRUE(second);
    first = std::move(second);
    EXPECT_EQ(first.get(), number);
  }
  EXPECT_EQ(::fcntl(number, F_GETFD), -1);
}

}  // namespace
}  // namespace velk
