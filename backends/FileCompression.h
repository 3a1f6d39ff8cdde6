// The gzip form of a file that may be far larger than the memory it should cost. Used by the upload backend; blocks
// for as long as reading, compressing and writing take.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "backends/ProcessUploads.h"
#include "backends/VelkReportingBackend.h"
#include "platform/UnnamedFile.h"

namespace velk {

/// Files up to this size are compressed in memory.
inline constexpr std::uint64_t kMaximumSizeInMemory = 4 * 1024 * 1024;

struct CompressedFile {
  enum class Outcome : std::uint8_t {
    compressed,
    nothingToRead,  ///< the file is empty, or could not be read
    failed,         ///< compressing failed, or there was no room; logged
    abandoned,      ///< the process is about to end
  };
  Outcome outcome = Outcome::failed;
  // One of the two is there when the file was compressed.
  std::shared_ptr<const std::string> inMemory;
  std::shared_ptr<const UnnamedFile> onDisk;

  [[nodiscard]] std::uint64_t size() const {
    if (inMemory) return inMemory->size();
    return onDisk ? onDisk->size() : 0;
  }
};

/// Reads at most `size` bytes from the file's beginning, whatever becomes of the file meanwhile. It is compressed piece
/// by piece, in turns with others, and given up when `uploads` stops. What is too large for memory is kept in a file
/// without a name in the file system of `directory`, as long as its user's share of the disk lasts; that is given back
/// with the file.
[[nodiscard]] CompressedFile gzipFile(const FileUpload& upload, std::uint64_t size, const std::string& directory,
                                      const std::shared_ptr<ProcessUploads>& uploads);

}  // namespace velk
