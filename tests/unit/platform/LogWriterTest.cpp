#include "platform/LogWriter.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <string>
#include <thread>
#include <vector>

#include "foundation/Text.h"
#include "platform/FileDescriptor.h"
#include "platform/Lock.h"
#include "platform/LogSinks.h"
#include "platform/Process.h"

namespace velk {
namespace {

using log::Level;
using log::LogWriter;

/// Takes lines, and blocks while it is told to.
class Reader {
 public:
  void stop() {
    Guard guard(_lock);
    _stopped = true;
  }
  void go() {
    {
      Guard guard(_lock);
      _stopped = false;
    }
    _changed.notifyAll();
  }
  void take(std::string_view lines) {
    Guard guard(_lock);
    _waiting = true;
    _changed.notifyAll();
    while (_stopped) _changed.wait(_lock);
    _waiting = false;
    ++_writes;
    _text += lines;
  }
  void waitUntilAWriterWaits() {
    Guard guard(_lock);
    while (!_waiting) _changed.wait(_lock);
  }
  [[nodiscard]] std::string text() {
    Guard guard(_lock);
    return _text;
  }
  [[nodiscard]] int writes() {
    Guard guard(_lock);
    return _writes;
  }

 private:
  Lock _lock;
  Condition _changed;
  std::string _text VELK_GUARDED_BY(_lock);
  int _writes VELK_GUARDED_BY(_lock) = 0;
  bool _stopped VELK_GUARDED_BY(_lock) = false;
  bool _waiting VELK_GUARDED_BY(_lock) = false;
};

class ReaderOutput final : public log::LineOutput {
 public:
  explicit ReaderOutput(std::shared_ptr<Reader> reader) : _reader(std::move(reader)) {}
  void write(std::string_view lines) override { _reader->take(lines); }
  std::size_t tryWrite(std::string_view lines, std::chrono::milliseconds) override {
    _reader->take(lines.substr(0, kTakenAtOnce));
    return std::min(kTakenAtOnce, lines.size());
  }
  static constexpr std::size_t kTakenAtOnce = 6;

 private:
  const std::shared_ptr<Reader> _reader;
};

Result<std::thread> refuseThread(std::string_view, UniqueFunction<void()>) {
  return failure("posix", EAGAIN, "no more threads");
}

class LogWriterTest : public testing::Test {
 protected:
  [[nodiscard]] std::unique_ptr<log::LineOutput> output() const { return std::make_unique<ReaderOutput>(reader); }
  const std::shared_ptr<Reader> reader = std::make_shared<Reader>();
};

TEST_F(LogWriterTest, WritesLinesInOrder) {
  LogWriter subject(output());
  subject.write(Level::debug, "one");
  subject.write(Level::standard, "two");
  subject.write(Level::error, "three");
  EXPECT_TRUE(subject.flush());
  EXPECT_TRUE(subject.isWritten());
  EXPECT_EQ(reader->text(), "<7>one\n<6>two\n<3>three\n");
}

TEST_F(LogWriterTest, LinesThatComeWhileItWritesShareOneWrite) {
  LogWriter subject(output());
  reader->stop();
  subject.write(Level::standard, "first");
  reader->waitUntilAWriterWaits();
  for (int number = 0; number < 100; ++number) subject.write(Level::standard, "x");
  EXPECT_FALSE(subject.isWritten());
  reader->go();
  EXPECT_TRUE(subject.flush());
  EXPECT_EQ(reader->writes(), 2);
}

// Fails by never ending when callers wait.
TEST_F(LogWriterTest, CallersNeverWaitForAReaderThatStoppedAndTheLinesLeftOutAreCounted) {
  LogWriter subject(output());
  reader->stop();
  const std::string line(996, 'x');  // 1,000 bytes with its prefix and its end
  subject.write(Level::standard, line);
  reader->waitUntilAWriterWaits();
  for (int number = 0; number < 2000; ++number) subject.write(Level::standard, line);
  subject.write(Level::error, "errors still have room");
  reader->go();
  EXPECT_TRUE(subject.flush());
  const auto text = reader->text();
  const auto lines = split(text, '\n');
  const std::size_t taken = (LogWriter::kMaximumBytes - LogWriter::kReservedForErrors) / 1000;
  ASSERT_EQ(lines.size(), taken + 3);
  EXPECT_EQ(lines[taken], "<3>errors still have room");
  EXPECT_EQ(lines[taken + 1], "<3>log: left out " + std::to_string(2001 - taken) + " lines that nothing read in time");
  subject.write(Level::standard, "afterwards");
  EXPECT_TRUE(subject.flush());
  EXPECT_TRUE(reader->text().ends_with("in time\n<6>afterwards\n"));
}

TEST_F(LogWriterTest, ErrorsAreBoundedToo) {
  LogWriter subject(output());
  reader->stop();
  const std::string line(996, 'x');
  for (int number = 0; number < 3000; ++number) subject.write(Level::error, line);
  reader->go();
  EXPECT_TRUE(subject.flush());
  EXPECT_LE(reader->text().size(), LogWriter::kMaximumBytes + 100);
}

TEST_F(LogWriterTest, ItsEndIsNotHeldUpByAReaderThatStopped) {
  reader->stop();
  const auto begun = std::chrono::steady_clock::now();
  {
    LogWriter subject(output());
    subject.write(Level::standard, "x");
    EXPECT_FALSE(subject.flush());
  }
  EXPECT_GE(std::chrono::steady_clock::now() - begun, LogWriter::kFlushTime);
  reader->go();
}

TEST_F(LogWriterTest, WithoutAThreadTheCallerWritesAsMuchAsIsTakenAtOnce) {
  LogWriter subject(output(), &refuseThread);
  subject.write(Level::standard, "ab");
  EXPECT_EQ(reader->text(), "<6>ab\n");
  // Not asked again so soon; the rest waits.
  subject.write(Level::standard, "cd");
  subject.write(Level::standard, "ef");
  EXPECT_EQ(reader->text(), "<6>ab\n");
  EXPECT_FALSE(subject.flush());
  EXPECT_EQ(reader->text(), "<6>ab\n<6>cd\n");
  EXPECT_TRUE(subject.flush());
  EXPECT_EQ(reader->text(), "<6>ab\n<6>cd\n<6>ef\n");
}

// -- The programs' sink, with a real pipe as the standard error stream of a child process.

struct Child {
  pid_t pid;
  FileDescriptor stream;
};

template <class Body>
Child fork(Body body) {
  int ends[2];
  EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    ::dup2(ends[1], STDERR_FILENO);
    ::unsetenv("JOURNAL_STREAM");
    body();
    ::_exit(99);
  }
  ::close(ends[1]);
  return {child, FileDescriptor(ends[0])};
}

std::string readAll(int descriptor) {
  std::string text;
  char buffer[4096];
  for (ssize_t count; (count = ::read(descriptor, buffer, sizeof buffer)) > 0;) {
    text.append(buffer, static_cast<std::size_t>(count));
  }
  return text;
}

int statusOf(pid_t child) {
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return status;
}

class SystemLogSinkEnd : public ::testing::Test {
 protected:
  void SetUp() override {
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP() << "the sanitizer lets no child of a process with threads start its own";
#endif
  }
};

TEST_F(SystemLogSinkEnd, EndNowWritesWhatIsBuffered) {
  const auto child = fork([] {
    log::setSink(log::makeSystemLogSink("test"));
    for (int number = 0; number < 100; ++number) log::standard("line %d", number);
    process::endNow(3);
  });
  const auto text = readAll(child.stream.get());
  EXPECT_TRUE(text.ends_with("<6>line 99\n")) << text;
  EXPECT_EQ(WEXITSTATUS(statusOf(child.pid)), 3);
}

TEST_F(SystemLogSinkEnd, FatalSignalEndsTheProcessAfterItsLastLines) {
  const auto child = fork([] {
    for (const int number : {SIGABRT, SIGSEGV}) std::signal(number, SIG_DFL);
    log::setSink(log::makeSystemLogSink("test"));
    log::flushSystemLogOnFatalSignals();
    for (int number = 0; number < 100; ++number) log::standard("line %d", number);
    std::abort();
  });
  const auto text = readAll(child.stream.get());
  EXPECT_TRUE(text.ends_with("<6>line 99\n")) << text;
  const int status = statusOf(child.pid);
  ASSERT_TRUE(WIFSIGNALED(status));
  EXPECT_EQ(WTERMSIG(status), SIGABRT);
}

// The pipe is never read: the process ends all the same.
TEST_F(SystemLogSinkEnd, FullPipeHoldsUpNeitherCallersNorTheEnd) {
  const auto child = fork([] {
    log::setSink(log::makeSystemLogSink("test"));
    const std::string value(900, 'x');
    for (int number = 0; number < 3000; ++number) log::standard("line %d %s", number, value);
    process::endNow(4);
  });
  EXPECT_EQ(WEXITSTATUS(statusOf(child.pid)), 4);
}

}  // namespace
}  // namespace velk
