#include "daemon/MessageLogFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <ctime>
#include <map>
#include <thread>
#include <vector>

#include "daemon/MessageLogTexts.h"
#include "platform/Files.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/ManualScheduler.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

constexpr std::int64_t kHour = 3600;
constexpr std::int64_t kDay = 24 * kHour;
constexpr off_t kFullFile = 64 * 1024 * 1024;

class MessageLogFileTest : public testing::Test {
 protected:
  MessageLogFileTest()
      : subject(directory / "logs", clock, submission, scheduler.makeSerialQueue("expired"),
                [this](const std::string& path) { return birthOf(path); }) {}

  /// A message, and the end of what it made expire.
  void write(std::string_view text) {
    subject.writeToLogFile(text);
    scheduler.runUntilIdle();
  }
  /// As the file system would say it, if the clock were its clock.
  [[nodiscard]] std::optional<TimeValue> birthOf(const std::string& path) {
    if (!hasBirths) return std::nullopt;
    return births.try_emplace(path, clock.wallTime()).first->second;
  }

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
  std::string makeLog(std::int64_t age, std::string_view contents) {
    const auto path = directory.write("logs/" + nameAt(age), contents);
    births[path] = TimeValue{clock.wallTime().seconds - age, 0};
    return path;
  }
  static void fill(const std::string& path) { ASSERT_EQ(::truncate(path.c_str(), kFullFile), 0); }
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
  test::ManualScheduler scheduler;
  test::FakeClock& clock = scheduler.fakeClock();
  test::FakeLogSubmission submission;
  std::map<std::string, TimeValue> births;
  bool hasBirths = true;
  MessageLogFile subject;
};

TEST_F(MessageLogFileTest, BeginsWithOneFileAndOneLine) {
  write("[post -> sendMessageWithDictionary] {}");
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
  write("first");
  clock.advance(std::chrono::hours(24));
  write("second");
  EXPECT_EQ(contents(nameAt(kDay)), "(2020-09-13 12:26:40 +0000) first\n(2020-09-14 12:26:40 +0000) second\n");
  EXPECT_EQ(logFiles().size(), 1U);
}

TEST_F(MessageLogFileTest, SubmitsTheOldLogAndGoesOnWithTheRecentOne) {
  const auto old = makeLog(2 * kDay, "old\n");
  makeLog(kHour, "recent\n");
  write("new");
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
  write("new");
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(kHour)});
  EXPECT_EQ(log.count(log::Level::standard, "deleteExpiredLogFile: Deleted expired velkreportingd log file " + old +
                                                " (2020-09-11 12:26:40 +0000)"),
            1);
}

TEST_F(MessageLogFileTest, KeepsTheNewestOfTheRecentLogs) {
  const auto older = makeLog(5 * kHour, "older\n");
  const auto oldest = makeLog(6 * kHour, "oldest\n");
  makeLog(kHour, "newer\n");
  write("new");
  EXPECT_EQ(movedPaths(), (std::vector<std::string>{oldest, older}));
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(kHour)});
}

TEST_F(MessageLogFileTest, IgnoresFilesOfOtherServices) {
  const std::vector<std::string> foreign{
      "other_2020-09-10-00-00-00_messageLog.ips", "velkreportingd_2020-09-10-00-00-00_messageLog.ips_x",
      "velkreportingd_a_b_messageLog.ips", "velkreportingd_messageLog.ips", "velkreportingd_x_other.txt"};
  for (const auto& name : foreign) directory.write("logs/" + name, "foreign");
  write("new");
  EXPECT_TRUE(movedPaths().empty());
  EXPECT_EQ(logFiles().size(), foreign.size() + 1);
  for (const auto& name : foreign) EXPECT_EQ(contents(name), "foreign");
}

TEST_F(MessageLogFileTest, ReplacesACurrentFileAfterADay) {
  write("first");
  clock.advance(std::chrono::seconds(kDay + 1));
  log.clear();
  write("lost");
  // The expired file is found gone, which costs this message.
  EXPECT_EQ(movedPaths(), std::vector<std::string>{pathAt(kDay + 1)});
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(0)});
  EXPECT_EQ(contents(nameAt(0)), "");
  EXPECT_EQ(log.count("writeToLogFile: Saved log message to " + pathAt(0)), 1);
  write("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-14 12:26:41 +0000) kept\n");
}

TEST_F(MessageLogFileTest, LosesOneMessageWhenTheFileVanished) {
  write("first");
  ASSERT_TRUE(files::remove(pathAt(0)));
  clock.advance(std::chrono::minutes(1));
  write("lost");
  EXPECT_EQ(contents(nameAt(0)), "");
  write("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:27:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, GoesOnInANewFileWhenTheCurrentOneIsFull) {
  write("first");
  fill(pathAt(0));
  log.clear();
  write("kept");
  // The name of this second is taken.
  ASSERT_EQ(logFiles(), std::vector<std::string>{nameAt(-1)});
  EXPECT_EQ(contents(nameAt(-1)), "(2020-09-13 12:26:40 +0000) kept\n");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{pathAt(0)});
  std::vector<std::string> texts;
  for (const auto& line : log.lines()) texts.push_back(line.text.substr(0, line.text.find(pathAt(0).substr(0, 20))));
  EXPECT_EQ(texts,
            (std::vector<std::string>{"deleteExpiredLogFile: LogMoveForSubmission succesfully submitted log file ",
                                      "writeToLogFile: Created new velkreportingd log file ",
                                      "writeToLogFile: Saved log message to "}));
  clock.advance(std::chrono::hours(1));
  write("second");
  EXPECT_EQ(contents(nameAt(kHour - 1)), "(2020-09-13 12:26:40 +0000) kept\n(2020-09-13 13:26:40 +0000) second\n");
}

TEST_F(MessageLogFileTest, DeletesAFullFileThatIsNotTaken) {
  submission.accepts = false;
  write("first");
  fill(pathAt(0));
  write("kept");
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(-1)});
}

TEST_F(MessageLogFileTest, FilesThatFillUpWithinASecondAreNotConfused) {
  submission.accepts = false;
  for (int number = 0; number < 3; ++number) {
    subject.writeToLogFile("entry " + std::to_string(number));
    fill(pathAt(-number));
  }
  EXPECT_EQ(logFiles(), (std::vector<std::string>{nameAt(0), nameAt(-1), nameAt(-2)}));
  subject.writeToLogFile("last");
  EXPECT_EQ(logFiles().size(), 4U);
  scheduler.runUntilIdle();
  EXPECT_EQ(logFiles(), std::vector<std::string>{nameAt(-3)});
  EXPECT_EQ(contents(nameAt(-3)), "(2020-09-13 12:26:40 +0000) last\n");
}

TEST_F(MessageLogFileTest, DropsEntriesWhileTooManyFullFilesWaitAndSaysSoOnce) {
  for (std::size_t number = 0; number <= MessageLogFile::kMaximumExpiring; ++number) {
    subject.writeToLogFile("entry");
    fill(pathAt(-static_cast<std::int64_t>(number)));
  }
  subject.writeToLogFile("dropped");
  subject.writeToLogFile("dropped");
  EXPECT_EQ(logFiles().size(), MessageLogFile::kMaximumExpiring + 1);
  EXPECT_EQ(log.count(log::Level::error,
                      "writeToLogFile: " + pathAt(-3) + " is full, and those before it are not submitted yet"),
            1);
  scheduler.runUntilIdle();
  write("kept");
  ASSERT_EQ(logFiles().size(), 1U);
  EXPECT_TRUE(contents(logFiles()[0]).ends_with("kept\n"));
}

// Its submission may read it whole, over a slow disk.
TEST_F(MessageLogFileTest, NoEntryWaitsForTheSubmission) {
  const auto old = makeLog(2 * kDay, "old\n");
  subject.writeToLogFile("one");
  subject.writeToLogFile("two");
  EXPECT_TRUE(submission.moved().empty());
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) one\n(2020-09-13 12:26:40 +0000) two\n");
  scheduler.runUntilIdle();
  EXPECT_EQ(movedPaths(), std::vector<std::string>{old});
}

// A sink that needs the message log's lock on another thread: it would wait for ever if a line were written under it.
TEST_F(MessageLogFileTest, WritesNoLineOfTheSystemLogUnderItsLock) {
  class Writer final : public log::Sink {
   public:
    explicit Writer(MessageLogFile& messageLog) : _messageLog(messageLog) {}
    void write(log::Level, std::string_view) override {
      if (_isBusy.exchange(true)) return;
      std::thread([this] { _messageLog.writeToLogFile("from another thread"); }).join();
      _isBusy = false;
    }

   private:
    MessageLogFile& _messageLog;
    std::atomic<bool> _isBusy = false;
  };
  log::setSink(std::make_shared<Writer>(subject));
  write("first");
  EXPECT_TRUE(contents(nameAt(0)).ends_with("from another thread\n"));
}

TEST_F(MessageLogFileTest, TriesAgainAfterAFileCouldNotBeMade) {
  submission.creates = false;
  write("dropped");
  EXPECT_EQ(log.count(log::Level::error, "writeToLogFile: Failed to create new velkreportingd log file " + pathAt(0)),
            1);
  EXPECT_TRUE(logFiles().empty());
  submission.creates = true;
  write("kept");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, ReportsADirectoryThatItCannotRead) {
  // A loop of symbolic links can neither be read nor made.
  ASSERT_EQ(::symlink((directory / "logs").c_str(), (directory / "logs").c_str()), 0);
  write("dropped");
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

// A change of the time zone, or of the clock, leaves names that say something else.
TEST_F(MessageLogFileTest, TellsTheAgeByTheBirthNotByTheName) {
  const auto old = makeLog(kHour, "born long ago\n");
  births[old] = TimeValue{clock.wallTime().seconds - 2 * kDay, 0};
  const auto recent = makeLog(3 * kDay, "recent\n");
  births[recent] = TimeValue{clock.wallTime().seconds - kHour, 0};
  write("new");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{old});
  EXPECT_EQ(contents(nameAt(3 * kDay)), "recent\n(2020-09-13 12:26:40 +0000) new\n");
}

TEST_F(MessageLogFileTest, NameTellsTheAgeWhereTheFileSystemKeepsNoBirth) {
  hasBirths = false;
  const auto old = makeLog(2 * kDay, "appended to just now\n");
  const auto recent = makeLog(kHour, "recent\n");
  write("new");
  EXPECT_EQ(movedPaths(), std::vector<std::string>{old});
  EXPECT_EQ(contents(nameAt(kHour)), "recent\n(2020-09-13 12:26:40 +0000) new\n");
}

TEST_F(MessageLogFileTest, EntryThatWasCutOffBeforeTheStartGetsItsLineBreak) {
  makeLog(kHour, "whole\ncut o");
  write("new");
  EXPECT_EQ(contents(nameAt(kHour)), "whole\ncut o\n(2020-09-13 12:26:40 +0000) new\n");
}

TEST_F(MessageLogFileTest, LosesOneMessageWhenTheFileWasMovedAndNeverWritesToItAgain) {
  write("first");
  const auto moved = directory / "logs/moved";
  ASSERT_TRUE(files::move(pathAt(0), moved));
  write("lost");
  write("kept");
  EXPECT_EQ(contents("moved"), "(2020-09-13 12:26:40 +0000) first\n");
  EXPECT_EQ(contents(nameAt(0)), "(2020-09-13 12:26:40 +0000) kept\n");
}

TEST_F(MessageLogFileTest, LetsNoTextPassForAnEntry) {
  write("text\r\x1b[2J\n(2020-01-01 00:00:00 +0000) forged\n{\n\t\"a\": 1\n}");
  EXPECT_EQ(contents(nameAt(0)),
            "(2020-09-13 12:26:40 +0000) text\\r\\x1b[2J\n\t(2020-01-01 00:00:00 +0000) forged\n{\n\t\"a\": 1\n}\n");
}

TEST_F(MessageLogFileTest, CutsLongTextsBetweenCharacters) {
  std::string text;
  while (text.size() < 300 * 1024) text += "äöü";
  write(text);
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
