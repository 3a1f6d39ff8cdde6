#include "platform/NativeThread.h"

#include <pthread.h>
#include <signal.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <system_error>
#include <utility>

namespace velk {
namespace {

/// Blocks signals for a scope: a new thread inherits the mask of its maker.
class BlockedSignals {
 public:
  BlockedSignals() noexcept {
    sigset_t blocked;
    sigfillset(&blocked);
    for (const int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGABRT, SIGSYS}) {
      sigdelset(&blocked, fault);
    }
    pthread_sigmask(SIG_BLOCK, &blocked, &_former);
  }
  ~BlockedSignals() { pthread_sigmask(SIG_SETMASK, &_former, nullptr); }
  BlockedSignals(const BlockedSignals&) = delete;
  BlockedSignals& operator=(const BlockedSignals&) = delete;

 private:
  sigset_t _former;
};

}  // namespace

Result<std::thread> startThread(std::string_view name, UniqueFunction<void()> body) {
  BlockedSignals blocked;
  try {
    return std::thread([name = std::string(name), body = std::move(body)]() mutable {
      setCurrentThreadName(name);
      body();
    });
  } catch (const std::system_error& error) {
    return failure("posix", error.code().value(), error.what());
  }
}

void setCurrentThreadName(std::string_view name) noexcept {
  char text[16] = {};
  std::memcpy(text, name.data(), std::min(name.size(), sizeof text - 1));
  pthread_setname_np(pthread_self(), text);
}

}  // namespace velk
