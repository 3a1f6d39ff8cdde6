// Unpacking of gzip bodies from strangers: bounded, and strict about what follows.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "foundation/Error.h"

namespace velk::collector {

/// The contents of one gzip member (RFC 1952), checked against its checksum. Fails on anything else, on bytes after
/// the member, and as soon as the contents would grow beyond `maximumBytes`: a bomb costs no more memory than that.
[[nodiscard]] Result<std::string> unpackGzip(std::string_view packed, std::size_t maximumBytes);

}  // namespace velk::collector
