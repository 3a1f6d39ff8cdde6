// The way of log lines out of the process: callers leave them in a bounded buffer, a thread of the log's own writes
// them in order. No caller ever waits for the reader of the log, whatever locks it holds.
//
// The thread starts with the first line and sleeps while there is none. After a batch it naps for a moment, so that
// lines which come quickly share one write, and their callers wake no thread.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string_view>
#include <thread>

#include "foundation/Error.h"
#include "foundation/Function.h"
#include "platform/Log.h"
#include "platform/NativeThread.h"

namespace velk::log {

/// Where a writer's lines end up. Called by one thread at a time.
class LineOutput {
 public:
  virtual ~LineOutput() = default;
  /// Some lines, each as "<N>TEXT\n" with N from `priorityOf`. May block; a line that cannot be written is lost.
  virtual void write(std::string_view lines) = 0;
  /// The same without blocking for longer than `patience`; how many bytes were taken.
  virtual std::size_t tryWrite(std::string_view lines, std::chrono::milliseconds patience) = 0;
};

/// Any thread. Bounds: lines wait in kMaximumBytes, some ten thousand of them: minutes of a busy daemon, a tenth of
/// what it may have resident. The last quarter is for errors, so that a flood of others does not push them out. Lines
/// that find no room are counted, and one error line tells how many those were once there is room.
class LogWriter {
 public:
  static constexpr std::size_t kMaximumBytes = 1024 * 1024;
  static constexpr std::size_t kReservedForErrors = 256 * 1024;
  /// How long the end of a process waits for what is buffered.
  static constexpr std::chrono::milliseconds kFlushTime{500};

  using ThreadStarter = Result<std::thread> (*)(std::string_view name, UniqueFunction<void()> body);

  /// A system that refuses the thread is asked again with later lines, once a second at most. What the output takes
  /// without blocking is then written by the caller, the rest stays buffered.
  explicit LogWriter(std::unique_ptr<LineOutput> output, ThreadStarter starter = &startThread);
  /// Flushes. A thread that is still blocked then is left behind with the output.
  ~LogWriter();
  LogWriter(const LogWriter&) = delete;
  LogWriter& operator=(const LogWriter&) = delete;

  /// Never blocks.
  void write(Level level, std::string_view line);
  /// Waits until everything that was buffered before is written, kFlushTime at most; whether it is.
  bool flush();
  /// Whether nothing is waiting. For handlers of signals: takes no lock.
  [[nodiscard]] bool isWritten() const noexcept;

 private:
  struct State;
  static void run(State& state);
  void startThreadIfNone(std::chrono::milliseconds patience);
  void writeWithoutThread(std::chrono::milliseconds patience);

  const std::shared_ptr<State> _state;  // shared with the thread
  const ThreadStarter _starter;
};

}  // namespace velk::log
