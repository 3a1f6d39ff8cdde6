#include "tests/unit/daemon/StorebagFakes.h"

#include <gtest/gtest.h>

#include "foundation/Base64.h"
#include "platform/Cryptography.h"
#include "platform/PropertyList.h"

namespace velk::test {

SigningKey::SigningKey() {
  auto pair = generateRsaKeyPair(2048);
  if (!pair) {
    ADD_FAILURE() << pair.error().description;
    return;
  }
  _privateKeyPem = std::move(pair->privateKeyPem);
  _publicKeyDer = std::move(pair->publicKeyDer);
}

const SigningKey& SigningKey::shared() {
  static const SigningKey key;
  return key;
}

StorebagPublicKeySource SigningKey::source() const {
  return [this] { return rsaPublicKeyFromDer(_publicKeyDer); };
}

ByteData SigningKey::envelope(const PropertyValue& bag) const {
  return envelopeOfBytes(propertylist::serialize(bag, propertylist::Form::binary).value_or(ByteData{}));
}

ByteData SigningKey::envelopeOfBytes(const ByteData& bag) const {
  const auto signature = signSha1Digest(_privateKeyPem, sha1(bag)).value_or(ByteData{});
  const PropertyDictionary envelope{{"signature", base64Encoded(signature)}, {"bag", base64Encoded(bag)}};
  return propertylist::serialize(envelope, propertylist::Form::xml).value_or(ByteData{});
}

void MemoryStorebagFiles::put(const std::string& name, ByteData bytes) {
  Guard guard(_lock);
  _files[name] = {std::move(bytes), _clock.wallTime()};
}

void MemoryStorebagFiles::setModificationDate(const std::string& name, TimeValue date) {
  Guard guard(_lock);
  _files[name].modified = date;
}

std::optional<ByteData> MemoryStorebagFiles::bytes(const std::string& name) const {
  Guard guard(_lock);
  const auto found = _files.find(name);
  return found != _files.end() ? std::optional(found->second.bytes) : std::nullopt;
}

std::optional<TimeValue> MemoryStorebagFiles::modificationDate(const std::string& name) const {
  Guard guard(_lock);
  const auto found = _files.find(name);
  return found != _files.end() ? std::optional(found->second.modified) : std::nullopt;
}

void MemoryStorebagFiles::remove(const std::string& name) {
  Guard guard(_lock);
  _files.erase(name);
}

void MemoryStorebagFiles::setUnreadable(bool unreadable) {
  Guard guard(_lock);
  _unreadable = unreadable;
}

int MemoryStorebagFiles::loads() const {
  Guard guard(_lock);
  return _loads;
}

std::set<std::string> MemoryStorebagFiles::setAside() const {
  Guard guard(_lock);
  return _setAside;
}

std::set<std::string> MemoryStorebagFiles::unprotected() const {
  Guard guard(_lock);
  return _unprotected;
}

class MemoryStorebagDiskCache : public StorebagDiskCache {
 public:
  explicit MemoryStorebagDiskCache(MemoryStorebagFiles& files) : _files(files) {}

  bool saveStorebagToDisk(const std::string& name, std::span<const std::uint8_t> envelope) override {
    _files.put(name, ByteData(envelope.begin(), envelope.end()));
    return true;
  }
  std::optional<ByteData> loadStorebagFromDisk(const std::string& name) override {
    {
      Guard guard(_files._lock);
      ++_files._loads;
      if (_files._unreadable) return std::nullopt;
    }
    return _files.bytes(name);
  }
  std::optional<TimeValue> modificationDate(const std::string& name) const override {
    return _files.modificationDate(name);
  }
  void setStorageClassProtectionLevel(const std::string& name) override {
    Guard guard(_files._lock);
    _files._unprotected.insert(name);
  }
  void setAside(const std::string& name) override {
    Guard guard(_files._lock);
    _files._files.erase(name);
    _files._setAside.insert(name);
  }

 private:
  MemoryStorebagFiles& _files;
};

std::unique_ptr<StorebagDiskCache> MemoryStorebagFiles::cache() {
  return std::make_unique<MemoryStorebagDiskCache>(*this);
}

}  // namespace velk::test
