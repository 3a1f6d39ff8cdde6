#include <atomic>
#include <cctype>
#include <cstdlib>
#include <ctime>
#include <string>

#include "foundation/Text.h"
#include "platform/DeviceInformation.h"
#include "platform/Files.h"
#include "platform/LocalTime.h"
#include "platform/UserDefaults.h"
#include "platform/linux/KeyValueFile.h"

namespace velk {
namespace {

constexpr std::string_view kAutomaticTimeZoneSetting = "TMAutomaticTimeZoneEnabled";

/// The region of a locale's name: "AT" of "de_AT.UTF-8@euro", "419" of "es_419". None in "C" or "POSIX".
std::optional<std::string> regionOf(std::string_view locale) {
  const auto underscore = locale.find('_');
  if (underscore == std::string_view::npos) return std::nullopt;
  auto region = locale.substr(underscore + 1);
  region = region.substr(0, region.find_first_of(".@"));
  std::string code;
  int letters = 0;
  int digits = 0;
  for (const char character : region) {
    const auto byte = static_cast<unsigned char>(character);
    letters += byte < 0x80 && std::isalpha(byte) != 0;
    digits += byte < 0x80 && std::isdigit(byte) != 0;
    code += static_cast<char>(std::toupper(byte));
  }
  const bool isCode = (letters == 2 && region.size() == 2) || (digits == 3 && region.size() == 3);
  return isCode ? std::optional(code) : std::nullopt;
}

class SystemLocale : public Locale {
 public:
  SystemLocale(std::unique_ptr<UserDefaults> timeSuite, std::string root)
      : _timeSuite(std::move(timeSuite)), _root(std::move(root)) {}

  std::optional<std::string> countryCode() const override {
    // The first variable that is set decides, whether it names a region or not.
    for (const char* variable : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
      const char* value = ::secure_getenv(variable);
      if (value != nullptr && value[0] != '\0') return regionOf(value);
    }
    for (const char* file : {"/etc/locale.conf", "/etc/default/locale"}) {
      const auto settings = readKeyValueFile(_root + file);
      for (const char* variable : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        const auto found = settings.find(variable);
        if (found != settings.end() && !found->second.empty()) return regionOf(found->second);
      }
    }
    return std::nullopt;
  }

  std::int32_t timeZoneOffset() const override {
    // Every event asks, and the answer costs a look at the zone's file: one a second is enough.
    const auto now = static_cast<std::uint32_t>(::time(nullptr));
    const std::uint64_t remembered = _offsetOfSecond.load(std::memory_order_relaxed);
    if (remembered >> 32U == now) return static_cast<std::int32_t>(static_cast<std::uint32_t>(remembered));
    const std::int32_t offset = localOffset(static_cast<std::time_t>(now));
    _offsetOfSecond.store(std::uint64_t{now} << 32U | static_cast<std::uint32_t>(offset), std::memory_order_relaxed);
    return offset;
  }

  std::optional<bool> automaticTimeZoneEnabled() const override {
    const auto setting = _timeSuite ? _timeSuite->value(kAutomaticTimeZoneSetting) : std::nullopt;
    return setting ? std::optional(booleanValue(&*setting)) : std::nullopt;
  }

 private:
  const std::unique_ptr<UserDefaults> _timeSuite;
  const std::string _root;
  /// The second (upper half) and the offset in it (lower half).
  mutable std::atomic<std::uint64_t> _offsetOfSecond{0};
};

}  // namespace

std::unique_ptr<Locale> makeLocale(std::unique_ptr<UserDefaults> timeSuite, const std::string& root) {
  return std::make_unique<SystemLocale>(std::move(timeSuite), root);
}

}  // namespace velk
