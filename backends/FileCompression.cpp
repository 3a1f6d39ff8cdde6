#include "backends/FileCompression.h"

#include <zlib.h>

#include <algorithm>
#include <functional>
#include <utility>
#include <vector>

#include "backends/Compression.h"
#include "backends/LogTexts.h"
#include "platform/HandedFile.h"
#include "platform/Log.h"

namespace velk {

namespace {

using Outcome = CompressedFile::Outcome;

constexpr std::size_t kPieceBytes = 256 * 1024;
constexpr int kGzipWindowBits = 31;
constexpr int kMemoryLevel = 8;

/// Takes compressed bytes; false, and a line in the log, when they cannot be kept.
using Keep = std::function<bool(std::span<const std::uint8_t>)>;

/// A stream that is fed piece by piece. Its own counters may be 32 bits wide, so nobody looks at them.
class GzipStream {
 public:
  GzipStream(ProcessUploads& uploads, ProcessUploads::User user, Keep keep)
      : _uploads(uploads), _user(user), _keep(std::move(keep)), _piece(kPieceBytes) {}
  ~GzipStream() {
    if (_isSetUp) deflateEnd(&_stream);
  }
  GzipStream(const GzipStream&) = delete;
  GzipStream& operator=(const GzipStream&) = delete;

  [[nodiscard]] bool setUp() {
    const int result =
        deflateInit2(&_stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kGzipWindowBits, kMemoryLevel, Z_DEFAULT_STRATEGY);
    _isSetUp = result == Z_OK;
    if (!_isSetUp) log::standard(backend_texts::kCompressSetupError, deflateSetupErrorText(result), _stream.msg);
    return _isSetUp;
  }

  [[nodiscard]] bool add(std::span<std::uint8_t> bytes) { return run(bytes, Z_NO_FLUSH); }
  [[nodiscard]] bool finish() { return run({}, Z_FINISH); }

 private:
  bool run(std::span<std::uint8_t> bytes, int flush) {
    _stream.next_in = bytes.data();
    _stream.avail_in = static_cast<uInt>(bytes.size());
    int result = Z_OK;
    do {
      _stream.next_out = _piece.data();
      _stream.avail_out = static_cast<uInt>(_piece.size());
      result = compressPiece(flush);
      if (result != Z_OK && result != Z_STREAM_END && result != Z_BUF_ERROR) {
        log::standard(backend_texts::kCompressError, deflateErrorText(result), _stream.msg);
        return false;
      }
      const std::size_t made = _piece.size() - _stream.avail_out;
      if (made > 0 && !_keep(std::span(_piece).first(made))) return false;
    } while (flush == Z_FINISH ? result != Z_STREAM_END : _stream.avail_out == 0);
    return true;
  }

  int compressPiece(int flush) {
    const ProcessUploads::CompressionTurn turn(_uploads, _user);
    return deflate(&_stream, flush);
  }

  ProcessUploads& _uploads;
  const ProcessUploads::User _user;
  const Keep _keep;
  std::vector<std::uint8_t> _piece;
  z_stream _stream{};
  bool _isSetUp = false;
};

/// Reads and compresses in turns; `compressedBytes` answers for the log how much has been kept.
Outcome compress(const FileUpload& upload, std::uint64_t size, ProcessUploads& uploads, Keep keep,
                 const std::function<std::uint64_t()>& compressedBytes) {
  GzipStream stream(uploads, upload.user, std::move(keep));
  if (!stream.setUp()) return Outcome::failed;
  std::vector<std::uint8_t> piece(static_cast<std::size_t>(std::min<std::uint64_t>(size, kPieceBytes)));
  std::uint64_t done = 0;
  while (done < size) {
    if (uploads.isStopping()) return Outcome::abandoned;
    const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(size - done, piece.size()));
    const auto read = readAt(upload.file, done, std::span(piece).first(wanted));
    if (!read) return Outcome::nothingToRead;
    if (*read == 0) break;
    done += *read;
    if (!stream.add(std::span(piece).first(*read))) return Outcome::failed;
  }
  if (done == 0) return Outcome::nothingToRead;
  if (!stream.finish()) return Outcome::failed;
  log::standard(backend_texts::kCompressed, done, compressedBytes());
  return Outcome::compressed;
}

CompressedFile inMemory(const FileUpload& upload, std::uint64_t size, ProcessUploads& uploads) {
  const auto body = std::make_shared<std::string>();
  const auto keep = [&body](std::span<const std::uint8_t> bytes) {
    body->append(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return true;
  };
  const auto outcome = compress(upload, size, uploads, keep, [&body] { return body->size(); });
  return {outcome, outcome == Outcome::compressed ? body : nullptr, nullptr};
}

/// A compressed file, and the room that it takes.
struct KeptFile {
  KeptFile(std::unique_ptr<UnnamedFile> made, std::shared_ptr<ProcessUploads> uploads, ProcessUploads::User user)
      : room(std::move(uploads), user), file(std::move(made)) {}

  [[nodiscard]] Result<void> append(std::span<const std::uint8_t> bytes) {
    if (auto fits = room.grow(bytes.size(), file->availableSpace()); !fits) return fits;
    return file->append(bytes);
  }

  ProcessUploads::DiskRoom room;  // given back behind the file
  const std::unique_ptr<UnnamedFile> file;
};

CompressedFile onDisk(const FileUpload& upload, std::uint64_t size, const std::string& directory,
                      const std::shared_ptr<ProcessUploads>& uploads) {
  auto made = UnnamedFile::make(directory);
  if (!made) {
    log::error(backend_texts::kUploadNotKept, upload.path, made.error());
    return {};
  }
  const auto output = std::make_shared<KeptFile>(std::move(*made), uploads, upload.user);
  const auto keep = [&](std::span<const std::uint8_t> bytes) {
    const auto kept = output->append(bytes);
    if (!kept) log::error(backend_texts::kUploadNotKept, upload.path, kept.error());
    return kept.has_value();
  };
  const auto outcome = compress(upload, size, *uploads, keep, [&output] { return output->file->size(); });
  if (outcome != Outcome::compressed) return {outcome, nullptr, nullptr};
  return {outcome, nullptr, std::shared_ptr<const UnnamedFile>(output, output->file.get())};
}

}  // namespace

CompressedFile gzipFile(const FileUpload& upload, std::uint64_t size, const std::string& directory,
                        const std::shared_ptr<ProcessUploads>& uploads) {
  if (size == 0) return {Outcome::nothingToRead, nullptr, nullptr};
  return size <= kMaximumSizeInMemory ? inMemory(upload, size, *uploads) : onDisk(upload, size, directory, uploads);
}

}  // namespace velk
