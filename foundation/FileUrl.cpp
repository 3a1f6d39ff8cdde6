#include "foundation/FileUrl.h"

#include "foundation/Text.h"

namespace velk {

namespace {

constexpr std::string_view kScheme = "file:";

/// The byte of the escape that `text` begins with; 0 when it begins with none that may be resolved.
char escapedByte(std::string_view text) noexcept {
  if (text.size() < 3 || text[0] != '%') return 0;
  const int high = hexadecimalDigit(text[1]);
  const int low = hexadecimalDigit(text[2]);
  return high < 0 || low < 0 ? '\0' : static_cast<char>(high * 16 + low);
}

/// RFC 3986 allows these characters in a path unescaped.
bool isAllowedInPath(char character) noexcept {
  const bool isLetter = (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z');
  const bool isDigit = character >= '0' && character <= '9';
  return isLetter || isDigit || std::string_view("-._~!$&'()*+,;=:@/").find(character) != std::string_view::npos;
}

std::string withoutEscapes(std::string_view text) {
  std::string path;
  path.reserve(text.size());
  for (std::size_t at = 0; at < text.size();) {
    const char byte = escapedByte(text.substr(at));
    path += byte != 0 ? byte : text[at];
    at += byte != 0 ? 3 : 1;
  }
  return path;
}

}  // namespace

std::string fileSystemPath(std::string_view url) {
  if (!equalsIgnoringCase(url.substr(0, kScheme.size()), kScheme)) return std::string(url);
  std::string_view rest = url.substr(kScheme.size());
  if (rest.empty() || rest.front() != '/') return std::string(url);
  if (rest.substr(0, 2) == "//") {
    const std::size_t slash = rest.find('/', 2);
    rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash);
  }
  return withoutEscapes(rest);
}

std::string absoluteFileUrl(std::string_view urlOrPath) {
  if (urlOrPath.empty() || urlOrPath.front() != '/') return std::string(urlOrPath);
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  std::string url = "file://";
  for (const char character : urlOrPath) {
    if (isAllowedInPath(character)) {
      url += character;
      continue;
    }
    const auto byte = static_cast<unsigned char>(character);
    url += '%';
    url += kDigits[byte >> 4U];
    url += kDigits[byte & 0xFU];
  }
  return url;
}

}  // namespace velk
