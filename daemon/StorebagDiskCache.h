// The storebags on disk: one file per storebag name, holding the signed envelope exactly as it was received. Used by
// the storebag service, which serialises all access; an in-memory twin stands in for it in tests.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"

namespace velk {

/// `name` is always a row of the storebag table, never text from outside. The storebag lock guards the calls, except
/// `modificationDate`, which may be asked at any time.
class StorebagDiskCache {
 public:
  virtual ~StorebagDiskCache() = default;
  /// Replaces the file as a whole. False: nothing was changed, and the failure has been logged.
  virtual bool saveStorebagToDisk(const std::string& name, std::span<const std::uint8_t> envelope) = 0;
  /// Nothing when there is no file or it cannot be read, which has then been logged.
  [[nodiscard]] virtual std::optional<ByteData> loadStorebagFromDisk(const std::string& name) = 0;
  [[nodiscard]] virtual std::optional<TimeValue> modificationDate(const std::string& name) const = 0;
  /// Makes sure that the daemon's user can reach the file: lifts what somebody may have put on it or on its
  /// directories. Failures, usual as long as there is no file, are logged and otherwise ignored.
  virtual void setStorageClassProtectionLevel(const std::string& name) = 0;
  /// Takes a file that cannot be used out of the way, where somebody may look at it.
  virtual void setAside(const std::string& name) = 0;
};

/// In `directory`, which is made (0700, files 0600) when first needed. Protection here is the mode of the file, of the
/// directory and of the one above it.
[[nodiscard]] std::unique_ptr<StorebagDiskCache> makeStorebagDiskCache(std::string directory);

}  // namespace velk
