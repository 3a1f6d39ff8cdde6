#include "daemon/MessageLogFile.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <ctime>
#include <utility>
#include <vector>

#include "daemon/MessageLogTexts.h"
#include "foundation/Text.h"
#include "platform/BlockingScope.h"
#include "platform/Clock.h"
#include "platform/Files.h"
#include "platform/LocalTime.h"
#include "platform/Log.h"
#include "platform/Platform.h"

namespace velk {
namespace {

constexpr std::string_view kNamePrefix = "velkreportingd";
constexpr std::string_view kNameSuffix = "messageLog.ips";
constexpr const char* kLogType = "224";
constexpr double kMaximumAgeInSeconds = 86400;
constexpr std::size_t kMaximumEntryBytes = 256 * 1024;
constexpr std::size_t kMaximumFileBytes = 64 * 1024 * 1024;
/// More than the files that can wait for their submission.
constexpr int kNamesTried = 10;

std::string formatted(const std::tm& time, const char* format) {
  std::array<char, 64> buffer{};
  const std::size_t length = std::strftime(buffer.data(), buffer.size(), format, &time);
  return {buffer.data(), length};
}

/// "2024-05-01-13-45-10" in local time.
std::string nameTime(Date date) {
  return formatted(localTime(static_cast<std::time_t>(date.secondsSince1970)), "%Y-%m-%d-%H-%M-%S");
}

/// "2024-05-01 11:45:10 +0000": the same wherever it is read.
std::string dateText(Date date) {
  return formatted(universalTime(static_cast<std::time_t>(date.secondsSince1970)), "%Y-%m-%d %H:%M:%S +0000");
}

std::optional<std::string> dateText(const std::optional<Date>& date) {
  return date ? std::optional(dateText(*date)) : std::nullopt;
}

std::optional<Date> dateFromNameTime(const std::string& text) {
  std::tm local{};
  int used = 0;
  const int fields = std::sscanf(text.c_str(), "%4d-%2d-%2d-%2d-%2d-%2d%n", &local.tm_year, &local.tm_mon,
                                 &local.tm_mday, &local.tm_hour, &local.tm_min, &local.tm_sec, &used);
  if (fields != 6 || static_cast<std::size_t>(used) != text.size()) return std::nullopt;
  local.tm_year -= 1900;
  local.tm_mon -= 1;
  const std::time_t seconds = timeOfLocal(local);
  return seconds != -1 ? std::optional(Date{static_cast<double>(seconds)}) : std::nullopt;
}

/// The three parts of a name that belongs to this service; none of any other.
std::vector<std::string_view> partsOfOwnName(std::string_view name) {
  auto parts = split(name, '_');
  if (parts.size() != 3 || parts[0] != kNamePrefix || parts[2] != kNameSuffix) parts.clear();
  return parts;
}

bool isContinuationByte(char character) { return (static_cast<unsigned char>(character) & 0xc0) == 0x80; }

std::string_view cut(std::string_view text) {
  if (text.size() <= kMaximumEntryBytes) return text;
  std::size_t length = kMaximumEntryBytes;
  while (length > 0 && isContinuationByte(text[length])) --length;
  return text.substr(0, length);
}

/// Whether no character of the text would be changed: the usual case, since JSON escapes control characters.
bool standsAsItIs(std::string_view text) {
  bool lineBegins = false;
  for (const char character : text) {
    const auto byte = static_cast<unsigned char>(character);
    if ((byte < 0x20 && byte != '\n' && byte != '\t') || byte >= 0x7F) return false;
    if (lineBegins && byte == '(') return false;
    lineBegins = byte == '\n';
  }
  return true;
}

/// The text with its line breaks and tabs, but no other control character; no line of it looks like a new entry.
std::string changedText(std::string_view text) {
  std::string result;
  bool first = true;
  for (const auto line : split(text, '\n')) {
    if (!first) result += line.substr(0, 1) == "(" ? "\n\t" : "\n";
    first = false;
    bool firstCell = true;
    for (const auto cell : split(line, '\t')) {
      if (!firstCell) result += '\t';
      firstCell = false;
      result += withoutControlCharacters(cell);
    }
  }
  return result;
}

}  // namespace

/// Made before the lock is taken. The text outlives it.
struct MessageLogFile::Entry {
  Entry(Date date, std::string_view whole) : head("(" + dateText(date) + ") "), text(cut(whole)) {
    if (standsAsItIs(text)) return;
    changed = changedText(text);
    text = changed;
  }
  Entry(const Entry&) = delete;
  Entry& operator=(const Entry&) = delete;
  [[nodiscard]] std::size_t size() const { return head.size() + text.size() + 1; }

  const std::string head;
  std::string changed;
  std::string_view text;
};

Monitor MessageLogFile::_logFileLock;

MessageLogFile::MessageLogFile(std::string directory, const Clock& clock, LogSubmission& submission,
                               std::shared_ptr<Queue> expiryQueue, CreationTime creationTime)
    : _directory(std::move(directory)),
      _clock(clock),
      _submission(submission),
      _expiryQueue(std::move(expiryQueue)),
      _creationTime(std::move(creationTime)) {}

Date MessageLogFile::now() const { return Date{secondsFromTimeValue(_clock.wallTime())}; }

bool MessageLogFile::isExpired(const std::optional<Date>& date) const {
  return date && now().secondsSince1970 - date->secondsSince1970 > kMaximumAgeInSeconds;
}

/// The file's birth, which neither entries nor a change of the time zone move. On a file system that keeps none the
/// time in the name stands in: the time of the last change would never be a day ago.
std::optional<Date> MessageLogFile::creationDate(const std::string& path) const {
  if (const auto birth = _creationTime(path)) return Date{secondsFromTimeValue(*birth)};
  const auto parts = partsOfOwnName(std::string_view(path).substr(path.rfind('/') + 1));
  return parts.empty() ? std::nullopt : dateFromNameTime(std::string(parts[1]));
}

void MessageLogFile::writeToLogFile(std::string_view text) {
  const Entry entry(now(), text);
  Steps steps;
  {
    Guard guard(_logFileLock);
    // A current file without a date is used as it is.
    if (!_currentPath || isExpired(_currentDate)) scanDirectoryLocked(steps);
    if (_currentPath) appendLocked(entry, steps);
  }
  perform(std::move(steps));
}

void MessageLogFile::perform(Steps steps) {
  const auto isExpiry = [](const Step& step) { return step.format == nullptr; };
  if (std::none_of(steps.begin(), steps.end(), isExpiry)) return performNow(steps);
  // The lines behind the end of a file wait for it, so that they tell what happened in its order.
  _expiryQueue->async([this, steps = std::move(steps)] { performNow(steps); });
}

void MessageLogFile::performNow(const Steps& steps) {
  for (const auto& step : steps) {
    if (step.format == nullptr) {
      deleteExpiredLogFile(*step.subject, step.date);
      Guard guard(_logFileLock);
      _expiring.erase(std::find(_expiring.begin(), _expiring.end(), *step.subject));
    } else if (step.level == log::Level::error) {
      log::error(step.format, step.subject);
    } else {
      log::standard(step.format, step.subject, dateText(step.date));
    }
  }
}

void MessageLogFile::scanDirectoryLocked(Steps& steps) {
  // The current file is not forgotten before the scan: when it has expired it may stay current by name until this entry
  // finds it gone.
  for (const auto& path : ownFiles(steps)) {
    if (!isExpiringLocked(path)) considerEntryLocked(path, creationDate(path), steps);
  }
  if (!_currentPath) createLocked(_currentPath, _currentDate, steps);
}

std::vector<std::string> MessageLogFile::ownFiles(Steps& steps) const {
  std::vector<std::string> paths;
  const auto names = files::list(_directory);
  if (names) {
    for (const auto& name : *names) {
      if (!partsOfOwnName(name).empty()) paths.push_back(_directory + "/" + name);
    }
    return paths;
  }
  if (names.error().code != static_cast<int>(files::Code::notFound)) {
    steps.push_back({log::Level::error, logtexts::kErrorReadingLogDirectory, names.error().description});
    return paths;
  }
  steps.push_back({log::Level::standard, logtexts::kCreatingLogDirectory, _directory});
  // When it cannot be made, the file in it cannot either, and that is reported.
  (void)files::createDirectories(_directory);
  return paths;
}

void MessageLogFile::considerEntryLocked(const std::string& path, const std::optional<Date>& date, Steps& steps) {
  if (isExpired(date)) return expireLocked(path, date, steps);
  if (_currentPath && _currentDate) {
    const bool isNewer = date && date->secondsSince1970 > _currentDate->secondsSince1970;
    if (!isNewer) return expireLocked(path, date, steps);
    expireLocked(*_currentPath, _currentDate, steps);
  }
  _currentPath = path;
  _currentDate = date;
}

void MessageLogFile::expireLocked(const std::string& path, const std::optional<Date>& date, Steps& steps) {
  _expiring.push_back(path);
  steps.push_back({log::Level::standard, nullptr, path, date});
}

bool MessageLogFile::isExpiringLocked(const std::string& path) const {
  return std::find(_expiring.begin(), _expiring.end(), path) != _expiring.end();
}

void MessageLogFile::createNewLogFile(std::optional<std::string>* path, std::optional<Date>* creation) {
  if (path == nullptr || creation == nullptr) {
    log::error(logtexts::kLogFileArgumentsMissing);
    return;
  }
  Steps steps;
  {
    Guard guard(_logFileLock);
    createLocked(*path, *creation, steps);
  }
  perform(std::move(steps));
}

/// Named after this second, or after the next one whose name is free: a full file is replaced within its second.
std::string MessageLogFile::freePathLocked() const {
  const Date date = now();
  std::string path;
  for (int second = 0; second < kNamesTried; ++second) {
    path = _directory + "/" + std::string(kNamePrefix) + "_" + nameTime(Date{date.secondsSince1970 + second}) + "_" +
           std::string(kNameSuffix);
    if (!files::exists(path) && !isExpiringLocked(path)) break;
  }
  return path;
}

void MessageLogFile::createLocked(std::optional<std::string>& path, std::optional<Date>& creation, Steps& steps) {
  path.reset();
  creation.reset();
  _file = AppendedFile();
  std::string created = freePathLocked();
  // The file's existence decides.
  (void)_submission.createSubmittableLog(created, kLogType);
  if (!files::exists(created)) {
    steps.push_back({log::Level::error, logtexts::kFailedToCreateLogFile, std::move(created)});
    return;
  }
  creation = creationDate(created);
  steps.push_back({log::Level::standard, logtexts::kCreatedLogFile, created, creation});
  path = std::move(created);
}

void MessageLogFile::deleteExpiredLogFile(const std::string& path, const std::optional<Date>& creation) {
  // The submission may copy the file.
  BlockingScope blocking;
  if (_submission.moveForSubmission(path, kLogType)) {
    log::standard(logtexts::kSubmittedLogFile, path, dateText(creation));
    return;
  }
  // It may be gone already, which is as good.
  (void)files::remove(path);
  log::standard(logtexts::kDeletedLogFile, path, dateText(creation));
}

/// False: the entry is lost. A full current file is replaced.
bool MessageLogFile::hasRoomLocked(std::size_t size, const Entry& entry, Steps& steps) {
  if (size + entry.size() <= kMaximumFileBytes) return true;
  if (_expiring.size() >= kMaximumExpiring) {
    if (!std::exchange(_saidThatEntriesAreLost, true)) {
      steps.push_back(
          {log::Level::error, "writeToLogFile: %s is full, and those before it are not submitted yet", _currentPath});
    }
    return false;
  }
  expireLocked(*_currentPath, _currentDate, steps);
  createLocked(_currentPath, _currentDate, steps);
  return _currentPath && _file.open(*_currentPath);
}

void MessageLogFile::appendLocked(const Entry& entry, Steps& steps) {
  const auto size = _file.open(*_currentPath);
  if (!size || isExpiringLocked(*_currentPath)) {
    // A file that was taken away costs the message in hand; the next one goes to the new file.
    createLocked(_currentPath, _currentDate, steps);
  } else if (!hasRoomLocked(*size, entry, steps)) {
    return;
  } else if (const auto appended = _file.append({entry.head, entry.text, "\n"}); !appended) {
    // Once, not for every message while the disk is full.
    if (std::exchange(_saidThatEntriesAreLost, true)) return;
    steps.push_back({log::Level::error, "writeToLogFile: %s", appended.error().description});
    return;
  } else {
    _saidThatEntriesAreLost = false;
  }
  if (log::isEnabled(log::Level::standard)) {
    steps.push_back({log::Level::standard, logtexts::kSavedLogMessage, _currentPath});
  }
}

}  // namespace velk
