// Where the collector keeps uploaded files: each as it came, in a directory, and a line for each in an SQLite file.
//   uploads (id, received, name, target, wire_bytes, file_bytes, file)
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "tools/collector/Database.h"

namespace velk::collector {

struct KeptUpload {
  std::string path;    ///< of the file that came, in the store's directory; it is given a name there
  std::string name;    ///< as the sender calls it
  std::string target;  ///< of the request
  std::uint64_t wireBytes = 0;
  std::uint64_t fileBytes = 0;
};

/// Any thread; uploads are listed one after the other.
class UploadStore {
 public:
  /// Opens or makes the directory (0700) and the file (0600) in `stateDirectory`.
  [[nodiscard]] static Result<std::unique_ptr<UploadStore>> open(const std::string& stateDirectory);
  ~UploadStore();
  UploadStore(const UploadStore&) = delete;
  UploadStore& operator=(const UploadStore&) = delete;

  [[nodiscard]] const std::string& directory() const { return _directory; }
  /// Answers its number. The file is then called "NUMBER-NAME", with everything but letters, digits, dots and dashes
  /// replaced.
  [[nodiscard]] Result<std::int64_t> keep(const KeptUpload& upload, TimeValue received);

 private:
  explicit UploadStore(std::string directory) : _directory(std::move(directory)) {}
  [[nodiscard]] Result<void> prepare(const std::string& databasePath);
  [[nodiscard]] Result<std::int64_t> insertAndMoveLocked(const KeptUpload& upload, TimeValue received)
      VELK_REQUIRES(_lock);
  [[nodiscard]] Result<std::int64_t> insertLocked(const KeptUpload& upload, TimeValue received) VELK_REQUIRES(_lock);

  const std::string _directory;
  // Held while SQLite works: that is what it is for.
  Lock _lock;
  Database _database VELK_GUARDED_BY(_lock);
  Statement _insert VELK_GUARDED_BY(_lock);
};

}  // namespace velk::collector
