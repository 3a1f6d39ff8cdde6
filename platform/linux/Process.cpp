#include "platform/Process.h"

#include <malloc.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "platform/LogSinks.h"

namespace velk::process {
namespace {

constexpr int kUtilityNice = 5;
// Beyond this, code of libraries that goes through all descriptors a process might have takes noticeable time.
constexpr rlim_t kUsefulDescriptors = 65'536;
// linux/ioprio.h is not part of every distribution's headers.
constexpr int kIoPriorityOfProcess = 1;
constexpr int kIoPriorityClassShift = 13;
constexpr int kIoPriorityBestEffort = 2;
constexpr int kLowestIoPriority = 7;

Failure systemFailure(const char* what) {
  return failure("Process", errno, std::string(what) + ": " + std::strerror(errno));
}

}  // namespace

void dropFromEnvironment(const char* variable) { ::unsetenv(variable); }

void restrictNewFiles() { ::umask(077); }

void raiseDescriptorLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  // Infinity is the largest number of all.
  limit.rlim_cur = std::max(limit.rlim_cur, std::min(limit.rlim_max, kUsefulDescriptors));
  static_cast<void>(::setrlimit(RLIMIT_NOFILE, &limit));
}

void limitHeaps() { ::mallopt(M_ARENA_MAX, 2); }

void returnFreeMemory() { ::malloc_trim(0); }

void endNow(int status) {
  log::flushSystemLog();
  ::_exit(status);
}

void setUtilityPriority() {
  static_cast<void>(::setpriority(PRIO_PROCESS, 0, kUtilityNice));
  static_cast<void>(::syscall(SYS_ioprio_set, kIoPriorityOfProcess, 0,
                              (kIoPriorityBestEffort << kIoPriorityClassShift) | kLowestIoPriority));
}

Result<std::unique_ptr<RunLoop>> RunLoop::make() {
  std::signal(SIGPIPE, SIG_IGN);
  sigset_t handled;
  ::sigemptyset(&handled);
  for (const int number : {SIGHUP, SIGTERM, SIGINT}) ::sigaddset(&handled, number);
  if (const int error = ::pthread_sigmask(SIG_BLOCK, &handled, nullptr); error != 0) {
    errno = error;
    return systemFailure("cannot block signals");
  }
  FileDescriptor signals(::signalfd(-1, &handled, SFD_CLOEXEC | SFD_NONBLOCK));
  if (!signals) return systemFailure("cannot receive signals");
  FileDescriptor wakeUps(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wakeUps) return systemFailure("cannot make an event descriptor");
  return std::unique_ptr<RunLoop>(new RunLoop(std::move(signals), std::move(wakeUps)));
}

RunLoop::Event RunLoop::wait() {
  for (;;) {
    pollfd sources[] = {{_signals.get(), POLLIN, 0}, {_wakeUps.get(), POLLIN, 0}};
    static_cast<void>(::poll(sources, 2, -1));
    signalfd_siginfo received{};
    if (::read(_signals.get(), &received, sizeof(received)) == sizeof(received)) {
      return received.ssi_signo == SIGHUP ? Event::reload : Event::stop;
    }
    std::uint64_t count = 0;
    if (::read(_wakeUps.get(), &count, sizeof(count)) == sizeof(count)) return Event::wakeUp;
  }
}

void RunLoop::letInterruptEndTheProcess() noexcept {
  std::signal(SIGINT, SIG_DFL);
  sigset_t interrupt;
  ::sigemptyset(&interrupt);
  ::sigaddset(&interrupt, SIGINT);
  ::pthread_sigmask(SIG_UNBLOCK, &interrupt, nullptr);
}

void RunLoop::wakeUp() noexcept {
  const std::uint64_t one = 1;
  // It fails only when the counter is full, and then the loop is about to look anyway.
  static_cast<void>(!::write(_wakeUps.get(), &one, sizeof(one)));
}

}  // namespace velk::process
