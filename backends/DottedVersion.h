// A version of three numbers, as the daemon's own and as storebag entries ask for it.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <string_view>

namespace velk {

struct DottedVersion {
  std::uint8_t major = 0;
  std::uint8_t middle = 0;
  std::uint8_t minor = 0;

  auto operator<=>(const DottedVersion&) const = default;

  /// ".minor", or nothing when the minor number is 0: how versions end in events and in the user agent.
  [[nodiscard]] std::string minorSuffix() const;
  /// "8.0" or "8.1.2".
  [[nodiscard]] std::string reportVersion() const;
};

/// "major.middle.minor": each cut to its low 8 bits, missing ones 0, further ones ignored.
[[nodiscard]] DottedVersion parseDottedVersion(std::string_view text);

}  // namespace velk
