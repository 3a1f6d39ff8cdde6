#include <pthread.h>
#include <signal.h>
#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <ctime>
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

/// A write into a pipe that nobody reads raises a signal on the writing thread, which may be the host's: it is held
/// back meanwhile, and taken away again. A line that cannot be written is lost.
void writeToErrorStream(const iovec* parts, int count) noexcept {
  sigset_t brokenPipe;
  sigset_t former;
  sigset_t pending;
  sigemptyset(&brokenPipe);
  sigaddset(&brokenPipe, SIGPIPE);
  sigemptyset(&pending);
  sigpending(&pending);
  pthread_sigmask(SIG_BLOCK, &brokenPipe, &former);
  const bool isRaised = ::writev(STDERR_FILENO, parts, count) < 0 && errno == EPIPE;
  const bool isOurs = isRaised && sigismember(&pending, SIGPIPE) == 0;
  constexpr timespec kNow{};
  while (isOurs && sigtimedwait(&brokenPipe, nullptr, &kNow) < 0 && errno == EINTR) {
  }
  pthread_sigmask(SIG_SETMASK, &former, nullptr);
}

class ErrorStreamSink final : public Sink {
 public:
  explicit ErrorStreamSink(Level lowest) : _lowest(lowest) {}

  /// In one write, so that lines of several threads stay whole.
  void write(Level level, std::string_view line) override {
    if (level < _lowest) return;
    constexpr std::string_view kPrefix = "velkreporting: ";
    const iovec parts[] = {{const_cast<char*>(kPrefix.data()), kPrefix.size()},
                           {const_cast<char*>(line.data()), line.size()},
                           {const_cast<char*>("\n"), 1}};
    writeToErrorStream(parts, 3);
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
