#include "platform/linux/KeyValueFile.h"

#include "foundation/Text.h"
#include "platform/Files.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumBytes = 64 * 1024;

std::string unquoted(std::string_view value) {
  const bool quoted =
      value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front();
  if (!quoted) return std::string(value);
  const bool escapes = value.front() == '"';
  value = value.substr(1, value.size() - 2);
  std::string result;
  for (std::size_t index = 0; index < value.size(); ++index) {
    if (escapes && value[index] == '\\' && index + 1 < value.size()) ++index;
    result += value[index];
  }
  return result;
}

}  // namespace

std::string_view trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(" \t\r\n");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t\r\n") - first + 1);
}

KeyValues parseKeyValues(std::string_view text) {
  KeyValues values;
  for (const auto line : split(text, '\n')) {
    const auto content = trimmed(line);
    const auto equals = content.find('=');
    if (content.empty() || content.front() == '#' || equals == std::string_view::npos) continue;
    values.insert_or_assign(std::string(trimmed(content.substr(0, equals))),
                            unquoted(trimmed(content.substr(equals + 1))));
  }
  return values;
}

KeyValues readKeyValueFile(const std::string& path) {
  const auto bytes = files::read(path, kMaximumBytes);
  if (!bytes) return {};
  return parseKeyValues({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
}

}  // namespace velk
