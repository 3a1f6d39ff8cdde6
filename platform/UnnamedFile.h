// A file without a name: large bytes that need not be in memory and leave nothing behind, however the process ends.
#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <string>

#include "foundation/Error.h"
#include "platform/FileDescriptor.h"

namespace velk {

/// Filled by one thread; then it changes no more and any thread may read it. The space is given back with it.
class UnnamedFile {
 public:
  /// In the file system of that directory, readable by this process alone. Creates the directory if need be.
  [[nodiscard]] static Result<std::unique_ptr<UnnamedFile>> make(const std::string& directory);

  /// A file that is open already, whatever becomes of its name: its first `size` bytes.
  [[nodiscard]] static std::shared_ptr<const UnnamedFile> adopt(FileDescriptor file, std::uint64_t size);

  /// Fails when there is no room.
  [[nodiscard]] Result<void> append(std::span<const std::uint8_t> bytes);

  /// What its file system has left for this process; all there can be where the system does not say.
  [[nodiscard]] std::uint64_t availableSpace() const;

  [[nodiscard]] const FileDescriptor& file() const noexcept { return _file; }
  [[nodiscard]] std::uint64_t size() const noexcept { return _size; }

 private:
  explicit UnnamedFile(FileDescriptor file, std::uint64_t size = 0) : _file(std::move(file)), _size(size) {}

  const FileDescriptor _file;
  std::uint64_t _size;
};

}  // namespace velk
