#include <poll.h>
#include <signal.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/systemd_sink.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <string>
#include <utility>

#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/LogSinks.h"
#include "platform/LogWriter.h"

namespace velk::log {
namespace {

spdlog::level::level_enum spdlogLevelOf(Level level) {
  switch (level) {
    case Level::debug:
      return spdlog::level::debug;
    case Level::standard:
      return spdlog::level::info;
    case Level::error:
      return spdlog::level::err;
  }
  return spdlog::level::err;
}

/// What the digit of a line's prefix stands for.
Level levelOf(char priority) {
  for (const auto level : {Level::debug, Level::standard}) {
    if (priority == '0' + priorityOf(level)) return level;
  }
  return Level::error;
}

/// The standard error stream, in writes of whole lines that a pipe takes in one piece: other processes may share it.
/// It is theirs as well, so it is never made non-blocking.
class ErrorStream final : public LineOutput {
 public:
  void write(std::string_view lines) override {
    while (!lines.empty()) {
      const auto part = wholeLines(lines);
      writeAll(part);
      lines.remove_prefix(part.size());
    }
  }

  std::size_t tryWrite(std::string_view lines, std::chrono::milliseconds patience) override {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    std::size_t taken = 0;
    while (taken < lines.size()) {
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      if (!waitForRoom(static_cast<int>(std::max<std::int64_t>(left.count(), 0)))) break;
      // A pipe with any room has room for this much.
      const auto count =
          ::write(STDERR_FILENO, lines.data() + taken, std::min<std::size_t>(lines.size() - taken, PIPE_BUF));
      if (count <= 0) break;
      taken += static_cast<std::size_t>(count);
    }
    return taken;
  }

 private:
  static std::string_view wholeLines(std::string_view lines) {
    if (lines.size() <= PIPE_BUF) return lines;
    auto end = lines.rfind('\n', PIPE_BUF - 1);
    if (end == std::string_view::npos) end = lines.find('\n');
    return lines.substr(0, end + 1);
  }

  static void writeAll(std::string_view part) {
    while (!part.empty()) {
      const auto count = ::write(STDERR_FILENO, part.data(), part.size());
      if (count < 0 && errno == EINTR) continue;
      if (count < 0 && errno == EAGAIN && waitForRoom(-1)) continue;  // Another process made it non-blocking.
      if (count <= 0) return;                                         // No reader: there is nowhere to say so.
      part.remove_prefix(static_cast<std::size_t>(count));
    }
  }

  static bool waitForRoom(int milliseconds) {
    pollfd stream{STDERR_FILENO, POLLOUT, 0};
    return ::poll(&stream, 1, milliseconds) == 1 && (stream.revents & POLLOUT) != 0;
  }
};

/// Its socket blocks while the log daemon does not read.
class Journal final : public LineOutput {
 public:
  explicit Journal(const std::string& identifier)
      : _logger(identifier, std::make_shared<spdlog::sinks::systemd_sink_st>(identifier)) {
    _logger.set_level(spdlog::level::trace);
    // A line that cannot be written is lost; the log is no place to say so.
    _logger.set_error_handler([](const std::string&) {});
  }

  void write(std::string_view lines) override {
    constexpr std::size_t kPrefix = 3;
    while (!lines.empty()) {
      const auto line = lines.substr(0, lines.find('\n'));
      const auto text = line.substr(std::min(kPrefix, line.size()));
      _logger.log(spdlogLevelOf(levelOf(line.size() > 1 ? line[1] : '3')),
                  spdlog::string_view_t(text.data(), text.size()));
      lines.remove_prefix(std::min(line.size() + 1, lines.size()));
    }
  }

  /// The journal's library knows no way that never blocks.
  std::size_t tryWrite(std::string_view, std::chrono::milliseconds) override { return 0; }

 private:
  spdlog::logger _logger;
};

class SystemLogSink final : public Sink {
 public:
  explicit SystemLogSink(std::unique_ptr<LineOutput> output);
  ~SystemLogSink() override;
  void write(Level level, std::string_view line) override { _writer->write(level, line); }

 private:
  const std::shared_ptr<LogWriter> _writer;
};

/// The newest writer, for the end of the process. A forked child has none: the thread is not there.
struct Newest {
  Lock lock;
  std::shared_ptr<LogWriter> writer VELK_GUARDED_BY(lock);
  /// The same, for handlers of signals.
  std::atomic<const LogWriter*> forHandlers{nullptr};
};
constinit PerProcess<Newest> newests;

SystemLogSink::SystemLogSink(std::unique_ptr<LineOutput> output)
    : _writer(std::make_shared<LogWriter>(std::move(output))) {
  auto& newest = newests.get([] { return new Newest; });
  Guard guard(newest.lock);
  newest.writer = _writer;
  newest.forHandlers = _writer.get();
}

SystemLogSink::~SystemLogSink() {
  auto* const newest = newests.existing();
  if (newest == nullptr) return;
  Guard guard(newest->lock);
  if (newest->writer != _writer) return;
  newest->forHandlers = nullptr;
  // It ends with this object, outside the lock.
  newest->writer.reset();
}

constexpr int kFatalSignals[] = {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS};

/// The other threads still run, the log's included.
void waitForLogThenEnd(int number) {
  constexpr timespec kStep{0, 5'000'000};
  const auto* const newest = newests.existing();
  const auto* const writer = newest != nullptr ? newest->forHandlers.load() : nullptr;
  for (int step = 0; step < 100 && writer != nullptr && !writer->isWritten(); ++step) ::nanosleep(&kStep, nullptr);
  // Its default action is back: that happens when this returns.
  static_cast<void>(::raise(number));
}

}  // namespace

void flushSystemLog() {
  auto* const newest = newests.existing();
  if (newest == nullptr) return;
  std::shared_ptr<LogWriter> writer;
  {
    Guard guard(newest->lock);
    writer = newest->writer;
  }
  if (writer) writer->flush();
}

void flushSystemLogOnFatalSignals() {
  struct sigaction handler {};
  handler.sa_handler = waitForLogThenEnd;
  handler.sa_flags = static_cast<int>(SA_RESETHAND);
  for (const int number : kFatalSignals) {
    struct sigaction former {};
    if (::sigaction(number, nullptr, &former) != 0 || former.sa_handler != SIG_DFL) continue;
    static_cast<void>(::sigaction(number, &handler, nullptr));
  }
}

bool isJournalStream(std::string_view journalStream, int descriptor) noexcept {
  const auto colon = journalStream.find(':');
  if (colon == std::string_view::npos) return false;
  const auto parse = [](std::string_view text, std::uint64_t& number) {
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    return error == std::errc() && end == text.data() + text.size();
  };
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  if (!parse(journalStream.substr(0, colon), device) || !parse(journalStream.substr(colon + 1), inode)) return false;
  struct stat status {};
  return ::fstat(descriptor, &status) == 0 && status.st_dev == device && status.st_ino == inode;
}

std::shared_ptr<Sink> makeSystemLogSink(const std::string& identifier, bool alwaysErrorStream) {
  const char* const journalStream = std::getenv("JOURNAL_STREAM");
  if (!alwaysErrorStream && journalStream != nullptr && isJournalStream(journalStream, STDERR_FILENO)) {
    return std::make_shared<SystemLogSink>(std::make_unique<Journal>(identifier));
  }
  return std::make_shared<SystemLogSink>(std::make_unique<ErrorStream>());
}

}  // namespace velk::log
