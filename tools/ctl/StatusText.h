// The daemon's status in words: as tables, or as the trees that its sessions form. Nothing in it can steer a terminal,
// whatever clients call themselves.
#pragma once

#include <string>

#include "foundation/PropertyValue.h"

namespace velk::ctl {

/// Everything but the finer points, which JSON has. Without a line's end. A daemon of another version may leave things
/// out or tell them in another form: what cannot be read stands as "-".
[[nodiscard]] std::string statusText(const PropertyDictionary& status);

/// The hierarchies: under each token its sessions, deeper levels further to the right. The first session of a level is
/// the parent of all sessions of the next one, which stand below it. Missing levels are told.
[[nodiscard]] std::string statusTree(const PropertyDictionary& status);

/// "Media / Calls", "client 7 / -" and the like: how a session's row names its client and service.
[[nodiscard]] std::string clientText(const PropertyDictionary& session);
/// "splunk enabled (12 events, 4.1 KiB), quill disabled".
[[nodiscard]] std::string backendsText(const PropertyDictionary& session);
/// What else there is to say: "aggregates, finished".
[[nodiscard]] std::string notesText(const PropertyDictionary& session);
/// The text or number under that key; nothing when there is neither.
[[nodiscard]] std::string plainText(const PropertyDictionary& dictionary, std::string_view key);
/// "  (3 more are not shown)" when the count says more than the list holds; nothing otherwise.
[[nodiscard]] std::string omissionText(const PropertyDictionary& status, std::string_view count, std::string_view list);

}  // namespace velk::ctl
