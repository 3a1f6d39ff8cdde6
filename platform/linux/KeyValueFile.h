// Files of `KEY=value` lines, as the system keeps them in /etc. Private to platform/linux/.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <string_view>

namespace velk {

using KeyValues = std::map<std::string, std::string, std::less<>>;

/// Lines without "=" and lines that begin with "#" are passed over; quotes around a value are removed, and what
/// backslashes escape within double quotes is unescaped. The last line of a key counts.
[[nodiscard]] KeyValues parseKeyValues(std::string_view text);
/// The same from a file; empty when it cannot be read (or is longer than 64 KiB).
[[nodiscard]] KeyValues readKeyValueFile(const std::string& path);

/// `text` without blanks at both ends.
[[nodiscard]] std::string_view trimmed(std::string_view text);

}  // namespace velk
