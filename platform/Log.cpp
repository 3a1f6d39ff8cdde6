#include "platform/Log.h"

#include <utility>

#include "platform/Fork.h"
#include "platform/Lock.h"

namespace velk::log {
namespace {

constexpr int kNothing = static_cast<int>(Level::error) + 1;

struct Current {
  Lock lock;
  std::shared_ptr<Sink> sink VELK_GUARDED_BY(lock);
  bool wasSet VELK_GUARDED_BY(lock) = false;
};

/// In a forked child there is no sink until it sets its own: the parent's may be in use by threads that are not there.
constinit PerProcess<Current> currents;
Current& current() {
  return currents.get([] { return new Current; });
}

}  // namespace

namespace detail {

// Nothing is enabled before there is a sink.
std::atomic<int> lowestLevel{kNothing};

void write(Level level, std::string_view format, std::initializer_list<FormatArgument> arguments) {
  std::shared_ptr<Sink> sink;
  {
    Guard guard(current().lock);
    sink = current().sink;
  }
  if (sink) sink->write(level, withoutControlCharacters(formatText(format, arguments)));
}

}  // namespace detail

void setSink(std::shared_ptr<Sink> sink, Level lowest) {
  const int level = sink ? static_cast<int>(lowest) : kNothing;
  {
    Guard guard(current().lock);
    std::swap(current().sink, sink);
    current().wasSet = true;
  }
  detail::lowestLevel.store(level, std::memory_order_relaxed);
  // The former sink ends here, outside the lock.
}

void setSinkIfNone(std::shared_ptr<Sink> sink, Level lowest) {
  const int level = sink ? static_cast<int>(lowest) : kNothing;
  Guard guard(current().lock);
  if (std::exchange(current().wasSet, true)) return;
  current().sink = std::move(sink);
  detail::lowestLevel.store(level, std::memory_order_relaxed);
}

}  // namespace velk::log
