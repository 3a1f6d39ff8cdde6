#include "daemon/ActiveClientCounter.h"

namespace velk {

std::uint8_t ActiveClientCounter::count(std::int32_t clientType) const noexcept {
  return isCounted(clientType) ? _counts[static_cast<std::size_t>(clientType)] : std::uint8_t{0};
}

bool ActiveClientCounter::isLimitReached(std::int32_t clientType) const noexcept { return count(clientType) >= kLimit; }

std::optional<std::uint8_t> ActiveClientCounter::increment(std::int32_t clientType) noexcept {
  if (!isCounted(clientType)) return std::nullopt;
  return ++_counts[static_cast<std::size_t>(clientType)];
}

std::optional<std::uint8_t> ActiveClientCounter::decrement(std::int32_t clientType) noexcept {
  if (count(clientType) == 0) return std::nullopt;
  return --_counts[static_cast<std::size_t>(clientType)];
}

}  // namespace velk
