// The statuses that the tools end with, numbered as sysexits numbers them. Used by every command.
#pragma once

namespace velk::tools {

enum class ExitCode : int {
  ok = 0,
  usage = 64,          ///< the command line is wrong
  data = 65,           ///< what was read is not what it should be
  noInput = 66,        ///< a file is missing or cannot be read
  unavailable = 69,    ///< the daemon or a port cannot be had, or the connection ended
  software = 70,       ///< our own mistake
  cannotCreate = 73,   ///< a file cannot be written
  ioError = 74,        ///< reading or writing failed half-way
  noPermission = 77,   ///< not allowed
  configuration = 78,  ///< a setting or a file of the configuration is of no use
};

[[nodiscard]] constexpr int status(ExitCode code) noexcept { return static_cast<int>(code); }

}  // namespace velk::tools
