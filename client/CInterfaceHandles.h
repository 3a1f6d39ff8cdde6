// What stands behind the handles of the C interface: a reference count and the C++ object. Private to client/.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <utility>

#include "client/VelkReporting.h"
#include "client/VelkReportingC.h"
#include "foundation/PropertyValue.h"

struct VelkReportingValue {
  std::atomic<std::uint32_t> references{1};
  velk::PropertyValue value;
  /// How many containers stand within each other, at most: bounded, since the end of a value takes a call for each.
  int depth = 0;
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

/// The border: runs `work`, and answers `fallback` (with a line in the log) when memory or threads are short.
void logException(const char* function) noexcept;
template <class Work>
auto guarded(const char* function, decltype(std::declval<Work>()()) fallback, Work&& work) noexcept
    -> decltype(work()) {
  try {
    return work();
  } catch (...) {
    logException(function);
    return fallback;
  }
}
template <class Work>
void guardedVoid(const char* function, Work&& work) noexcept {
  static_cast<void>(guarded(function, false, [&] {
    work();
    return false;
  }));
}

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
[[nodiscard]] VelkReportingValue* newValue(PropertyValue value, int depth);
template <class Container>
[[nodiscard]] VelkReportingValue* newValueOrNull(const std::optional<Container>& container) {
  return container ? newValue(PropertyValue(*container)) : nullptr;
}

/// The dictionary or array behind a handle; null when there is none.
[[nodiscard]] const PropertyDictionary* dictionaryOf(const VelkReportingValue* value) noexcept;
[[nodiscard]] const PropertyArray* arrayOf(const VelkReportingValue* value) noexcept;
/// The same as an argument of the C++ interface.
[[nodiscard]] std::optional<PropertyDictionary> optionalDictionary(const VelkReportingValue* value);

[[nodiscard]] VelkReportingError* newError(const Error& error);
/// Hands an error out, in the library's domain whatever its own was: null when there is none.
void handOut(VelkReportingError** out, const Error& error);

}  // namespace velk::cinterface
