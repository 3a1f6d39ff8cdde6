// Opening a file in order to hand it to another process.
#pragma once

#include <string>

#include "foundation/Error.h"
#include "platform/FileDescriptor.h"

namespace velk {

/// Opens for reading without following a link, without waiting (a FIFO) and without leaking into programs that are
/// started meanwhile. What cannot be opened so (a link, a socket) is handed over as a descriptor of its path alone, so
/// that the receiver sees what it is and says so. The error's code is the system's error number.
[[nodiscard]] Result<FileDescriptor> openToHandOver(const std::string& path);

}  // namespace velk
