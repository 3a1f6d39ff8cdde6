// A file descriptor with an owner.
#pragma once

#include <utility>

namespace velk {

/// Closes what it owns. Move-only.
class FileDescriptor {
 public:
  FileDescriptor() noexcept = default;
  explicit FileDescriptor(int descriptor) noexcept : _descriptor(descriptor) {}
  FileDescriptor(FileDescriptor&& other) noexcept : _descriptor(std::exchange(other._descriptor, -1)) {}
  FileDescriptor& operator=(FileDescriptor&& other) noexcept {
    std::swap(_descriptor, other._descriptor);
    return *this;
  }
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  ~FileDescriptor();

  [[nodiscard]] int get() const noexcept { return _descriptor; }
  [[nodiscard]] explicit operator bool() const noexcept { return _descriptor >= 0; }
  /// Gives the descriptor up to the caller.
  [[nodiscard]] int release() noexcept { return std::exchange(_descriptor, -1); }

 private:
  int _descriptor = -1;
};

}  // namespace velk
