// The signals that ask a program to end, taken as an ordinary wait instead of a handler.
#pragma once

namespace velk::tools {

/// Made at the top of `main`, before any thread: SIGINT and SIGTERM are blocked from then on, in every thread. A
/// vanished reader of a pipe then shows as a failed write as well, not as a signal.
class StopSignals {
 public:
  StopSignals();
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  /// Blocks until one of them comes, or `wake` was called.
  void wait();
  /// From any thread.
  void wake();
};

}  // namespace velk::tools
