// A locale with settable answers. Set them before other threads ask.
#pragma once

#include "platform/DeviceInformation.h"

namespace velk::test {

class FakeLocale : public Locale {
 public:
  [[nodiscard]] std::optional<std::string> countryCode() const override;
  [[nodiscard]] std::int32_t timeZoneOffset() const override;
  [[nodiscard]] std::optional<bool> automaticTimeZoneEnabled() const override;

  std::optional<std::string> country = "US";
  std::int32_t offset = 3600;
  std::optional<bool> automaticTimeZone;
};

}  // namespace velk::test
