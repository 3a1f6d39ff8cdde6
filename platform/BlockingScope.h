// Says to the pool of threads that the current one is about to wait for something outside its control.
#pragma once

namespace velk {

/// While one lives, the calling thread does not count as running: if it belongs to a pool and work is waiting, the
/// pool starts or wakes another thread. May nest; costs nothing to speak of on threads that belong to no pool.
class BlockingScope {
 public:
  BlockingScope() noexcept;
  ~BlockingScope();
  BlockingScope(const BlockingScope&) = delete;
  BlockingScope& operator=(const BlockingScope&) = delete;
};

}  // namespace velk
