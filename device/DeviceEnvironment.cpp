#include "device/DeviceEnvironment.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "device/ComponentTable.h"
#include "device/LogTexts.h"
#include "ipc/Vocabulary.h"
#include "platform/DeviceInformation.h"
#include "platform/Log.h"
#include "platform/UserDefaults.h"
#include "unicode/CaseFolding.h"

namespace velk {
namespace {

constexpr std::string_view kEnvironmentTypeSetting = "environmentType";
constexpr std::string_view kInternalRelease = "Internal";
constexpr const char* kUnknownFrameworkVersion = "8.0";
/// The library refuses client types below this one, and health reports know them by no name.
constexpr std::int32_t kFirstClientTypeOfLibrary = 5;

}  // namespace

DeviceEnvironment::DeviceEnvironment(const UserDefaults& defaults, const DeviceInformation& device,
                                     std::optional<std::string> frameworkVersion)
    : _defaults(defaults), _device(device), _frameworkVersion(std::move(frameworkVersion)) {}

std::uint32_t DeviceEnvironment::userDefaultsEnvironment() const {
  std::uint32_t type = kEnvironmentNone;
  if (const auto setting = _defaults.value(kEnvironmentTypeSetting)) {
    type = uint32Value(&*setting);
    if (type > kEnvironmentRelease) {
      log::error(logtexts::kInvalidEnvironmentType, type);
      type = kEnvironmentInternal;
    }
  } else {
    // Devices in the field follow the seed section unless they are told otherwise.
    type = isInternalBuild() ? kEnvironmentInternal : kEnvironmentSeed;
  }
  log::standard(logtexts::kEnvironmentType, type);
  return type;
}

bool DeviceEnvironment::isInternalBuild() const {
  std::call_once(_internalBuildAsked, [this] { _isInternalBuild = _device.answer("ReleaseType") == kInternalRelease; });
  return _isInternalBuild;
}

std::optional<std::string> DeviceEnvironment::productVersion() const { return _device.answer("ProductVersion"); }
std::optional<std::string> DeviceEnvironment::buildVersion() const { return _device.answer("BuildVersion"); }
std::optional<std::string> DeviceEnvironment::productType() const { return _device.answer("ProductType"); }
std::optional<std::string> DeviceEnvironment::deviceName() const { return _device.answer("DeviceName"); }
std::optional<std::string> DeviceEnvironment::hardwareModel() const { return _device.answer("HWModelStr"); }
std::optional<std::string> DeviceEnvironment::serialNumber() const { return _device.answer("SerialNumber"); }

void DeviceEnvironment::uniqueDeviceIdentifier(std::span<char> buffer) const {
  const auto identifier = _device.answer("UniqueDeviceID");
  if (!identifier || identifier->size() >= buffer.size()) return;
  std::memcpy(buffer.data(), identifier->c_str(), identifier->size() + 1);
  buffer.back() = '\0';
}

std::string DeviceEnvironment::frameworkVersion() const {
  return _frameworkVersion && !_frameworkVersion->empty() ? *_frameworkVersion : kUnknownFrameworkVersion;
}

std::optional<std::string_view> environmentSectionName(std::uint32_t environmentType) noexcept {
  switch (environmentType) {
    case kEnvironmentDevelopment:
      return "development";
    case kEnvironmentInternal:
      return "tavrin_internal";
    case kEnvironmentSeed:
      return "seed";
    case kEnvironmentRelease:
      return "release";
    default:
      return std::nullopt;
  }
}

std::string userInfoIdentifierString(const PropertyDictionary& userInfo) {
  const auto name = [&](std::string_view key) {
    const auto* text = userInfo.string(key);
    return text != nullptr ? lowerCasedText(*text) : std::string();
  };
  return name(kVelkReportingUserInfoClientName) + ":" + name(kVelkReportingUserInfoServiceName);
}

Error errorObject(std::string message, int code) {
  return Error{std::string(kVelkReportingErrorDomain), code, std::move(message)};
}

double finiteOrMinusOne(double value) noexcept { return std::isfinite(value) ? value : -1.0; }

std::string_view componentShortCode(std::int32_t clientType) noexcept {
  if (clientType < 0 || static_cast<std::size_t>(clientType) >= kComponentShortCodes.size()) return kUnknownComponent;
  return kComponentShortCodes[static_cast<std::size_t>(clientType)];
}

std::string_view healthShortCode(std::int32_t clientType) noexcept {
  return clientType >= kFirstClientTypeOfLibrary ? componentShortCode(clientType) : kUnknownComponent;
}

}  // namespace velk
