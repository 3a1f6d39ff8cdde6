// A look at a shared object before the loader maps it. Private to platform/linux/.
#pragma once

#include <string>

#include "foundation/Error.h"

namespace velk {

/// An error unless the file is an ELF file of this machine's word size that holds all that its headers promise. The
/// loader believes the headers: a file that was cut short (a copy under way, a full disk) would end the process.
[[nodiscard]] Result<void> checkElfFile(const std::string& path);

}  // namespace velk
