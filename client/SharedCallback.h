// What the user gives the library to call: function objects, and with them all that they captured. They pass through
// the library's own thread, which never runs the user's code; and the copy and the end of what was captured are the
// user's code as much as the call is. So they are shared from the moment they are handed over, and whoever lets go of
// one last sees to it that it ends where callbacks run. Private to client/.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <tuple>
#include <utility>

#include "client/ClientRuntime.h"

namespace velk {

/// Shares something of the user's. It ends once: on the thread that lets go of it last or, when that is the library's
/// own, on one for callbacks.
template <class Owned>
[[nodiscard]] std::shared_ptr<Owned> shareForUser(ClientRuntime& runtime, Owned owned) {
  const auto end = [&runtime](Owned* ending) {
    std::unique_ptr<Owned> last(ending);
    if (runtime.loop().isCurrent()) runtime.runCallback([last = std::move(last)] {});
  };
  return std::shared_ptr<Owned>(new Owned(std::move(owned)), end);
}

/// A function of the user's that may be called, copied and given up on any thread. None stays none.
template <class... Arguments>
[[nodiscard]] std::function<void(Arguments...)> sharedForUser(ClientRuntime& runtime,
                                                              std::function<void(Arguments...)> function) {
  if (!function) return nullptr;
  auto shared = shareForUser(runtime, std::move(function));
  return [shared = std::move(shared)](Arguments... arguments) { (*shared)(std::forward<Arguments>(arguments)...); };
}

/// A completion of the user's, shared between a reply and an error handler: whichever comes first has it run, on a
/// thread for callbacks, once. What it captured ends right behind the call, or with the last owner if none is made.
template <class... Arguments>
class SharedCallback {
 public:
  using Function = std::function<void(Arguments...)>;

  SharedCallback(ClientRuntime& runtime, Function function) : _runtime(&runtime) {
    if (function) _completion = shareForUser(runtime, Completion(std::move(function)));
  }

  template <class... Given>
  void operator()(Given... given) const {
    if (!takesCall()) return;
    _runtime->runCallback([completion = _completion, given = std::make_tuple(std::move(given)...)] {
      std::apply([&completion](const auto&... each) { run(*completion, each...); }, given);
    });
  }
  /// The same on this thread, which is one for callbacks.
  template <class... Given>
  void callHere(const Given&... given) const {
    if (takesCall()) run(*_completion, given...);
  }

 private:
  struct Completion {
    explicit Completion(Function called) : function(std::move(called)) {}
    Completion(Completion&& other) noexcept : function(std::move(other.function)) {}
    Function function;
    std::atomic<bool> isCalled{false};
  };

  [[nodiscard]] bool takesCall() const { return _completion && !_completion->isCalled.exchange(true); }
  template <class... Given>
  static void run(Completion& completion, const Given&... given) {
    const Function function = std::move(completion.function);
    function(given...);
  }

  ClientRuntime* _runtime;
  std::shared_ptr<Completion> _completion;
};

}  // namespace velk
