#include "platform/Clock.h"

namespace velk {
namespace {

class SystemClock final : public Clock {
 public:
  [[nodiscard]] TimeValue wallTime() const override {
    using namespace std::chrono;
    const auto sinceEpoch = system_clock::now().time_since_epoch();
    const auto whole = floor<seconds>(sinceEpoch);
    return TimeValue{whole.count(), static_cast<std::int32_t>(duration_cast<microseconds>(sinceEpoch - whole).count())};
  }
  [[nodiscard]] SteadyTime steadyTime() const override { return std::chrono::steady_clock::now(); }
};

}  // namespace

Clock& systemClock() {
  // Never destroyed: threads and exit handlers ask it to the very end of the process.
  static SystemClock& clock = *new SystemClock;
  return clock;
}

}  // namespace velk
