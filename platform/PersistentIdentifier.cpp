#include "platform/PersistentIdentifier.h"

#include "foundation/Uuid.h"
#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/LogTexts.h"

namespace velk {
namespace {

// Held while the suite's file is read and written: the two operations that it serialises are rare, and the suite
// never calls back.
constinit PerProcess<Lock> identifierLocks;
Lock& identifierLock() {
  return identifierLocks.get([] { return new Lock; });
}

std::string_view keyForDNU(bool respectConsent) { return respectConsent ? "uuidRespectDNU" : "uuidOverrideDNU"; }

void store(UserDefaults& defaults, std::string_view key, const std::string& identifier) {
  if (const auto stored = defaults.set(key, identifier); !stored) {
    log::error("persistentIdentifier: Cannot store %s: %s", key, stored.error());
  }
}

}  // namespace

std::string persistentIdentifier(UserDefaults& defaults, std::string_view key) {
  std::string made;
  const auto value = defaults.valueOrStore(key, [&] { return PropertyValue(made = randomUuidText()); });
  if (!value) {
    log::error("persistentIdentifier: Cannot store %s: %s", key, value.error());
    return made.empty() ? randomUuidText() : made;
  }
  if (const auto* identifier = value->string()) return *identifier;
  // Something that is no identifier stands there.
  made = randomUuidText();
  store(defaults, key, made);
  return made;
}

std::string getPersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent) {
  const auto key = keyForDNU(respectConsent);
  std::string identifier;
  {
    Guard guard(identifierLock());
    identifier = persistentIdentifier(defaults, key);
  }
  log::standard(logtexts::kPersistentIdentifierForDNU, key, identifier);
  return identifier;
}

void regeneratePersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent) {
  const auto key = keyForDNU(respectConsent);
  const std::string identifier = randomUuidText();
  {
    Guard guard(identifierLock());
    store(defaults, key, identifier);
  }
  log::standard(logtexts::kRegeneratedPersistentIdentifierForDNU, key, identifier);
}

}  // namespace velk
