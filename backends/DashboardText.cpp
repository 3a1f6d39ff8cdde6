#include "backends/DashboardText.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <utility>
#include <vector>

#include "device/DeviceEnvironment.h"
#include "foundation/DashboardDatagram.h"
#include "foundation/Format.h"

namespace velk {

namespace {

constexpr std::size_t kMostLineBytes = 1151;
constexpr const char* kLineFormat = "%u.%03d %s 127.0.0.1 %s %5u %5u %5u %5u %5u %s";

/// Texts end at a zero byte: on the other side they are read as terminated ones.
std::string_view upToZero(std::string_view text) { return text.substr(0, text.find('\0')); }

std::string replaced(std::string_view text, char character, std::string_view replacement) {
  std::string result;
  result.reserve(text.size());
  for (const char each : text) {
    if (each == character) {
      result += replacement;
    } else {
      result += each;
    }
  }
  return result;
}

std::string realText(double number) {
  std::array<char, 32> buffer{};
  const auto end = std::to_chars(buffer.data(), buffer.data() + buffer.size(), number).ptr;
  return std::string(buffer.data(), end);
}

}  // namespace

std::string descriptionForObject(const PropertyValue& value) {
  if (const auto* text = value.string()) return *text;
  if (const auto* flag = value.boolean()) return *flag ? "1" : "0";
  if (const auto* number = value.integer()) return std::to_string(*number);
  if (const auto* number = value.unsignedInteger()) return std::to_string(*number);
  if (const auto* number = value.real()) return realText(*number);
  return "null";
}

std::string sanitize(std::string_view text) {
  const auto result = replaced(replaced(replaced(text, '\n', ""), '\\', "\\\\"), '=', "\\=");
  return result.empty() ? "empty" : result;
}

std::string keyValueText(const PropertyDictionary& payload) {
  std::vector<std::pair<std::string_view, std::string>> words;
  words.reserve(payload.size());
  for (const auto& entry : payload) words.emplace_back(entry.key, descriptionForObject(entry.value));
  std::stable_sort(words.begin(), words.end(),
                   [](const auto& left, const auto& right) { return left.second.size() < right.second.size(); });
  std::string text;
  for (const auto& [key, value] : words) {
    if (text.size() >= dashboard::kMostTextBytes) break;
    text += ' ';
    text += upToZero(key);
    text += '=';
    text += upToZero(sanitize(value));
  }
  if (text.size() > dashboard::kMostTextBytes) text.resize(dashboard::kMostTextBytes);
  return text;
}

std::string writeLocalLog(std::span<const std::uint8_t> datagram) {
  const auto header = dashboard::readHeader(datagram);
  if (!header) return {};
  const auto text = datagram.subspan(dashboard::kHeaderBytes);
  auto line = formatText(
      kLineFormat,
      {header->seconds, static_cast<int>(header->fourMilliseconds) * dashboard::kFourMilliseconds,
       upToZero({header->deviceIdentifier.data(), header->deviceIdentifier.size()}),
       componentShortCode(header->component), header->clientVersion, header->sessionID, header->eventNumber,
       header->method, header->respCode, std::string_view(reinterpret_cast<const char*>(text.data()), text.size())});
  if (line.size() > kMostLineBytes) line.resize(kMostLineBytes);
  return line;
}

}  // namespace velk
