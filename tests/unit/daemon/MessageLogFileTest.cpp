#include "daemon/MessageLogFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <ctime>
#include <thread>
#include <vector>

#include "daemon/MessageLogTexts.h"
#include "platform/Files.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

constexpr std::int64_t kHour = 3600;
constexpr std::int64_t kDay = 24 * kHour;

class MessageLogFileTest : public testing::Test {
 protected:
  MessageLogFileTest() : subject(directory / "logs", clock, submission) {}

  /// The name of a log made this many seconds before now.
  [[nodiscard]] std::string nameAt(std::int64_t age) const {
    const std::time_t time = clock.wallTime().seconds - age;
    std::tm local{};
    ::localtime_r(&time, &local);
    char text[64];
    std::strftime(text, sizeof text, "velkreportingd_%Y-%m-%d-%H-%M-%S_messageLog.ips", &local);
    return text;
  }
  [[nodiscard]] std::string pathAt(std::int64_t age) const { return directory / ("logs/" + nameAt(age)); }
  std::string makeLog(std::int64_t age, std::string_view contents) const {
    return directory.write("logs/" + nameAt(age), contents);
  }
  [[nodiscard]] std::vector<std::string> logFiles() const {
    return files::list(directory / "logs").value_or(std::vector<std::string>());
  }
  [[nodiscard]] std::string contents(const std::string& name) const { return directory.read("logs/" + name); }
  [[nodiscard]] std::vector<std::string> movedPaths() const {
    std::vector<std::string> paths;
    for (const auto& entry : submission.moved()) {
      EXPECT_EQ(entry.logType, "224");
      paths.push_back(entry.path);
    }
    return paths;
  }
  [[nodiscard]] unsigned modeOf(const std::string& path) const {
    struct stat status {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0);
    return status.st_mode & 07777;
  }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
  test::FakeClock clock;
  test::FakeLogSubmission submission;
  MessageLogFile subject;
};

TEST_F(MessageLogFileTest, BeginsWithOneFileAndOneLine) {
  subject.writeToLogFile("[post -> sendMessageWithDictionary] {}");
  ASSERT_EQ(logFiles(), std::vector<std::string>{nameAt(0)});
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) [post -> sendMessageWithDictionary] {}\n");
  ASSERT_EQ(submission.created().size(), 1U);
  EXPECT_EQ(submission.created()[0].logType, "224");
  EXPECT_EQ(modeOf(directory / "logs"), 0700U);
  EXPECT_EQ(modeOf(pathAt(0)), 0600U);
  const auto lines = log.lines();
  ASSERT_EQ(lines.size(), 3U);
  EXPECT_EQ(lines[0].text, "writeToLogFile: Creating velkreportingd log directory at " + (directory / "logs"));
  EXPECT_EQ(lines[1].text,
            "writeToLogFile: Created new velkreportingd log file " + pathAt(0) + " (2020-09-13 12:26:40 +0000)");
  EXPECT_EQ(lines[2].text, "writeToLogFile: Saved log message to " + pathAt(0));
  for (const auto& line : lines) EXPECT_EQ(line.level, log::Level::standard);
}

TEST_F(MessageLogFileTest, AppendsToTheCurrentFile) {
  subject.writeToLogFile("first");
  clock.advance(std::chrono::hours(24));
  subject.writeToLogFile("second");
  EXPECT_EQ(contents(nameAt(kDay)), "(2020-09-13 12:26:40 +0000) first\n(2020-09-14 12:26:40 +0000) second\n");
  EXPECT_EQ(logFiles().size(), 1U);
}

TEST_F(MessageLogFileTest, SubmitsTheOldLogAndGoesOnWithTheRecentOne) {
  const auto old = makeLog(2 * kDay, "old\n");
  makeLog(kHour, "recent\n");
  subject.writeToLogFile("new");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{old});
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(kHour)});
  EXPECT_EQ(contents(nameAt(kHour)), "recent\n(2020-09-13 12:26:40 +0000) new\n");
  EXPECT_EQ(
      log.count(log::Level::standard, "deleteExpiredLogFile: LogMoveForSubmission succesfully submitted log file " +
                                          old + " (2020-09-11 12:26:40 +0000)"),
      1);
}

TEST_F(MessageLogFileTest, DeletesWhatIsNotTaken) {
  submission.accepts = false;
  const auto old = makeLog(2 * kDay, "old\n");
  makeLog(kHour, "recent\n");
  subject.writeToLogFile("new");
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(kHour)});
  EXPECT_EQ(log.count(log::Level::standard, "deleteExpiredLogFile: Deleted expired velkreportingd log file " + old +
                                                " (2020-09-11 12:26:40 +0000)"),
            1);
}

TEST_F(MessageLogFileTest, KeepsTheNewestOfTheRecentLogs) {
  const auto older = makeLog(5 * kHour, "older\n");
  const auto oldest = makeLog(6 * kHour, "oldest\n");
  makeLog(kHour, "newer\n");
  subject.writeToLogFile("new");
  EXPECT_EQ(movedPaths(), (std::vector<std::string>{oldest, older}));
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(kHour)});
}

TEST_F(MessageLogFileTest, IgnoresFilesOfOtherServices) {
  const std::vector<std::string> foreign{
      "other_2020-09-10-00-00-00_messageLog.ips", "velkreportingd_2020-09-10-00-00-00_messageLog.ips_x",
      "velkreportingd_a_b_messageLog.ips", "velkreportingd_messageLog.ips", "velkreportingd_x_other.txt"};
  for (const auto& name : foreign) directory.write("logs/" + name, "foreign");
  subject.writeToLogFile("new");
  EXPECT_TRUE(movedPaths().empty());
  EXPECT_EQ(logFiles().size(), foreign.size() + 1);
  for (const auto& name : foreign) EXPECT_EQ(contents(name), "foreign");
}

TEST_F(MessageLogFileTest, ReplacesACurrentFileAfterADay) {
  subject.writeToLogFile("first");
  clock.advance(std::chrono::seconds(kDay + 1));
  log.clear();
  subject.writeToLogFile("lost");
  // The expired file is found gone, which costs this message.
  EXPECT_EQ(movedPaths(), std::vector<std::string>{pathAt(kDay + 1)});
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(0)});
  EXPECT_EQ(contents(nameAt(0)), "");
  EXPECT_EQ(log.count("writeToLogFile: Saved log message to " + pathAt(0)), 1);
  subject.writeToLogFile("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-14 12:26:41 +0000) kept\n");
}

TEST_F(MessageLogFileTest, LosesOneMessageWhenTheFileVanished) {
  subject.writeToLogFile("first");
  ASSERT_TRUE(files::remove(pathAt(0)));
  clock.advance(std::chrono::minutes(1));
  subject.writeToLogFile("lost");
  EXPECT_EQ(contents(nameAt(0)), "");
  subject.writeToLogFile("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:27:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, DropsMessagesWhileItsFileIsFullAndSaysSoOnce) {
  subject.writeToLogFile("first");
  ASSERT_EQ(::truncate(pathAt(0).c_str(), 64 * 1024 * 1024), 0);
  subject.writeToLogFile("dropped");
  subject.writeToLogFile("dropped");
  EXPECT_EQ(files::size(pathAt(0)), 64U * 1024 * 1024);
  EXPECT_EQ(log.count(log::Level::error, "writeToLogFile: " + pathAt(0) + " is full"), 1);
}

// The clock was years ahead when the file was made, and has been set right since.
TEST_F(MessageLogFileTest, ReplacesAFullFileOfTheFuture) {
  const auto future = makeLog(-30 * kDay, "");
  ASSERT_EQ(::truncate(future.c_str(), 64 * 1024 * 1024), 0);
  subject.writeToLogFile("kept");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{future});
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, TriesAgainAfterAFileCouldNotBeMade) {
  submission.creates = false;
  subject.writeToLogFile("dropped");
  EXPECT_EQ(log.count(log::Level::error, "writeToLogFile: Failed to create new velkreportingd log file " + pathAt(0)),
            1);
  EXPECT_TRUE(logFiles().empty());
  submission.creates = true;
  subject.writeToLogFile("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, ReportsADirectoryThatItCannotRead) {
  // A loop of symbolic links can neither be read nor made.
  ASSERT_EQ(::symlink((directory / "logs").c_str(), (directory / "logs").c_str()), 0);
  subject.writeToLogFile("dropped");
  ASSERT_FALSE(log.lines().empty());
  EXPECT_EQ(log.lines()[0].level, log::Level::error);
  EXPECT_TRUE(log.contains("writeToLogFile: Error reading from log directory: "));
  EXPECT_FALSE(log.contains("Saved"));
}

TEST_F(MessageLogFileTest, WantsBothPartsOfTheCurrentFile) {
  std::optional<std::string> path("old");
  std::optional<Date> date;
  subject.createNewLogFile(nullptr, &date);
  subject.createNewLogFile(&path, nullptr);
  EXPECT_EQ(log.count(log::Level::error, logtexts::kLogFileArgumentsMissing), 2);
  EXPECT_EQ(path, "old");
  EXPECT_TRUE(submission.created().empty());
}

TEST_F(MessageLogFileTest, ForgetsTheOldFileBeforeItMakesANewOne) {
  std::optional<std::string> path("old");
  std::optional<Date> date(Date{1});
  submission.creates = false;
  subject.createNewLogFile(&path, &date);
  EXPECT_EQ(path, std::nullopt);
  EXPECT_EQ(date, std::nullopt);
}

TEST_F(MessageLogFileTest, TellsTheAgeByTheNameNotByTheLastChange) {
  const auto old = makeLog(2 * kDay, "appended to just now\n");
  subject.writeToLogFile("new");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{old});
}

TEST_F(MessageLogFileTest, LetsNoTextPassForAnEntry) {
  subject.writeToLogFile("text\r\x1b[2J\n(2020-01-01 00:00:00 +0000) forged\n{\n\t\"a\": 1\n}");
  EXPECT_EQ(contents(nameAt(0)),
            "(2020-09-13 12:26:40 +0000) text\\r\\x1b[2J\n\t(2020-01-01 00:00:00 +0000) forged\n{\n\t\"a\": 1\n}\n");
}

TEST_F(MessageLogFileTest, CutsLongTextsBetweenCharacters) {
  std::string text;
  while (text.size() < 300 * 1024) text += "äöü";
  subject.writeToLogFile(text);
  const auto written = contents(nameAt(0));
  EXPECT_LE(written.size(), 257U * 1024);
  EXPECT_EQ(written.back(), '\n');
  EXPECT_NE(written.find("äöü"), std::string::npos);
}

TEST_F(MessageLogFileTest, TakesTextsOfManyThreads) {
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([this] {
      for (int message = 0; message < 25; ++message) subject.writeToLogFile("a message of one of the threads");
    });
  }
  for (auto& thread : threads) thread.join();
  const std::string line = "(2020-09-13 12:26:40 +0000) a message of one of the threads\n";
  EXPECT_EQ(contents(nameAt(0)).size(), 100 * line.size());
  EXPECT_EQ(submission.created().size(), 1U);
}

}  // namespace
}  // namespace velk
