#include "foundation/Uuid.h"

#include <cstring>
#include <random>

namespace velk {

Uuid randomUuid() {
  Uuid uuid{};
  std::random_device device;  // the kernel's random numbers, not a generator seeded from them
  for (std::size_t at = 0; at < uuid.size(); at += sizeof(std::uint32_t)) {
    const std::uint32_t word = device();
    std::memcpy(uuid.data() + at, &word, sizeof(word));
  }
  uuid[6] = static_cast<std::uint8_t>((uuid[6] & 0x0FU) | 0x40U);
  uuid[8] = static_cast<std::uint8_t>((uuid[8] & 0x3FU) | 0x80U);
  return uuid;
}

std::string uuidText(const Uuid& uuid) {
  constexpr const char* kDigits = "0123456789ABCDEF";
  std::string text;
  text.reserve(36);
  for (std::size_t at = 0; at < uuid.size(); ++at) {
    if (at == 4 || at == 6 || at == 8 || at == 10) text.push_back('-');
    text.push_back(kDigits[uuid[at] >> 4U]);
    text.push_back(kDigits[uuid[at] & 0xFU]);
  }
  return text;
}

}  // namespace velk
