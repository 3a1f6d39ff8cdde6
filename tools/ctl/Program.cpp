#include "tools/ctl/Program.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <memory>
#include <string_view>

#include "platform/Lock.h"
#include "platform/Log.h"
#include "tools/CommandLine.h"
#include "tools/ctl/Commands.h"

namespace velk::ctl {

using tools::ExitCode;

namespace {

/// What goes wrong beneath a command without ending it, for whoever ran it: files set aside, settings ignored.
class WarningSink final : public log::Sink {
 public:
  explicit WarningSink(Context& context) : _context(context) {}
  void write(log::Level, std::string_view line) override {
    Guard guard(_lock);
    if (!_isOver) _context.warn(std::string(line));
  }
  /// Lines in flight on other threads may come later than the context's end.
  void end() {
    Guard guard(_lock);
    _isOver = true;
  }

 private:
  Context& _context;
  Lock _lock;
  bool _isOver VELK_GUARDED_BY(_lock) = false;
};

/// The process's log for as long as a command runs.
class WarningScope {
 public:
  explicit WarningScope(Context& context) : _sink(std::make_shared<WarningSink>(context)) {
    log::setSink(_sink, log::Level::error);
  }
  ~WarningScope() {
    log::setSink(nullptr);
    _sink->end();
  }
  WarningScope(const WarningScope&) = delete;
  WarningScope& operator=(const WarningScope&) = delete;

 private:
  const std::shared_ptr<WarningSink> _sink;
};

}  // namespace

ExitCode run(std::vector<std::string> arguments, std::ostream& out, std::ostream& error) {
  Context context(out, error);
  const WarningScope warnings(context);
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
