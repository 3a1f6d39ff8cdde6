#include "platform/Fork.h"

#include <pthread.h>

#include <atomic>

namespace velk {
namespace {

std::atomic<std::uint64_t> generation{0};

bool watchForks() noexcept {
  return pthread_atfork(nullptr, nullptr, [] { generation.fetch_add(1, std::memory_order_relaxed); }) == 0;
}

}  // namespace

std::uint64_t processGeneration() noexcept {
  static const bool watching = watchForks();
  static_cast<void>(watching);
  return generation.load(std::memory_order_relaxed);
}

}  // namespace velk
