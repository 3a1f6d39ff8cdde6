#include "daemon/StorebagTable.h"

#include <array>

namespace velk {

namespace {

constexpr std::int32_t kFirstClientType = 5;

// By client type, from 5 to 30. Types that share a name share every cache.
constexpr std::array<std::string_view, 26> kStorebagNames = {
    "bramble",   // 5
    "clover",    // 6
    "sorrel",    // 7, conferencing
    "fennel",    // 8
    "heather",   // 9
    "juniper",   // 10
    "sorrel",    // 11, conferencing
    "lavender",  // 12
    "sorrel",    // 13, conferencing
    "mallow",    // 14
    "nettle",    // 15
    "orchid",    // 16
    "primrose",  // 17
    "clover",    // 18, shares media playback's
    "rosemary",  // 19
    "sorrel",    // 20, conferencing
    "saffron",   // 21
    "tansy",     // 22
    "thistle",   // 23
    "juniper",   // 24, shares storage's
    "valerian",  // 25
    "verbena",   // 26
    "willow",    // 27
    "yarrow",    // 28
    "comfrey",   // 29
    "burdock",   // 30
};

}  // namespace

std::optional<std::string_view> storebagNameForClientType(std::int32_t clientType) noexcept {
  const auto row = static_cast<std::int64_t>(clientType) - kFirstClientType;
  if (row < 0 || row >= static_cast<std::int64_t>(kStorebagNames.size())) return std::nullopt;
  return kStorebagNames[static_cast<std::size_t>(row)];
}

}  // namespace velk
