#include "backends/ClientIdentifiers.h"

#include <algorithm>
#include <span>
#include <string_view>

#include "backends/LogTexts.h"
#include "platform/Cryptography.h"
#include "platform/Log.h"
#include "platform/PersistentIdentifier.h"

namespace velk {

namespace {

constexpr std::string_view kKeyPrefix = "uuid:";

std::size_t countStored(const UserDefaults& defaults) {
  const PropertyDictionary values = defaults.allValues();
  return static_cast<std::size_t>(
      std::count_if(values.begin(), values.end(), [](const auto& entry) { return entry.key.starts_with(kKeyPrefix); }));
}

std::string textOf(const std::string* part) { return part != nullptr ? *part : std::string(); }

}  // namespace

std::string ClientIdentifiers::getPersistentIdentifierForCustomClientIDSuffix(UserDefaults& defaults,
                                                                              const std::string* prefix,
                                                                              const std::string* suffix) {
  const std::string key = std::string(kKeyPrefix) + textOf(prefix) + ":" + textOf(suffix);
  const bool isTooLong = (prefix != nullptr && prefix->size() > kMaximumNameBytes) ||
                         (suffix != nullptr && suffix->size() > kMaximumNameBytes);
  std::string identifier = identifierFor(defaults, key, isTooLong);
  if (!isTooLong) log::standard(backend_texts::kPersistentIdentifierForCustomClientIDSuffix, key, identifier);
  return identifier;
}

std::string ClientIdentifiers::identifierFor(UserDefaults& defaults, const std::string& key, bool isTooLong) {
  if (isTooLong) {
    if (!_hasToldOfLength.exchange(true)) log::error(backend_texts::kIdentifierNameTooLong, kMaximumNameBytes);
    return passingIdentifier(key);
  }
  // Several threads may count the same and go a little beyond the bound together, which does no harm.
  if (!defaults.value(key) && countStored(defaults) >= kMaximumIdentifiers) {
    if (!_hasToldOfNumber.exchange(true)) log::error(backend_texts::kTooManyIdentifiers, kMaximumIdentifiers);
    return passingIdentifier(key);
  }
  return persistentIdentifier(defaults, key);
}

std::string ClientIdentifiers::passingIdentifier(const std::string& key) const {
  const std::string text = _secret + key;
  const auto digest = sha256(std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
  Uuid uuid{};
  std::copy_n(digest.begin(), uuid.size(), uuid.begin());
  // Version and variant of a random one.
  uuid[6] = static_cast<std::uint8_t>((uuid[6] & 0x0FU) | 0x40U);
  uuid[8] = static_cast<std::uint8_t>((uuid[8] & 0x3FU) | 0x80U);
  return uuidText(uuid);
}

}  // namespace velk
