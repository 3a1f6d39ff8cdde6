// A program that a test starts, talks to and ends. Its output is read by threads of the test, line by line.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdlib>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/FileDescriptor.h"
#include "platform/Lock.h"

namespace velk::test {

/// How long a test waits for something that must happen; far above what it takes, for slow and sanitized runs.
/// VELK_TEST_PATIENCE (seconds) changes it, for those who write tests.
inline const std::chrono::seconds kPatience{
    std::getenv("VELK_TEST_PATIENCE") != nullptr ? std::atoi(std::getenv("VELK_TEST_PATIENCE")) : 60};

/// Lines that arrive from elsewhere; any thread.
class LineCollector {
 public:
  void add(std::string line);
  /// No more lines will come.
  void end();
  [[nodiscard]] std::vector<std::string> lines() const;
  /// The first line at or after `from` for which `matches` holds; nothing when it did not come in time or cannot come.
  [[nodiscard]] std::optional<std::string> waitFor(const std::function<bool(const std::string&)>& matches,
                                                   std::size_t from = 0,
                                                   std::chrono::milliseconds patience = kPatience) const;
  [[nodiscard]] bool waitForPart(const std::string& part, std::size_t from = 0,
                                 std::chrono::milliseconds patience = kPatience) const;
  /// Waits until no more lines can come.
  void waitForEnd() const;
  /// How many lines that are here now hold `part`.
  [[nodiscard]] std::size_t count(const std::string& part) const;
  /// The same, once there are `expected` of them (or that cannot be any more): a program's lines come by a way of their
  /// own, and may be behind its answers.
  [[nodiscard]] std::size_t countOnceThereAre(std::size_t expected, const std::string& part) const;

 private:
  mutable Lock _lock;
  mutable Condition _changed;
  std::vector<std::string> _lines VELK_GUARDED_BY(_lock);
  bool _ended VELK_GUARDED_BY(_lock) = false;
};

class ChildProcess {
 public:
  struct Options {
    std::vector<std::string> command;
    /// Added to (or, with an empty text, removed from) this process's environment.
    std::map<std::string, std::string> environment;
    /// The user to run as; only root may choose.
    std::optional<uid_t> user;
  };

  explicit ChildProcess(const Options& options);
  /// Ends it hard if it is still there.
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  [[nodiscard]] pid_t pid() const { return _pid; }
  [[nodiscard]] LineCollector& output() { return _output; }
  [[nodiscard]] LineCollector& errors() { return _errors; }
  void write(const std::string& text);
  void closeInput() { _input = FileDescriptor(); }
  void signal(int number) const;
  /// The exit status (128 + the signal's number when one ended it), or nothing when it did not end in time.
  [[nodiscard]] std::optional<int> wait(std::chrono::milliseconds patience = kPatience);

 private:
  pid_t _pid = -1;
  std::optional<int> _status;
  FileDescriptor _input;
  LineCollector _output;
  LineCollector _errors;
  std::vector<std::thread> _readers;
};

}  // namespace velk::test
