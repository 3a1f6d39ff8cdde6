#include "backends/Compression.h"

#include <zlib.h>

#include <limits>

#include "backends/LogTexts.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr int kDefaultLevel = -1;
constexpr int kGzipWindowBits = 31;  // a 15-bit window within a gzip wrapper
constexpr int kZlibWindowBits = 15;
constexpr int kMemoryLevel = 8;
constexpr const char* kZlibVersion = "1.2.11";

/// One stream over one input.
class Deflation {
 public:
  Deflation() = default;
  Deflation(const Deflation&) = delete;
  Deflation& operator=(const Deflation&) = delete;
  ~Deflation() {
    if (_isSetUp) deflateEnd(&_stream);
  }

  int setUp(bool gzip, std::span<const std::uint8_t> data) {
    // zlib counts a stream's input in 32 bits.
    if (data.size() > std::numeric_limits<uInt>::max()) return Z_STREAM_ERROR;
    _stream.next_in = const_cast<Bytef*>(data.data());  // zlib only reads it
    _stream.avail_in = static_cast<uInt>(data.size());
    const int result = deflateInit2_(&_stream, kDefaultLevel, Z_DEFLATED, gzip ? kGzipWindowBits : kZlibWindowBits,
                                     kMemoryLevel, Z_DEFAULT_STRATEGY, kZlibVersion, sizeof(_stream));
    _isSetUp = result == Z_OK;
    return result;
  }

  int run(std::string& output) {
    output.resize(deflateBound(&_stream, _stream.avail_in));
    int result = Z_OK;
    while (result == Z_OK) {
      const std::size_t left = output.size() - _stream.total_out;
      _stream.next_out = reinterpret_cast<Bytef*>(output.data()) + _stream.total_out;
      _stream.avail_out = static_cast<uInt>(std::min<std::size_t>(left, std::numeric_limits<uInt>::max()));
      result = deflate(&_stream, Z_FINISH);
    }
    output.resize(_stream.total_out);
    return result;
  }

  [[nodiscard]] const char* message() const { return _stream.msg; }

 private:
  z_stream _stream{};
  bool _isSetUp = false;
};

}  // namespace

std::optional<std::string> compressDataWithZlibOrGzip(bool gzip, std::span<const std::uint8_t> data) {
  if (data.empty()) {
    log::standard(backend_texts::kCompressEmpty);
    return std::nullopt;
  }
  Deflation deflation;
  if (const int result = deflation.setUp(gzip, data); result != Z_OK) {
    log::standard(backend_texts::kCompressSetupError, deflateSetupErrorText(result), deflation.message());
    return std::nullopt;
  }
  std::string output;
  if (const int result = deflation.run(output); result != Z_STREAM_END) {
    log::standard(backend_texts::kCompressError, deflateErrorText(result), deflation.message());
    return std::nullopt;
  }
  log::standard(backend_texts::kCompressed, data.size(), output.size());
  return output;
}

std::optional<std::string> gzipDeflate(std::span<const std::uint8_t> data) {
  return compressDataWithZlibOrGzip(true, data);
}

std::optional<std::string> gzipDeflate(std::string_view data) {
  return gzipDeflate(std::span(reinterpret_cast<const std::uint8_t*>(data.data()), data.size()));
}

const char* deflateSetupErrorText(int result) noexcept {
  switch (result) {
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    case Z_MEM_ERROR:
      return "Insufficient memory.";
    case Z_STREAM_ERROR:
      return "Invalid parameter passed in to function.";
    default:
      return "Unknown error code.";
  }
}

const char* deflateErrorText(int result) noexcept {
  switch (result) {
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    case Z_BUF_ERROR:
      return "Ran out of output buffer for writing compressed bytes.";
    case Z_MEM_ERROR:
      return "Memory could not be allocated for processing.";
    case Z_DATA_ERROR:
      return "The deflate data was invalid or incomplete.";
    case Z_STREAM_ERROR:
      return "The stream state was inconsistent (e.g., next_in or next_out was NULL).";
    case Z_ERRNO:
      return "Error occured while reading file.";
    default:
      return "Unknown error code.";
  }
}

}  // namespace velk
