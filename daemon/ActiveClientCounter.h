// How many counted sessions each client type has. Part of the agent, whose lock guards every call.
#pragma once

#include <array>
#include <cstdint>
#include <optional>

namespace velk {

class ActiveClientCounter {
 public:
  /// A client type with this many active sessions gets no further one.
  static constexpr std::uint8_t kLimit = 5;
  static constexpr std::int32_t kFirstUncountedType = 31;

  /// Whether one more session of this type would exceed the limit. Types outside the table have none.
  [[nodiscard]] bool isLimitReached(std::int32_t clientType) const noexcept;
  /// The new count, which is kept in eight bits and wraps; nothing for types outside the table.
  std::optional<std::uint8_t> increment(std::int32_t clientType) noexcept;
  /// The new count; nothing when it was 0 already, and for types outside the table.
  std::optional<std::uint8_t> decrement(std::int32_t clientType) noexcept;
  /// 0 for types outside the table.
  [[nodiscard]] std::uint8_t count(std::int32_t clientType) const noexcept;

 private:
  static bool isCounted(std::int32_t clientType) noexcept {
    return clientType >= 0 && clientType < kFirstUncountedType;
  }

  std::array<std::uint8_t, kFirstUncountedType> _counts{};
};

}  // namespace velk
