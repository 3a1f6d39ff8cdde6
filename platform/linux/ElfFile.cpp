#include "platform/linux/ElfFile.h"

#include <elf.h>
#include <fcntl.h>
#include <link.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>
#include <vector>

#include "platform/FileDescriptor.h"

namespace velk {
namespace {

using Header = ElfW(Ehdr);
using Segment = ElfW(Phdr);

constexpr unsigned char kNativeClass = sizeof(void*) == 8 ? ELFCLASS64 : ELFCLASS32;

Failure refusal(const std::string& path, const char* what) { return failure("ElfFile", ENOEXEC, path + " " + what); }

bool readAt(int descriptor, void* target, std::size_t size, std::uint64_t offset) {
  return ::pread(descriptor, target, size, static_cast<off_t>(offset)) == static_cast<ssize_t>(size);
}

bool isWithin(std::uint64_t offset, std::uint64_t size, std::uint64_t whole) {
  return offset <= whole && size <= whole - offset;
}

}  // namespace

Result<void> checkElfFile(const std::string& path) {
  const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOFOLLOW));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0) {
    const int error = errno;
    return failure("ElfFile", error, path + ": " + std::generic_category().message(error));
  }
  const auto size = static_cast<std::uint64_t>(status.st_size);
  Header header{};
  if (!readAt(file.get(), &header, sizeof header, 0) || std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0 ||
      header.e_ident[EI_CLASS] != kNativeClass || header.e_type != ET_DYN || header.e_phentsize != sizeof(Segment)) {
    return refusal(path, "is not a shared object of this machine");
  }
  // The count is 16 bits wide, so this stays small.
  std::vector<Segment> segments(header.e_phnum);
  const std::size_t segmentBytes = segments.size() * sizeof(Segment);
  if (!isWithin(header.e_phoff, segmentBytes, size) ||
      !readAt(file.get(), segments.data(), segmentBytes, header.e_phoff)) {
    return refusal(path, "is cut short");
  }
  for (const auto& segment : segments) {
    if (segment.p_filesz > 0 && !isWithin(segment.p_offset, segment.p_filesz, size))
      return refusal(path, "is cut short");
  }
  return {};
}

}  // namespace velk
