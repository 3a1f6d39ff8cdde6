// What the tools say about a command line that they cannot use. Used by both programs' parsers.
#pragma once

#include <CLI/CLI.hpp>
#include <algorithm>
#include <ostream>
#include <string>
#include <vector>

#include "tools/ExitCode.h"
#include "tools/JsonLines.h"

namespace velk::tools {

/// Whether results are wanted as JSON, however little of the command line makes sense.
[[nodiscard]] inline bool asksForJson(const std::vector<std::string>& arguments) {
  return std::find(arguments.begin(), arguments.end(), "--json") != arguments.end();
}

/// Why a program ends: a sentence on the error stream, or for programs an object with "error" and "status".
inline ExitCode complain(std::ostream& error, const char* program, bool json, ExitCode code,
                         const std::string& sentence) {
  if (json) {
    error << jsonText({{"error", sentence}, {"status", status(code)}}) << std::endl;
  } else {
    error << program << ": " << sentence << std::endl;
  }
  return code;
}

/// Prints the help that was asked for, or what is wrong with the command line.
inline ExitCode finishParsing(CLI::App& app, const CLI::ParseError& problem, bool json, std::ostream& out,
                              std::ostream& error) {
  if (json && problem.get_exit_code() != 0) {
    return complain(error, app.get_name().c_str(), true, ExitCode::usage, problem.what());
  }
  if (app.exit(problem, out, error) != 0) return ExitCode::usage;
  out.flush();
  return out ? ExitCode::ok
             : complain(error, app.get_name().c_str(), json, ExitCode::ioError,
                        "the help could not be written to standard output");
}

}  // namespace velk::tools
