// The system log: three levels, one line a call, whatever the arguments hold. Any thread.
// The library hosts a small sink of its own; the daemon installs one that knows journald.
#pragma once

#include <atomic>
#include <initializer_list>
#include <memory>
#include <string_view>

#include "foundation/Format.h"

namespace velk::log {

enum class Level { debug, standard, error };

/// Where lines go. `write` may be called from any thread at once and must not log.
class Sink {
 public:
  virtual ~Sink() = default;
  virtual void write(Level level, std::string_view line) = 0;
};

/// Replaces the sink of the process (null: lines are dropped) and the lowest level that reaches it.
/// Lines in flight may still reach the old sink.
void setSink(std::shared_ptr<Sink> sink, Level lowest = Level::standard);
/// The same where no sink was ever set: a library must not take a process's log away from it.
void setSinkIfNone(std::shared_ptr<Sink> sink, Level lowest);

namespace detail {
extern std::atomic<int> lowestLevel;
void write(Level level, std::string_view format, std::initializer_list<FormatArgument> arguments);
}  // namespace detail

/// Whether a line of this level would be written: ask before preparing costly arguments.
[[nodiscard]] inline bool isEnabled(Level level) noexcept {
  return static_cast<int>(level) >= detail::lowestLevel.load(std::memory_order_relaxed);
}

// The arguments fill the format's placeholders (see formatText); control characters in the line are escaped.
template <class... Arguments>
void debug(std::string_view format, const Arguments&... arguments) {
  if (isEnabled(Level::debug)) detail::write(Level::debug, format, {FormatArgument(arguments)...});
}
template <class... Arguments>
void standard(std::string_view format, const Arguments&... arguments) {
  if (isEnabled(Level::standard)) detail::write(Level::standard, format, {FormatArgument(arguments)...});
}
template <class... Arguments>
void error(std::string_view format, const Arguments&... arguments) {
  if (isEnabled(Level::error)) detail::write(Level::error, format, {FormatArgument(arguments)...});
}

}  // namespace velk::log
