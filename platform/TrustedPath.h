// Who could have put a file where it is: asked before a file's contents become part of this process.
#pragma once

#include <string>

#include "foundation/Error.h"

namespace velk {

/// The path of a regular file with all links resolved, when the file and every directory on the way to it belong to
/// root or to this process's user and nobody else may write them. A directory that everybody may write is fine when it
/// is sticky: nobody can take the place of somebody else's entry there. The error says what is wrong with which path.
/// The answer stays true for as long as root and this user leave the path alone. Blocks for file work. Any thread.
[[nodiscard]] Result<std::string> trustedPath(const std::string& path);

}  // namespace velk
