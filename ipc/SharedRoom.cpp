#include "ipc/SharedRoom.h"

#include <utility>

namespace velk::ipc {

std::size_t SharedRoom::taken() const {
  Guard guard(_lock);
  return _taken;
}

bool SharedRoom::hasRoomLocked(const User& user, std::size_t more) const {
  return user.taken + more <= _ofUser && _taken + more <= _ofProcess;
}

SharedRoom::Part::Part(std::shared_ptr<SharedRoom> room, std::uint32_t user, std::function<void()> end)
    : _room(std::move(room)), _user(user), _end(std::move(end)) {
  Guard guard(_room->_lock);
  ++_room->_users[_user].parts;
  _room->_parts.insert(this);
}

SharedRoom::Part::~Part() {
  resize([] { return std::size_t{0}; });
  Guard guard(_room->_lock);
  _room->_parts.erase(this);
  const auto user = _room->_users.find(_user);
  if (--user->second.parts == 0) _room->_users.erase(user);
}

bool SharedRoom::Part::resize(std::size_t (*bytes)(const void*), const void* context, bool isForced) {
  std::vector<UniqueFunction<void()>> waiting;
  {
    Guard guard(_room->_lock);
    const std::size_t before = _bytes.load(std::memory_order_relaxed);
    const std::size_t after = bytes(context);
    auto& user = _room->_users[_user];
    if (after > before && !isForced && !_room->hasRoomLocked(user, after - before)) {
      _isRefusedByUser = user.taken + (after - before) > _room->_ofUser;
      return false;
    }
    user.taken += after - before;
    _room->_taken += after - before;
    _bytes.store(after, std::memory_order_relaxed);
    if (after < before) waiting.swap(_room->_waiting);
  }
  for (auto& callBack : waiting) callBack();
  return true;
}

void SharedRoom::Part::owesSince(SteadyTime time) {
  Guard guard(_room->_lock);
  if (!_owesSince) _owesSince = time;
}

void SharedRoom::Part::owesNothing() {
  Guard guard(_room->_lock);
  _owesSince.reset();
  _isEnding = false;
}

void SharedRoom::Part::whenThereIsRoom(std::size_t more, UniqueFunction<void()> callBack) {
  {
    Guard guard(_room->_lock);
    if (!_room->hasRoomLocked(_room->_users[_user], more)) return _room->_waiting.push_back(std::move(callBack));
  }
  callBack();
}

bool SharedRoom::Part::isCrowded() const {
  Guard guard(_room->_lock);
  return _room->_users[_user].taken > _room->_ofUser / 2 || _room->_taken > _room->_ofProcess / 2;
}

void SharedRoom::Part::endOverdue(SteadyTime time, bool oneIsEnough) {
  std::vector<std::function<void()>> ends;
  {
    Guard guard(_room->_lock);
    Part* oldest = nullptr;
    for (auto* part : _room->_parts) {
      if (!part->_owesSince || *part->_owesSince > time || part->_isEnding) continue;
      if (_isRefusedByUser && part->_user != _user) continue;
      if (!oneIsEnough) {
        part->_isEnding = true;
        ends.push_back(part->_end);
      } else if (oldest == nullptr || *part->_owesSince < *oldest->_owesSince) {
        oldest = part;
      }
    }
    if (oldest != nullptr) {
      oldest->_isEnding = true;
      ends.push_back(oldest->_end);
    }
  }
  for (const auto& end : ends) end();
}

}  // namespace velk::ipc
