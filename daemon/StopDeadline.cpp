#include "daemon/StopDeadline.h"

#include <algorithm>
#include <utility>

#include "platform/Log.h"

namespace velk {

StopDeadline::StopDeadline(Duration limit, std::function<void()> whenPassed)
    : _limit(limit), _whenPassed(std::move(whenPassed)) {}

Result<void> StopDeadline::prepare() { return _thread.start(); }

void StopDeadline::begin() {
  {
    Guard guard(_lock);
    _begun = systemClock().steadyTime();
  }
  _thread.postAfter(_limit, [this] { pass(); });
}

void StopDeadline::expect(std::string_view wait, std::string_view loss) {
  Guard guard(_lock);
  _wait = wait;
  _loss = loss;
}

Duration StopDeadline::leftUntil(Duration offset) const {
  Guard guard(_lock);
  return std::max(Duration::zero(), Duration(_begun + offset - systemClock().steadyTime()));
}

void StopDeadline::pass() {
  std::string_view wait;
  std::string_view loss;
  {
    Guard guard(_lock);
    wait = _wait;
    loss = _loss;
  }
  log::error("stop: still waiting for %@ after %d ms; the process ends without it: %@", wait,
             _limit / std::chrono::milliseconds(1), loss);
  _whenPassed();
}

}  // namespace velk
