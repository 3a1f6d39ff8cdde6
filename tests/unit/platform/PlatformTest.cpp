#include "platform/Platform.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>

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

TEST(LogSubmission, OldestFilesOfItsTypeGoWhenTheSpoolIsFull) {
  const test::RecordingLog log;
  const test::TemporaryDirectory directory;
  const auto submission = makeLogSubmission(directory / "spool");
  for (int number = 0; number < 5; ++number) {
    const auto path = directory.write("spool/224-log" + std::to_string(number), "x");
    ASSERT_EQ(::truncate(path.c_str(), 60 * 1024 * 1024), 0);
    const timeval times[] = {{1000 - number, 0}, {1000 - number, 0}};
    ASSERT_EQ(::utimes(path.c_str(), times), 0);
  }
  directory.write("spool/other", "x");
  EXPECT_TRUE(submission->moveForSubmission(directory.write("new", "x"), "224"));
  EXPECT_EQ(files::list(directory / "spool").value_or(std::vector<std::string>()),
            (std::vector<std::string>{"224-log0", "224-log1", "224-log2", "224-log3", "224-new", "other"}));
  EXPECT_TRUE(log.contains("224-log4, the oldest of those that were not collected"));
  // The number of files is bounded as well.
  for (int number = 0; number < 40; ++number) {
    EXPECT_TRUE(submission->moveForSubmission(directory.write("more" + std::to_string(number), "x"), "224"));
  }
  EXPECT_EQ(files::list(directory / "spool").value_or(std::vector<std::string>()).size(), 33U);
}

TEST(LogSubmission, CopiesToAnotherFileSystem) {
  const test::TemporaryDirectory directory;
  char name[] = "/dev/shm/velk-spool-XXXXXX";
  if (::mkdtemp(name) == nullptr) GTEST_SKIP() << "there is no other file system";
  const std::string spool = name;
  const std::string text(3 * 1000 * 1000 + 1, 't');
  EXPECT_TRUE(makeLogSubmission(spool)->moveForSubmission(directory.write("log", text), "224"));
  EXPECT_FALSE(files::exists(directory / "log"));
  const auto copied = files::read(spool + "/224-log", text.size());
  ASSERT_TRUE(copied);
  EXPECT_TRUE(std::equal(copied->begin(), copied->end(), text.begin(), text.end()));
  EXPECT_EQ(files::list(spool).value_or(std::vector<std::string>()), std::vector<std::string>{"224-log"});
  EXPECT_TRUE(files::remove(spool + "/224-log"));
  EXPECT_EQ(::rmdir(name), 0);
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
