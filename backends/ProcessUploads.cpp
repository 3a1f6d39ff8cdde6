#include "backends/ProcessUploads.h"

#include <algorithm>
#include <utility>

#include "platform/BlockingScope.h"

namespace velk {

bool ProcessUploads::enter(User user) {
  Guard guard(_lock);
  const auto own = _places.find(user);
  if ((own == _places.end() ? 0 : own->second) >= kMaximumUploads - _count) return false;
  ++_places[user];
  ++_count;
  return true;
}

void ProcessUploads::leave(User user) {
  Guard guard(_lock);
  if (const auto own = _places.find(user); --own->second == 0) _places.erase(own);
  --_count;
  _changed.notifyAll();
}

std::size_t ProcessUploads::count() const {
  Guard guard(_lock);
  return _count;
}

void ProcessUploads::stop() { _isStopping = true; }

bool ProcessUploads::waitUntilNone(Duration limit) {
  BlockingScope blocking;
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(_lock);
  while (_count > 0) {
    if (!_changed.waitUntil(_lock, deadline) && _count > 0) return false;
  }
  return true;
}

void ProcessUploads::waitInLineLocked(User user, Semaphore& handed) {
  const auto own =
      std::find_if(_line.begin(), _line.end(), [user](const WaitingUser& each) { return each.user == user; });
  if (own == _line.end()) {
    _line.push_back({user, {&handed}});
  } else {
    own->files.push_back(&handed);
  }
}

Semaphore* ProcessUploads::takeNextLocked() {
  if (_line.empty()) return nullptr;
  WaitingUser served = std::move(_line.front());
  _line.pop_front();
  auto* const next = served.files.front();
  served.files.pop_front();
  if (!served.files.empty()) _line.push_back(std::move(served));
  return next;
}

std::size_t ProcessUploads::waitingForTurns() const {
  Guard guard(_lock);
  std::size_t waiting = 0;
  for (const auto& each : _line) waiting += each.files.size();
  return waiting;
}

ProcessUploads::CompressionTurn::CompressionTurn(ProcessUploads& uploads, User user) : _uploads(uploads) {
  Semaphore handed;
  {
    Guard guard(_uploads._lock);
    if (_uploads._turns < kMaximumCompressions) {
      ++_uploads._turns;
      return;
    }
    _uploads.waitInLineLocked(user, handed);
  }
  handed.wait();
}

// The turn goes to the next in line, if there is one.
ProcessUploads::CompressionTurn::~CompressionTurn() {
  Guard guard(_uploads._lock);
  if (auto* const next = _uploads.takeNextLocked()) {
    next->signal();
  } else {
    --_uploads._turns;
  }
}

}  // namespace velk
