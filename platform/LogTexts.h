// The fixed log texts of platform/.
#pragma once

namespace velk::logtexts {

inline constexpr const char* kPersistentIdentifierForDNU = "getPersistentIdentifierForDNU: The value for %s: %s";
inline constexpr const char* kRegeneratedPersistentIdentifierForDNU =
    "regeneratePersistentIdentifierForDNU: Set new value for %s: %s";

}  // namespace velk::logtexts
