// gzip and zlib compression of whole bodies, for event posts and file uploads. Re-entrant: each call has a stream of
// its own. Failures are logged here and yield nothing.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace velk {

/// The compressed form, with a gzip header and trailer or with zlib's. Empty input yields nothing.
[[nodiscard]] std::optional<std::string> compressDataWithZlibOrGzip(bool gzip, std::span<const std::uint8_t> data);

[[nodiscard]] std::optional<std::string> gzipDeflate(std::span<const std::uint8_t> data);
[[nodiscard]] std::optional<std::string> gzipDeflate(std::string_view data);

/// What log lines call a result of setting a stream up, and the final result of compressing. The first table knows
/// fewer codes than the second.
[[nodiscard]] const char* deflateSetupErrorText(int result) noexcept;
[[nodiscard]] const char* deflateErrorText(int result) noexcept;

}  // namespace velk
