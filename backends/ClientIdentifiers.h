// The identifiers of their own that storebag entries ask for, one for each client and service, in the daemon's suite.
// Their names come from clients, so both a name's length and the number of identifiers have a bound: what lies beyond
// has an identifier that is kept nowhere and stays the same while the process runs. One a process, made with what
// backends are handed (`BackendContext`). Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <string>

#include "foundation/Uuid.h"
#include "platform/UserDefaults.h"

namespace velk {

class ClientIdentifiers {
 public:
  /// Bytes of a client's or a service's name.
  static constexpr std::size_t kMaximumNameBytes = 256;
  /// With the longest names they fill less than the suite may hold.
  static constexpr std::size_t kMaximumIdentifiers = 1024;

  /// The identifier under "uuid:<prefix>:<suffix>" (absent parts count as empty); a new random one is stored first when
  /// there is none. One error line reports the first identifier beyond each bound.
  [[nodiscard]] std::string getPersistentIdentifierForCustomClientIDSuffix(UserDefaults& defaults,
                                                                           const std::string* prefix,
                                                                           const std::string* suffix);

 private:
  [[nodiscard]] std::string identifierFor(UserDefaults& defaults, const std::string& key, bool isTooLong);
  [[nodiscard]] std::string passingIdentifier(const std::string& key) const;

  const std::string _secret = randomUuidText();
  std::atomic<bool> _hasToldOfLength{false};
  std::atomic<bool> _hasToldOfNumber{false};
};

}  // namespace velk
