#include "daemon/StorebagDiskCache.h"

#include "daemon/LogTexts.h"
#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {

namespace {

// No storebag is near this; what is longer was not written by this daemon.
constexpr std::size_t kMaximumEnvelopeBytes = 16 * 1024 * 1024;

class DirectoryStorebagDiskCache : public StorebagDiskCache {
 public:
  explicit DirectoryStorebagDiskCache(std::string directory) : _directory(std::move(directory)) {}

  bool saveStorebagToDisk(const std::string& name, std::span<const std::uint8_t> envelope) override {
    auto written = files::createDirectories(_directory);
    if (written) written = files::writeAtomically(path(name), envelope);
    if (!written) log::error(daemontexts::kCouldNotSave, name, path(name), written.error());
    return written.has_value();
  }

  std::optional<ByteData> loadStorebagFromDisk(const std::string& name) override {
    auto bytes = files::read(path(name), kMaximumEnvelopeBytes);
    if (bytes) return std::move(*bytes);
    log::standard(daemontexts::kCouldNotLoad, name, path(name), bytes.error());
    return std::nullopt;
  }

  std::optional<TimeValue> modificationDate(const std::string& name) const override {
    return files::modificationTime(path(name));
  }

  void setStorageClassProtectionLevel(const std::string& name) override {
    setMode(_directory.substr(0, _directory.rfind('/')), 0700, "mode 0700");
    setMode(_directory, 0700, "mode 0700");
    setMode(path(name), 0600, "mode 0600");
  }

  void setAside(const std::string& name) override {
    const auto moved = files::setAside(path(name));
    if (moved) {
      log::error("StorebagDiskCache: the file of storebag '%@' cannot be used and was set aside as '%@'", name, *moved);
    } else {
      log::error("StorebagDiskCache: the file of storebag '%@' cannot be used nor set aside: %@", name, moved.error());
    }
  }

 private:
  static void setMode(const std::string& path, unsigned mode, std::string_view attribute) {
    const auto changed = files::setMode(path, mode);
    if (!changed) log::standard(daemontexts::kCouldNotSetAttribute, attribute, path, changed.error());
  }

  [[nodiscard]] std::string path(const std::string& name) const { return _directory + "/" + name; }

  const std::string _directory;
};

}  // namespace

std::unique_ptr<StorebagDiskCache> makeStorebagDiskCache(std::string directory) {
  return std::make_unique<DirectoryStorebagDiskCache>(std::move(directory));
}

}  // namespace velk
