// The calls of one connection that wait for their answer. Owned by the connection's core, guarded by its lock.
#pragma once

#include <cstdint>
#include <utility>
#include <vector>

#include "ipc/Connection.h"
#include "ipc/Limits.h"

namespace velk::ipc {

/// A table of slots that are used again: in the long run a call allocates nothing here. A serial names the slot and
/// how often it has been used, so that an answer finds its call at once and no answer is taken twice. Not synchronised.
class PendingReplies {
 public:
  /// 0 when the table is full; `handler` is untouched then.
  [[nodiscard]] std::uint64_t add(ReplyHandler& handler) {
    if (_count >= kMaximumPendingReplies) return 0;
    if (_free.empty()) {
      _free.push_back(static_cast<std::uint32_t>(_slots.size()));
      _slots.emplace_back();
    }
    const auto number = _free.back();
    _free.pop_back();
    ++_count;
    auto& slot = _slots[number];
    slot.handler = std::move(handler);
    ++slot.generation;
    return serialOf(number, slot.generation);
  }

  /// Empty when no call with this serial waits.
  [[nodiscard]] ReplyHandler take(std::uint64_t serial) {
    const auto number = static_cast<std::uint32_t>(serial) - 1;
    if (number >= _slots.size() || serial != serialOf(number, _slots[number].generation)) return {};
    if (!_slots[number].handler) return {};
    _free.push_back(number);
    --_count;
    return std::move(_slots[number].handler);
  }

  [[nodiscard]] std::vector<ReplyHandler> takeAll() {
    std::vector<ReplyHandler> all;
    for (std::uint32_t number = 0; number < _slots.size(); ++number) {
      if (_slots[number].handler) all.push_back(take(serialOf(number, _slots[number].generation)));
    }
    return all;
  }

  [[nodiscard]] std::size_t size() const noexcept { return _count; }

 private:
  struct Slot {
    ReplyHandler handler;
    std::uint32_t generation = 0;
  };

  static std::uint64_t serialOf(std::uint32_t number, std::uint32_t generation) noexcept {
    return (static_cast<std::uint64_t>(generation) << 32) | (number + 1);
  }

  std::vector<Slot> _slots;
  std::vector<std::uint32_t> _free;
  std::size_t _count = 0;
};

}  // namespace velk::ipc
