#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>
#include <vector>

#include "foundation/TimeValue.h"
#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/Platform.h"

namespace velk {
namespace {

constexpr int kMaximumSameNames = 100;
/// Bounds of the spool, for the files of one log type: a month of daily logs, four logs that were full. The oldest go.
constexpr std::size_t kMaximumFiles = 32;
constexpr std::size_t kMaximumBytes = 256 * 1024 * 1024;
constexpr std::size_t kCopiedAtOnce = 256 * 1024;

Error copyError(const char* what, const std::string& path) {
  return {"LogSubmission", errno, std::string(what) + " " + path + ": " + std::generic_category().message(errno)};
}

bool writeAll(int descriptor, const char* bytes, std::size_t size) {
  while (size > 0) {
    const ssize_t written = ::write(descriptor, bytes, size);
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    bytes += written;
    size -= static_cast<std::size_t>(written);
  }
  return true;
}

/// A log may be large: it is copied in pieces. The name that collectors look for appears when all is there.
Result<void> copy(const std::string& from, const std::string& to) {
  const FileDescriptor source(::open(from.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
  if (!source) return Failure(copyError("cannot open", from));
  const std::string part = to + ".part";
  (void)::unlink(part.c_str());
  const FileDescriptor target(::open(part.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!target) return Failure(copyError("cannot create", part));
  std::vector<char> piece(kCopiedAtOnce);
  ssize_t got = 0;
  while ((got = ::read(source.get(), piece.data(), piece.size())) > 0 || (got < 0 && errno == EINTR)) {
    if (got > 0 && !writeAll(target.get(), piece.data(), static_cast<std::size_t>(got))) break;
  }
  if (got == 0 && ::fsync(target.get()) == 0 && ::rename(part.c_str(), to.c_str()) == 0) return {};
  const auto error = copyError("cannot copy to", to);
  (void)::unlink(part.c_str());
  return Failure(error);
}

class SpoolDirectory : public LogSubmission {
 public:
  explicit SpoolDirectory(std::string spoolDirectory) : _spoolDirectory(std::move(spoolDirectory)) {}

  Result<void> createSubmittableLog(const std::string& path, const std::string&) override {
    return files::createEmpty(path);
  }

  bool moveForSubmission(const std::string& path, const std::string& logType) override {
    if (_spoolDirectory.empty()) return false;
    if (const auto made = files::createDirectories(_spoolDirectory); !made) return refuse(path, made.error());
    makeRoom(files::size(path).value_or(0), logType + "-");
    const std::string target = freeName(path.substr(path.rfind('/') + 1), logType);
    if (files::move(path, target)) return true;
    // The spool may be on another file system.
    if (const auto copied = copy(path, target); !copied) return refuse(path, copied.error());
    if (const auto removed = files::remove(path); !removed) {
      // Not both: it would be taken again.
      (void)files::remove(target);
      return refuse(path, removed.error());
    }
    return true;
  }

 private:
  struct Spooled {
    std::string path;
    double changed;
    std::size_t bytes;
  };

  static bool refuse(const std::string& path, const Error& error) {
    log::error("LogSubmission: Cannot take %s: %s", path, error);
    return false;
  }

  /// Removes the oldest files whose names begin with `prefix` until one more of `bytes` fits.
  void makeRoom(std::size_t bytes, const std::string& prefix) const {
    auto spooled = filesThatBeginWith(prefix);
    std::size_t sum = bytes;
    for (const auto& file : spooled) sum += file.bytes;
    const auto isOlder = [](const Spooled& left, const Spooled& right) { return left.changed < right.changed; };
    std::stable_sort(spooled.begin(), spooled.end(), isOlder);
    std::size_t count = spooled.size();
    for (const auto& file : spooled) {
      if (count < kMaximumFiles && sum <= kMaximumBytes) return;
      if (const auto removed = files::remove(file.path); !removed) continue;
      log::standard("LogSubmission: Removed %s, the oldest of those that were not collected", file.path);
      --count;
      sum -= file.bytes;
    }
  }

  std::vector<Spooled> filesThatBeginWith(const std::string& prefix) const {
    std::vector<Spooled> found;
    for (const auto& name : files::list(_spoolDirectory).value_or(std::vector<std::string>())) {
      if (!name.starts_with(prefix)) continue;
      const std::string path = _spoolDirectory + "/" + name;
      const auto changed = files::modificationTime(path);
      const auto bytes = files::size(path);
      if (changed && bytes) found.push_back({path, secondsFromTimeValue(*changed), *bytes});
    }
    return found;
  }

  std::string freeName(const std::string& name, const std::string& logType) const {
    const std::string base = _spoolDirectory + "/" + logType + "-" + name;
    std::string candidate = base;
    for (int number = 1; files::exists(candidate) && number <= kMaximumSameNames; ++number) {
      candidate = base + "." + std::to_string(number);
    }
    return candidate;
  }

  const std::string _spoolDirectory;
};

}  // namespace

std::unique_ptr<LogSubmission> makeLogSubmission(std::string spoolDirectory) {
  return std::make_unique<SpoolDirectory>(std::move(spoolDirectory));
}

}  // namespace velk
