#include "platform/Queue.h"

#include <cstdio>
#include <cstdlib>

#include "platform/CurrentQueue.h"

namespace velk {
namespace {
thread_local const CurrentQueueScope* innermost = nullptr;
}  // namespace

CurrentQueueScope::CurrentQueueScope(const void* queue) noexcept : _queue(queue), _outer(innermost) {
  innermost = this;
}

CurrentQueueScope::~CurrentQueueScope() { innermost = _outer; }

bool CurrentQueueScope::contains(const void* queue) noexcept {
  for (const auto* scope = innermost; scope != nullptr; scope = scope->_outer) {
    if (scope->_queue == queue) return true;
  }
  return false;
}

void assertOnQueue(const Queue& queue) {
  if (queue.isCurrent()) return;
  const auto label = queue.label();
  std::fprintf(stderr, "called off its queue: %.*s\n", static_cast<int>(label.size()), label.data());
  std::abort();
}

}  // namespace velk
