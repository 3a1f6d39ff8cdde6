// What the daemon last said about a session's backends and event categories, for the tests made on each send.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/Lock.h"

namespace velk {

/// One answer of the daemon. Immutable: it is replaced whole.
class EventLists {
 public:
  EventLists() = default;
  EventLists(const std::optional<PropertyArray>& enabledBackends, const std::optional<PropertyArray>& whitelist,
             const std::optional<PropertyArray>& blacklist);

  /// An empty list, and none, let everything pass.
  [[nodiscard]] bool isWhitelisted(std::uint16_t category) const;
  [[nodiscard]] bool isBlacklisted(std::uint16_t category) const;
  [[nodiscard]] const PropertyArray& enabledBackends() const { return _enabledBackends; }

 private:
  PropertyArray _enabledBackends;
  std::vector<std::int64_t> _whitelist;  // sorted
  std::vector<std::int64_t> _blacklist;  // sorted
};

/// The current lists: read on every sending thread, replaced on the reporting queue.
class CurrentEventLists {
 public:
  [[nodiscard]] std::shared_ptr<const EventLists> get() const {
    Guard guard(_lock);
    return _lists;
  }
  void replace(std::shared_ptr<const EventLists> lists) {
    Guard guard(_lock);
    _lists.swap(lists);
  }

 private:
  mutable Lock _lock;
  std::shared_ptr<const EventLists> _lists VELK_GUARDED_BY(_lock) = std::make_shared<const EventLists>();
};

}  // namespace velk
