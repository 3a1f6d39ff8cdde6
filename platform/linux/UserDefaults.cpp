#include "platform/UserDefaults.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <system_error>
#include <thread>

#include "foundation/Json.h"
#include "platform/BlockingScope.h"
#include "platform/Clock.h"
#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/Platform.h"

namespace velk {
namespace {

/// No write makes a file larger than this, but for the consent's.
constexpr std::size_t kMaximumSuiteBytes = 4 * 1024 * 1024;
/// What is read: consent can be given and withdrawn in a full file as well.
constexpr std::size_t kMaximumReadBytes = kMaximumSuiteBytes + 64 * 1024;

/// What one version of a file is told by. Files are replaced, never written in place, and a version that is in use is
/// kept open, so that its number cannot be given to the next one; size and time of change tell when somebody edits it
/// in place or changes its mode.
struct FileIdentity {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = -1;  ///< below 0: there is no file
  std::int64_t changed = 0;

  bool operator==(const FileIdentity&) const = default;
};

FileIdentity identityOf(const struct stat& status) {
  return {status.st_dev, status.st_ino, status.st_size,
          std::int64_t{status.st_ctim.tv_sec} * 1'000'000'000 + status.st_ctim.tv_nsec};
}

FileIdentity identityOfPath(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 ? identityOf(status) : FileIdentity{};
}

/// `outOfReach`: for want of descriptors or memory, which says nothing about the file.
enum class Usability { usable, corrupt, unreadable, outOfReach };

/// One version of a suite's file in memory.
struct Version {
  FileIdentity identity;
  FileDescriptor file;
  PropertyDictionary values;
  bool isTrustworthy = true;
  Usability usability = Usability::usable;
  std::string problem;
};

Version problematic(Version version, Usability usability, std::string problem) {
  version.usability = usability;
  version.problem = std::move(problem);
  return version;
}

Version readVersion(const std::string& path) {
  Version version;
  version.file = FileDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!version.file) {
    if (errno == ENOENT || errno == ENOTDIR) return version;
    const bool isScarcity = errno == EMFILE || errno == ENFILE || errno == ENOMEM;
    const std::string problem = std::generic_category().message(errno);
    version.identity = identityOfPath(path);
    return problematic(std::move(version), isScarcity ? Usability::outOfReach : Usability::unreadable, problem);
  }
  struct stat status {};
  if (::fstat(version.file.get(), &status) == 0) version.identity = identityOf(status);
  version.isTrustworthy = files::isTrustworthy(path);
  // The open descriptor, not the path: the file may be replaced at any moment.
  const auto bytes = files::readDescriptor(version.file.get(), path, kMaximumReadBytes);
  if (!bytes) {
    const bool tooLarge = bytes.error().code == static_cast<int>(files::Code::tooLarge);
    return problematic(std::move(version), tooLarge ? Usability::corrupt : Usability::unreadable,
                       bytes.error().description);
  }
  auto parsed = json::parse({reinterpret_cast<const char*>(bytes->data()), bytes->size()}, json::Extensions::tagged);
  if (!parsed) return problematic(std::move(version), Usability::corrupt, parsed.error().description);
  const auto* dictionary = parsed->dictionary();
  if (dictionary == nullptr) return problematic(std::move(version), Usability::corrupt, "not a dictionary");
  version.values = *dictionary;
  return version;
}

/// A file whose last version is kept in memory. Reads cost one stat() while nobody writes.
class CachedFile {
 public:
  explicit CachedFile(std::string path) : _path(std::move(path)) {}

  [[nodiscard]] const std::string& path() const noexcept { return _path; }

  /// The version that is on the disk now. `isNew` becomes true when this object had not seen it before.
  std::shared_ptr<const Version> current(bool& isNew) {
    const FileIdentity identity = identityOfPath(_path);
    {
      Guard guard(_lock);
      isNew = _version == nullptr || _version->identity != identity;
      if (!isNew) return _version;
    }
    // Not under the lock: another thread that reads the file meanwhile finds the same.
    auto version = std::make_shared<const Version>(readVersion(_path));
    Guard guard(_lock);
    if (version->usability == Usability::outOfReach) {
      // Not kept, so that the next read tries again.
      isNew = !std::exchange(_isOutOfReach, true);
      return version;
    }
    _isOutOfReach = false;
    _version = version;
    return version;
  }

  /// For readers: while the present version is out of reach, what was there before is closer to it than nothing.
  std::shared_ptr<const Version> currentOrLast(bool& isNew) {
    auto version = current(isNew);
    if (version->usability != Usability::outOfReach) return version;
    if (isNew) log::error("UserDefaults: Cannot read %s for now: %s", _path, version->problem);
    Guard guard(_lock);
    return _version != nullptr ? _version : version;
  }

 private:
  const std::string _path;
  Lock _lock;
  std::shared_ptr<const Version> _version VELK_GUARDED_BY(_lock);
  bool _isOutOfReach VELK_GUARDED_BY(_lock) = false;
};

/// How long a writer waits for the others: it may be a session that holds up more than itself.
constexpr Duration kLockTime = std::chrono::seconds(1);
/// After a wait in vain no caller waits again for so long, so that the several settings of one session cost one wait.
constexpr Duration kHeldMemory = std::chrono::seconds(10);
/// The system wakes nobody after a time, so the file is tried again and again; and a process that writes many settings
/// in a row leaves the others this gap to come in.
constexpr Duration kLockRetry = std::chrono::microseconds(500);
constexpr Duration kLockGap = std::chrono::milliseconds(1);

/// The way to a suite's lock file in this process: one thread at a time asks for it.
class SuiteGate {
 public:
  explicit SuiteGate(std::string path) : _path(std::move(path)) {}

  [[nodiscard]] const std::string& path() const noexcept { return _path; }

  /// False when another thread was still in at the deadline. The caller counts as blocked.
  bool enter(SteadyTime deadline) {
    Guard guard(_lock);
    while (_isTaken) {
      if (!_left.waitUntil(_lock, deadline) && _isTaken) return false;
    }
    _isTaken = true;
    return true;
  }
  void leave() {
    {
      Guard guard(_lock);
      _isTaken = false;
    }
    _left.notifyOne();
  }

  // Of whoever is in.

  /// Whether the file was found held a moment ago, so that one more attempt must do.
  [[nodiscard]] bool isKnownToBeHeld(SteadyTime now) const { return now < _heldUntil; }
  void noteHeld(SteadyTime now) { _heldUntil = now + kHeldMemory; }
  void noteReleased(SteadyTime now) { _released = now; }
  [[nodiscard]] Duration gapLeft(SteadyTime now) const { return _released + kLockGap - now; }

 private:
  const std::string _path;
  // Used by whoever is in.
  SteadyTime _heldUntil{};
  SteadyTime _released{};
  // Guarded by _lock.
  Lock _lock;
  Condition _left;
  bool _isTaken VELK_GUARDED_BY(_lock) = false;
};

/// The lock file of a suite, held by one writer of all processes, or the reason why it is not.
class SuiteLock {
 public:
  explicit SuiteLock(SuiteGate& gate) : _gate(gate) {
    const BlockingScope blocking;
    const auto deadline = systemClock().steadyTime() + kLockTime;
    _isIn = _gate.enter(deadline);
    if (!_isIn) {
      _isHeldElsewhere = true;
      _whyNot = gate.path() + " is held by another thread of this process";
      return;
    }
    // Failing is usual: the file is there already.
    (void)files::createEmpty(_gate.path());
    _file = FileDescriptor(::open(_gate.path().c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW));
    if (!_file || !acquires(deadline)) fail(errno);
  }
  ~SuiteLock() {
    // Closing it would not do: a child that was forked meanwhile has a copy, and would keep everybody out.
    if (_file) {
      static_cast<void>(::flock(_file.get(), LOCK_UN));
      _gate.noteReleased(systemClock().steadyTime());
    }
    if (_isIn) _gate.leave();
  }
  SuiteLock(const SuiteLock&) = delete;
  SuiteLock& operator=(const SuiteLock&) = delete;
  [[nodiscard]] bool held() const noexcept { return static_cast<bool>(_file); }
  /// Another process has it, which may be changing the suite just now.
  [[nodiscard]] bool isHeldElsewhere() const noexcept { return _isHeldElsewhere; }
  [[nodiscard]] const std::string& whyNot() const noexcept { return _whyNot; }

 private:
  bool acquires(SteadyTime deadline) {
    const auto begun = systemClock().steadyTime();
    if (const auto gap = _gate.gapLeft(begun); gap > Duration::zero()) std::this_thread::sleep_for(gap);
    for (;;) {
      if (::flock(_file.get(), LOCK_EX | LOCK_NB) == 0) return true;
      if (errno == EINTR) continue;
      if (errno != EWOULDBLOCK) return false;
      const auto now = systemClock().steadyTime();
      if (now >= deadline || _gate.isKnownToBeHeld(now)) {
        // A wait, and not this attempt alone, begins the time without waiting: it ends some day.
        if (now >= deadline) _gate.noteHeld(now);
        errno = EWOULDBLOCK;
        return false;
      }
      std::this_thread::sleep_for(kLockRetry);
    }
  }

  void fail(int error) {
    _isHeldElsewhere = error == EWOULDBLOCK;
    _whyNot = _isHeldElsewhere ? _gate.path() + " is held by another process"
                               : "cannot lock " + _gate.path() + ": " + std::generic_category().message(error);
    _file = FileDescriptor();
  }

  SuiteGate& _gate;
  bool _isIn = false;
  bool _isHeldElsewhere = false;
  FileDescriptor _file;
  std::string _whyNot;
};

class FileUserDefaults : public UserDefaults {
 public:
  FileUserDefaults(std::string_view suite, std::string stateDirectory, const std::string& configurationDirectory)
      : _stateDirectory(std::move(stateDirectory)),
        _gate(_stateDirectory + "/" + std::string(suite) + ".lock"),
        _user(_stateDirectory + "/" + std::string(suite) + ".json"),
        _administrator(configurationDirectory.empty() ? ""
                                                      : configurationDirectory + "/" + std::string(suite) + ".json") {}

  std::optional<PropertyValue> value(std::string_view key) const override {
    const auto user = userVersion();
    if (const auto* found = user->values.find(key)) return *found;
    const auto defaults = administratorValues();
    const auto* found = defaults.find(key);
    return found != nullptr ? std::optional(*found) : std::nullopt;
  }

  PropertyDictionary allValues() const override {
    auto values = administratorValues();
    values.merge(userVersion()->values);
    return values;
  }

  Result<void> set(std::string_view key, PropertyValue value) override {
    const auto edit = [&](PropertyDictionary& values) {
      values.set(key, std::move(value));
      return true;
    };
    return change(edit, key == kDiagnosticsAndUsageSetting ? kMaximumReadBytes : kMaximumSuiteBytes);
  }

  Result<void> remove(std::string_view key) override {
    if (!userVersion()->values.contains(key)) return {};
    return change([&](PropertyDictionary& values) { return values.remove(key); });
  }

  Result<PropertyValue> valueOrStore(std::string_view key, const std::function<PropertyValue()>& make) override {
    if (auto found = value(key)) return std::move(*found);
    PropertyValue result;
    const auto changed = change([&](PropertyDictionary& values) {
      // Another process may have been quicker.
      if (const auto* found = values.find(key)) {
        result = *found;
        return false;
      }
      result = make();
      values.set(key, result);
      return true;
    });
    if (!changed) return Failure(changed.error());
    return result;
  }

 private:
  std::shared_ptr<const Version> userVersion() const {
    bool isNew = false;
    auto version = _user.currentOrLast(isNew);
    if (version->usability == Usability::corrupt) return afterSettingAside(isNew);
    if (isNew && version->usability == Usability::unreadable) {
      log::error("UserDefaults: Cannot read %s: %s", _user.path(), version->problem);
    }
    return version;
  }

  /// Under the suite's lock a corrupt file is what every process sees, so it is moved away once.
  std::shared_ptr<const Version> afterSettingAside(bool isUnreported) const {
    const SuiteLock suite(_gate);
    if (!suite.isHeldElsewhere()) return setAsideLocked(isUnreported);
    bool isNew = false;
    auto version = _user.current(isNew);
    if (isUnreported) log::error("UserDefaults: Cannot use %s: %s; %s", _user.path(), version->problem, suite.whyNot());
    return version;
  }

  std::shared_ptr<const Version> setAsideLocked(bool isUnreported) const {
    bool isNew = false;
    auto version = _user.current(isNew);
    if (version->usability != Usability::corrupt) return version;
    if (const auto name = files::setAside(_user.path())) {
      log::error("UserDefaults: Set aside unusable %s as %s: %s", _user.path(), *name, version->problem);
    } else if (isNew || isUnreported) {
      log::error("UserDefaults: Cannot use %s: %s", _user.path(), version->problem);
    }
    return _user.current(isNew);
  }

  PropertyDictionary administratorValues() const {
    if (_administrator.path().empty()) return {};
    bool isNew = false;
    const auto version = _administrator.currentOrLast(isNew);
    const bool refused = !version->isTrustworthy;
    if (isNew && refused) log::error("UserDefaults: Ignoring %s: others can write it", _administrator.path());
    if (isNew && !refused && version->usability != Usability::usable && version->usability != Usability::outOfReach) {
      log::error("UserDefaults: Cannot use %s: %s", _administrator.path(), version->problem);
    }
    return refused ? PropertyDictionary() : version->values;
  }

  /// Reads, lets `edit` change the values, and writes them when it returns true: one step among all processes. Refused
  /// when the file would be larger than `maximumBytes` and larger than it is.
  Result<void> change(const std::function<bool(PropertyDictionary&)>& edit,
                      std::size_t maximumBytes = kMaximumSuiteBytes) {
    if (auto made = files::createDirectories(_stateDirectory, 0700); !made) return made;
    const SuiteLock suite(_gate);
    if (!suite.held()) return failure("UserDefaults", 1, suite.whyNot());
    const auto version = setAsideLocked(false);
    if (version->usability == Usability::unreadable || version->usability == Usability::outOfReach) {
      return failure("UserDefaults", 2, "cannot read " + _user.path() + ": " + version->problem);
    }
    PropertyDictionary values = version->values;
    if (!edit(values)) return {};
    std::string text;
    if (!json::writePretty(values, text, json::Extensions::tagged)) {
      return failure("UserDefaults", 3, "a value cannot be stored in " + _user.path());
    }
    const auto present = version->identity.size > 0 ? static_cast<std::size_t>(version->identity.size) : 0;
    const auto mayBe = std::max(maximumBytes, present);
    if (text.size() >= mayBe) {
      // Without its blanks it may still fit: a file that was written by hand may have had none.
      text.clear();
      if (!json::write(values, text, json::Extensions::tagged) || text.size() >= mayBe) {
        return failure("UserDefaults", 4, _user.path() + " would grow too large");
      }
    }
    text += '\n';
    return files::writeAtomically(_user.path(), {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
  }

  // Constant after construction.
  const std::string _stateDirectory;
  // Self-synchronised.
  mutable SuiteGate _gate;
  mutable CachedFile _user;
  mutable CachedFile _administrator;
};

}  // namespace

std::unique_ptr<UserDefaults> openUserDefaults(std::string_view suite, std::string stateDirectory,
                                               std::string configurationDirectory) {
  return std::make_unique<FileUserDefaults>(suite, std::move(stateDirectory), configurationDirectory);
}

}  // namespace velk
