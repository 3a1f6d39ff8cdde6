#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/Platform.h"

namespace velk {
namespace {

/// Logs that are moved to another file system are read whole; larger ones are not taken.
constexpr std::size_t kMaximumCopiedBytes = 64 * 1024 * 1024;
constexpr int kMaximumSameNames = 100;

class SpoolDirectory : public LogSubmission {
 public:
  explicit SpoolDirectory(std::string spoolDirectory) : _spoolDirectory(std::move(spoolDirectory)) {}

  Result<void> createSubmittableLog(const std::string& path, const std::string&) override {
    return files::createEmpty(path);
  }

  bool moveForSubmission(const std::string& path, const std::string& logType) override {
    if (_spoolDirectory.empty()) return false;
    if (const auto made = files::createDirectories(_spoolDirectory); !made) return refuse(path, made.error());
    const std::string target = freeName(path.substr(path.rfind('/') + 1), logType);
    if (files::move(path, target)) return true;
    // The spool may be on another file system.
    const auto bytes = files::read(path, kMaximumCopiedBytes);
    if (!bytes) return refuse(path, bytes.error());
    if (const auto written = files::writeAtomically(target, *bytes); !written) return refuse(path, written.error());
    if (const auto removed = files::remove(path); !removed) return refuse(path, removed.error());
    return true;
  }

 private:
  static bool refuse(const std::string& path, const Error& error) {
    log::error("LogSubmission: Cannot take %s: %s", path, error);
    return false;
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
