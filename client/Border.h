// The border between the library and its host: no exception passes it. Private to client/.
#pragma once

#include <type_traits>
#include <utility>

namespace velk {

/// In a handler: tells the log what was thrown, and what to do.
void logException(const char* operation) noexcept;

/// Runs `work`, and answers `fallback` (with a line in the log) when it throws: when memory is short, above all.
template <class Work>
auto guarded(const char* operation, std::type_identity_t<std::invoke_result_t<Work&>> fallback, Work&& work) noexcept
    -> std::invoke_result_t<Work&> {
  try {
    return work();
  } catch (...) {
    logException(operation);
    return fallback;
  }
}
template <class Work>
void guardedVoid(const char* operation, Work&& work) noexcept {
  try {
    work();
  } catch (...) {
    logException(operation);
  }
}

}  // namespace velk
