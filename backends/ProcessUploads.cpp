#include "backends/ProcessUploads.h"

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

ProcessUploads::CompressionTurn::CompressionTurn(ProcessUploads& uploads) : _uploads(uploads) {
  Semaphore handed;
  {
    Guard guard(_uploads._lock);
    if (_uploads._turns < kMaximumCompressions) {
      ++_uploads._turns;
      return;
    }
    _uploads._line.push_back(&handed);
  }
  handed.wait();
}

// The turn goes to the next in line, if there is one.
ProcessUploads::CompressionTurn::~CompressionTurn() {
  Guard guard(_uploads._lock);
  if (_uploads._line.empty()) {
    --_uploads._turns;
    return;
  }
  auto* const next = _uploads._line.front();
  _uploads._line.pop_front();
  next->signal();
}

}  // namespace velk
