#include "tools/collector/DigestKey.h"

#include <algorithm>
#include <cstdint>
#include <span>

#include "foundation/Text.h"
#include "platform/Cryptography.h"
#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr std::size_t kMaximumKeyBytes = 64 * 1024;

bool isHexadecimal(std::string_view text) {
  return !text.empty() && text.size() % 2 == 0 &&
         std::all_of(text.begin(), text.end(), [](char digit) { return hexadecimalDigit(digit) >= 0; });
}

ByteData bytesFromHexadecimal(std::string_view text) {
  ByteData bytes;
  bytes.reserve(text.size() / 2);
  for (std::size_t at = 0; at + 1 < text.size(); at += 2) {
    bytes.push_back(static_cast<std::uint8_t>(hexadecimalDigit(text[at]) * 16 + hexadecimalDigit(text[at + 1])));
  }
  return bytes;
}

// Takes as long for a near miss as for a far one, so that a digest cannot be guessed digit by digit.
bool equalInConstantTime(std::string_view left, std::string_view right) {
  if (left.size() != right.size()) return false;
  unsigned difference = 0;
  for (std::size_t at = 0; at < left.size(); ++at) {
    difference |= static_cast<unsigned>(static_cast<unsigned char>(left[at]) ^ static_cast<unsigned char>(right[at]));
  }
  return difference == 0;
}

}  // namespace

Result<ByteData> digestKeyFromArgument(const std::string& argument) {
  if (isHexadecimal(argument)) return bytesFromHexadecimal(argument);
  Result<ByteData> key = files::read(argument, kMaximumKeyBytes);
  if (key && key->empty()) return failure("digest", 1, "the key file " + argument + " is empty");
  return key;
}

Result<void> checkDigest(const ByteData& key, std::string_view json, const std::string* header) {
  if (header == nullptr)
    return failure("digest", 1, "the post has no X-Velk-DIGEST header, and this collector wants one");
  const std::span<const std::uint8_t> bytes(reinterpret_cast<const std::uint8_t*>(json.data()), json.size());
  const auto digest = hmacSha1(key, bytes);
  if (!equalInConstantTime(hexadecimal(digest), *header)) {
    return failure("digest", 2, "the X-Velk-DIGEST header does not fit the body");
  }
  return {};
}

}  // namespace velk::collector
