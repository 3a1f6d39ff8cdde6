#include <cstdio>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "daemon/DaemonOptions.h"
#include "daemon/DaemonProcess.h"
#include "daemon/LogTexts.h"
#include "platform/Launch.h"
#include "platform/Log.h"
#include "platform/LogSinks.h"
#include "platform/Process.h"

namespace {

using namespace velk;
using process::RunLoop;

int fail(const Error& error, int status) {
  log::error("velkreportingd: %@", error);
  return status;
}

/// Until a signal ends it, or nobody has needed the daemon for a while.
void runMainLoop(DaemonProcess& daemon, RunLoop& runLoop) {
  for (;;) {
    switch (runLoop.wait()) {
      case RunLoop::Event::reload:
        daemon.reload();
        break;
      case RunLoop::Event::stop:
        log::standard("main: Asked to stop.");
        return;
      case RunLoop::Event::wakeUp:
        if (!daemon.stopsListeningIfIdle()) break;
        log::standard("main: Nobody needs the daemon any more.");
        return;
    }
  }
}

int runDaemon(const DaemonOptions& options) {
  const auto runLoop = RunLoop::make();
  if (!runLoop) return fail(runLoop.error(), kExitOsError);
  process::setUtilityPriority();
  log::standard(daemontexts::kStartLogging);
  ReportingSessionConnectivityHelper::cleanupStorageRootFolder();
  auto daemon = DaemonProcess::make(options, **runLoop);
  if (!daemon) return fail(daemon.error(), daemon.error().code);
  if (const auto resumed = (*daemon)->resume(); !resumed) {
    (*daemon)->stop();
    return fail(resumed.error(), resumed.error().code);
  }
  log::standard(daemontexts::kListenerResumes);
  launch::notifyReady("listening");
  runMainLoop(**daemon, **runLoop);
  launch::notifyStopping();
  (*runLoop)->letInterruptEndTheProcess();
  (*daemon)->stop();
  return kExitOk;
}

}  // namespace

int main(int argumentCount, char** arguments) {
  // Variables that make the TLS library write keys to a file or load a configuration of somebody's choice.
  velk::process::dropFromEnvironment("SSLKEYLOGFILE");
  velk::process::dropFromEnvironment("OPENSSL_CONF");
  velk::process::restrictNewFiles();
  velk::process::limitHeaps();
  velk::process::raiseDescriptorLimit();
  const auto parsed = velk::parseDaemonOptions(argumentCount, arguments);
  if (const auto* status = std::get_if<int>(&parsed)) return *status;
  const auto& options = std::get<velk::DaemonOptions>(parsed);
  velk::log::setSink(velk::log::makeSystemLogSink("velkreportingd", options.foreground), options.logLevel);
  velk::log::flushSystemLogOnFatalSignals();
  const int status = runDaemon(options);
  velk::log::flushSystemLog();
  return status;
}
