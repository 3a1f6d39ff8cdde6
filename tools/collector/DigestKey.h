// The key that posts are signed with, and the check of a post's digest header.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::collector {

/// The key from the command line: hexadecimal digits (an even number of them), or the path of a file whose bytes
/// are the key. A file with such a name is given as ./NAME.
[[nodiscard]] Result<ByteData> digestKeyFromArgument(const std::string& argument);

/// Checks the "X-Velk-DIGEST" header: 40 lower-case hexadecimal digits, the HMAC-SHA1 of the JSON text under the
/// key. A missing header (null) fails as well, or leaving it out would be all that a forger needs.
[[nodiscard]] Result<void> checkDigest(const ByteData& key, std::string_view json, const std::string* header);

}  // namespace velk::collector
