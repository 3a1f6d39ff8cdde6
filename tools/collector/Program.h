// The collector as a program: puts the parts together, runs until it is told to stop, and takes them apart again.
#pragma once

#include <iosfwd>
#include <string>
#include <vector>

#include "tools/ExitCode.h"
#include "tools/StopSignals.h"

namespace velk::collector {

/// Blocks until `signals` says stop. Called once, from main.
[[nodiscard]] tools::ExitCode run(std::vector<std::string> arguments, std::ostream& out, std::ostream& error,
                                  tools::StopSignals& signals);

}  // namespace velk::collector
