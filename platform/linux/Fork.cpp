#include "platform/Fork.h"

#include <pthread.h>

#include <atomic>

namespace velk {
namespace {

std::atomic<std::uint64_t> generation{0};

std::atomic<bool> watching{false};

// Threads that come here together each do it: a child's number then grows by more than one, which does no harm, while a
// lock might be held when another thread forks.
void watchForks() noexcept {
  static_cast<void>(pthread_atfork(nullptr, nullptr, [] { generation.fetch_add(1, std::memory_order_relaxed); }));
  watching.store(true, std::memory_order_release);
}

}  // namespace

std::uint64_t processGeneration() noexcept {
  if (!watching.load(std::memory_order_acquire)) watchForks();
  return generation.load(std::memory_order_relaxed);
}

}  // namespace velk
