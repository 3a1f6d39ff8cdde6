// A callback of the C interface with its context, which is destroyed exactly once, after its last use. Private to
// client/.
#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "client/VelkReportingC.h"

namespace velk::cinterface {

/// Destroys a context: here, or on a thread for callbacks when this is the library's own thread, which never runs the
/// user's code.
void destroyContext(VelkReportingDestroyFunction destroy, void* context) noexcept;

/// Shared by the copies of the function object that wraps it. Made first of all, so that it owns the context on every
/// path, also those on which nothing is called.
template <class Function>
class CallbackOwner {
 public:
  CallbackOwner(Function function, void* context, VelkReportingDestroyFunction destroy) noexcept
      : _function(function), _context(context), _destroy(destroy) {}
  CallbackOwner(const CallbackOwner&) = delete;
  CallbackOwner& operator=(const CallbackOwner&) = delete;
  ~CallbackOwner() {
    if (_destroy != nullptr) destroyContext(_destroy, _context);
  }

  template <class... Arguments>
  void operator()(Arguments... arguments) const {
    _function(arguments..., _context);
  }
  [[nodiscard]] bool isCallable() const noexcept { return _function != nullptr; }

 private:
  const Function _function;
  void* const _context;
  const VelkReportingDestroyFunction _destroy;
};

template <class Function>
using SharedCallbackOwner = std::shared_ptr<const CallbackOwner<Function>>;

/// Null, with the context destroyed, when memory is short.
template <class Function>
[[nodiscard]] SharedCallbackOwner<Function> ownCallback(Function function, void* context,
                                                        VelkReportingDestroyFunction destroy) noexcept {
  try {
    return std::make_shared<const CallbackOwner<Function>>(function, context, destroy);
  } catch (...) {
    if (destroy != nullptr) destroyContext(destroy, context);
    return nullptr;
  }
}

/// What `wrap` makes of the owner, which goes into it; nothing when there is no callback to call: then the context is
/// destroyed here.
template <class Block, class Function, class Wrap>
[[nodiscard]] Block blockOf(SharedCallbackOwner<Function> owner, Wrap wrap) {
  if (!owner || !owner->isCallable()) return nullptr;
  return Block(wrap(std::move(owner)));
}

}  // namespace velk::cinterface
