#include "connectivity/UploadStorage.h"

#include "foundation/Text.h"
#include "foundation/Uuid.h"
#include "platform/Files.h"

namespace velk {
namespace {

bool isContainer(std::string_view name) {
  const auto extension = "." + std::string(kUploadContainerExtension);
  return name.size() >= extension.size() && equalsIgnoringCase(name.substr(name.size() - extension.size()), extension);
}

}  // namespace

std::string uniqueUploadContainer(std::string_view folder) {
  return std::string(folder) + "/" + randomUuidText() + "." + std::string(kUploadContainerExtension);
}

void cleanUploadStorage(const std::string& folder) {
  if (!files::createDirectories(folder)) return;
  const auto names = files::list(folder);
  if (!names) return;
  for (const auto& name : *names) {
    if (isContainer(name)) (void)files::remove(folder + "/" + name);
  }
}

}  // namespace velk
