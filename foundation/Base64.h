// Base64 in the standard alphabet with padding (RFC 4648, section 4).
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "foundation/PropertyValue.h"

namespace velk {

/// One line, padded.
[[nodiscard]] std::string base64Encoded(std::span<const std::uint8_t> bytes);

/// Decodes while ignoring characters outside the alphabet (line breaks, blanks). Nothing when the digits that are
/// left do not form whole bytes.
[[nodiscard]] std::optional<ByteData> base64Decoded(std::string_view text);

}  // namespace velk
