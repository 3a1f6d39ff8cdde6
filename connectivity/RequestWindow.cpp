#include "connectivity/RequestWindow.h"

#include <algorithm>
#include <utility>

#include "platform/BlockingScope.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumStopped = 1024;

}  // namespace

void RequestWindow::waitForRoom(std::uint64_t sender) {
  {
    Guard guard(_lock);
    if (!isFullLocked(sender)) return;
  }
  BlockingScope blocking;
  Guard guard(_lock);
  while (isFullLocked(sender)) _changed.wait(_lock);
}

void RequestWindow::enter(std::uint64_t sender) {
  Guard guard(_lock);
  ++_underWay[sender];
}

void RequestWindow::leave(std::uint64_t sender) {
  Guard guard(_lock);
  const auto found = _underWay.find(sender);
  // Those that wait may be of several senders.
  if (found->second-- == kMaximumRequests) _changed.notifyAll();
  if (found->second == 0) _underWay.erase(found);
}

void RequestWindow::stopWaiting(std::uint64_t sender) {
  Guard guard(_lock);
  _stopped.push_back(sender);
  if (_stopped.size() > kMaximumStopped) _stopped.pop_front();
  _changed.notifyAll();
}

void RequestWindow::close() {
  Guard guard(_lock);
  _isClosed = true;
  _changed.notifyAll();
}

void RequestWindow::open() {
  Guard guard(_lock);
  _isClosed = false;
}

std::size_t RequestWindow::senderCount() {
  Guard guard(_lock);
  return _underWay.size();
}

bool RequestWindow::isFullLocked(std::uint64_t sender) const {
  const auto found = _underWay.find(sender);
  if (_isClosed || found == _underWay.end() || found->second < kMaximumRequests) return false;
  return std::find(_stopped.begin(), _stopped.end(), sender) == _stopped.end();
}

PlaceInWindow::PlaceInWindow(std::shared_ptr<RequestWindow> window, std::uint64_t sender)
    : _window(std::move(window)), _sender(sender) {
  _window->enter(_sender);
}

void PlaceInWindow::leave() {
  if (!_hasLeft.exchange(true)) _window->leave(_sender);
}

}  // namespace velk
