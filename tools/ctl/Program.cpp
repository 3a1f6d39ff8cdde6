#include "tools/ctl/Program.h"

#include <CLI/CLI.hpp>
#include <algorithm>

#include "tools/CommandLine.h"
#include "tools/ctl/Commands.h"

namespace velk::ctl {

using tools::ExitCode;

ExitCode run(std::vector<std::string> arguments, std::ostream& out, std::ostream& error) {
  Context context{out, error};
  CLI::App app("Talks to the reporting daemon, and makes what it needs.", "velkreportingctl");
  app.require_subcommand(1);
  app.fallthrough();
  app.add_flag("--json", context.json, "Print results as JSON");
  addStatusCommand(app, context);
  addSendCommand(app, context);
  addSessionCommand(app, context);
  addDefaultsCommand(app, context);
  addConsentCommand(app, context);
  addStorebagCommands(app, context);

  const bool json = tools::asksForJson(arguments);
  std::reverse(arguments.begin(), arguments.end());
  try {
    app.parse(std::move(arguments));
  } catch (const CLI::ParseError& problem) {
    return tools::finishParsing(app, problem, json, out, error);
  }
  return context.exitCode;
}

}  // namespace velk::ctl
