#include "platform/UnnamedFile.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>
#include <limits>
#include <system_error>

#include "platform/Files.h"

namespace velk {

namespace {

Failure systemFailure(const char* what, int error) {
  return failure("UnnamedFile", error, std::string(what) + ": " + std::generic_category().message(error));
}

/// For file systems that only know files with names: this one loses its own at once.
FileDescriptor makeAndForget(const std::string& directory) {
  std::string path = directory + "/.unnamed-XXXXXX";
  FileDescriptor file(::mkostemp(path.data(), O_CLOEXEC));
  if (file) ::unlink(path.c_str());
  return file;
}

}  // namespace

Result<std::unique_ptr<UnnamedFile>> UnnamedFile::make(const std::string& directory) {
  if (auto made = files::createDirectories(directory); !made) return Failure(made.error());
  FileDescriptor file(::open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC | O_EXCL, 0600));
  if (!file) file = makeAndForget(directory);
  if (!file) return systemFailure("cannot make a temporary file", errno);
  return std::unique_ptr<UnnamedFile>(new UnnamedFile(std::move(file)));
}

std::shared_ptr<const UnnamedFile> UnnamedFile::adopt(FileDescriptor file, std::uint64_t size) {
  return std::shared_ptr<const UnnamedFile>(new UnnamedFile(std::move(file), size));
}

Result<void> UnnamedFile::append(std::span<const std::uint8_t> bytes) {
  while (!bytes.empty()) {
    const ssize_t written = ::pwrite(_file.get(), bytes.data(), bytes.size(), static_cast<off_t>(_size));
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return systemFailure("cannot write a temporary file", errno);
    _size += static_cast<std::uint64_t>(written);
    bytes = bytes.subspan(static_cast<std::size_t>(written));
  }
  return {};
}

std::uint64_t UnnamedFile::availableSpace() const {
  struct statvfs system {};
  // File systems without a size of their own say that they have no blocks.
  if (::fstatvfs(_file.get(), &system) != 0 || system.f_blocks == 0) return std::numeric_limits<std::uint64_t>::max();
  return static_cast<std::uint64_t>(system.f_bavail) * system.f_frsize;
}

}  // namespace velk
