// Whether this process is still the one that made an object. Objects with threads behind them do nothing in a child
// that was forked from their process: its copies of their locks may be held by threads that it does not have.
#pragma once

#include <cstdint>

namespace velk {

/// Grows by one in every forked child. Cheap enough for every call: no system call after the first.
[[nodiscard]] std::uint64_t processGeneration() noexcept;

/// Remembers the process that made it. Any thread; takes no lock.
class ForkGuard {
 public:
  ForkGuard() noexcept : _generation(processGeneration()) {}
  /// True in a child forked after construction.
  [[nodiscard]] bool forked() const noexcept { return _generation != processGeneration(); }

 private:
  const std::uint64_t _generation;
};

}  // namespace velk
