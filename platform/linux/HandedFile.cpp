#include "platform/HandedFile.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>

namespace velk {

Result<FileDescriptor> openToHandOver(const std::string& path) {
  FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (file) return file;
  const int reason = errno;
  if (reason == ELOOP || reason == ENXIO) file = FileDescriptor(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (file) return file;
  return failure("HandedFile", reason, path + ": " + std::strerror(reason));
}

}  // namespace velk
