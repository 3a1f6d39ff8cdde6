// The bounded place in which what the user is to be told waits for a callback that is slower than it comes. What finds
// no room is dropped: the log hears of the first one at once, and of their number when the callback has caught up.
#pragma once

#include <cstddef>
#include <memory>
#include <string_view>
#include <utility>

#include "client/EventOutbox.h"
#include "platform/Lock.h"

namespace velk {

/// Any thread.
class CallbackRoom : public std::enable_shared_from_this<CallbackRoom> {
 public:
  static constexpr std::size_t kMaximumWaiting = EventRoom::kMaximumEvents;
  static constexpr std::size_t kMaximumBytes = EventRoom::kMaximumBytes;

  /// Room for one call, given back at its end: made or not. It keeps what it is a place of.
  class Place {
   public:
    Place() noexcept = default;
    Place(Place&& other) noexcept : _room(std::move(other._room)), _bytes(other._bytes) {}
    Place& operator=(Place&&) = delete;
    Place(const Place&) = delete;
    Place& operator=(const Place&) = delete;
    ~Place() {
      if (_room) _room->release(_bytes);
    }
    explicit operator bool() const noexcept { return _room != nullptr; }

   private:
    friend class CallbackRoom;
    Place(std::shared_ptr<CallbackRoom> room, std::size_t bytes) noexcept : _room(std::move(room)), _bytes(bytes) {}

    std::shared_ptr<CallbackRoom> _room;
    std::size_t _bytes = 0;
  };

  /// The log's lines, which outlive it: for the first that is dropped, and (with their number) for when all is over.
  CallbackRoom(std::string_view whenFull, std::string_view whenOver) : _whenFull(whenFull), _whenOver(whenOver) {}

  /// None when so many, or so many bytes, wait already.
  [[nodiscard]] Place reserve(std::size_t bytes);

 private:
  [[nodiscard]] bool take(std::size_t bytes, bool& isFirstDropped);
  void release(std::size_t bytes);

  const std::string_view _whenFull;
  const std::string_view _whenOver;

  Lock _lock;
  std::size_t _waiting VELK_GUARDED_BY(_lock) = 0;
  std::size_t _bytesWaiting VELK_GUARDED_BY(_lock) = 0;
  std::size_t _dropped VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace velk
