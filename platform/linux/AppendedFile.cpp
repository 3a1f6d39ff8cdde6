#include "platform/AppendedFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <array>
#include <cassert>
#include <cerrno>
#include <system_error>

#include "platform/Files.h"

namespace velk {
namespace {

Failure systemFailure(const char* what, const std::string& path, files::Code code) {
  return failure("files", static_cast<int>(code),
                 std::string(what) + " " + path + ": " + std::generic_category().message(errno));
}

bool lastByteIsALineBreak(int file, off_t size) {
  char last = '\n';
  return size == 0 || ::pread(file, &last, 1, size - 1) != 1 || last == '\n';
}

/// Drops what was written from the front of the parts.
void advance(iovec*& part, int& count, std::size_t written) {
  while (count > 0 && written >= part->iov_len) {
    written -= part->iov_len;
    ++part;
    --count;
  }
  if (count == 0) return;
  part->iov_base = static_cast<char*>(part->iov_base) + written;
  part->iov_len -= written;
}

}  // namespace

Result<std::size_t> AppendedFile::open(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) {
    auto error = systemFailure("cannot open", path, files::Code::notFound);
    // The open file has been moved or removed: its space is given back.
    _file = FileDescriptor();
    return error;
  }
  // While it is open, its number is given to no other file.
  if (_file && status.st_dev == _device && status.st_ino == _inode) return static_cast<std::size_t>(status.st_size);
  _file = FileDescriptor(::open(path.c_str(), O_RDWR | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
  if (!_file || ::fstat(_file.get(), &status) != 0) return systemFailure("cannot open", path, files::Code::other);
  if (!S_ISREG(status.st_mode)) {
    _file = FileDescriptor();
    return failure("files", static_cast<int>(files::Code::other), path + " is not a regular file");
  }
  _path = path;
  _device = status.st_dev;
  _inode = status.st_ino;
  _endsWithinALine = !lastByteIsALineBreak(_file.get(), status.st_size);
  return static_cast<std::size_t>(status.st_size);
}

Result<void> AppendedFile::append(std::initializer_list<std::string_view> parts) {
  assert(parts.size() <= kMaximumParts);
  std::array<iovec, kMaximumParts + 1> vectors{};
  int count = 0;
  char lineBreak = '\n';
  if (_endsWithinALine) vectors[static_cast<std::size_t>(count++)] = {&lineBreak, 1};
  for (const auto part : parts) {
    vectors[static_cast<std::size_t>(count++)] = {const_cast<char*>(part.data()), part.size()};
  }
  iovec* left = vectors.data();
  while (count > 0) {
    const ssize_t written = ::writev(_file.get(), left, count);
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return systemFailure("cannot write", _path, files::Code::incomplete);
    if (written > 0) _endsWithinALine = true;
    advance(left, count, static_cast<std::size_t>(written));
  }
  _endsWithinALine = false;
  return {};
}

}  // namespace velk
