// The path that a file address names. The client's library opens it; for the daemon it is only a word.
#pragma once

#include <string>
#include <string_view>

namespace velk {

/// The path of a "file:/PATH" or "file://HOST/PATH" address, the scheme in whatever case, its host dropped and its
/// percent escapes resolved (but for a null byte, which stays escaped); empty for a host alone. Text that is no such
/// address is taken for a path as it is, "file:PATH" included: a relative path may begin so.
[[nodiscard]] std::string fileSystemPath(std::string_view url);

}  // namespace velk
