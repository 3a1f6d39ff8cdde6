// How much the batches of all backends hold together. One a process, made with what backends are handed
// (`BackendContext`) and shared with the batches. Any thread.
#pragma once

#include <atomic>
#include <cstdint>

namespace velk {

class BatchMemory {
 public:
  static constexpr std::uint64_t kMaximumBytes = 64U * 1024 * 1024;

  explicit BatchMemory(std::uint64_t maximumBytes = kMaximumBytes) noexcept : _maximumBytes(maximumBytes) {}

  /// Takes `bytes` for a batch that holds `held` so far. Refused, and nothing taken, when the batch would then hold
  /// more than is left for all others: so a single batch gets half, and a new one always finds room.
  [[nodiscard]] bool take(std::uint64_t bytes, std::uint64_t held) noexcept {
    const std::uint64_t taken = _taken.fetch_add(bytes, std::memory_order_relaxed) + bytes;
    if (taken <= _maximumBytes && held + bytes <= _maximumBytes - taken) return true;
    giveBack(bytes);
    return false;
  }
  void giveBack(std::uint64_t bytes) noexcept { _taken.fetch_sub(bytes, std::memory_order_relaxed); }
  /// Changes the size of a batch. Never refused: the events are in memory already.
  void replace(std::uint64_t before, std::uint64_t now) noexcept {
    _taken.fetch_add(now - before, std::memory_order_relaxed);  // a smaller size wraps around to the right sum
  }
  [[nodiscard]] std::uint64_t taken() const noexcept { return _taken.load(std::memory_order_relaxed); }

 private:
  const std::uint64_t _maximumBytes;
  std::atomic<std::uint64_t> _taken{0};
};

}  // namespace velk
