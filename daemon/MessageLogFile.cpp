#include "daemon/MessageLogFile.h"

#include <array>
#include <cstdio>
#include <ctime>
#include <vector>

#include "daemon/MessageLogTexts.h"
#include "foundation/Text.h"
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

/// When the file was made: what its name says, else its birth. Appending changes neither.
std::optional<Date> creationDate(const std::string& path) {
  const auto parts = partsOfOwnName(std::string_view(path).substr(path.rfind('/') + 1));
  if (parts.size() == 3) {
    if (const auto date = dateFromNameTime(std::string(parts[1]))) return date;
  }
  const auto birth = files::creationTime(path);
  return birth ? std::optional(Date{secondsFromTimeValue(*birth)}) : std::nullopt;
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
std::string entryText(std::string_view text) {
  text = cut(text);
  if (standsAsItIs(text)) return std::string(text);
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

Monitor MessageLogFile::_logFileLock;

MessageLogFile::MessageLogFile(std::string directory, const Clock& clock, LogSubmission& submission)
    : _directory(std::move(directory)), _clock(clock), _submission(submission) {}

Date MessageLogFile::now() const { return Date{secondsFromTimeValue(_clock.wallTime())}; }

bool MessageLogFile::isExpired(const std::optional<Date>& date) const {
  return date && now().secondsSince1970 - date->secondsSince1970 > kMaximumAgeInSeconds;
}

bool MessageLogFile::isOfTheFuture(const std::optional<Date>& date) const {
  return date && date->secondsSince1970 - now().secondsSince1970 > kMaximumAgeInSeconds;
}

void MessageLogFile::writeToLogFile(std::string_view text) {
  Guard guard(_logFileLock);
  // A current file without a date is used as it is.
  if (!_currentPath || isExpired(_currentDate)) scanDirectory();
  if (!_currentPath) return;
  appendEntry(text);
}

void MessageLogFile::scanDirectory() {
  // The current file is not forgotten before the scan: when it has expired it may stay current by name until the next
  // entry finds it gone.
  for (const auto& path : ownFiles()) considerEntry(path, creationDate(path));
  if (!_currentPath) createNewLogFile(&_currentPath, &_currentDate);
}

std::vector<std::string> MessageLogFile::ownFiles() {
  std::vector<std::string> paths;
  const auto names = files::list(_directory);
  if (names) {
    for (const auto& name : *names) {
      if (!partsOfOwnName(name).empty()) paths.push_back(_directory + "/" + name);
    }
    return paths;
  }
  if (names.error().code != static_cast<int>(files::Code::notFound)) {
    log::error(logtexts::kErrorReadingLogDirectory, names.error());
    return paths;
  }
  log::standard(logtexts::kCreatingLogDirectory, _directory);
  // When it cannot be made, the file in it cannot either, and that is reported.
  (void)files::createDirectories(_directory);
  return paths;
}

void MessageLogFile::considerEntry(const std::string& path, const std::optional<Date>& date) {
  if (isExpired(date)) return deleteExpiredLogFile(path, date);
  if (_currentPath && _currentDate) {
    const bool isNewer = date && date->secondsSince1970 > _currentDate->secondsSince1970;
    if (!isNewer) return deleteExpiredLogFile(path, date);
    deleteExpiredLogFile(*_currentPath, _currentDate);
  }
  _currentPath = path;
  _currentDate = date;
}

void MessageLogFile::createNewLogFile(std::optional<std::string>* path, std::optional<Date>* creation) {
  if (path == nullptr || creation == nullptr) {
    log::error(logtexts::kLogFileArgumentsMissing);
    return;
  }
  path->reset();
  creation->reset();
  std::string created =
      _directory + "/" + std::string(kNamePrefix) + "_" + nameTime(now()) + "_" + std::string(kNameSuffix);
  // What counts is whether the file is there: one of the same second is as good.
  (void)_submission.createSubmittableLog(created, kLogType);
  if (!files::exists(created)) {
    log::error(logtexts::kFailedToCreateLogFile, created);
    return;
  }
  *creation = creationDate(created);
  log::standard(logtexts::kCreatedLogFile, created, dateText(*creation));
  *path = std::move(created);
}

void MessageLogFile::deleteExpiredLogFile(const std::string& path, const std::optional<Date>& creation) {
  if (_submission.moveForSubmission(path, kLogType)) {
    log::standard(logtexts::kSubmittedLogFile, path, dateText(creation));
    return;
  }
  // It may be gone already, which is as good.
  (void)files::remove(path);
  log::standard(logtexts::kDeletedLogFile, path, dateText(creation));
}

void MessageLogFile::appendEntry(std::string_view text) {
  const std::string line = "(" + dateText(now()) + ") " + entryText(text) + "\n";
  const auto size = files::size(*_currentPath);
  if (size && *size + line.size() > kMaximumFileBytes && isOfTheFuture(_currentDate)) {
    // Made while the clock was wrong: it would stay current, and full, until its day has come.
    deleteExpiredLogFile(*_currentPath, _currentDate);
    createNewLogFile(&_currentPath, &_currentDate);
    if (!_currentPath) return;
  } else if (size && *size + line.size() > kMaximumFileBytes) {
    if (_reportedFull != _currentPath) log::error("writeToLogFile: %s is full", *_currentPath);
    _reportedFull = _currentPath;
    return;
  }
  const auto appended = files::append(*_currentPath, {reinterpret_cast<const std::uint8_t*>(line.data()), line.size()});
  if (!appended && appended.error().code == static_cast<int>(files::Code::incomplete)) {
    log::error("writeToLogFile: %s", appended.error());
    return;
  }
  // A file that was taken away costs the message in hand; the next one goes to the new file.
  if (!appended) createNewLogFile(&_currentPath, &_currentDate);
  log::standard(logtexts::kSavedLogMessage, _currentPath);
}

}  // namespace velk
