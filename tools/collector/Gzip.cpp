#include "tools/collector/Gzip.h"

#include <zlib.h>

#include <algorithm>
#include <memory>

namespace velk::collector {
namespace {

constexpr int kGzipOnly = 15 + 16;  // the largest window, in a gzip wrapper
constexpr std::size_t kFirstGuess = 16 * 1024;

struct InflateEnd {
  void operator()(z_stream* stream) const noexcept { inflateEnd(stream); }
};

Failure refused(const char* why) { return failure("gzip", 1, why); }

}  // namespace

Result<std::string> unpackGzip(std::string_view packed, std::size_t maximumBytes) {
  z_stream stream{};
  if (inflateInit2(&stream, kGzipOnly) != Z_OK) return failure("gzip", 2, "no memory to unpack the body");
  const std::unique_ptr<z_stream, InflateEnd> end(&stream);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(packed.data()));
  stream.avail_in = static_cast<uInt>(packed.size());

  std::string plain;
  int state = Z_OK;
  while (state == Z_OK) {
    const std::size_t used = plain.size();
    if (used > maximumBytes) return refused("the body unpacks to more than is taken");
    // One byte above the bound tells "full" from "too large".
    plain.resize(std::min(maximumBytes + 1, std::max({kFirstGuess, packed.size() * 4, used * 2})));
    stream.next_out = reinterpret_cast<Bytef*>(plain.data() + used);
    stream.avail_out = static_cast<uInt>(plain.size() - used);
    state = inflate(&stream, Z_NO_FLUSH);
    plain.resize(plain.size() - stream.avail_out);
    if (state == Z_OK && stream.avail_out != 0) return refused("the gzip body is cut short");
  }
  if (state == Z_BUF_ERROR) return refused("the gzip body is cut short");
  if (state != Z_STREAM_END) return refused("the body is not gzip");
  if (plain.size() > maximumBytes) return refused("the body unpacks to more than is taken");
  if (stream.avail_in != 0) return refused("there are bytes after the gzip body");
  return plain;
}

}  // namespace velk::collector
