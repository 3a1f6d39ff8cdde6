#include "platform/PersistentIdentifier.h"

#include <map>
#include <optional>
#include <utility>

#include "foundation/Uuid.h"
#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/LogTexts.h"

namespace velk {
namespace {

/// Identifiers that could not be stored, so that a process whose suite cannot be written reports under one all the
/// same. Any thread; nothing blocks under its lock.
class Unstored {
 public:
  /// Keys may be made from what clients call themselves; identifiers beyond this many are new ones each time.
  static constexpr std::size_t kMaximum = 1024;

  [[nodiscard]] std::optional<std::string> find(const UserDefaults& suite, std::string_view key) const {
    Guard guard(_lock);
    const auto found = _identifiers.find(Key(&suite, key));
    return found != _identifiers.end() ? std::optional(found->second) : std::nullopt;
  }
  /// The one that is kept: another thread may have been quicker.
  [[nodiscard]] std::string keep(const UserDefaults& suite, std::string_view key, std::string identifier) {
    Guard guard(_lock);
    if (_identifiers.size() >= kMaximum && !_identifiers.contains(Key(&suite, key))) return identifier;
    return _identifiers.emplace(Key(&suite, key), std::move(identifier)).first->second;
  }
  void forget(const UserDefaults& suite, std::string_view key) {
    Guard guard(_lock);
    _identifiers.erase(Key(&suite, key));
  }

 private:
  using Key = std::pair<const UserDefaults*, std::string>;

  mutable Lock _lock;
  std::map<Key, std::string> _identifiers VELK_GUARDED_BY(_lock);
};

constinit PerProcess<Unstored> unstoredOfProcess;
Unstored& unstored() {
  return unstoredOfProcess.get([] { return new Unstored; });
}

std::string_view keyForDNU(bool respectConsent) { return respectConsent ? "uuidRespectDNU" : "uuidOverrideDNU"; }

void store(UserDefaults& defaults, std::string_view key, const std::string& identifier) {
  if (const auto stored = defaults.set(key, identifier); !stored) {
    log::error("persistentIdentifier: Cannot store %s: %s", key, stored.error());
  }
}

}  // namespace

std::string persistentIdentifier(UserDefaults& defaults, std::string_view key) {
  const auto kept = unstored().find(defaults, key);
  std::string made;
  const auto value = defaults.valueOrStore(key, [&] { return PropertyValue(made = kept ? *kept : randomUuidText()); });
  if (!value) {
    log::error("persistentIdentifier: Cannot store %s: %s", key, value.error());
    if (kept) return *kept;
    return unstored().keep(defaults, key, made.empty() ? randomUuidText() : made);
  }
  if (kept) unstored().forget(defaults, key);
  if (const auto* identifier = value->string()) return *identifier;
  // Something that is no identifier stands there.
  made = randomUuidText();
  store(defaults, key, made);
  return made;
}

std::string getPersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent) {
  const auto key = keyForDNU(respectConsent);
  const auto identifier = persistentIdentifier(defaults, key);
  log::standard(logtexts::kPersistentIdentifierForDNU, key, identifier);
  return identifier;
}

void regeneratePersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent) {
  const auto key = keyForDNU(respectConsent);
  const std::string identifier = randomUuidText();
  unstored().forget(defaults, key);
  store(defaults, key, identifier);
  log::standard(logtexts::kRegeneratedPersistentIdentifierForDNU, key, identifier);
}

}  // namespace velk
