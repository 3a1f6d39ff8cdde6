// The calls of foreign code that are under way: how many may be, and whether all have returned. Private to
// platform/linux/. Any thread.
#pragma once

#include <cstddef>

#include "foundation/TimeValue.h"
#include "platform/BlockingScope.h"
#include "platform/Lock.h"

namespace velk {

class ForeignCalls {
 public:
  explicit ForeignCalls(std::size_t maximum) : _maximum(maximum) {}

  /// One call, as long as it lives. The thread counts as blocked meanwhile: nobody knows what foreign code waits for.
  class Scope {
   public:
    explicit Scope(ForeignCalls& calls) : _calls(calls), _entered(calls.enter()) {}
    ~Scope() {
      if (_entered) _calls.leave();
    }
    Scope(const Scope&) = delete;
    Scope& operator=(const Scope&) = delete;
    /// False: too many are under way, or no more may begin. The call is not to be made.
    [[nodiscard]] bool isEntered() const noexcept { return _entered; }

   private:
    ForeignCalls& _calls;
    const bool _entered;
    const BlockingScope _blocking;
  };

  /// Lets no further call begin and waits for those under way; false when some have not returned within `limit`.
  [[nodiscard]] bool stop(Duration limit);

 private:
  [[nodiscard]] bool enter();
  void leave();

  // Constant after construction.
  const std::size_t _maximum;

  // Guarded by _lock.
  Lock _lock;
  Condition _allReturned;
  std::size_t _underWay VELK_GUARDED_BY(_lock) = 0;
  bool _stopped VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
