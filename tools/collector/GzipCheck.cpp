#include "tools/collector/GzipCheck.h"

#include <zlib.h>

#include <vector>

namespace velk::collector {
namespace {

constexpr int kGzipOnly = 15 + 16;  // the largest window, in a gzip wrapper
constexpr std::size_t kScratchBytes = 64 * 1024;

Failure refused(const char* why) { return failure("gzip", 1, why); }

}  // namespace

struct GzipCheck::Stream {
  z_stream state{};
  bool isUsable = false;
  bool hasEnded = false;
  std::uint64_t bytes = 0;
  std::vector<std::uint8_t> scratch = std::vector<std::uint8_t>(kScratchBytes);
};

GzipCheck::GzipCheck(std::uint64_t maximumBytes) : _maximumBytes(maximumBytes), _stream(std::make_unique<Stream>()) {
  _stream->isUsable = inflateInit2(&_stream->state, kGzipOnly) == Z_OK;
}

GzipCheck::~GzipCheck() {
  if (_stream->isUsable) inflateEnd(&_stream->state);
}

Result<void> GzipCheck::take(std::string_view packed) {
  if (packed.empty()) return {};
  if (!_stream->isUsable) return failure("gzip", 2, "no memory to unpack the body");
  if (_stream->hasEnded) return refused("there are bytes after the gzip body");
  z_stream& state = _stream->state;
  state.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(packed.data()));
  state.avail_in = static_cast<uInt>(packed.size());
  int result = Z_OK;
  do {
    state.next_out = _stream->scratch.data();
    state.avail_out = static_cast<uInt>(_stream->scratch.size());
    result = inflate(&state, Z_NO_FLUSH);
    _stream->bytes += _stream->scratch.size() - state.avail_out;
    if (_stream->bytes > _maximumBytes) return refused("the body unpacks to more than is taken");
  } while (result == Z_OK && (state.avail_in > 0 || state.avail_out == 0));
  if (result == Z_STREAM_END) {
    _stream->hasEnded = true;
    if (state.avail_in > 0) return refused("there are bytes after the gzip body");
  } else if (result != Z_OK && result != Z_BUF_ERROR) {
    return refused("the body is not gzip");
  }
  return {};
}

Result<std::uint64_t> GzipCheck::finish() const {
  if (!_stream->hasEnded) return refused("the gzip body is cut short");
  return _stream->bytes;
}

}  // namespace velk::collector
