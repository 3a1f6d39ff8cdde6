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

}  // namespace velk
