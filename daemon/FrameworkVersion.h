// The version of the reporting framework that is installed. Read once, when the daemon starts: it belongs to the
// program that runs, whatever is installed meanwhile.
#pragma once

#include <optional>
#include <string>

namespace velk {

/// The first line of `version` in the data directory. Nothing when there is no such file; nothing, and an error line,
/// when it holds no version: letters, digits, "." and "-", at most 32 of them.
[[nodiscard]] std::optional<std::string> installedFrameworkVersion(const std::string& dataDirectory);

}  // namespace velk
