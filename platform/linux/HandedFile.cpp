#include "platform/HandedFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>
#include <utility>

namespace velk {

namespace {

Failure systemFailure(const std::string& path, int error) {
  return failure("HandedFile", error, path + ": " + std::generic_category().message(error));
}

/// The directory and the name in it; a path that ends in a slash names the directory itself.
std::pair<std::string, std::string> directoryAndName(const std::string& path) {
  const auto slash = path.rfind('/');
  if (slash == std::string::npos) return {".", path};
  std::string name = path.substr(slash + 1);
  return {path.substr(0, slash + 1), name.empty() ? "." : std::move(name)};
}

bool isRegular(const FileDescriptor& file) {
  struct stat status {};
  return ::fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode);
}

}  // namespace

FileToHandOver::FileToHandOver(std::string path, std::string name, FileDescriptor directory, FileDescriptor file)
    : _path(std::move(path)), _name(std::move(name)), _directory(std::move(directory)), _file(std::move(file)) {}

Result<FileToHandOver> FileToHandOver::open(const std::string& path) {
  if (path.empty()) return systemFailure(path, ENOENT);
  auto [directoryPath, name] = directoryAndName(path);
  FileDescriptor directory(::open(directoryPath.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return systemFailure(path, errno);
  constexpr int kFlags = O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  FileDescriptor file(::openat(directory.get(), name.c_str(), O_RDONLY | kFlags));
  if (!file) {
    const int reason = errno;
    file = FileDescriptor(::openat(directory.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    // A regular file that may not be read is not offered to somebody who might.
    if (!file || isRegular(file)) return systemFailure(path, reason);
  }
  return FileToHandOver(path, std::move(name), std::move(directory), std::move(file));
}

Result<FileDescriptor> FileToHandOver::descriptor() const {
  FileDescriptor copy(::fcntl(_file.get(), F_DUPFD_CLOEXEC, 0));
  if (!copy) return systemFailure(_path, errno);
  return copy;
}

// As long as the file is held open, no other file can have its number.
Result<void> FileToHandOver::removeIfUnchanged() const {
  struct stat held {};
  struct stat named {};
  if (::fstat(_file.get(), &held) != 0) return systemFailure(_path, errno);
  if (::fstatat(_directory.get(), _name.c_str(), &named, AT_SYMLINK_NOFOLLOW) != 0) return systemFailure(_path, errno);
  if (held.st_dev != named.st_dev || held.st_ino != named.st_ino || !S_ISREG(held.st_mode)) {
    return failure("HandedFile", ESTALE, _path + ": another file has taken its place");
  }
  if (::unlinkat(_directory.get(), _name.c_str(), 0) != 0) return systemFailure(_path, errno);
  return {};
}

std::optional<std::uint64_t> sizeOfRegularFile(const FileDescriptor& file) {
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return std::nullopt;
  return static_cast<std::uint64_t>(status.st_size);
}

Result<std::size_t> readAt(const FileDescriptor& file, std::uint64_t offset, std::span<std::uint8_t> buffer) {
  std::size_t filled = 0;
  while (filled < buffer.size()) {
    const ssize_t got =
        ::pread(file.get(), buffer.data() + filled, buffer.size() - filled, static_cast<off_t>(offset + filled));
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return systemFailure("a file that was handed over", errno);
    if (got == 0) break;
    filled += static_cast<std::size_t>(got);
  }
  return filled;
}

}  // namespace velk
