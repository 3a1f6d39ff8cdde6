// A file that grows by entries and stays open between them: an append costs one look at the path and one write.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "platform/FileDescriptor.h"

namespace velk {

/// Not thread-safe.
class AppendedFile {
 public:
  static constexpr std::size_t kMaximumParts = 4;

  /// Opens the regular file at `path` unless it is the one that is open: another file may have been put there, or none
  /// may be there any more. Symbolic links are not followed, and nothing is created. Returns the file's size.
  [[nodiscard]] Result<std::size_t> open(const std::string& path);

  /// Appends the parts as one entry; the last of them ends it with a line break. An entry that was cut off before, by
  /// this process or a former one, gets its line break first. The error: not all could be written.
  [[nodiscard]] Result<void> append(std::initializer_list<std::string_view> parts);

 private:
  FileDescriptor _file;
  std::string _path;
  std::uint64_t _device = 0;
  std::uint64_t _inode = 0;
  bool _endsWithinALine = false;
};

}  // namespace velk
