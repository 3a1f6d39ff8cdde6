#include "platform/TrustedPath.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>
#include <system_error>

namespace velk {
namespace {

Failure refusal(const std::string& text) { return failure("TrustedPath", EPERM, text); }

Failure systemFailure(const std::string& path) {
  const int error = errno;
  return failure("TrustedPath", error, path + ": " + std::generic_category().message(error));
}

/// `path` is one entry of the chain, with no link in it.
Result<void> checkEntry(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) return systemFailure(path);
  if (status.st_uid != 0 && status.st_uid != ::geteuid()) {
    return refusal(path + " belongs to user " + std::to_string(status.st_uid) +
                   ", who is neither root nor the user that this process runs as");
  }
  const bool isSticky = S_ISDIR(status.st_mode) && (status.st_mode & S_ISVTX) != 0;
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0 && !isSticky) {
    return refusal(path + " can be written by others than its owner");
  }
  return {};
}

Result<void> checkRegularFile(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) return systemFailure(path);
  if (!S_ISREG(status.st_mode)) return refusal(path + " is not a regular file");
  return {};
}

}  // namespace

Result<std::string> trustedPath(const std::string& path) {
  if (path.empty() || path[0] != '/') return refusal("\"" + path + "\" is not an absolute path");
  const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr), &std::free);
  if (!resolved) return systemFailure(path);
  std::string real(resolved.get());
  if (const auto regular = checkRegularFile(real); !regular) return Failure(regular.error());
  if (const auto root = checkEntry("/"); !root) return Failure(root.error());
  for (std::size_t end = real.find('/', 1);; end = real.find('/', end + 1)) {
    if (const auto entry = checkEntry(real.substr(0, end)); !entry) return Failure(entry.error());
    if (end == std::string::npos) return real;
  }
}

}  // namespace velk
