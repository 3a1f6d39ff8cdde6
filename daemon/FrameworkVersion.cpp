#include "daemon/FrameworkVersion.h"

#include <algorithm>

#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumFileBytes = 1024;
constexpr std::size_t kMaximumVersionBytes = 32;

/// It becomes part of addresses and events.
bool isVersion(const std::string& text) {
  return !text.empty() && text.size() <= kMaximumVersionBytes && std::all_of(text.begin(), text.end(), [](char c) {
    return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '.' || c == '-';
  });
}

}  // namespace

std::optional<std::string> installedFrameworkVersion(const std::string& dataDirectory) {
  const auto path = dataDirectory + "/version";
  if (!files::exists(path)) return std::nullopt;
  const auto bytes = files::read(path, kMaximumFileBytes);
  if (!bytes) {
    log::error("frameworkVersion: cannot read '%@': %@", path, bytes.error());
    return std::nullopt;
  }
  std::string version(bytes->begin(), std::find(bytes->begin(), bytes->end(), '\n'));
  if (isVersion(version)) return version;
  log::error("frameworkVersion: '%@' holds no version in its first line", path);
  return std::nullopt;
}

}  // namespace velk
