#include "client/ReportingQueue.h"

#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

void ReportingQueue::hold() {
  assertOnQueue(*_beneath);
  _isHeld = true;
}

void ReportingQueue::release() {
  assertOnQueue(*_beneath);
  _isHeld = false;
  _overflowed = false;
  while (!_isHeld && !_waiting.empty()) {
    Task work = std::move(_waiting.front());
    _waiting.pop_front();
    if (work) work();
  }
}

bool ReportingQueue::hasRoom() {
  if (_waiting.size() < kMaximumWaiting) return true;
  if (!std::exchange(_overflowed, true)) {
    log::error(texts::kTooManyCallsWait, _waiting.size());
  }
  return false;
}

}  // namespace velk
