#include "tools/collector/HttpDate.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cstdio>

namespace velk::collector {
namespace {

using std::chrono::days;
using std::chrono::sys_days;
using std::chrono::year_month_day;

constexpr std::int64_t kSecondsPerDay = 86400;
constexpr std::array<const char*, 7> kDays = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
constexpr std::array<const char*, 12> kMonths = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                                 "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
// What stands where: a 0 is a digit, an a a letter.
constexpr std::string_view kForm = "aaa, 00 aaa 0000 00:00:00 GMT";

bool hasForm(std::string_view text) {
  if (text.size() != kForm.size()) return false;
  for (std::size_t at = 0; at < text.size(); ++at) {
    const bool digit = text[at] >= '0' && text[at] <= '9';
    const bool isPlaceholder = kForm[at] == '0' || kForm[at] == 'a';
    if (kForm[at] == '0' && !digit) return false;
    if (!isPlaceholder && text[at] != kForm[at]) return false;
  }
  return true;
}

int number(std::string_view text, std::size_t at, std::size_t length) {
  int value = 0;
  std::from_chars(text.data() + at, text.data() + at + length, value);
  return value;
}

}  // namespace

std::string httpDate(std::int64_t secondsSince1970) {
  std::int64_t day = secondsSince1970 / kSecondsPerDay;
  std::int64_t second = secondsSince1970 % kSecondsPerDay;
  if (second < 0) {
    second += kSecondsPerDay;
    --day;
  }
  const sys_days date{days(day)};
  const year_month_day calendar(date);
  std::array<char, 64> text{};
  std::snprintf(text.data(), text.size(), "%s, %02u %s %04d %02d:%02d:%02d GMT",
                kDays[std::chrono::weekday(date).c_encoding()], static_cast<unsigned>(calendar.day()),
                kMonths[static_cast<unsigned>(calendar.month()) - 1], static_cast<int>(calendar.year()),
                static_cast<int>(second / 3600), static_cast<int>(second / 60 % 60), static_cast<int>(second % 60));
  return text.data();
}

std::optional<std::int64_t> secondsFromHttpDate(std::string_view text) {
  if (!hasForm(text)) return std::nullopt;
  const auto month = std::find(kMonths.begin(), kMonths.end(), text.substr(8, 3));
  if (month == kMonths.end()) return std::nullopt;
  const year_month_day calendar{std::chrono::year(number(text, 12, 4)),
                                std::chrono::month(static_cast<unsigned>(month - kMonths.begin()) + 1),
                                std::chrono::day(static_cast<unsigned>(number(text, 5, 2)))};
  const int hour = number(text, 17, 2);
  const int minute = number(text, 20, 2);
  const int second = number(text, 23, 2);
  if (!calendar.ok() || hour > 23 || minute > 59 || second > 60) return std::nullopt;
  const std::int64_t day = sys_days(calendar).time_since_epoch().count();
  return day * kSecondsPerDay + hour * 3600 + minute * 60 + second;
}

}  // namespace velk::collector
