// The message log on the disk: a plain-text record of what sessions did with their messages, in one current file that
// is replaced once a day, or when it is full. Sessions call it from their queues; it lives as long as the agent.
//
// File: none -> created at the first message (or when the current one is older than a day at the next, or full) ->
// current -> expired (submitted or deleted, on a queue) when a later scan finds it too old or finds a newer one, or
// when it is full. Nothing happens between messages.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"
#include "platform/AppendedFile.h"
#include "platform/Files.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/Queue.h"
#include "session/SessionServices.h"

namespace velk {

class Clock;
class LogSubmission;

/// Any thread. All objects of the process share one lock, which is held for the file work alone: lines of the system
/// log are written, and expired files submitted, after it has been let go. Bounds: an entry is cut at 256 KiB, a file
/// is full at 64 MiB, and kMaximumExpiring files wait for their submission; while more would, entries are dropped (one
/// error line tells).
class MessageLogFile : public MessageLog {
 public:
  static constexpr std::size_t kMaximumExpiring = 3;
  using CreationTime = std::function<std::optional<TimeValue>(const std::string& path)>;

  /// `clock` and `submission` outlive the object; what was handed to `expiryQueue` ends before it. `directory` is made
  /// (0700) when the first message needs it.
  MessageLogFile(std::string directory, const Clock& clock, LogSubmission& submission,
                 std::shared_ptr<Queue> expiryQueue, CreationTime creationTime = files::creationTime);

  /// Appends "(date) text". The one message that finds the current file gone is lost; the next goes to a new file.
  /// Control characters other than line breaks and tabs are escaped, and a continued line that begins as entries do is
  /// indented by a tab, so that no text can pass for an entry of its own.
  void writeToLogFile(std::string_view text) override;

  /// Makes a new current file. Both parts of a current file are handed in and out. Takes the lock.
  void createNewLogFile(std::optional<std::string>* path, std::optional<Date>* creationDate);
  /// Submits or deletes the file, which may take as long as copying it does. Without the lock.
  void deleteExpiredLogFile(const std::string& path, const std::optional<Date>& creationDate);

 private:
  struct Entry;
  /// Work that runs outside the lock: a line of the system log, or the end of an expired file.
  struct Step {
    log::Level level = log::Level::standard;
    /// Null: the file at `subject` has expired.
    const char* format = nullptr;
    std::optional<std::string> subject;
    std::optional<Date> date;
  };
  using Steps = std::vector<Step>;

  static Monitor _logFileLock;

  void scanDirectoryLocked(Steps& steps) VELK_REQUIRES(_logFileLock);
  void considerEntryLocked(const std::string& path, const std::optional<Date>& date, Steps& steps)
      VELK_REQUIRES(_logFileLock);
  void expireLocked(const std::string& path, const std::optional<Date>& date, Steps& steps) VELK_REQUIRES(_logFileLock);
  [[nodiscard]] bool isExpiringLocked(const std::string& path) const VELK_REQUIRES(_logFileLock);
  void createLocked(std::optional<std::string>& path, std::optional<Date>& creationDate, Steps& steps)
      VELK_REQUIRES(_logFileLock);
  [[nodiscard]] std::string freePathLocked() const VELK_REQUIRES(_logFileLock);
  void appendLocked(const Entry& entry, Steps& steps) VELK_REQUIRES(_logFileLock);
  [[nodiscard]] bool hasRoomLocked(std::size_t size, const Entry& entry, Steps& steps) VELK_REQUIRES(_logFileLock);
  [[nodiscard]] std::vector<std::string> ownFiles(Steps& steps) const;

  void perform(Steps steps);
  void performNow(const Steps& steps);
  [[nodiscard]] bool isExpired(const std::optional<Date>& date) const;
  [[nodiscard]] std::optional<Date> creationDate(const std::string& path) const;
  [[nodiscard]] Date now() const;

  // Constant after construction.
  const std::string _directory;
  const Clock& _clock;
  LogSubmission& _submission;
  const std::shared_ptr<Queue> _expiryQueue;
  const CreationTime _creationTime;

  // Guarded by the process's log-file lock.
  std::optional<std::string> _currentPath VELK_GUARDED_BY(_logFileLock);
  std::optional<Date> _currentDate VELK_GUARDED_BY(_logFileLock);
  AppendedFile _file VELK_GUARDED_BY(_logFileLock);
  /// Files that have expired and may still be there: as good as gone. One may be here twice.
  std::vector<std::string> _expiring VELK_GUARDED_BY(_logFileLock);
  /// Whether the error line that tells of lost entries has been written since the last entry that was not.
  bool _saidThatEntriesAreLost VELK_GUARDED_BY(_logFileLock) = false;
};

}  // namespace velk
