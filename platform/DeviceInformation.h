// The device-information query service and the locale.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace velk {

class UserDefaults;

/// Answers questions about the device: "ProductVersion", "BuildVersion", "ProductType", "DeviceName",
/// "HWModelStr", "SerialNumber", "UniqueDeviceID", "ReleaseType", and whatever else `device.conf` holds. Any thread.
class DeviceInformation {
 public:
  virtual ~DeviceInformation() = default;
  [[nodiscard]] virtual std::optional<std::string> answer(std::string_view key) const = 0;
};

/// `device.conf` of the configuration directory first, then os-release, DMI or device-tree, machine-id.
/// "DeviceName" always has an answer (model or family), which is never the host name. A `device.conf` that others can
/// write is refused with an error line. `root` stands before the system's own paths (tests have their own).
[[nodiscard]] std::unique_ptr<DeviceInformation> makeDeviceInformation(const std::string& configurationDirectory,
                                                                       const std::string& root = {});

/// The current locale and zone. Any thread.
class Locale {
 public:
  virtual ~Locale() = default;
  /// The upper-case region code, such as "US"; nothing when the locale names none.
  [[nodiscard]] virtual std::optional<std::string> countryCode() const = 0;
  /// The local zone's offset from GMT in seconds, at this moment.
  [[nodiscard]] virtual std::int32_t timeZoneOffset() const = 0;
  /// Whether the system sets its time zone by itself; nothing where nobody has said so.
  [[nodiscard]] virtual std::optional<bool> automaticTimeZoneEnabled() const = 0;
};

/// The suite of the time daemon, which says there whether it sets the zone by itself.
inline constexpr std::string_view kTimeDefaultsSuite = "com.tavrin.timed";

/// LC_ALL, LC_MESSAGES, LANG of the environment, else /etc/locale.conf (and /etc/default/locale); the zone by tzdata;
/// whether it is set automatically by "TMAutomaticTimeZoneEnabled" of `timeSuite` (null: no answer). `root` stands
/// before these paths (tests have their own).
[[nodiscard]] std::unique_ptr<Locale> makeLocale(std::unique_ptr<UserDefaults> timeSuite = nullptr,
                                                 const std::string& root = {});

}  // namespace velk
