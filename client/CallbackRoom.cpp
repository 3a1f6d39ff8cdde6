#include "client/CallbackRoom.h"

#include "platform/Log.h"

namespace velk {

CallbackRoom::Place CallbackRoom::reserve(std::size_t bytes) {
  bool isFirstDropped = false;
  if (take(bytes, isFirstDropped)) return {shared_from_this(), bytes};
  if (isFirstDropped) log::error(_whenFull);
  return {};
}

bool CallbackRoom::take(std::size_t bytes, bool& isFirstDropped) {
  Guard guard(_lock);
  if (_waiting == kMaximumWaiting || bytes > kMaximumBytes - _bytesWaiting) {
    isFirstDropped = _dropped++ == 0;
    return false;
  }
  ++_waiting;
  _bytesWaiting += bytes;
  return true;
}

void CallbackRoom::release(std::size_t bytes) {
  std::size_t dropped = 0;
  {
    Guard guard(_lock);
    _bytesWaiting -= bytes;
    if (--_waiting == 0) dropped = std::exchange(_dropped, 0);
  }
  if (dropped != 0) log::error(_whenOver, dropped);
}

}  // namespace velk
