// The collector's side of file uploads: checks each gzip body while it comes, keeps it in a file as it came, lists it
// in a database, and says "success". Knows nothing of sockets or TLS.
#pragma once

#include <cstdint>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Clock.h"
#include "tools/collector/Announcer.h"
#include "tools/collector/Collector.h"
#include "tools/collector/CollectorOptions.h"
#include "tools/collector/GzipCheck.h"
#include "tools/collector/UploadStore.h"

namespace velk::collector {

/// What one upload may cost. One above a bound is refused whole.
inline constexpr std::uint64_t kMaximumUploadBytes = std::uint64_t{4} * 1024 * 1024 * 1024;
inline constexpr std::uint64_t kMaximumUploadedFileBytes = std::uint64_t{64} * 1024 * 1024 * 1024;

/// The file's name in the target of an upload's request, unescaped. It may hold ampersands, and therefore reaches up to
/// the last parameter.
[[nodiscard]] std::string uploadedFileName(std::string_view target);

/// One upload on its way, on its connection's thread. What was not kept in the end leaves no file behind.
class IncomingUpload {
 public:
  static constexpr int kNotKept = 2;

  /// An empty path: nothing is kept.
  explicit IncomingUpload(std::string path);
  ~IncomingUpload();
  IncomingUpload(const IncomingUpload&) = delete;
  IncomingUpload& operator=(const IncomingUpload&) = delete;

  /// False when the rest need not come: `finish` says why.
  [[nodiscard]] bool take(std::string_view bytes);
  /// The size of the file when it came whole and sound. An error with the code `kNotKept` is the collector's own.
  [[nodiscard]] Result<std::uint64_t> finish();

  [[nodiscard]] const std::string& path() const { return _path; }
  [[nodiscard]] std::uint64_t wireBytes() const { return _wireBytes; }

 private:
  [[nodiscard]] Result<void> add(std::string_view bytes);
  [[nodiscard]] Failure notKept() const;

  const std::string _path;
  std::ofstream _file;
  GzipCheck _check{kMaximumUploadedFileBytes};
  std::uint64_t _wireBytes = 0;
  std::optional<Error> _refusal;
};

/// Made by the program before the server, and outlives it. Any thread.
class Uploads {
 public:
  /// `store` may be null (nothing is kept); it and the others outlive this.
  Uploads(const CollectorOptions& options, UploadStore* store, Announcer& announcer, const Clock& clock)
      : _options(options), _store(store), _announcer(announcer), _clock(clock) {}

  [[nodiscard]] std::unique_ptr<IncomingUpload> begin() const;
  /// `whole`: all of the body came, and `upload` took it.
  [[nodiscard]] Answer end(IncomingUpload& upload, bool whole, const std::string& target);

 private:
  [[nodiscard]] Answer refuse(int status, const std::string& reason);
  [[nodiscard]] Answer cannotKeep(const Error& error);

  const CollectorOptions& _options;
  UploadStore* const _store;
  Announcer& _announcer;
  const Clock& _clock;
};

}  // namespace velk::collector
