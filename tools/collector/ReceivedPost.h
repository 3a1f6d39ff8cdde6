// One event post as the daemon sends it: read from bytes that anybody may have sent.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::collector {

/// What a post may cost. A post above a bound is refused whole.
struct PostBounds {
  /// As it comes over the wire.
  std::size_t wireBytes = std::size_t{16} * 1024 * 1024;
  /// Unpacked: a batch of 51 events of ordinary size is some tens of kilobytes.
  std::size_t bodyBytes = std::size_t{32} * 1024 * 1024;
};

using HeaderList = std::vector<std::pair<std::string, std::string>>;

/// The first value under `name` (in any case), or null.
[[nodiscard]] const std::string* headerValue(const HeaderList& headers, std::string_view name);

/// The fields of an event that have columns of their own. Filters may have removed or hashed any of them.
struct EventFields {
  std::optional<std::int64_t> method;
  std::optional<std::int64_t> status;
  std::optional<std::int64_t> eventNumber;
  std::optional<std::string> sender;
  std::optional<std::string> session;
};
[[nodiscard]] EventFields eventFields(const PropertyDictionary& event);

struct ReceivedPost {
  double postTime = 0;
  std::string clientId;
  std::vector<PropertyDictionary> events;
  std::size_t wireBytes = 0;
  std::size_t bodyBytes = 0;
};

/// The JSON text of a post: unpacked when `headers` say that it is gzip. The error is a sentence for the sender.
[[nodiscard]] Result<std::string> plainBody(std::string_view wire, const HeaderList& headers, const PostBounds& bounds);

/// Reads the JSON text: an object with "postTime" (a number), "clientId" (a string) and "events" (an array of
/// objects). The sizes are left to the caller.
[[nodiscard]] Result<ReceivedPost> readPost(std::string_view json);

/// How many events the JSON text holds, by a walk that builds nothing. For counting at full speed: it trusts that
/// the text is JSON, and never reads beyond it if it is not.
[[nodiscard]] std::size_t countEvents(std::string_view json);

}  // namespace velk::collector
