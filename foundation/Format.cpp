#include "foundation/Format.h"

#include <algorithm>
#include <charconv>
#include <cinttypes>
#include <cstdio>

#include "foundation/Json.h"
#include "foundation/Text.h"

namespace velk {

namespace {

constexpr std::string_view kNone = "(null)";
constexpr std::string_view kFlags = "-+ #0";
constexpr std::string_view kLengthModifiers = "hlqLzjt";
constexpr int kMaximumWidth = 255;

// One placeholder as it stands in a format.
struct Placeholder {
  std::string flags;
  int width = -1;
  int precision = -1;
  char conversion = 0;
  std::size_t length = 0;  // of the whole placeholder, the percent sign included
};

bool isDigit(char character) { return character >= '0' && character <= '9'; }

int number(std::string_view format, std::size_t& at) {
  int value = 0;
  while (at < format.size() && isDigit(format[at])) {
    value = value * 10 + (format[at++] - '0');
    if (value > kMaximumWidth) value = kMaximumWidth;
  }
  return value;
}

// `format` begins with a percent sign.
Placeholder placeholderAt(std::string_view format) {
  Placeholder found;
  std::size_t at = 1;
  while (at < format.size() && kFlags.find(format[at]) != std::string_view::npos) found.flags += format[at++];
  if (at < format.size() && isDigit(format[at])) found.width = number(format, at);
  if (at < format.size() && format[at] == '.') {
    ++at;
    found.precision = number(format, at);
  }
  while (at < format.size() && kLengthModifiers.find(format[at]) != std::string_view::npos) ++at;
  if (at < format.size()) found.conversion = format[at++];
  found.length = at;
  return found;
}

template <class Number>
std::string printed(const Placeholder& placeholder, const char* suffix, Number value) {
  std::string pattern = "%" + placeholder.flags;
  if (placeholder.width >= 0) pattern += std::to_string(placeholder.width);
  if (placeholder.precision >= 0) pattern += "." + std::to_string(placeholder.precision);
  pattern += suffix;
  const int size = std::snprintf(nullptr, 0, pattern.c_str(), value);
  if (size < 0) return {};
  std::string text(static_cast<std::size_t>(size) + 1, '\0');
  std::snprintf(text.data(), text.size(), pattern.c_str(), value);
  text.pop_back();
  return text;
}

std::string padded(const Placeholder& placeholder, std::string_view text) {
  if (placeholder.precision >= 0) text = text.substr(0, static_cast<std::size_t>(placeholder.precision));
  std::string result(text);
  const auto width = static_cast<std::size_t>(placeholder.width < 0 ? 0 : placeholder.width);
  if (result.size() >= width) return result;
  const bool left = placeholder.flags.find('-') != std::string::npos;
  result.insert(left ? result.size() : 0, width - result.size(), ' ');
  return result;
}

std::string integerText(const Placeholder& placeholder, std::int64_t value) {
  switch (placeholder.conversion) {
    case 'u':
      return printed(placeholder, PRIu64, static_cast<std::uint64_t>(value));
    case 'x':
      return printed(placeholder, PRIx64, static_cast<std::uint64_t>(value));
    case 'X':
      return printed(placeholder, PRIX64, static_cast<std::uint64_t>(value));
    case 'c':
      return std::string(1, static_cast<char>(value));
    case 'f':
    case 'g':
      return printed(placeholder, placeholder.conversion == 'f' ? "f" : "g", static_cast<double>(value));
    case 's':
    case '@':
      return padded(placeholder, std::to_string(value));
    default:
      return printed(placeholder, PRId64, value);
  }
}

std::string unsignedText(const Placeholder& placeholder, std::uint64_t value) {
  if (placeholder.conversion == 'd' || placeholder.conversion == 'i') return printed(placeholder, PRIu64, value);
  if (placeholder.conversion == 's' || placeholder.conversion == '@') return padded(placeholder, std::to_string(value));
  return integerText(placeholder, static_cast<std::int64_t>(value));
}

std::string doubleText(const Placeholder& placeholder, double value) {
  switch (placeholder.conversion) {
    case 'f':
      return printed(placeholder, "f", value);
    case 'd':
    case 'i':
    case 'u':
    case 'x':
    case 'X':
      return integerText(placeholder, integerValue(PropertyValue(value)));
    default:
      return printed(placeholder, "g", value);
  }
}

std::string pointerText(const void* pointer) {
  char buffer[32];
  std::snprintf(buffer, sizeof(buffer), "%p", pointer);
  return buffer;
}

struct ArgumentText {
  const Placeholder& placeholder;
  std::string operator()(std::monostate) const { return padded(placeholder, kNone); }
  std::string operator()(std::int64_t value) const { return integerText(placeholder, value); }
  std::string operator()(std::uint64_t value) const { return unsignedText(placeholder, value); }
  std::string operator()(double value) const { return doubleText(placeholder, value); }
  std::string operator()(std::string_view value) const { return padded(placeholder, value); }
  std::string operator()(const std::string& value) const { return padded(placeholder, value); }
  std::string operator()(const void* value) const { return pointerText(value); }
};

template <class Container>
std::string containerDescription(const Container& value) {
  const PropertyValue wrapped(value);
  return description(&wrapped);
}

}  // namespace

FormatArgument::FormatArgument(const PropertyValue& value) : _value(description(&value)) {}
FormatArgument::FormatArgument(const PropertyValue* value) : _value(description(value)) {}
FormatArgument::FormatArgument(const PropertyDictionary& value) : _value(containerDescription(value)) {}
FormatArgument::FormatArgument(const PropertyArray& value) : _value(containerDescription(value)) {}
FormatArgument::FormatArgument(const std::optional<PropertyDictionary>& value) {
  if (value) _value = containerDescription(*value);
}
FormatArgument::FormatArgument(const std::optional<PropertyArray>& value) {
  if (value) _value = containerDescription(*value);
}

std::string formatText(std::string_view format, std::initializer_list<FormatArgument> arguments) {
  std::string text;
  text.reserve(format.size() + 16 * arguments.size());
  const FormatArgument* next = arguments.begin();
  while (!format.empty()) {
    const std::size_t percent = format.find('%');
    text.append(format.substr(0, percent));
    if (percent == std::string_view::npos) break;
    format.remove_prefix(percent);
    const Placeholder placeholder = placeholderAt(format);
    if (placeholder.conversion == '%') {
      text += '%';
    } else if (next == arguments.end()) {
      text.append(format.substr(0, placeholder.length));
    } else {
      text += std::visit(ArgumentText{placeholder}, (next++)->_value);
    }
    format.remove_prefix(placeholder.length);
  }
  return text;
}

namespace {

// Values that JSON refuses (not finite, not UTF-8) still get a description.
void describe(const PropertyValue& value, std::string& out) {
  const std::size_t before = out.size();
  if (json::write(value, out, json::Extensions::tagged)) return;
  out.resize(before);
  if (const auto* array = value.array()) {
    out += '[';
    for (const auto& element : *array) {
      if (out.back() != '[') out += ',';
      describe(element, out);
    }
    out += ']';
  } else if (const auto* dictionary = value.dictionary()) {
    out += '{';
    for (const auto& entry : *dictionary) {
      if (out.back() != '{') out += ',';
      out += '"' + withoutControlCharacters(entry.key) + "\":";
      describe(entry.value, out);
    }
    out += '}';
  } else if (const auto* real = value.real()) {
    char buffer[32];
    std::snprintf(buffer, sizeof(buffer), "%g", *real);
    out += buffer;
  } else if (const auto* string = value.string()) {
    out += '"' + withoutControlCharacters(*string) + '"';
  }
}

// Control characters, and everything beyond ASCII: there are more of them, and bytes that are no text at all.
bool mayNeedEscape(char character) noexcept {
  const auto byte = static_cast<unsigned char>(character);
  return byte < 0x20 || byte >= 0x7F;
}

// Appends the character at the beginning of `text`, escaped if it must be; answers how many of its bytes that took.
std::size_t appendEscaped(std::string_view text, std::string& result) {
  const auto byte = static_cast<unsigned char>(text[0]);
  const std::size_t length = utf8CharacterLength(text);
  char escape[8] = {};
  if (byte == '\n' || byte == '\t' || byte == '\r') {
    result += byte == '\n' ? "\\n" : byte == '\t' ? "\\t" : "\\r";
  } else if (length == 0 || byte < 0x20 || byte == 0x7F) {
    std::snprintf(escape, sizeof(escape), "\\x%02x", byte);
  } else if (text.starts_with("\u2028") || text.starts_with("\u2029")) {
    result += text.starts_with("\u2028") ? "\\u2028" : "\\u2029";
  } else if (byte == 0xC2 && static_cast<unsigned char>(text[1]) < 0xA0) {
    std::snprintf(escape, sizeof(escape), "\\u%04x", static_cast<unsigned char>(text[1]));
  } else {
    result.append(text.substr(0, length));
  }
  result += escape;
  return std::max<std::size_t>(length, 1);
}

}  // namespace

std::string description(const PropertyValue* value) {
  if (value == nullptr || value->isNull()) return std::string(kNone);
  if (const auto* string = value->string()) return withoutControlCharacters(*string);
  std::string text;
  describe(*value, text);
  return withoutControlCharacters(text);
}

std::string withoutControlCharacters(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  while (!text.empty()) {
    std::size_t harmless = 0;
    while (harmless < text.size() && !mayNeedEscape(text[harmless])) ++harmless;
    result.append(text.substr(0, harmless));
    text.remove_prefix(harmless);
    if (!text.empty()) text.remove_prefix(appendEscaped(text, result));
  }
  return result;
}

}  // namespace velk
