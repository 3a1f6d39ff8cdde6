// How many references hold the process's keep-alive transaction. Part of the agent, whose lock guards every call.
#pragma once

#include <cstdint>
#include <string>

#include "platform/Platform.h"

namespace velk {

/// The transaction is begun by a reference taken while the count is exactly 0, and ended by a release that brings the
/// count to 0 or below. A count below zero stays until as many references have been taken, which begin nothing.
class KeepAliveCounter {
 public:
  /// `keepAlive` outlives it.
  explicit KeepAliveCounter(KeepAlive& keepAlive) : _keepAlive(keepAlive) {}

  /// Begins the transaction when nothing holds it. `sessionDescription` is for the log. `retain` follows.
  void beginIfUnused(const std::string& sessionDescription);
  void retain();
  void release(std::uint32_t count);

  [[nodiscard]] std::int32_t count() const noexcept { return _count; }

 private:
  KeepAlive& _keepAlive;
  std::int32_t _count = 0;
};

}  // namespace velk
