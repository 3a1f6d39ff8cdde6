// Shared by the uploads of all sessions: their number, the disk space that they take, the order in which they
// compress, and whether the process is about to end. One a process, made with what backends are handed
// (`BackendContext`) and shared with the uploads, which may outlive their sessions. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <utility>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "platform/Semaphore.h"

namespace velk {

class ProcessUploads {
 public:
  /// Uploads that are under way or wait: what sessions have taken outlives them, and a client may open another.
  static constexpr std::size_t kMaximumUploads = 64;

  /// All compressed files together take no more of the disk than this, and no more than half of the space that they
  /// find free.
  static constexpr std::uint64_t kMaximumDiskBytes = std::uint64_t{1} << 30U;
  /// Compressed files leave this much free on the file system: storebags need room as well.
  static constexpr std::uint64_t kSpareDiskBytes = std::uint64_t{64} << 20U;

  /// The user (a uid) whose process handed an upload over.
  using User = std::uint32_t;
  /// Files that are being compressed at the same moment: each keeps a processor busy, which everything else in the
  /// process needs as well.
  static constexpr std::size_t kMaximumCompressions = 2;

  /// Takes a place. False when the user has its share: it may hold as many places as are then left for others. One
  /// user alone gets half of them; several come to equal shares, with one share to spare for the next user.
  [[nodiscard]] bool enter(User user);
  void leave(User user);
  [[nodiscard]] std::size_t count() const;

  /// The room on the disk that one compressed file takes; given back with it.
  class DiskRoom {
   public:
    DiskRoom(std::shared_ptr<ProcessUploads> uploads, User user) : _uploads(std::move(uploads)), _user(user) {}
    ~DiskRoom();
    DiskRoom(const DiskRoom&) = delete;
    DiskRoom& operator=(const DiskRoom&) = delete;

    /// Before these bytes are written where `available` bytes are free. The error says what they do not fit into. As
    /// with the places, a user may take as much as it leaves for others.
    [[nodiscard]] Result<void> grow(std::uint64_t bytes, std::uint64_t available);

   private:
    const std::shared_ptr<ProcessUploads> _uploads;
    const User _user;
    std::uint64_t _bytes = 0;
  };

  /// The process is about to end: no upload begins any more, and what is being compressed is given up. Uploads that
  /// wait for a server go on until somebody ends their requests.
  void stop();
  [[nodiscard]] bool isStopping() const noexcept { return _isStopping; }
  /// False when some were left after `limit`.
  [[nodiscard]] bool waitUntilNone(Duration limit);
  /// An upload that was not delivered because the process ends. What was to be uploaded stays with its client.
  void noteLeftBehind() noexcept { ++_leftBehind; }
  [[nodiscard]] std::size_t leftBehind() const noexcept { return _leftBehind; }

  /// Waits until fewer than `kMaximumCompressions` others have a turn, and has one while it lives. Users are served in
  /// turn, the files of one user in the order of arrival. For a piece of a file at a time, and for nothing that waits:
  /// a file that cannot be read (it may lie on a disk of its owner's making) would hold all others up. Counts as
  /// blocked while it waits.
  class CompressionTurn {
   public:
    CompressionTurn(ProcessUploads& uploads, User user);
    ~CompressionTurn();
    CompressionTurn(const CompressionTurn&) = delete;
    CompressionTurn& operator=(const CompressionTurn&) = delete;

   private:
    ProcessUploads& _uploads;
  };

  /// How many wait for a turn. For tests.
  [[nodiscard]] std::size_t waitingForTurns() const;

 private:
  struct WaitingUser {
    User user;
    std::deque<Semaphore*> files;  ///< never empty
  };

  void waitInLineLocked(User user, Semaphore& handed) VELK_REQUIRES(_lock);
  /// Null when the line is empty.
  [[nodiscard]] Semaphore* takeNextLocked() VELK_REQUIRES(_lock);

  // Self-synchronised.
  std::atomic<bool> _isStopping{false};
  std::atomic<std::size_t> _leftBehind{0};
  // Guarded by _lock.
  mutable Lock _lock;
  Condition _changed;
  std::size_t _count VELK_GUARDED_BY(_lock) = 0;
  /// Of users that hold any.
  std::map<User, std::size_t> _places VELK_GUARDED_BY(_lock);
  std::uint64_t _diskBytes VELK_GUARDED_BY(_lock) = 0;
  /// Of users that have files on the disk.
  std::map<User, std::uint64_t> _diskBytesOfUsers VELK_GUARDED_BY(_lock);
  std::size_t _turns VELK_GUARDED_BY(_lock) = 0;
  /// Who waits for a turn, each until it is handed one. A user who was served goes to the end.
  std::deque<WaitingUser> _line VELK_GUARDED_BY(_lock);
};

}  // namespace velk
