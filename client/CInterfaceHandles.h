// What stands behind the handles of the C interface: a reference count and the C++ object. Private to client/.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <utility>

#include "client/Border.h"
#include "client/VelkReporting.h"
#include "client/VelkReportingC.h"
#include "foundation/PropertyValue.h"

namespace velk::cinterface {

/// How much a value is. Both are bounded: the end of a value takes a call for each level; and containers share what
/// they hold, so that one which is put into itself again and again costs little until somebody walks it.
struct Extent {
  int depth = 0;             ///< containers within each other
  std::uint64_t values = 1;  ///< all that a walk comes upon, this value included
};

}  // namespace velk::cinterface

struct VelkReportingValue {
  std::atomic<std::uint32_t> references{1};
  velk::PropertyValue value;
  /// At most; taken again where it matters.
  velk::cinterface::Extent extent;
};

struct VelkReportingError {
  std::atomic<std::uint32_t> references{1};
  velk::Error error;
};

/// Public references are counted here, apart from those that the library's own work holds.
struct VelkReportingClient {
  std::atomic<std::uint32_t> references{1};
  std::shared_ptr<velk::VelkReporting> client;
};

namespace velk::cinterface {

/// Containers within each other, as in the reader of JSON.
inline constexpr int kMaximumDepth = 64;
/// A walk over so many takes some milliseconds; no event holds a tenth of them.
inline constexpr std::uint64_t kMaximumValues = 1'048'576;

using velk::guarded;
using velk::guardedVoid;

template <class Handle>
Handle* retain(Handle* handle) noexcept {
  if (handle != nullptr) handle->references.fetch_add(1, std::memory_order_relaxed);
  return handle;
}
template <class Handle>
void release(Handle* handle) noexcept {
  if (handle != nullptr && handle->references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete handle;
}

/// Releases a handle at the end of a block: what callbacks are given.
template <class Handle>
struct Releasing {
  void operator()(Handle* handle) const noexcept { release(handle); }
};
template <class Handle>
using Owned = std::unique_ptr<Handle, Releasing<Handle>>;

/// A handle that the caller owns.
[[nodiscard]] VelkReportingValue* newValue(PropertyValue value);
[[nodiscard]] VelkReportingValue* newValue(PropertyValue value, Extent extent);
/// Recursive: only for values that are bounded.
[[nodiscard]] Extent extentOf(const PropertyValue& value);
template <class Container>
[[nodiscard]] VelkReportingValue* newValueOrNull(const std::optional<Container>& container) {
  return container ? newValue(PropertyValue(*container)) : nullptr;
}

/// The dictionary or array behind a handle; null when there is none.
[[nodiscard]] const PropertyDictionary* dictionaryOf(const VelkReportingValue* value) noexcept;
[[nodiscard]] const PropertyArray* arrayOf(const VelkReportingValue* value) noexcept;
/// The same as an argument of the C++ interface.
[[nodiscard]] std::optional<PropertyDictionary> optionalDictionary(const VelkReportingValue* value);

/// As integerValue, but with unsigned numbers beyond its bound at the bound as well: C has no use for their low bits.
[[nodiscard]] std::int64_t boundedInteger(const PropertyValue* value) noexcept;

[[nodiscard]] VelkReportingError* newError(const Error& error);
/// Hands an error out, in the library's domain whatever its own was: null when there is none.
void handOut(VelkReportingError** out, const Error& error);

}  // namespace velk::cinterface
