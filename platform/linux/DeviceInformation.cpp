#include "platform/DeviceInformation.h"

#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <climits>

#include "foundation/Text.h"
#include "platform/Cryptography.h"
#include "platform/Files.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/linux/KeyValueFile.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumFactBytes = 4096;
constexpr std::size_t kMaximumConfigurationBytes = 64 * 1024;
/// Makes the identifier one of this system alone: it cannot be told from the machine's identifier, nor that from it.
constexpr std::string_view kIdentifierSalt = "com.tavrin.velkreporting.UniqueDeviceID";
constexpr const char* kNameOfLastResort = "Linux device";

/// What firmware says when its maker did not fill it in.
bool isPlaceholder(std::string_view fact) {
  static constexpr std::array<std::string_view, 12> kPlaceholders{"To be filled by O.E.M.",
                                                                  "Default string",
                                                                  "System Product Name",
                                                                  "System Version",
                                                                  "System Serial Number",
                                                                  "Not Specified",
                                                                  "Not Applicable",
                                                                  "None",
                                                                  "Unknown",
                                                                  "O.E.M.",
                                                                  "Product Name",
                                                                  "0123456789"};
  for (const auto placeholder : kPlaceholders) {
    if (equalsIgnoringCase(fact, placeholder)) return true;
  }
  return fact.empty() || fact.find_first_not_of("0 ") == std::string_view::npos;
}

/// The text of a one-line file. Device trees end their texts with a NUL.
std::optional<std::string> factOf(const std::string& path) {
  const auto bytes = files::read(path, kMaximumFactBytes);
  if (!bytes) return std::nullopt;
  std::string_view text(reinterpret_cast<const char*>(bytes->data()), bytes->size());
  text = trimmed(text.substr(0, text.find('\0')));
  if (isPlaceholder(text) || !isUtf8(text)) return std::nullopt;
  return std::string(text);
}

bool isHostName(std::string_view name) {
  std::array<char, HOST_NAME_MAX + 1> host{};
  if (::gethostname(host.data(), host.size() - 1) != 0) return false;
  const std::string_view full(host.data());
  return equalsIgnoringCase(name, full) || equalsIgnoringCase(name, full.substr(0, full.find('.')));
}

/// `device.conf`, read again when it changes. Any thread.
class DeviceConfiguration {
 public:
  explicit DeviceConfiguration(std::string path) : _path(std::move(path)) {}

  std::optional<std::string> value(std::string_view key) {
    const auto values = current();
    const auto found = values->find(key);
    if (found == values->end() || found->second.empty() || !isUtf8(found->second)) return std::nullopt;
    return found->second;
  }

 private:
  struct Identity {
    ino_t inode = 0;
    off_t size = -1;
    std::int64_t changed = 0;
    mode_t mode = 0;
    bool operator==(const Identity&) const = default;
  };

  Identity identity() const {
    struct stat status {};
    if (::stat(_path.c_str(), &status) != 0) return {};
    // The time of change, not of modification: a change of owner or mode counts as well.
    return {status.st_ino, status.st_size, std::int64_t{status.st_ctim.tv_sec} * 1'000'000'000 + status.st_ctim.tv_nsec,
            status.st_mode};
  }

  std::shared_ptr<const KeyValues> current() {
    const Identity now = identity();
    {
      Guard guard(_lock);
      if (_values != nullptr && _identity == now) return _values;
    }
    auto values = std::make_shared<KeyValues>();
    if (now.size >= 0) *values = readTrusted();
    Guard guard(_lock);
    _identity = now;
    _values = values;
    return values;
  }

  KeyValues readTrusted() const {
    if (!files::isTrustworthy(_path)) {
      log::error("DeviceInformation: Ignoring %s: others can write it", _path);
      return {};
    }
    const auto bytes = files::read(_path, kMaximumConfigurationBytes);
    if (!bytes) {
      log::error("DeviceInformation: Ignoring %s: %s", _path, bytes.error());
      return {};
    }
    return parseKeyValues({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
  }

  const std::string _path;
  Lock _lock;
  Identity _identity VELK_GUARDED_BY(_lock);
  std::shared_ptr<const KeyValues> _values VELK_GUARDED_BY(_lock);
};

class SystemDeviceInformation : public DeviceInformation {
 public:
  SystemDeviceInformation(const std::string& configurationDirectory, std::string root)
      : _root(std::move(root)), _configuration(configurationDirectory + "/device.conf") {}

  std::optional<std::string> answer(std::string_view key) const override {
    if (auto configured = _configuration.value(key)) {
      if (key != "DeviceName" || !isHostName(*configured)) return configured;
    }
    if (key == "ProductVersion") return firstOf({release("VERSION_ID"), release("BUILD_ID")});
    if (key == "BuildVersion") {
      return firstOf({release("BUILD_ID"), release("IMAGE_VERSION"), factOf(_root + "/proc/sys/kernel/osrelease")});
    }
    if (key == "ProductType") return firstOf({dmi("product_name"), deviceTreeModel()});
    if (key == "HWModelStr") return firstOf({dmi("board_name"), deviceTreeModel(), dmi("product_name")});
    if (key == "SerialNumber") return dmi("product_serial");
    if (key == "DeviceName") return deviceName();
    if (key == "UniqueDeviceID") return uniqueIdentifier();
    return std::nullopt;
  }

 private:
  static std::optional<std::string> firstOf(std::initializer_list<std::optional<std::string>> facts) {
    for (const auto& fact : facts) {
      if (fact && !fact->empty()) return fact;
    }
    return std::nullopt;
  }

  std::optional<std::string> release(std::string_view key) const {
    auto values = readKeyValueFile(_root + "/etc/os-release");
    if (values.empty()) values = readKeyValueFile(_root + "/usr/lib/os-release");
    const auto found = values.find(key);
    if (found == values.end() || !isUtf8(found->second)) return std::nullopt;
    return found->second;
  }

  std::optional<std::string> dmi(const char* fact) const { return factOf(_root + "/sys/class/dmi/id/" + fact); }

  std::optional<std::string> deviceTreeModel() const { return factOf(_root + "/proc/device-tree/model"); }

  std::optional<std::string> deviceName() const {
    for (auto& candidate : {dmi("product_family"), dmi("product_name"), deviceTreeModel(), release("NAME")}) {
      if (candidate && !candidate->empty() && !isHostName(*candidate)) return candidate;
    }
    return kNameOfLastResort;
  }

  std::optional<std::string> uniqueIdentifier() const {
    const auto machine = factOf(_root + "/etc/machine-id");
    if (!machine || machine->size() != 32 ||
        machine->find_first_not_of("0123456789abcdefABCDEF") != std::string::npos) {
      return std::nullopt;
    }
    const std::string identifier = lowerCased(*machine);
    const auto bytes = [](std::string_view text) {
      return std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
    };
    return hexadecimal(hmacSha1(bytes(identifier), bytes(kIdentifierSalt)));
  }

  // Constant after construction.
  const std::string _root;
  // Self-synchronised.
  mutable DeviceConfiguration _configuration;
};

}  // namespace

std::unique_ptr<DeviceInformation> makeDeviceInformation(const std::string& configurationDirectory,
                                                         const std::string& root) {
  return std::make_unique<SystemDeviceInformation>(configurationDirectory, root);
}

}  // namespace velk
