// What the uploads of all sessions share: how many there are, whose turn it is to compress a large file, and whether
// the process is about to end. One a process, made with what backends are handed (`BackendContext`) and shared with the
// uploads, which may outlive their sessions. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <deque>

#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "platform/Semaphore.h"

namespace velk {

class ProcessUploads {
 public:
  /// Uploads that are under way or wait: what sessions have taken outlives them, and a client may open another.
  static constexpr std::size_t kMaximumUploads = 64;
  /// Large files that are being compressed at the same moment: each keeps a processor busy, which everything else in
  /// the process needs as well.
  static constexpr std::size_t kMaximumCompressions = 2;

  void enter();
  void leave();
  [[nodiscard]] std::size_t count() const;
  [[nodiscard]] bool isFull() const { return count() >= kMaximumUploads; }

  /// The process is about to end: no upload begins any more, and what is being compressed is given up. Uploads that
  /// wait for a server go on until somebody ends their requests.
  void stop();
  [[nodiscard]] bool isStopping() const noexcept { return _isStopping; }
  /// False when some were left after `limit`.
  [[nodiscard]] bool waitUntilNone(Duration limit);
  /// An upload that was not delivered because the process ends. What was to be uploaded stays with its client.
  void noteLeftBehind() noexcept { ++_leftBehind; }
  [[nodiscard]] std::size_t leftBehind() const noexcept { return _leftBehind; }

  /// Waits until fewer than `kMaximumCompressions` others have a turn, in the order of arrival, and has one while it
  /// lives. For a piece of a file at a time, and for nothing that waits: a file that cannot be read (it may lie on a
  /// disk of its owner's making) would hold all others up. Counts as blocked while it waits.
  class CompressionTurn {
   public:
    explicit CompressionTurn(ProcessUploads& uploads);
    ~CompressionTurn();
    CompressionTurn(const CompressionTurn&) = delete;
    CompressionTurn& operator=(const CompressionTurn&) = delete;

   private:
    ProcessUploads& _uploads;
  };

 private:
  // Self-synchronised.
  std::atomic<bool> _isStopping{false};
  std::atomic<std::size_t> _leftBehind{0};
  // Guarded by _lock.
  mutable Lock _lock;
  Condition _changed;
  std::size_t _count VELK_GUARDED_BY(_lock) = 0;
  std::size_t _turns VELK_GUARDED_BY(_lock) = 0;
  /// Who waits for a turn, each until it is handed one.
  std::deque<Semaphore*> _line VELK_GUARDED_BY(_lock);
};

}  // namespace velk
