// The storebags in memory: one entry per storebag name, with the rule when a name is fetched again. Part of the agent,
// whose lock guards every call - a cold fetch included, so that one name is fetched once and not once per session.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"
#include "platform/Clock.h"

namespace velk {

class ReportingdSession;
class StorebagService;

/// A name whose last fetch failed is attempted again after this long.
inline constexpr std::int32_t kStorebagRetrySeconds = 900;

class StorebagMemoryCache {
 public:
  /// Both outlive it.
  StorebagMemoryCache(StorebagService& service, const Clock& clock) : _service(service), _clock(clock) {}

  /// The section of the session's client type, or nothing. May fetch, and then blocks as the service does.
  [[nodiscard]] std::optional<PropertyDictionary> storebagForSession(const ReportingdSession& session);
  /// Never fetches.
  [[nodiscard]] std::optional<std::string> storebagVersionForSession(const ReportingdSession& session) const;

  /// Every entry is fetched again when it is next asked for; until that succeeds the old section is served.
  void expireAll();

  [[nodiscard]] std::size_t size() const { return _entries.size(); }
  /// The entries by storebag name, for health reports.
  [[nodiscard]] PropertyDictionary snapshot() const;
  /// Name, version, age and state of each entry.
  [[nodiscard]] PropertyArray status() const;

 private:
  struct Entry {
    std::optional<PropertyDictionary> data;
    std::optional<std::string> version;
    TimeValue fetchTime;
    /// Of the file on disk that the last fetch has seen.
    std::optional<TimeValue> copyDate;
    bool fetchSucceeded = false;
    std::int32_t maxAge = 0;
    bool expired = false;
  };

  [[nodiscard]] bool mustFetch(const std::string& name, const Entry& entry, std::int32_t clientType) const;
  [[nodiscard]] double ageInSeconds(const Entry& entry) const;
  void fetchAndCacheStorebag(std::int32_t clientType);

  StorebagService& _service;
  const Clock& _clock;
  std::map<std::string, Entry, std::less<>> _entries;
};

}  // namespace velk
