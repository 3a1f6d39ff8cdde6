// The components that report, by client type: deployment data, kept here and nowhere else.
#pragma once

#include <array>
#include <string_view>

namespace velk {

/// The short codes of the client types 0 to 30: two to eight upper-case letters and digits each, all different. They
/// stand in events, in the sender header, in the datagrams of the dashboard and in the names of health counters, so
/// servers know them: a row may be added or taken over by another component, never reused for something else.
extern const std::array<std::string_view, 31> kComponentShortCodes;

/// What stands for a client type without a row.
inline constexpr std::string_view kUnknownComponent = "Unknown";

}  // namespace velk
