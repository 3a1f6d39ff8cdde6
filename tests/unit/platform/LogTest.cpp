#include "platform/Log.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "platform/LogSinks.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

using log::Level;
using test::RecordingLog;

/// Sets an environment variable for a scope (null: takes it away).
class ScopedVariable {
 public:
  ScopedVariable(const char* name, const char* value) : _name(name) {
    if (const char* former = std::getenv(name)) _former = former;
    set(value);
  }
  ~ScopedVariable() { set(_former ? _former->c_str() : nullptr); }

 private:
  void set(const char* value) { value != nullptr ? ::setenv(_name, value, 1) : ::unsetenv(_name); }
  const char* const _name;
  std::optional<std::string> _former;
};

std::string written(log::Sink& sink, Level level, std::string_view line) {
  testing::internal::CaptureStderr();
  sink.write(level, line);
  log::flushSystemLog();
  return testing::internal::GetCapturedStderr();
}

TEST(Log, DropsEverythingWithoutASink) {
  log::setSink(nullptr);
  EXPECT_FALSE(log::isEnabled(Level::error));
  log::error("nobody hears %s", "this");
}

TEST(Log, LinesReachTheSinkAtTheirLevel) {
  RecordingLog recorded;
  log::debug("one %d", 1);
  log::standard("two %s", "2");
  log::error("three %@", std::string("3"));
  EXPECT_EQ(recorded.lines(), (std::vector<RecordingLog::Line>{
                                  {Level::debug, "one 1"}, {Level::standard, "two 2"}, {Level::error, "three 3"}}));
}

TEST(Log, LevelsBelowTheLowestStayAway) {
  class Counter : public log::Sink {
   public:
    void write(Level, std::string_view) override { ++count; }
    std::atomic<int> count = 0;
  };
  const auto counter = std::make_shared<Counter>();
  log::setSink(counter, Level::standard);
  EXPECT_FALSE(log::isEnabled(Level::debug));
  log::debug("no");
  log::standard("yes");
  log::setSink(counter, Level::error);
  log::standard("no");
  log::error("yes");
  log::setSink(nullptr);
  EXPECT_EQ(counter->count, 2);
}

TEST(Log, ArgumentCannotBeginANewLineOrSteerATerminal) {
  RecordingLog recorded;
  log::error("client says %s", "fine\nvelkreportingd: forged \x1b[2J");
  const auto lines = recorded.lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].text.find('\n'), std::string::npos);
  EXPECT_EQ(lines[0].text.find('\x1b'), std::string::npos);
  EXPECT_NE(lines[0].text.find("\\n"), std::string::npos);
}

TEST(Log, LongValuesAreCutBetweenCharactersAndNameTheirLength) {
  RecordingLog recorded;
  std::string value = "x";
  while (value.size() < 5000) value += "ä";
  log::standard("%d%% of %-5s and %s, %s", 5, std::string_view("a"), value, PropertyDictionary{{"key", value}});
  const auto lines = recorded.lines();
  ASSERT_EQ(lines.size(), 1U);
  const auto& text = lines[0].text;
  EXPECT_EQ(text.substr(0, 17), "5% of a     and x");
  EXPECT_EQ(text.substr(16, 1023), value.substr(0, 1023));
  EXPECT_EQ(text.substr(16 + 1023, 24), "...(cut, 5001 bytes), {\"");
  EXPECT_EQ(text.substr(text.size() - 20), "...(cut, 5011 bytes)");
  EXPECT_LT(text.size(), 2200U);
}

TEST(Log, ValuesUpToTheBoundStayWholeHoweverManyThereAre) {
  RecordingLog recorded;
  const std::string value(1024, 'v');
  log::standard("%s %s", value, value);
  ASSERT_EQ(recorded.lines().size(), 1U);
  EXPECT_EQ(recorded.lines()[0].text, value + " " + value);
}

TEST(Log, WholeLinesAreCut) {
  RecordingLog recorded;
  const std::string value(1024, '\x01');
  log::standard("%s %s %s", value, value, value);
  const auto lines = recorded.lines();
  ASSERT_EQ(lines.size(), 1U);
  const auto& text = lines[0].text;
  EXPECT_LE(text.size(), 8192U + 30);
  EXPECT_EQ(text.substr(text.size() - 21), "...(cut, 12290 bytes)");
}

TEST(Log, SinkMayBeReplacedWhileOthersWrite) {
  class Quiet : public log::Sink {
   public:
    void write(Level, std::string_view) override {}
  };
  std::atomic<bool> done = false;
  std::thread writer([&] {
    while (!done) log::error("line");
  });
  for (int turn = 0; turn < 500; ++turn) log::setSink(std::make_shared<Quiet>());
  done = true;
  writer.join();
  log::setSink(nullptr);
}

TEST(SystemLogSink, PrefixesThePriorityWhenTheStreamIsNotTheJournal) {
  ScopedVariable variable("JOURNAL_STREAM", nullptr);
  const auto sink = log::makeSystemLogSink("velkreportingd");
  EXPECT_EQ(written(*sink, Level::debug, "{} a"), "<7>{} a\n");
  EXPECT_EQ(written(*sink, Level::standard, "%s b"), "<6>%s b\n");
  EXPECT_EQ(written(*sink, Level::error, "c"), "<3>c\n");
}

TEST(SystemLogSink, JournalOfAnotherStreamIsNotTaken) {
  ScopedVariable variable("JOURNAL_STREAM", "1:1");
  const auto sink = log::makeSystemLogSink("velkreportingd");
  EXPECT_EQ(written(*sink, Level::error, "c"), "<3>c\n");
}

TEST(SystemLogSink, ErrorStreamIsTakenWhereItIsAskedForThoughTheJournalListens) {
  const auto name = [] {
    struct stat status {};
    return ::fstat(STDERR_FILENO, &status) == 0 ? std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino)
                                                : std::string();
  };
  testing::internal::CaptureStderr();
  {
    const auto stream = name();
    ScopedVariable variable("JOURNAL_STREAM", stream.c_str());
    // Its end writes what it was given.
    log::makeSystemLogSink("velkreportingd", true)->write(Level::error, "c");
  }
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "<3>c\n");
}

TEST(SystemLogSink, JournalStreamMustNameTheDescriptor) {
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  struct stat status {};
  ASSERT_EQ(::fstat(ends[1], &status), 0);
  const auto name = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
  EXPECT_TRUE(log::isJournalStream(name, ends[1]));
  EXPECT_FALSE(log::isJournalStream(name + "0", ends[1]));
  EXPECT_FALSE(log::isJournalStream(name + " ", ends[1]));
  EXPECT_FALSE(log::isJournalStream(":", ends[1]));
  EXPECT_FALSE(log::isJournalStream("", ends[1]));
  EXPECT_FALSE(log::isJournalStream("99999999999999999999999:1", ends[1]));
  ::close(ends[0]);
  ::close(ends[1]);
  EXPECT_FALSE(log::isJournalStream(name, -1));
}

TEST(SystemLogSink, LinesOfManyThreadsStayWhole) {
  ScopedVariable variable("JOURNAL_STREAM", nullptr);
  const auto sink = log::makeSystemLogSink("velkreportingd");
  const std::string line(300, 'x');
  testing::internal::CaptureStderr();
  std::vector<std::thread> threads;
  for (int number = 0; number < 4; ++number) {
    threads.emplace_back([&] {
      for (int turn = 0; turn < 50; ++turn) sink->write(Level::standard, line);
    });
  }
  for (auto& thread : threads) thread.join();
  log::flushSystemLog();
  std::string expected;
  for (int number = 0; number < 200; ++number) expected += "<6>" + line + "\n";
  EXPECT_EQ(testing::internal::GetCapturedStderr(), expected);
}

TEST(LibrarySink, SaysNothingOnTheHostsStreamUnlessAsked) {
  ScopedVariable variable("VELKREPORTING_LOG", nullptr);
  const auto sink = log::makeLibrarySink();
  ASSERT_TRUE(sink);
  EXPECT_EQ(written(*sink, Level::debug, "a"), "");
  EXPECT_EQ(written(*sink, Level::standard, "b"), "");
  EXPECT_EQ(log::librarySinkLevel(), Level::error);
}

TEST(LibrarySink, SettingNamesTheLowestLevelOfTheStream) {
  {
    ScopedVariable variable("VELKREPORTING_LOG", "debug");
    EXPECT_EQ(written(*log::makeLibrarySink(), Level::debug, "a"), "velkreporting: a\n");
    EXPECT_EQ(log::librarySinkLevel(), Level::debug);
  }
  {
    ScopedVariable variable("VELKREPORTING_LOG", "default");
    const auto sink = log::makeLibrarySink();
    EXPECT_EQ(written(*sink, Level::debug, "a"), "");
    EXPECT_EQ(written(*sink, Level::standard, "b"), "velkreporting: b\n");
    EXPECT_EQ(log::librarySinkLevel(), Level::standard);
  }
  ScopedVariable variable("VELKREPORTING_LOG", "error");
  const auto sink = log::makeLibrarySink();
  EXPECT_EQ(written(*sink, Level::standard, "b"), "");
  EXPECT_EQ(written(*sink, Level::error, "c"), "velkreporting: c\n");
}

TEST(LibrarySink, IsSilencedByItsSetting) {
  ScopedVariable variable("VELKREPORTING_LOG", "none");
  EXPECT_FALSE(log::makeLibrarySink());
}

}  // namespace
}  // namespace velk
