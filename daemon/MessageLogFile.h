// The message log on the disk: a plain-text record of what sessions did with their messages, in one current file that
// is replaced once a day. Sessions call it from their queues; it lives as long as the agent.
//
// File: none -> created at the first message (or when the current one is older than a day at the next) -> current ->
// expired (submitted or deleted) when a later scan finds it too old or finds a newer one. Nothing happens between
// messages.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/Lock.h"
#include "session/SessionServices.h"

namespace velk {

class Clock;
class LogSubmission;

/// Any thread. All objects of the process share one lock, which is held for the file work and its log lines: nothing
/// below calls back. Bounds: an entry is cut at 256 KiB; when a file has reached 64 MiB further entries are dropped
/// until it is replaced (one error line tells); one whose date is more than a day ahead is replaced at once.
class MessageLogFile : public MessageLog {
 public:
  /// `clock` and `submission` outlive the object. `directory` is made (0700) when the first message needs it.
  MessageLogFile(std::string directory, const Clock& clock, LogSubmission& submission);

  /// Appends "(date) text". The one message that finds the current file gone is lost; the next goes to a new file.
  /// Control characters other than line breaks and tabs are escaped, and a continued line that begins as entries do is
  /// indented by a tab, so that no text can pass for an entry of its own.
  void writeToLogFile(std::string_view text) override;

  // The steps of the above, under the lock. Both parts of a current file are handed in and out.
  void createNewLogFile(std::optional<std::string>* path, std::optional<Date>* creationDate);
  void deleteExpiredLogFile(const std::string& path, const std::optional<Date>& creationDate);

 private:
  static Monitor _logFileLock;

  void scanDirectory() VELK_REQUIRES(_logFileLock);
  void considerEntry(const std::string& path, const std::optional<Date>& date) VELK_REQUIRES(_logFileLock);
  void appendEntry(std::string_view text) VELK_REQUIRES(_logFileLock);
  [[nodiscard]] bool isExpired(const std::optional<Date>& date) const;
  [[nodiscard]] bool isOfTheFuture(const std::optional<Date>& date) const;
  [[nodiscard]] std::vector<std::string> ownFiles();
  [[nodiscard]] Date now() const;

  // Constant after construction.
  const std::string _directory;
  const Clock& _clock;
  LogSubmission& _submission;

  // Guarded by the process's log-file lock.
  std::optional<std::string> _currentPath VELK_GUARDED_BY(_logFileLock);
  std::optional<Date> _currentDate VELK_GUARDED_BY(_logFileLock);
  /// The full file that has been reported.
  std::optional<std::string> _reportedFull VELK_GUARDED_BY(_logFileLock);
};

}  // namespace velk
