// A user-defaults suite: persistent settings under string keys, shared by the processes of one user.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// The suite that the daemon and the library use.
inline constexpr std::string_view kVelkReportingDefaultsSuite = "com.tavrin.velkreporting";

/// One suite. Any thread; every read sees what any process wrote last. Failures to write are returned; a file that
/// cannot be read is set aside and reported, and counts as empty. A write waits a second at most for one that another
/// process or thread has under way; after a wait in vain the writes of the next seconds fail at once.
class UserDefaults {
 public:
  virtual ~UserDefaults() = default;
  /// The user's value, else the administrator's default, else nothing.
  [[nodiscard]] virtual std::optional<PropertyValue> value(std::string_view key) const = 0;
  /// Everything under its effective value.
  [[nodiscard]] virtual PropertyDictionary allValues() const = 0;
  [[nodiscard]] virtual Result<void> set(std::string_view key, PropertyValue value) = 0;
  /// Removes the user's value; the administrator's default shows again.
  [[nodiscard]] virtual Result<void> remove(std::string_view key) = 0;
  /// Reads the value under `key` and stores `make()` when there is none, as one step among all processes.
  [[nodiscard]] virtual Result<PropertyValue> valueOrStore(std::string_view key,
                                                           const std::function<PropertyValue()>& make) = 0;
};

/// The suite in `<stateDirectory>/<suite>.json`, over read-only defaults in `<configurationDirectory>/<suite>.json`
/// (an empty path: none). Files 0600 in a directory 0700, replaced atomically under a lock file.
[[nodiscard]] std::unique_ptr<UserDefaults> openUserDefaults(std::string_view suite, std::string stateDirectory,
                                                             std::string configurationDirectory);

}  // namespace velk
