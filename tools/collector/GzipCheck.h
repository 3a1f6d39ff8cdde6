// Looks at a gzip body while it comes, without keeping what it unpacks to.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "foundation/Error.h"

namespace velk::collector {

/// One gzip member (RFC 1952), of any size. One thread at a time.
class GzipCheck {
 public:
  /// Refuses bodies that unpack to more.
  explicit GzipCheck(std::uint64_t maximumBytes);
  ~GzipCheck();
  GzipCheck(const GzipCheck&) = delete;
  GzipCheck& operator=(const GzipCheck&) = delete;

  /// The next bytes. Fails with a sentence as soon as it is clear that the body is not what it should be.
  [[nodiscard]] Result<void> take(std::string_view packed);
  /// How many bytes the whole body unpacks to; fails when it ends too early.
  [[nodiscard]] Result<std::uint64_t> finish() const;

 private:
  struct Stream;
  const std::uint64_t _maximumBytes;
  std::unique_ptr<Stream> _stream;
};

}  // namespace velk::collector
