#include <paths.h>
#include <pthread.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/Clock.h"
#include "platform/FileDescriptor.h"
#include "platform/LocalTime.h"
#include "platform/Lock.h"
#include "platform/LogSinks.h"

namespace velk::log {
namespace {

constexpr std::string_view kPrefix = "velkreporting: ";

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
    const iovec parts[] = {{const_cast<char*>(kPrefix.data()), kPrefix.size()},
                           {const_cast<char*>(line.data()), line.size()},
                           {const_cast<char*>("\n"), 1}};
    writeToErrorStream(parts, 3);
  }

 private:
  const Level _lowest;
};

/// The way to the system's log daemon. That of the C library waits for a daemon that does not read, and has whoever
/// logs wait; here a line that is not taken at once is lost. Any thread.
class LogDaemonSocket {
 public:
  explicit LogDaemonSocket(std::string_view path) {
    _address.sun_family = AF_UNIX;
    path.copy(_address.sun_path, sizeof(_address.sun_path) - 1);
  }

  void send(std::string_view datagram) {
    const int socket = descriptor();
    if (socket < 0 || trySending(socket, datagram)) return;
    // The first line, or the first one after the daemon was restarted.
    if (::connect(socket, reinterpret_cast<const sockaddr*>(&_address), sizeof(_address)) != 0) return;
    static_cast<void>(trySending(socket, datagram));
  }

 private:
  static bool trySending(int socket, std::string_view datagram) {
    return ::send(socket, datagram.data(), datagram.size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0;
  }

  int descriptor() {
    {
      Guard guard(_lock);
      if (_socket) return _socket.get();
    }
    FileDescriptor made(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    Guard guard(_lock);
    if (!_socket) _socket = std::move(made);
    return _socket.get();
  }

  // Constant after construction.
  sockaddr_un _address{};
  // Guarded by _lock. Made at first use, and kept: it is connected anew, never replaced.
  Lock _lock;
  FileDescriptor _socket VELK_GUARDED_BY(_lock);
};

/// "<PRIORITY>Mmm dd hh:mm:ss PROGRAM[PROCESS]: ", as log daemons know it from everybody else: the months are English
/// in every locale, the time is local.
std::string headerOfLine() {
  static constexpr std::array kMonths{"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                      "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  const std::tm now = localTime(static_cast<std::time_t>(systemClock().wallTime().seconds));
  std::array<char, 96> time;
  std::snprintf(time.data(), time.size(), "<%d>%s %2d %02d:%02d:%02d ", LOG_USER | LOG_ERR,
                kMonths[static_cast<std::size_t>(now.tm_mon)], now.tm_mday, now.tm_hour, now.tm_min, now.tm_sec);
  return time.data() + std::string(program_invocation_short_name) + "[" + std::to_string(::getpid()) + "]: ";
}

/// Errors alone, and not many: the host's log is not ours.
class HostLogSink final : public Sink {
 public:
  explicit HostLogSink(std::string_view path) : _socket(path) {}

  void write(Level level, std::string_view line) override {
    if (level != Level::error || !mayWrite()) return;
    _socket.send(headerOfLine().append(kPrefix).append(line));
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

  // Self-synchronised.
  LogDaemonSocket _socket;
  // Guarded by _lock.
  Lock _lock;
  SteadyTime _minute VELK_GUARDED_BY(_lock);
  unsigned _written VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace

std::shared_ptr<Sink> makeLibrarySink() { return makeLibrarySink(_PATH_LOG); }

std::shared_ptr<Sink> makeLibrarySink(std::string_view logDaemonPath) {
  const auto setting = currentSetting();
  if (setting.silent) return nullptr;
  if (setting.toErrorStream) return std::make_shared<ErrorStreamSink>(*setting.toErrorStream);
  return std::make_shared<HostLogSink>(logDaemonPath);
}

Level librarySinkLevel() { return currentSetting().toErrorStream.value_or(Level::error); }

}  // namespace velk::log
