// What the daemon does at its start with the directories that it writes into. Called by `DaemonProcess`, once, before
// it takes connections. Other processes may be writing there meanwhile.
#pragma once

#include <string>

#include "foundation/Error.h"

namespace velk {

/// Makes the directories, removes what an earlier daemon of the same user left half-written in them, and says in the
/// log where nothing can be kept: the daemon does its work without, and people learn why nothing is remembered. The
/// error: a directory is not there and cannot be made.
[[nodiscard]] Result<void> prepareWorkingDirectories(const std::string& state, const std::string& cache,
                                                     const std::string& storebags);

}  // namespace velk
