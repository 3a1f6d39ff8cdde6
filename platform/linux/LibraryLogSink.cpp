#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <optional>
#include <string_view>

#include "platform/Clock.h"
#include "platform/Lock.h"
#include "platform/LogSinks.h"

namespace velk::log {
namespace {

struct Setting {
  bool silent = false;
  /// Set: lines of that level and above go to the standard error stream.
  std::optional<Level> toErrorStream;
};

Setting currentSetting() {
  const char* const text = secure_getenv("VELKREPORTING_LOG");
  if (text == nullptr) return {};
  const std::string_view setting = text;
  if (setting == "debug") return {false, Level::debug};
  if (setting == "default") return {false, Level::standard};
  if (setting == "error") return {false, Level::error};
  return {setting == "none", std::nullopt};
}

class ErrorStreamSink final : public Sink {
 public:
  explicit ErrorStreamSink(Level lowest) : _lowest(lowest) {}

  /// In one write, so that lines of several threads stay whole. A line that cannot be written is lost.
  void write(Level level, std::string_view line) override {
    if (level < _lowest) return;
    constexpr std::string_view kPrefix = "velkreporting: ";
    const iovec parts[] = {{const_cast<char*>(kPrefix.data()), kPrefix.size()},
                           {const_cast<char*>(line.data()), line.size()},
                           {const_cast<char*>("\n"), 1}};
    [[maybe_unused]] const auto ignored = ::writev(STDERR_FILENO, parts, 3);
  }

 private:
  const Level _lowest;
};

/// Errors alone, and not many: the host's log is not ours.
class HostLogSink final : public Sink {
 public:
  void write(Level level, std::string_view line) override {
    if (level != Level::error || !mayWrite()) return;
    syslog(LOG_USER | LOG_ERR, "velkreporting: %.*s", static_cast<int>(line.size()), line.data());
  }

 private:
  bool mayWrite() {
    const auto now = systemClock().steadyTime();
    Guard guard(_lock);
    if (now - _minute >= std::chrono::minutes(1)) {
      _minute = now;
      _written = 0;
    }
    return _written++ < kLibraryErrorsPerMinute;
  }

  Lock _lock;
  SteadyTime _minute VELK_GUARDED_BY(_lock);
  unsigned _written VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace

std::shared_ptr<Sink> makeLibrarySink() {
  const auto setting = currentSetting();
  if (setting.silent) return nullptr;
  if (setting.toErrorStream) return std::make_shared<ErrorStreamSink>(*setting.toErrorStream);
  return std::make_shared<HostLogSink>();
}

Level librarySinkLevel() { return currentSetting().toErrorStream.value_or(Level::error); }

}  // namespace velk::log
