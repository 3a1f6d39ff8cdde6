// An answer that somebody waits for: called at most once, and never lost.
// Several rules of the system say that a completion "is not called" (an inactive transport, a task that could
// not be made, a delegate that has gone). Whoever waits must still learn of it, so a completion that is
// destroyed uncalled runs its abandonment handler instead: it wakes the waiter, or fails the peer's reply.
#pragma once

#include <utility>

#include "foundation/Function.h"

namespace velk {

/// Move-only; not synchronised. Both handlers run on the thread that calls or destroys the completion.
template <class... Arguments>
class Completion {
 public:
  Completion() noexcept = default;
  Completion(std::nullptr_t) noexcept {}

  /// A completion whose abandonment is of no interest to anybody.
  template <class OnCall, class = std::enable_if_t<std::is_invocable_v<OnCall&, Arguments...>>>
  Completion(OnCall&& onCall) : _onCall(std::forward<OnCall>(onCall)) {}

  /// `onAbandoned` runs exactly when the completion is destroyed (or overwritten) without having been called.
  template <class OnCall, class OnAbandoned>
  Completion(OnCall&& onCall, OnAbandoned&& onAbandoned)
      : _onCall(std::forward<OnCall>(onCall)), _onAbandoned(std::forward<OnAbandoned>(onAbandoned)) {}

  Completion(Completion&&) noexcept = default;
  Completion& operator=(Completion&& other) noexcept {
    if (this != &other) {
      abandon();
      _onCall = std::move(other._onCall);
      _onAbandoned = std::move(other._onAbandoned);
    }
    return *this;
  }
  Completion(const Completion&) = delete;
  Completion& operator=(const Completion&) = delete;
  ~Completion() { abandon(); }

  /// True until it has been called. A completion that was never given is false as well.
  explicit operator bool() const noexcept { return static_cast<bool>(_onCall); }

  /// Answers. Calling an empty completion does nothing: replies are optional everywhere.
  void operator()(Arguments... arguments) {
    if (!_onCall) return;
    auto onCall = std::move(_onCall);
    _onAbandoned = nullptr;
    onCall(std::forward<Arguments>(arguments)...);
  }

 private:
  void abandon() noexcept {
    if (!_onCall) return;
    _onCall = nullptr;
    if (auto onAbandoned = std::move(_onAbandoned)) onAbandoned();
  }

  UniqueFunction<void(Arguments...)> _onCall;
  UniqueFunction<void()> _onAbandoned;
};

}  // namespace velk
