// Dates as HTTP headers carry them (RFC 9110, IMF-fixdate): "Sun, 06 Nov 1994 08:49:37 GMT".
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace velk::collector {

[[nodiscard]] std::string httpDate(std::int64_t secondsSince1970);
/// Nothing for any other form; the name of the day is not checked.
[[nodiscard]] std::optional<std::int64_t> secondsFromHttpDate(std::string_view text);

}  // namespace velk::collector
