// A backend's enable state together with the serial queue that guards it. A handle: copies share the state, so that
// work in flight (a post whose answer may disable the backend) needs no hold on the backend itself.
#pragma once

#include <cstdint>
#include <memory>
#include <utility>

#include "platform/Queue.h"

namespace velk {

/// Any thread, except where a method says otherwise.
class BackendStateHandle {
 public:
  explicit BackendStateHandle(std::shared_ptr<Queue> queue)
      : _queue(std::move(queue)), _value(std::make_shared<std::int32_t>(0)) {}

  /// Waits for everything queued so far.
  [[nodiscard]] std::int32_t read() const {
    return _queue->sync([this] { return *_value; });
  }
  /// Returns before the state has changed; reads made by the same thread afterwards see it changed.
  void write(std::int32_t state) const {
    _queue->async([value = _value, state] { *value = state; });
  }
  /// On the state queue only.
  [[nodiscard]] std::int32_t raw() const {
    assertOnQueue(*_queue);
    return *_value;
  }
  [[nodiscard]] Queue& queue() const { return *_queue; }

 private:
  // Constant after construction; what `_value` points to is guarded by `_queue`.
  std::shared_ptr<Queue> _queue;
  std::shared_ptr<std::int32_t> _value;
};

}  // namespace velk
