// The backends of one session, as one immutable set: made from the storebag, then published whole. Any thread may
// read a set; the backends in it synchronise themselves. Lives as long as somebody looks at it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "backends/VelkReportingBackend.h"
#include "foundation/PropertyValue.h"
#include "session/SessionServices.h"

namespace velk {

class SessionBackends {
 public:
  /// What the name says of a backend's part in replies, read once.
  enum class Kind : std::uint8_t {
    other,
    post,       ///< equals "korrin" or contains "splunk": its text answers the client
    dashboard,  ///< equals "dashboard": its text answers when no other does
  };
  struct Entry {
    std::string name;
    std::shared_ptr<VelkReportingBackend> backend;
    Kind kind = Kind::other;
  };
  using const_iterator = std::vector<Entry>::const_iterator;

  /// In the storebag's order, which is the order of every walk. Names are unique.
  void append(std::string name, std::shared_ptr<VelkReportingBackend> backend);

  [[nodiscard]] const_iterator begin() const noexcept { return _entries.begin(); }
  [[nodiscard]] const_iterator end() const noexcept { return _entries.end(); }
  [[nodiscard]] std::size_t size() const noexcept { return _entries.size(); }
  [[nodiscard]] bool empty() const noexcept { return _entries.empty(); }
  /// Null when there is none of that name.
  [[nodiscard]] VelkReportingBackend* find(std::string_view name) const noexcept;

 private:
  std::vector<Entry> _entries;
};

/// A set of new backends with all that a session gives them at creation, possibly empty. Null (and an error line)
/// without storebag or session info.
[[nodiscard]] std::shared_ptr<const SessionBackends> createBackends(const PropertyDictionary* storebag,
                                                                    const PropertyDictionary* sessionInfo,
                                                                    const std::optional<PropertyDictionary>& userInfo,
                                                                    const std::string& deviceIdentifier,
                                                                    const SessionServices& services);

/// "RequireUserDict" of a session info: true when it is absent.
[[nodiscard]] bool requiresUserInfo(const PropertyDictionary& sessionInfo) noexcept;

/// The sum over the set; 0 for none. Waits for the backends' state queues.
[[nodiscard]] std::uint64_t batchedEventsSize(const SessionBackends* backends);

// The three arrays of a configuration reply; each may be absent.
/// The names of the backends in state 2; nothing without a set.
[[nodiscard]] std::optional<PropertyArray> fetchReportingStates(const SessionBackends* backends);
/// The union of the whitelists, in the order of first appearance; nothing (no restriction) as soon as an enabled
/// post backend has none, and for no set or an empty one.
[[nodiscard]] std::optional<PropertyArray> fetchWhitelistedEvents(const SessionBackends* backends);
/// What every post backend that has a blacklist refuses, in the order of the first of them.
[[nodiscard]] std::optional<PropertyArray> fetchBlacklistedEvents(const SessionBackends* backends);

}  // namespace velk
