#include "backends/FileCompression.h"

#include <zlib.h>

#include <algorithm>
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

/// A stream that is fed piece by piece. Its own counters may be 32 bits wide, so nobody looks at them.
class GzipStream {
 public:
  GzipStream(UnnamedFile& output, ProcessUploads& uploads) : _output(output), _uploads(uploads), _piece(kPieceBytes) {}
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
      if (!keep(_piece.size() - _stream.avail_out)) return false;
    } while (flush == Z_FINISH ? result != Z_STREAM_END : _stream.avail_out == 0);
    return true;
  }

  int compressPiece(int flush) {
    const ProcessUploads::CompressionTurn turn(_uploads);
    return deflate(&_stream, flush);
  }

  bool keep(std::size_t bytes) {
    const auto kept = _output.append(std::span(_piece).first(bytes));
    if (!kept) log::error(backend_texts::kUploadNotKept, kept.error());
    return kept.has_value();
  }

  UnnamedFile& _output;
  ProcessUploads& _uploads;
  std::vector<std::uint8_t> _piece;
  z_stream _stream{};
  bool _isSetUp = false;
};

CompressedFile inMemory(const FileDescriptor& file, std::uint64_t size) {
  std::vector<std::uint8_t> bytes(size);
  const auto read = readAt(file, 0, bytes);
  if (!read || *read == 0) return {Outcome::nothingToRead, nullptr, nullptr};
  auto compressed = gzipDeflate(std::span(bytes).first(*read));
  if (!compressed) return {};
  return {Outcome::compressed, std::make_shared<const std::string>(std::move(*compressed)), nullptr};
}

CompressedFile onDisk(const FileDescriptor& file, std::uint64_t size, const std::string& directory,
                      ProcessUploads& uploads) {
  auto output = UnnamedFile::make(directory);
  if (!output) {
    log::error(backend_texts::kUploadNotKept, output.error());
    return {};
  }
  GzipStream stream(**output, uploads);
  if (!stream.setUp()) return {};
  std::vector<std::uint8_t> piece(kPieceBytes);
  std::uint64_t done = 0;
  while (done < size) {
    if (uploads.isStopping()) return {Outcome::abandoned, nullptr, nullptr};
    const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(size - done, piece.size()));
    const auto read = readAt(file, done, std::span(piece).first(wanted));
    if (!read) return {Outcome::nothingToRead, nullptr, nullptr};
    if (*read == 0) break;
    done += *read;
    if (!stream.add(std::span(piece).first(*read))) return {};
  }
  if (done == 0) return {Outcome::nothingToRead, nullptr, nullptr};
  if (!stream.finish()) return {};
  log::standard(backend_texts::kCompressed, done, (*output)->size());
  return {Outcome::compressed, nullptr, std::move(*output)};
}

}  // namespace

CompressedFile gzipFile(const FileDescriptor& file, std::uint64_t size, const std::string& directory,
                        ProcessUploads& uploads) {
  if (size == 0) return {Outcome::nothingToRead, nullptr, nullptr};
  return size <= kMaximumSizeInMemory ? inMemory(file, size) : onDisk(file, size, directory, uploads);
}

}  // namespace velk
