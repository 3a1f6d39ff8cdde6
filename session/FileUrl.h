// The path that a client's file address names. Only for words: the daemon never opens it.
#pragma once

#include <string>
#include <string_view>

namespace velk {

/// The path of a "file:" address, its host dropped and its percent escapes resolved (but for a null byte, which
/// stays escaped). Text that is no such address is taken for a path as it is.
[[nodiscard]] std::string fileSystemPath(std::string_view url);

}  // namespace velk
