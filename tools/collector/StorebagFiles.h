// The directory of signed storebag envelopes that a collector serves: one file per storebag name.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::collector {

struct StorebagFile {
  ByteData envelope;
  /// Whole seconds since 1970.
  std::int64_t modified = 0;
};

/// Any thread. Files are read afresh for each request, so that a bag that is signed anew is served at once.
class StorebagFiles {
 public:
  explicit StorebagFiles(std::string directory) : _directory(std::move(directory)) {}

  /// Fails when there is no such bag; a name that is none (a path, a hidden file) is no bag either.
  [[nodiscard]] Result<StorebagFile> find(std::string_view name) const;

 private:
  const std::string _directory;
};

/// Letters, digits, ".", "-" and "_", at most 64 of them, the first not a dot: never a way out of the directory.
[[nodiscard]] bool isStorebagName(std::string_view name);

}  // namespace velk::collector
