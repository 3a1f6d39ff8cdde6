// The path that a file address names, and the other way round. The client's library opens it; for the daemon it is only
// a word.
#pragma once

#include <string>
#include <string_view>

namespace velk {

/// The path of a "file:/PATH" or "file://HOST/PATH" address, the scheme in whatever case, its host dropped and its
/// percent escapes resolved (but for a null byte, which stays escaped); empty for a host alone. Text that is no such
/// address is taken for a path as it is, "file:PATH" included: a relative path may begin so.
[[nodiscard]] std::string fileSystemPath(std::string_view url);

/// The absolute address of a file. An address stays as it is, an absolute path becomes "file:///PATH" with percent
/// escapes; a relative path stays as well, since only its owner knows what it is relative to.
[[nodiscard]] std::string absoluteFileUrl(std::string_view urlOrPath);

}  // namespace velk
