// Random identifiers that survive restarts, each under a key of a user-defaults suite. The daemon keeps its own in
// its suite and the library those of the calling user in that user's.
#pragma once

#include <string>
#include <string_view>

#include "platform/UserDefaults.h"

namespace velk {

/// The identifier stored under `key`; a new random UUID text is stored first when there is none. When it cannot be
/// stored, the failure is logged and the new one is returned all the same, again and again in this process, until it
/// can be stored.
[[nodiscard]] std::string persistentIdentifier(UserDefaults& defaults, std::string_view key);

/// For clients that respect the user's diagnostics-and-usage consent ("uuidRespectDNU") and for those that need not
/// ("uuidOverrideDNU"). The suite makes reading and storing one step.
[[nodiscard]] std::string getPersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent);
/// Replaces the identifier; the other one stays.
void regeneratePersistentIdentifierForDNU(UserDefaults& defaults, bool respectConsent);

}  // namespace velk
