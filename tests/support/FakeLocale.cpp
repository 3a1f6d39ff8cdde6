#include "tests/support/FakeLocale.h"

namespace velk::test {

std::optional<std::string> FakeLocale::countryCode() const { return country; }
std::int32_t FakeLocale::timeZoneOffset() const { return offset; }
std::optional<bool> FakeLocale::automaticTimeZoneEnabled() const { return automaticTimeZone; }

}  // namespace velk::test
