// Whether this process is still the one that made an object. Objects with threads behind them do nothing in a child
// that was forked from their process: its copies of their locks may be held by threads that it does not have.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

namespace velk {

/// Grows in every forked child. Cheap enough for every call: no system call after the first.
[[nodiscard]] std::uint64_t processGeneration() noexcept;

/// Remembers the process that made it. Any thread; takes no lock.
class ForkGuard {
 public:
  ForkGuard() noexcept : _generation(processGeneration()) {}
  /// True in a child forked after construction.
  [[nodiscard]] bool forked() const noexcept { return _generation != processGeneration(); }

 private:
  const std::uint64_t _generation;
};

/// Keeps a descriptor to the process that made it: a forked child's copy is closed before `fork` returns there, so that
/// whoever is at the other end of a socket hears of this process's end although a child lives on. So many descriptors
/// of a process at most; of others the children keep their copies. Owns nothing: it ends before the descriptor is
/// closed. Any thread; takes no lock.
class NotForChildren {
 public:
  static constexpr std::size_t kMaximum = 1024;

  explicit NotForChildren(int descriptor) noexcept;
  ~NotForChildren();
  NotForChildren(const NotForChildren&) = delete;
  NotForChildren& operator=(const NotForChildren&) = delete;
  /// Whether it found a place.
  [[nodiscard]] explicit operator bool() const noexcept { return _place != nullptr; }

 private:
  const ForkGuard _fork;
  std::atomic<int>* _place = nullptr;
};

/// What each process has one of, made at first use and never destroyed: threads may use it while the process ends. A
/// forked child gets a new one of its own, since the locks of its parent's may be held by threads that it does not
/// have. Constant initialisation: for objects of static storage. Any thread; takes no lock.
template <class Object>
class PerProcess {
 public:
  /// `Make` answers a new object; it may be called in vain, when another thread is quicker.
  template <class Make>
  [[nodiscard]] Object& get(Make make) {
    if (Object* const object = existing()) return *object;
    Made* former = _made.load(std::memory_order_acquire);
    auto* const fresh = new Made{processGeneration(), make()};
    if (_made.compare_exchange_strong(former, fresh, std::memory_order_acq_rel)) return *fresh->object;
    delete fresh->object;
    delete fresh;
    return *former->object;
  }

  /// This process's own, or null.
  [[nodiscard]] Object* existing() const noexcept {
    const Made* const made = _made.load(std::memory_order_acquire);
    return made != nullptr && made->generation == processGeneration() ? made->object : nullptr;
  }

 private:
  struct Made {
    std::uint64_t generation;
    Object* object;
  };
  std::atomic<Made*> _made{nullptr};
};

}  // namespace velk
