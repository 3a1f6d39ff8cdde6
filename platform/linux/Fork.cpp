#include "platform/Fork.h"

#include <pthread.h>
#include <unistd.h>

#include <array>
#include <atomic>

namespace velk {
namespace {

std::atomic<std::uint64_t> generation{0};

std::atomic<bool> watching{false};

/// Descriptors that children do not keep, each one higher than it is; 0: a free place.
std::array<std::atomic<int>, NotForChildren::kMaximum> kept{};
/// No place from here on was ever used.
std::atomic<std::size_t> keptEnd{0};

/// In the child, whose only thread this is; `close` alone may be called here.
void closeKept() noexcept {
  const std::size_t end = keptEnd.load(std::memory_order_relaxed);
  for (std::size_t place = 0; place < end; ++place) {
    if (const int descriptor = kept[place].exchange(0, std::memory_order_relaxed); descriptor != 0) {
      ::close(descriptor - 1);
    }
  }
}

// Threads that come here together each do it: a child's number then grows by more than one, which does no harm, while a
// lock might be held when another thread forks.
void watchForks() noexcept {
  static_cast<void>(pthread_atfork(nullptr, nullptr, [] {
    generation.fetch_add(1, std::memory_order_relaxed);
    closeKept();
  }));
  watching.store(true, std::memory_order_release);
}

}  // namespace

std::uint64_t processGeneration() noexcept {
  if (!watching.load(std::memory_order_acquire)) watchForks();
  return generation.load(std::memory_order_relaxed);
}

NotForChildren::NotForChildren(int descriptor) noexcept {
  for (std::size_t place = 0; place < kept.size() && _place == nullptr; ++place) {
    int free = 0;
    if (!kept[place].compare_exchange_strong(free, descriptor + 1, std::memory_order_relaxed)) continue;
    _place = &kept[place];
    std::size_t end = keptEnd.load(std::memory_order_relaxed);
    while (end <= place && !keptEnd.compare_exchange_weak(end, place + 1, std::memory_order_relaxed)) {
    }
  }
}

// In a child the place is free already, and may be taken again.
NotForChildren::~NotForChildren() {
  if (_place != nullptr && !_fork.forked()) _place->store(0, std::memory_order_relaxed);
}

}  // namespace velk
