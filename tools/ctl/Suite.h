// The user-defaults suite as the commands use it.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "foundation/PropertyValue.h"
#include "platform/UserDefaults.h"

namespace velk::ctl {

/// The daemon's suite as this user sees it, or the one in `directory` when that is not empty: then the
/// administrator's defaults beside the daemon's configuration do not show.
[[nodiscard]] std::unique_ptr<UserDefaults> openSuite(const std::string& directory);

/// A value from the command line: JSON, or the text itself when it is no JSON (a bare word is a string).
[[nodiscard]] PropertyValue valueFromArgument(std::string_view argument);
/// For people: a string as it is, everything else as indented JSON.
[[nodiscard]] std::string wordsOf(const PropertyValue& value);

}  // namespace velk::ctl
