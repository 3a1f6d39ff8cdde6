// velkreportingctl as a function of its arguments and streams.
#pragma once

#include <iosfwd>
#include <string>
#include <vector>

#include "tools/ExitCode.h"

namespace velk::ctl {

/// Reads the command line (without the program's name), runs the command, answers the status to end with. `session`
/// reads the process's standard input. Called on the main thread.
[[nodiscard]] tools::ExitCode run(std::vector<std::string> arguments, std::ostream& out, std::ostream& error);

}  // namespace velk::ctl
