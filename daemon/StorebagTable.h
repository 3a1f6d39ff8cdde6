// Deployment data of the storebag service: which storebag a client type uses, and where storebags come from when no
// setting says otherwise. The one place for both.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace velk {

/// The storebag of the conferencing client, the one for which a fallback is built in.
inline constexpr std::string_view kConferencingStorebagName = "sorrel";

/// Bases of the addresses that storebags are fetched from; "/<name>?version=<version>" is appended.
inline constexpr std::string_view kInternalStorebagServer =
    "https://storebags.internal.tavrin.example/storebags/vindle";
inline constexpr std::string_view kProductionStorebagServer = "https://storebags.tavrin.example/bags/vindle";

/// The storebag name of a client type: one for 5 to 30 (several types share one), nothing for any other.
[[nodiscard]] std::optional<std::string_view> storebagNameForClientType(std::int32_t clientType) noexcept;

}  // namespace velk
