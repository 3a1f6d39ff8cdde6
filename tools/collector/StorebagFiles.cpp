#include "tools/collector/StorebagFiles.h"

#include <algorithm>

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr std::size_t kMaximumEnvelopeBytes = std::size_t{16} * 1024 * 1024;
constexpr std::size_t kMaximumNameLength = 64;

bool isNameCharacter(char character) {
  return (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z') ||
         (character >= '0' && character <= '9') || character == '.' || character == '-' || character == '_';
}

}  // namespace

bool isStorebagName(std::string_view name) {
  return !name.empty() && name.size() <= kMaximumNameLength && name.front() != '.' &&
         std::all_of(name.begin(), name.end(), isNameCharacter);
}

Result<StorebagFile> StorebagFiles::find(std::string_view name) const {
  if (!isStorebagName(name)) return failure("storebag", 1, "that is no storebag name");
  const std::string path = _directory + "/" + std::string(name);
  // The time first: a file that is replaced in between is then served once more, never kept back.
  const auto modified = files::modificationTime(path);
  if (!modified) return failure("storebag", 2, "there is no such storebag");
  Result<ByteData> envelope = files::read(path, kMaximumEnvelopeBytes);
  if (!envelope) return Failure(std::move(envelope).error());
  return StorebagFile{std::move(*envelope), modified->seconds};
}

}  // namespace velk::collector
