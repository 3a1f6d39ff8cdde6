#include "platform/BlockingScope.h"

#include "platform/BlockingObserver.h"

namespace velk {
namespace {
thread_local BlockingObserver* blockingObserver = nullptr;
thread_local unsigned depth = 0;
}  // namespace

void setBlockingObserver(BlockingObserver* observer) noexcept { blockingObserver = observer; }

BlockingScope::BlockingScope() noexcept {
  if (depth++ == 0 && blockingObserver != nullptr) blockingObserver->willBlock();
}

BlockingScope::~BlockingScope() {
  if (--depth == 0 && blockingObserver != nullptr) blockingObserver->didBlock();
}

}  // namespace velk
