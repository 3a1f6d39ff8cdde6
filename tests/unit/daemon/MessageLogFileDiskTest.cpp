// The message log with everything real: birth times, volume, the spool, and a disk that is full for a while.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <system_error>
#include <thread>
#include <vector>

#include "daemon/MessageLogFile.h"
#include "foundation/Text.h"
#include "platform/Clock.h"
#include "platform/Platform.h"
#include "platform/ThreadPool.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

class MessageLogFileDiskTest : public testing::Test {
 protected:
  [[nodiscard]] std::vector<std::string> names(std::string_view folder) const {
    return files::list(directory / folder).value_or(std::vector<std::string>());
  }
  /// What the directory holds of all files, and how many those are.
  [[nodiscard]] std::vector<std::string> entries(std::string_view folder) const {
    std::vector<std::string> found;
    for (const auto& name : names(folder)) {
      const auto text = directory.read(std::string(folder) + "/" + name);
      for (const auto line : split(text, '\n')) {
        if (!line.empty()) found.emplace_back(line.substr(0, 40));
      }
    }
    return found;
  }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
  const std::unique_ptr<ThreadPool> pool = makeThreadPool();
};

TEST_F(MessageLogFileDiskTest, SeventyMebibytesAreKeptWithoutALostEntry) {
  constexpr int kEntries = 280;
  {
    const auto submission = makeLogSubmission(directory / "spool");
    MessageLogFile subject(directory / "logs", systemClock(), *submission, pool->makeSerialQueue("expired"));
    const std::string filling(255 * 1024, 'x');
    for (int number = 0; number < kEntries; ++number) {
      subject.writeToLogFile("entry " + std::to_string(number) + " " + filling);
    }
    pool->stop();
  }
  EXPECT_EQ(names("logs").size(), 1U);
  ASSERT_EQ(names("spool").size(), 1U);
  EXPECT_TRUE(names("spool")[0].starts_with("224-velkreportingd_"));
  EXPECT_EQ(entries("logs").size() + entries("spool").size(), std::size_t{kEntries});
  EXPECT_NE(entries("logs").back().find("entry 279 x"), std::string::npos);
}

TEST_F(MessageLogFileDiskTest, OnlyTheRecentFileStaysWhereThereIsNoSpool) {
  const auto submission = makeLogSubmission("");
  MessageLogFile subject(directory / "logs", systemClock(), *submission, pool->makeSerialQueue("expired"));
  subject.writeToLogFile("first");
  ASSERT_EQ(::truncate((directory / ("logs/" + names("logs").at(0))).c_str(), 64 * 1024 * 1024), 0);
  subject.writeToLogFile("second");
  pool->stop();
  ASSERT_EQ(names("logs").size(), 1U);
  EXPECT_NE(entries("logs").at(0).find("second"), std::string::npos);
}

TEST_F(MessageLogFileDiskTest, FileMadeJustNowIsRecentWhateverItsNameSays) {
  const auto submission = makeLogSubmission("");
  const std::string name = "velkreportingd_2001-01-01-00-00-00_messageLog.ips";
  const auto path = directory.write("logs/" + name, "former\n");
  if (!files::creationTime(path)) GTEST_SKIP() << "this file system keeps no time of birth";
  MessageLogFile subject(directory / "logs", systemClock(), *submission, pool->makeSerialQueue("expired"));
  subject.writeToLogFile("new");
  pool->stop();
  EXPECT_EQ(names("logs"), std::vector<std::string>{name});
  EXPECT_EQ(entries("logs").size(), 2U);
}

/// Runs `body` on a thread with `place` on a small file system of its own, which no other thread sees. Empty, or why
/// that cannot be.
template <class Body>
std::string onASmallDisk(const std::string& place, Body body) {
  std::string refused;
  std::thread([&] {
    if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        ::mount("tmpfs", place.c_str(), "tmpfs", MS_NOSUID | MS_NODEV, "size=64k,mode=0700") != 0) {
      refused = "cannot mount a file system here: " + std::generic_category().message(errno);
      return;
    }
    body();
  }).join();
  return refused;
}

TEST_F(MessageLogFileDiskTest, EntriesNeverRunTogetherWhenTheDiskWasFull) {
  const auto submission = makeLogSubmission("");
  MessageLogFile subject(directory.path(), systemClock(), *submission, pool->makeSerialQueue("expired"));
  const auto refused = onASmallDisk(directory.path(), [&] {
    const auto blocker = directory.write("blocker", std::string(20 * 1024, 'b'));
    const std::string filling(1500, 'x');
    for (int number = 0; number < 60; ++number) subject.writeToLogFile("entry " + std::to_string(number) + filling);
    EXPECT_EQ(log.count(log::Level::error, std::string("writeToLogFile: cannot write ") + directory.path() + "/" +
                                               names("").back() + ": No space left on device"),
              1);
    ASSERT_TRUE(files::remove(blocker));
    subject.writeToLogFile("afterwards");
    std::vector<std::string> lines = entries("");
    ASSERT_GE(lines.size(), 20U);
    for (const auto& line : lines) EXPECT_EQ(line[0], '(') << line;
    EXPECT_NE(lines.back().find("+0000) afterwards"), std::string::npos) << lines.back();
    EXPECT_EQ(lines.back().find("entry"), std::string::npos);
  });
  if (!refused.empty()) GTEST_SKIP() << refused;
}

}  // namespace
}  // namespace velk
