// The age of storebags, kept in the user-defaults suite between fetches: the server's max age and date, and the time
// at which a delayed pull is due. Used by the storebag service under the storebag lock.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "foundation/TimeValue.h"
#include "platform/HttpSession.h"
#include "platform/UserDefaults.h"

namespace velk {

/// The max age that counts when the server gives none, and the most that a storebag may ask for itself.
inline constexpr std::int32_t kDefaultStorebagMaxAge = 86400;

class StorebagMetrics {
 public:
  /// `defaults` outlives it.
  explicit StorebagMetrics(UserDefaults& defaults) : _defaults(defaults) {}

  /// The stored max age in seconds, 0 when none was ever stored.
  [[nodiscard]] std::int32_t maxAge(const std::string& name) const;

  /// Replaces `lastModified` by the stored value when there is one. True: the stored one equals the one passed, so
  /// the storebag in hand has been dealt with already.
  bool updateLastModified(const std::string& name, std::optional<std::string>& lastModified) const;

  /// From the headers of a successful answer.
  void save(const std::string& name, const HttpResponse& response);

  /// The rest of the delay before the storebag is pulled, in seconds; 0 when that time has passed. Nothing when no time
  /// is stored, or a time beyond any delay: the clock jumped, or the setting was edited.
  [[nodiscard]] std::optional<std::uint32_t> secondsUntilPullDue(const std::string& name, TimeValue now) const;
  void savePullDue(const std::string& name, TimeValue now, std::uint32_t delay);
  /// The pull has been made.
  void removePullDue(const std::string& name);

 private:
  UserDefaults& _defaults;
};

/// The seconds of a "Cache-Control" header's max-age; the default when the header is absent or gives none.
[[nodiscard]] std::int32_t maxAgeOfCacheControl(const std::string* cacheControl);

}  // namespace velk
