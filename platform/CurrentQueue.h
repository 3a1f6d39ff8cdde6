// Which queues the current thread is working for: what `Queue::isCurrent` asks. Used by every implementation of Queue.
#pragma once

namespace velk {

/// While one lives, the calling thread works for `queue`. Scopes nest (a task that calls `sync` of another queue works
/// for both) and end in reverse order. Lives on the stack.
class CurrentQueueScope {
 public:
  /// `queue` is an identity, never followed.
  explicit CurrentQueueScope(const void* queue) noexcept;
  ~CurrentQueueScope();
  CurrentQueueScope(const CurrentQueueScope&) = delete;
  CurrentQueueScope& operator=(const CurrentQueueScope&) = delete;

  [[nodiscard]] static bool contains(const void* queue) noexcept;

 private:
  const void* const _queue;
  const CurrentQueueScope* const _outer;
};

}  // namespace velk
