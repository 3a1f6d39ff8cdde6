#include "platform/Log.h"

#include <algorithm>
#include <string>
#include <utility>

#include "platform/Fork.h"
#include "platform/Lock.h"

namespace velk::log {
namespace {

constexpr int kNothing = static_cast<int>(Level::error) + 1;
/// A value of a line, and a whole line, are cut there; a mark behind names their full length.
constexpr std::size_t kMaximumValueBytes = 1024;
constexpr std::size_t kMaximumLineBytes = 8 * 1024;
constexpr std::size_t kLongestCharacter = 4;

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

std::string cutTo(std::string text, std::size_t most) {
  if (text.size() <= most) return text;
  const std::string mark = "...(cut, " + std::to_string(text.size()) + " bytes)";
  // Between two characters, where it is text.
  std::size_t end = most;
  while (end > most - kLongestCharacter && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;
  text.resize(end);
  return text + mark;
}

/// As `formatText`, with every value cut.
std::string textWithCutValues(std::string_view format, std::initializer_list<FormatArgument> arguments) {
  std::string text;
  const FormatArgument* next = arguments.begin();
  while (!format.empty()) {
    const auto percent = std::min(format.find('%'), format.size());
    text.append(format.substr(0, percent));
    format.remove_prefix(percent);
    // The flags, width, precision and length modifiers, then the conversion.
    const auto conversion = std::min(format.find_first_not_of("-+ #0123456789.hlqLzjt", 1), format.size());
    const auto placeholder = format.substr(0, conversion + 1);
    format.remove_prefix(placeholder.size());
    const bool isPercentSign = placeholder.size() > 1 && placeholder.back() == '%';
    if (isPercentSign || next == arguments.end()) {
      text += formatText(placeholder, {});
    } else {
      text += cutTo(formatText(placeholder, {*next++}), kMaximumValueBytes);
    }
  }
  return text;
}

/// The line with its bounds: values may come from clients. Few lines need more than the first step.
std::string lineText(std::string_view format, std::initializer_list<FormatArgument> arguments) {
  std::string text = formatText(format, arguments);
  if (text.size() > kMaximumValueBytes) text = textWithCutValues(format, arguments);
  return cutTo(withoutControlCharacters(text), kMaximumLineBytes);
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
  if (sink) sink->write(level, lineText(format, arguments));
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
