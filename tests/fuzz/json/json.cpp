// What a hostile server's body, a suite on disk or a line for the tools can hold. Whatever is read is written, read
// again and written again, and must come out the same; indented it must be what walking the value gives.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "foundation/Json.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velk;
  const auto value = json::parse({reinterpret_cast<const char*>(data), size}, json::Extensions::tagged);
  if (!value) return 0;
  std::string first;
  if (!json::write(*value, first, json::Extensions::tagged)) return 0;  // a date beyond what a double holds
  const auto again = json::parse(first, json::Extensions::tagged);
  std::string second;
  if (!again || !json::write(*again, second, json::Extensions::tagged) || first != second) std::abort();
  std::string walked;
  std::string indented;
  if (!json::writePretty(*value, walked, json::Extensions::tagged)) std::abort();
  json::appendPretty(first, indented);
  if (walked != indented) std::abort();
  return 0;
}
