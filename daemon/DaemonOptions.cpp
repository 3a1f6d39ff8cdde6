#include "daemon/DaemonOptions.h"

#include <CLI/CLI.hpp>
#include <map>

namespace velk {

namespace {

constexpr const char* kVersion = "velkreportingd " VELK_VERSION;
constexpr long kLongestIdleSeconds = 365L * 24 * 3600;

}  // namespace

std::variant<DaemonOptions, int> parseDaemonOptions(int argumentCount, const char* const* arguments) {
  DaemonOptions options;
  long idleExit = 0;
  const std::map<std::string, log::Level> levels{
      {"debug", log::Level::debug}, {"default", log::Level::standard}, {"error", log::Level::error}};

  CLI::App app(
      "Takes the events that the processes of this machine report, and delivers them as the signed "
      "configuration of their kind demands.");
  app.name("velkreportingd");
  app.set_version_flag("--version", kVersion);
  app.add_option("--socket", options.socketPath,
                 "Listen on this socket (default: com.tavrin.velkreportingd in the runtime directory)")
      ->envname("VELKREPORTING_SOCKET")
      ->type_name("PATH");
  const auto* idleOption =
      app.add_option("--idle-exit", idleExit,
                     "Exit after this long without sessions and connections; 0 never does (default: 30 when started "
                     "by the service manager for a socket, else never)")
          ->check(CLI::Range(0L, kLongestIdleSeconds))
          ->type_name("SECONDS");
  app.add_option("--log-level", options.logLevel, "debug, default or error")
      ->transform(CLI::CheckedTransformer(levels, CLI::ignore_case))
      ->type_name("LEVEL");
  app.add_flag("--foreground", options.foreground, "Log to the standard error stream, whoever started the daemon");
  try {
    app.parse(argumentCount, arguments);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? kExitOk : kExitUsage;
  }
  if (idleOption->count() > 0) options.idleExitSeconds = idleExit;
  return options;
}

}  // namespace velk
