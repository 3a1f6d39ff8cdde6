// What a command of velkreportingctl works with: where it reads and writes, and how it ends.
#pragma once

#include <iosfwd>
#include <string>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "platform/Lock.h"
#include "tools/ExitCode.h"

namespace velk::ctl {

/// Lives as long as the run of the program; used by its main thread, except for `warn`.
struct Context {
  Context(std::ostream& outStream, std::ostream& errorStream) : out(outStream), _error(errorStream) {}

  std::ostream& out;
  /// Results as one JSON object instead of words.
  bool json = false;
  tools::ExitCode exitCode = tools::ExitCode::ok;

  /// The result of a command, in the form that was asked for. Words are printed with a line's end after them, unless
  /// they are empty.
  void report(const PropertyDictionary& object, const std::string& words);
  /// Why the command failed: a sentence on the error stream (an object with "error" when JSON was asked for).
  void fail(tools::ExitCode code, const std::string& sentence);
  /// What the user should know although the command goes on, in the same place (an object with "warning"). Any thread.
  void warn(const std::string& sentence);

 private:
  void writeProblem(const PropertyDictionary& object, const std::string& sentence);

  Lock _lock;
  std::ostream& _error VELK_GUARDED_BY(_lock);
};

/// The status for a file that could not be read.
[[nodiscard]] tools::ExitCode exitCodeForReading(const Error& error);
/// The status for a file that could not be written.
[[nodiscard]] tools::ExitCode exitCodeForWriting(const Error& error);

}  // namespace velk::ctl
