// What the connections of one listener hold for their peers, bounded for the process and for each user: one room for
// what was received and waits, one for what waits to be sent.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <vector>

#include "foundation/Function.h"
#include "foundation/TimeValue.h"
#include "platform/Clock.h"
#include "platform/Lock.h"

namespace velk::ipc {

/// Thread-safe. Lives as long as one of its parts. Its lock is innermost; nothing is called under it.
class SharedRoom : public std::enable_shared_from_this<SharedRoom> {
 public:
  class Part;

  SharedRoom(std::size_t ofProcess, std::size_t ofUser) noexcept : _ofProcess(ofProcess), _ofUser(ofUser) {}

  /// The bytes of all parts.
  [[nodiscard]] std::size_t taken() const;

 private:
  struct User {
    std::size_t taken = 0;
    std::size_t parts = 0;
  };

  [[nodiscard]] bool hasRoomLocked(const User& user, std::size_t more) const VELK_REQUIRES(_lock);

  const std::size_t _ofProcess;
  const std::size_t _ofUser;

  // Guarded by _lock.
  mutable Lock _lock;
  std::size_t _taken VELK_GUARDED_BY(_lock) = 0;
  std::map<std::uint32_t, User> _users VELK_GUARDED_BY(_lock);
  std::set<Part*> _parts VELK_GUARDED_BY(_lock);
  /// Called once, when a part has become smaller.
  std::vector<UniqueFunction<void()>> _waiting VELK_GUARDED_BY(_lock);
};

/// One connection's part of a room. Any thread, but constructor and destructor.
class SharedRoom::Part {
 public:
  /// `end` asks the connection to end; from any thread, possibly more than once. It must not wait.
  Part(std::shared_ptr<SharedRoom> room, std::uint32_t user, std::function<void()> end);
  ~Part();
  Part(const Part&) = delete;
  Part& operator=(const Part&) = delete;

  /// Takes what `bytes()` says now; it is asked under the room's lock, so that of two threads the later one has the
  /// last word. False when that is more than before and there is no room for it: then nothing changes.
  template <class Bytes>
  [[nodiscard]] bool tryResize(const Bytes& bytes) {
    return resize([](const void* context) { return (*static_cast<const Bytes*>(context))(); }, &bytes, false);
  }
  /// The same, whether or not there is room.
  template <class Bytes>
  void resize(const Bytes& bytes) {
    static_cast<void>(
        resize([](const void* context) { return (*static_cast<const Bytes*>(context))(); }, &bytes, true));
  }
  [[nodiscard]] std::size_t bytes() const noexcept { return _bytes.load(std::memory_order_relaxed); }

  /// The peer owes something for which room is held: the rest of a frame, or reading its replies. The first call
  /// counts, until `owesNothing`.
  void owesSince(SteadyTime time);
  void owesNothing();

  /// Calls back once when any part has become smaller; at once if there is room for `more` now.
  void whenThereIsRoom(std::size_t more, UniqueFunction<void()> callBack);
  /// More than half of what the user or all together may have is taken.
  [[nodiscard]] bool isCrowded() const;
  /// For a part that was refused. Asks those to end whose peers have owed something since before `time`: of the same
  /// user if it was the user's room that was full, else of all. With `oneIsEnough` only the one that has owed for the
  /// longest.
  void endOverdue(SteadyTime time, bool oneIsEnough);

 private:
  bool resize(std::size_t (*bytes)(const void*), const void* context, bool isForced);

  const std::shared_ptr<SharedRoom> _room;
  const std::uint32_t _user;
  const std::function<void()> _end;
  std::atomic<std::size_t> _bytes{0};
  // Guarded by the room's lock.
  std::optional<SteadyTime> _owesSince;
  bool _isEnding = false;
  bool _isRefusedByUser = false;
};

}  // namespace velk::ipc
