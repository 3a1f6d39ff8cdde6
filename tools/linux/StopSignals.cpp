#include "tools/StopSignals.h"

#include <signal.h>
#include <unistd.h>

namespace velk::tools {
namespace {

sigset_t stopSignals() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  return signals;
}

}  // namespace

StopSignals::StopSignals() {
  const sigset_t signals = stopSignals();
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  ::signal(SIGPIPE, SIG_IGN);
}

void StopSignals::wait() {
  const sigset_t signals = stopSignals();
  int received = 0;
  while (sigwait(&signals, &received) != 0) {
  }
}

void StopSignals::wake() { ::kill(::getpid(), SIGTERM); }

}  // namespace velk::tools
