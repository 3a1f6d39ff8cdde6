// What a stranger can send to the collector's dashboard, or to a backend that waits for acknowledgements. What is read
// as a datagram is written again, and must come out the same; its line for a log stays within its bound.
#include <algorithm>
#include <array>
#include <cstdlib>

#include "backends/DashboardText.h"
#include "tools/collector/DashboardListener.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velk;
  const std::span<const std::uint8_t> bytes(data, size);
  if (dashboard::acknowledgedEventNumber(bytes).has_value() != (size >= 62)) std::abort();
  const std::string line = writeLocalLog(bytes);
  if (line.size() > 1151 || line.empty() != (size < 64)) std::abort();
  const auto datagram = collector::readDatagram(bytes);
  if (!datagram) return 0;
  if (datagram->header.length != size || datagram->text.size() + 64 != size || size > 1087) std::abort();
  std::array<std::uint8_t, dashboard::kHeaderBytes> header{};
  dashboard::writeHeader(datagram->header, header);
  // The third byte is a constant, which nobody reads.
  header[2] = bytes[2];
  if (!std::equal(header.begin(), header.end(), bytes.begin())) std::abort();
  return 0;
}
