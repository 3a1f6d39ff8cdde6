// The folder in which file-backed uploads keep their bodies while they are handed over.
#pragma once

#include <string>
#include <string_view>

namespace velk {

inline constexpr std::string_view kUploadStorageRootFolder = "/tmp/velkstorage";
inline constexpr std::string_view kUploadContainerExtension = "velkdiag";

/// "<folder>/<random UUID>.velkdiag". Nothing is created.
[[nodiscard]] std::string uniqueUploadContainer(std::string_view folder);

/// Creates the folder, and removes every container that an earlier process left in it. Other files stay. Failures
/// are ignored on purpose: what could not be removed is tried again at the next start.
void cleanUploadStorage(const std::string& folder);

}  // namespace velk
