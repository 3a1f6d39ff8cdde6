// A program started for a measurement, and what the system says of it.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace velk::bench {

/// Ended (killed) and waited for by its destructor, unless that has happened. One thread.
class ChildProgram {
 public:
  struct Options {
    std::vector<std::string> command;                ///< the program's path first
    std::map<std::string, std::string> environment;  ///< on top of this process's own
    std::string errorFile;  ///< where its standard error stream goes; empty: where this process's goes
  };
  /// Its standard input and output are pipes. Ends this program when it cannot be started.
  explicit ChildProgram(const Options& options);
  ~ChildProgram();
  ChildProgram(const ChildProgram&) = delete;
  ChildProgram& operator=(const ChildProgram&) = delete;

  [[nodiscard]] int input() const { return _input; }
  [[nodiscard]] int output() const { return _output; }
  [[nodiscard]] pid_t pid() const { return _pid; }

  /// Of all its threads, so far.
  [[nodiscard]] double cpuSeconds() const;
  /// Resident memory in MB (2^20 bytes), now and at most.
  [[nodiscard]] double residentMegabytes() const { return status("VmRSS:"); }
  [[nodiscard]] double peakMegabytes() const { return status("VmHWM:"); }
  /// Of the resident memory, what is no file's.
  [[nodiscard]] double anonymousMegabytes() const { return status("RssAnon:"); }

  void signal(int number) const;
  /// Waits for its end: the exit status, or -1 when a signal ended it.
  int wait();

 private:
  [[nodiscard]] double status(const char* field) const;

  pid_t _pid = -1;
  int _input = -1;
  int _output = -1;
};

}  // namespace velk::bench
