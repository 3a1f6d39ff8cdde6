#include "platform/Files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "platform/FileDescriptor.h"

namespace velk::files {
namespace {

/// How many unusable versions of one file are kept for somebody to look at.
constexpr int kKeptSetAsideFiles = 5;

Failure systemFailure(const char* what, const std::string& path, int error) {
  Code code = Code::other;
  if (error == ENOENT || error == ENOTDIR) code = Code::notFound;
  if (error == EACCES || error == EPERM || error == EROFS) code = Code::notAllowed;
  return failure("files", static_cast<int>(code),
                 std::string(what) + " " + path + ": " + std::generic_category().message(error));
}

std::string parentOf(const std::string& path) {
  const auto slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool writeAll(int descriptor, std::span<const std::uint8_t> bytes) {
  while (!bytes.empty()) {
    const ssize_t written = ::write(descriptor, bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    bytes = bytes.subspan(static_cast<std::size_t>(written));
  }
  return true;
}

/// Reads to the end of the file, whatever its size was said to be: it may grow meanwhile, and files of /proc have none.
Result<ByteData> readToEnd(int descriptor, const std::string& path, std::size_t expected, std::size_t maximumBytes) {
  ByteData bytes(std::min(expected, maximumBytes) + 1);
  std::size_t used = 0;
  for (;;) {
    if (used == bytes.size()) bytes.resize(std::min(bytes.size() * 2 + 4096, maximumBytes + 1));
    const ssize_t got = ::read(descriptor, bytes.data() + used, bytes.size() - used);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return systemFailure("cannot read", path, errno);
    if (got == 0) break;
    used += static_cast<std::size_t>(got);
    if (used > maximumBytes) {
      return failure("files", static_cast<int>(Code::tooLarge),
                     path + " is larger than " + std::to_string(maximumBytes) + " bytes");
    }
  }
  bytes.resize(used);
  return bytes;
}

void syncDirectoryOf(const std::string& path) {
  // Best effort: not every file system can sync a directory, and the file itself is safe.
  const FileDescriptor directory(::open(parentOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory) (void)::fsync(directory.get());
}

void giveToOwnerOfDirectory(int descriptor, const std::string& path) {
  if (::geteuid() != 0) return;
  struct stat status {};
  if (::stat(parentOf(path).c_str(), &status) != 0 || status.st_uid == 0) return;
  // Best effort: a file system without owners is fine as well.
  if (::fchown(descriptor, status.st_uid, status.st_gid) != 0) errno = 0;
}

/// The error number of what failed, 0 when the bytes are on the disk.
int fillTemporary(int descriptor, std::span<const std::uint8_t> bytes, unsigned mode) {
  if (::fchmod(descriptor, static_cast<mode_t>(mode)) != 0) return errno;
  if (!writeAll(descriptor, bytes)) return errno;
  return ::fsync(descriptor) == 0 ? 0 : errno;
}

constexpr std::string_view kTemporaryMark = ".tmp-";
constexpr std::string_view kTemporaryPlaces = "XXXXXX";

/// A new file beside `path`, whose name it puts into `temporary`. It is locked for as long as it is open: whoever
/// sweeps the directory meanwhile leaves it alone.
FileDescriptor newTemporary(const std::string& path, std::string& temporary) {
  constexpr int kAttempts = 8;
  FileDescriptor file;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    temporary = path;
    temporary.append(kTemporaryMark).append(kTemporaryPlaces);
    file = FileDescriptor(::mkostemp(temporary.data(), O_CLOEXEC));
    struct stat status {};
    // Best effort: where files cannot be locked, nothing is swept either.
    if (!file || ::flock(file.get(), LOCK_EX) != 0 || ::fstat(file.get(), &status) != 0) break;
    if (status.st_nlink > 0) break;
    // Swept in the instant before it was locked.
  }
  return file;
}

bool isTemporaryName(std::string_view name) {
  const std::size_t length = kTemporaryMark.size() + kTemporaryPlaces.size();
  if (name.size() <= length) return false;
  const auto end = name.substr(name.size() - length);
  const auto isPlace = [](unsigned char character) { return std::isalnum(character) != 0; };
  return end.starts_with(kTemporaryMark) &&
         std::all_of(end.begin() + static_cast<std::ptrdiff_t>(kTemporaryMark.size()), end.end(), isPlace);
}

/// True when it was ours, nobody was writing it, and it is gone.
bool sweepTemporary(int directory, const std::string& name) {
  const FileDescriptor file(
      ::openat(directory, name.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0) return false;
  if (!S_ISREG(status.st_mode) || status.st_uid != ::geteuid()) return false;
  if (::flock(file.get(), LOCK_EX | LOCK_NB) != 0) return false;
  return ::unlinkat(directory, name.c_str(), 0) == 0;
}

bool onlyTrustedMayWrite(const struct stat& status) {
  return (status.st_uid == 0 || status.st_uid == ::geteuid()) && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

bool directoryIsTrustworthy(const std::string& directory) {
  struct stat status {};
  return ::stat(directory.c_str(), &status) == 0 && S_ISDIR(status.st_mode) && onlyTrustedMayWrite(status);
}

}  // namespace

Result<ByteData> read(const std::string& path, std::size_t maximumBytes) {
  // Without O_NONBLOCK a FIFO that somebody put there would hold us for ever.
  const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!file) return systemFailure("cannot open", path, errno);
  return readDescriptor(file.get(), path, maximumBytes);
}

Result<ByteData> readDescriptor(int descriptor, const std::string& name, std::size_t maximumBytes) {
  struct stat status {};
  if (::fstat(descriptor, &status) != 0) return systemFailure("cannot look at", name, errno);
  if (!S_ISREG(status.st_mode)) {
    return failure("files", static_cast<int>(Code::other), name + " is not a regular file");
  }
  return readToEnd(descriptor, name, static_cast<std::size_t>(status.st_size), maximumBytes);
}

Result<void> writeAtomically(const std::string& path, std::span<const std::uint8_t> bytes, unsigned mode) {
  std::string temporary;
  const FileDescriptor file = newTemporary(path, temporary);
  if (!file) return systemFailure("cannot create a file beside", path, errno);
  giveToOwnerOfDirectory(file.get(), path);
  int error = fillTemporary(file.get(), bytes, mode);
  if (error == 0 && ::rename(temporary.c_str(), path.c_str()) != 0) error = errno;
  if (error != 0) {
    (void)::unlink(temporary.c_str());
    return systemFailure("cannot write", path, error);
  }
  syncDirectoryOf(path);
  return {};
}

std::size_t sweepTemporaries(const std::string& directory) {
  const auto names = list(directory);
  const FileDescriptor opened(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!names || !opened) return 0;
  return static_cast<std::size_t>(std::count_if(names->begin(), names->end(), [&](const std::string& name) {
    return isTemporaryName(name) && sweepTemporary(opened.get(), name);
  }));
}

Result<void> probeWritable(const std::string& directory) {
  if (const FileDescriptor file(::open(directory.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, 0600)); file) return {};
  if (errno != EOPNOTSUPP && errno != EISDIR) return systemFailure("cannot write into", directory, errno);
  // A file system without files that have no name.
  std::string temporary;
  const FileDescriptor file = newTemporary(directory + "/probe", temporary);
  if (!file) return systemFailure("cannot write into", directory, errno);
  (void)::unlink(temporary.c_str());
  return {};
}

Result<void> createDirectories(const std::string& path, unsigned mode) {
  for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    const std::string part = path.substr(0, end);
    if (::mkdir(part.c_str(), static_cast<mode_t>(mode)) == 0) {
      // Whatever the process's umask takes away from new files.
      static_cast<void>(::chmod(part.c_str(), static_cast<mode_t>(mode)));
    } else if (errno != EEXIST) {
      const int error = errno;
      struct stat status {};
      // A parent that is there but not ours to write is fine (EROFS, EACCES).
      if (::stat(part.c_str(), &status) != 0) return systemFailure("cannot create directory", part, error);
    }
    if (end == std::string::npos) break;
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return systemFailure("cannot create directory", path, errno);
  if (!S_ISDIR(status.st_mode)) return systemFailure("cannot create directory", path, ENOTDIR);
  return {};
}

Result<void> setMode(const std::string& path, unsigned mode) {
  if (::chmod(path.c_str(), static_cast<mode_t>(mode)) != 0) return systemFailure("cannot change", path, errno);
  return {};
}

std::optional<TimeValue> modificationTime(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return std::nullopt;
  return TimeValue{status.st_mtim.tv_sec, static_cast<std::int32_t>(status.st_mtim.tv_nsec / 1000)};
}

std::optional<TimeValue> creationTime(const std::string& path) {
  struct statx status {};
  if (::statx(AT_FDCWD, path.c_str(), AT_STATX_SYNC_AS_STAT, STATX_BTIME, &status) != 0) return std::nullopt;
  if ((status.stx_mask & STATX_BTIME) == 0) return std::nullopt;
  return TimeValue{status.stx_btime.tv_sec, static_cast<std::int32_t>(status.stx_btime.tv_nsec / 1000)};
}

bool exists(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0;
}

std::optional<std::size_t> size(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return std::nullopt;
  return static_cast<std::size_t>(status.st_size);
}

Result<std::vector<std::string>> list(const std::string& directory) {
  DIR* stream = ::opendir(directory.c_str());
  if (stream == nullptr) return systemFailure("cannot list", directory, errno);
  std::vector<std::string> names;
  errno = 0;
  while (const dirent* entry = ::readdir(stream)) {
    const std::string_view name(entry->d_name);
    if (name != "." && name != "..") names.emplace_back(name);
    errno = 0;
  }
  const int error = errno;
  ::closedir(stream);
  if (error != 0) return systemFailure("cannot list", directory, error);
  std::sort(names.begin(), names.end());
  return names;
}

Result<void> remove(const std::string& path) {
  if (::unlink(path.c_str()) != 0) return systemFailure("cannot remove", path, errno);
  return {};
}

Result<void> move(const std::string& from, const std::string& to) {
  if (::rename(from.c_str(), to.c_str()) != 0) return systemFailure("cannot move", from, errno);
  return {};
}

Result<void> createEmpty(const std::string& path, unsigned mode) {
  const int flags = O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW;
  const FileDescriptor file(::open(path.c_str(), flags, static_cast<mode_t>(mode)));
  if (!file) return systemFailure("cannot create", path, errno);
  giveToOwnerOfDirectory(file.get(), path);
  return {};
}

Result<void> append(const std::string& path, std::span<const std::uint8_t> bytes) {
  const FileDescriptor file(::open(path.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (!file) return systemFailure("cannot open", path, errno);
  struct stat status {};
  if (::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return failure("files", static_cast<int>(Code::other), path + " is not a regular file");
  }
  if (!writeAll(file.get(), bytes)) {
    auto error = systemFailure("cannot write", path, errno);
    error.value().code = static_cast<int>(Code::incomplete);
    return error;
  }
  return {};
}

Result<std::string> setAside(const std::string& path) {
  std::string oldest;
  std::optional<TimeValue> oldestTime;
  for (int number = 1; number <= kKeptSetAsideFiles; ++number) {
    const std::string candidate = path + ".corrupt-" + std::to_string(number);
    const auto time = modificationTime(candidate);
    const bool older = time && (!oldestTime || secondsFromTimeValue(*time) < secondsFromTimeValue(*oldestTime));
    if (!time || older) {
      oldest = candidate;
      oldestTime = time;
    }
    if (!time) break;
  }
  if (::rename(path.c_str(), oldest.c_str()) != 0) return systemFailure("cannot set aside", path, errno);
  return oldest;
}

bool isTrustworthy(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0 || !onlyTrustedMayWrite(status)) return false;
  if (!directoryIsTrustworthy(parentOf(path))) return false;
  // Behind a symbolic link stands another directory, whose writers could put another file there.
  char* resolved = ::realpath(path.c_str(), nullptr);
  if (resolved == nullptr) return false;
  const std::string target(resolved);
  std::free(resolved);
  return directoryIsTrustworthy(parentOf(target));
}

}  // namespace velk::files
