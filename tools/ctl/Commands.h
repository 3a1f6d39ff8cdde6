// The commands of velkreportingctl. Each function describes its commands to the parser of the command line and says
// what runs when they are chosen; what it needs meanwhile lives as long as the parser.
#pragma once

#include <memory>

#include "tools/ctl/Context.h"

namespace CLI {
class App;
}

namespace velk::ctl {

void addStorebagCommands(CLI::App& app, Context& context);
void addDefaultsCommand(CLI::App& app, Context& context);
void addConsentCommand(CLI::App& app, Context& context);
void addSessionCommand(CLI::App& app, Context& context);
void addSendCommand(CLI::App& app, Context& context);
void addStatusCommand(CLI::App& app, Context& context);

}  // namespace velk::ctl
