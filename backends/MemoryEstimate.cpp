#include "backends/MemoryEstimate.h"

#include <cstddef>

namespace velk {

namespace {

// The granularity and the header of a usual heap block.
constexpr std::size_t kGranularity = 16;
constexpr std::size_t kBlockHeader = 8;

std::uint32_t blockOf(std::size_t bytes) noexcept {
  return static_cast<std::uint32_t>((bytes + kBlockHeader + kGranularity - 1) / kGranularity * kGranularity);
}

std::uint32_t textBlock(std::size_t length) noexcept { return blockOf(sizeof(void*) + length + 1); }
std::uint32_t listBlock(std::size_t count, std::size_t slot) noexcept { return blockOf(sizeof(void*) + count * slot); }

}  // namespace

std::uint32_t allocationSize(const PropertyValue& value) noexcept {
  switch (value.type()) {
    case PropertyValue::Type::string:
      return textBlock(value.string()->size());
    case PropertyValue::Type::data:
      return textBlock(value.data()->size());
    case PropertyValue::Type::array:
      return listBlock(value.array()->size(), sizeof(void*));
    case PropertyValue::Type::dictionary:
      return listBlock(value.dictionary()->size(), 2 * sizeof(void*));
    default:
      return blockOf(2 * sizeof(void*));
  }
}

std::uint32_t memoryEstimate(const PropertyValue& value) noexcept {
  if (const auto* dictionary = value.dictionary()) return memoryEstimate(*dictionary);
  if (const auto* array = value.array()) return memoryEstimate(*array);
  return allocationSize(value);
}

std::uint32_t memoryEstimate(const PropertyDictionary& dictionary) noexcept {
  std::uint32_t sum = listBlock(dictionary.size(), 2 * sizeof(void*));
  for (const auto& entry : dictionary) {
    sum += textBlock(entry.key.size());
    sum += memoryEstimate(entry.value) + allocationSize(entry.value);
  }
  return sum;
}

std::uint32_t memoryEstimate(const PropertyArray& array) noexcept {
  std::uint32_t sum = listBlock(array.size(), sizeof(void*));
  for (const auto& value : array) sum += memoryEstimate(value) + allocationSize(value);
  return sum;
}

}  // namespace velk
