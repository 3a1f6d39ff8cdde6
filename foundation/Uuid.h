// Random identifiers (RFC 4122, version 4).
#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace velk {

using Uuid = std::array<std::uint8_t, 16>;

/// From the system's random numbers. Any thread.
[[nodiscard]] Uuid randomUuid();

/// The canonical form: 36 characters, upper-case hexadecimal with hyphens.
[[nodiscard]] std::string uuidText(const Uuid& uuid);
[[nodiscard]] inline std::string randomUuidText() { return uuidText(randomUuid()); }

}  // namespace velk
