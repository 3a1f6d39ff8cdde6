// The lines of a program's input, read so that something else may break the wait for the next one.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>

#include "platform/FileDescriptor.h"

namespace velk::ctl {

/// Used by one thread, except for `wake`. The input may be a terminal, a pipe or a file; it is not owned.
class InputLines {
 public:
  enum class Event {
    line,     ///< a whole line (the last one may lack its end)
    tooLong,  ///< a line beyond the bound was skipped
    end,      ///< there is no more input
    failed,   ///< the input cannot be read
    woken,    ///< `wake` was called; so it is from then on
  };

  InputLines(int descriptor, std::size_t maximumLineBytes);

  /// Blocks until there is something to tell.
  [[nodiscard]] Event next(std::string& line);
  /// Blocks for a time; false when it was woken before.
  [[nodiscard]] bool sleep(std::chrono::duration<double> time);
  /// From any thread; never blocks.
  void wake();

 private:
  /// True when there is input, false when woken.
  [[nodiscard]] bool waitForInput();
  [[nodiscard]] std::optional<Event> takeLine(std::string& line);

  const int _descriptor;
  const std::size_t _maximumLineBytes;
  const FileDescriptor _wakeUp;
  std::string _buffer;
  std::size_t _searched = 0;
  bool _skipping = false;
  bool _ended = false;
};

}  // namespace velk::ctl
