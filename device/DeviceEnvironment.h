// Facts about the device and the deployment, wherever the daemon needs them: which section of the storebags applies,
// whether this is an internal build, what the device is called. Any thread; almost nothing is kept.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"
#include "platform/Platform.h"

namespace velk {

enum EnvironmentType : std::uint32_t {
  kEnvironmentNone = 0,  ///< accepted, but names no section
  kEnvironmentDevelopment = 1,
  kEnvironmentInternal = 2,
  kEnvironmentSeed = 3,
  kEnvironmentRelease = 4,
};

class DeviceEnvironment {
 public:
  /// The arguments outlive it. `frameworkVersion`: the bundle version of the reporting framework, when it is known.
  DeviceEnvironment(const UserDefaults& defaults, const DeviceInformation& device,
                    std::optional<std::string> frameworkVersion = std::nullopt);

  /// The setting "environmentType", read afresh: 5 and above give 2 and an error line; absent gives 2 on internal
  /// builds and 3 on all others.
  [[nodiscard]] std::uint32_t userDefaultsEnvironment() const;

  /// The release type is exactly "Internal". Asked once per process object.
  [[nodiscard]] bool isInternalBuild() const;

  // Each asks the query service afresh.
  [[nodiscard]] std::optional<std::string> productVersion() const;
  [[nodiscard]] std::optional<std::string> buildVersion() const;
  [[nodiscard]] std::optional<std::string> productType() const;
  [[nodiscard]] std::optional<std::string> deviceName() const;
  [[nodiscard]] std::optional<std::string> hardwareModel() const;
  [[nodiscard]] std::optional<std::string> serialNumber() const;

  /// Fills the buffer with the unique device identifier; its last byte is 0 when the identifier fits. Without an
  /// answer the buffer stays as it is.
  void uniqueDeviceIdentifier(std::span<char> buffer) const;

  /// The framework's bundle version, "8.0" when it is not known.
  [[nodiscard]] std::string frameworkVersion() const;

 private:
  const UserDefaults& _defaults;
  const DeviceInformation& _device;
  const std::optional<std::string> _frameworkVersion;
  mutable std::once_flag _internalBuildAsked;
  mutable bool _isInternalBuild = false;
};

/// "development", "tavrin_internal", "seed", "release" for 1 to 4; nothing for anything else.
[[nodiscard]] std::optional<std::string_view> environmentSectionName(std::uint32_t environmentType) noexcept;

/// Lower-cased client name, ":", lower-cased service name; a missing name (or one that is not text) is empty.
[[nodiscard]] std::string userInfoIdentifierString(const PropertyDictionary& userInfo);

/// An error for clients, in the domain "VelkReportingErrorDomain".
[[nodiscard]] Error errorObject(std::string message, int code);

/// The value itself, or -1 for infinities and NaN, which no payload can hold.
[[nodiscard]] double finiteOrMinusOne(double value) noexcept;

/// The short code of a client type: the row of the component table (0 to 30), "Unknown" for any other type.
[[nodiscard]] std::string_view componentShortCode(std::int32_t clientType) noexcept;
/// The code that health reports count a client type under: types 5 to 30 by the same table, others "Unknown".
[[nodiscard]] std::string_view healthShortCode(std::int32_t clientType) noexcept;

}  // namespace velk
