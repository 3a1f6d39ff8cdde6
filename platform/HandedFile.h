// Files that one process opens and another one reads: how they are opened in order to be handed over and removed
// afterwards by the client's library and the tools, and how the daemon looks at what it was handed.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "foundation/Error.h"
#include "platform/FileDescriptor.h"

namespace velk {

/// A file that was opened in order to hand it over. It keeps the file itself and the directory that it was found in, so
/// that later on nothing else can be taken for it. Any thread, one at a time.
class FileToHandOver {
 public:
  /// Opens for reading without following a link, without waiting (a FIFO) and without leaking into programs that are
  /// started meanwhile. What is no regular file and cannot be opened so (a link, a socket, what may not be read) is
  /// handed over as a descriptor of its path alone, so that the receiver sees what it is and says so. The error's code
  /// is the system's error number.
  [[nodiscard]] static Result<FileToHandOver> open(const std::string& path);

  /// One more descriptor of the file, for the receiver.
  [[nodiscard]] Result<FileDescriptor> descriptor() const;

  /// Removes the file, with this process's own rights, if its name still stands for it; a file that has taken its
  /// place stays. Fails as well when it may not be removed.
  [[nodiscard]] Result<void> removeIfUnchanged() const;

 private:
  FileToHandOver(std::string path, std::string name, FileDescriptor directory, FileDescriptor file);

  std::string _path;
  std::string _name;
  FileDescriptor _directory;
  FileDescriptor _file;
};

/// The size of a regular file; nothing for everything else, and for no descriptor at all. May wait for the file's
/// file system.
[[nodiscard]] std::optional<std::uint64_t> sizeOfRegularFile(const FileDescriptor& file);

/// Reads what fits into `buffer` from `offset` on, less at the end of the file. May wait for the file's file system.
[[nodiscard]] Result<std::size_t> readAt(const FileDescriptor& file, std::uint64_t offset,
                                         std::span<std::uint8_t> buffer);

}  // namespace velk
