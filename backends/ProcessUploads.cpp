#include "backends/ProcessUploads.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "foundation/Format.h"
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

ProcessUploads::DiskRoom::~DiskRoom() {
  if (_bytes == 0) return;
  Guard guard(_uploads->_lock);
  _uploads->_diskBytes -= _bytes;
  const auto own = _uploads->_diskBytesOfUsers.find(_user);
  if ((own->second -= _bytes) == 0) _uploads->_diskBytesOfUsers.erase(own);
}

Result<void> ProcessUploads::DiskRoom::grow(std::uint64_t bytes, std::uint64_t available) {
  if (available < kSpareDiskBytes || available - kSpareDiskBytes < bytes) {
    return failure("ProcessUploads", ENOSPC,
                   formatText("only %llu bytes are free on the disk, and %llu of them are kept free",
                              {available, kSpareDiskBytes}));
  }
  std::uint64_t most = 0;
  {
    Guard guard(_uploads->_lock);
    auto& total = _uploads->_diskBytes;
    most = available / 2 < kMaximumDiskBytes - total / 2 ? available / 2 + total / 2 : kMaximumDiskBytes;
    const auto found = _uploads->_diskBytesOfUsers.find(_user);
    const std::uint64_t own = found == _uploads->_diskBytesOfUsers.end() ? 0 : found->second;
    if (bytes <= most && own + bytes + total + bytes <= most) {
      total += bytes;
      _uploads->_diskBytesOfUsers[_user] += bytes;
      _bytes += bytes;
      return {};
    }
  }
  return failure("ProcessUploads", ENOSPC,
                 formatText("its user has its share of the %llu bytes that uploads may take of the disk", {most}));
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
