// What storebag tests share: a key pair, envelopes signed with it, a disk cache in memory, and a network that answers
// what the test says.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "daemon/StorebagDiskCache.h"
#include "daemon/StorebagEnvelope.h"
#include "foundation/PropertyValue.h"
#include "platform/Clock.h"
#include "platform/Lock.h"

namespace velk::test {

/// Made once for the program: a key takes a moment.
class SigningKey {
 public:
  static const SigningKey& shared();
  [[nodiscard]] StorebagPublicKeySource source() const;
  [[nodiscard]] const ByteData& publicKeyDer() const { return _publicKeyDer; }
  /// An envelope as a server sends it.
  [[nodiscard]] ByteData envelope(const PropertyValue& bag) const;
  [[nodiscard]] ByteData envelopeOfBytes(const ByteData& bag) const;

 private:
  SigningKey();
  std::string _privateKeyPem;
  ByteData _publicKeyDer;
};

[[nodiscard]] inline std::string textOf(const ByteData& bytes) { return {bytes.begin(), bytes.end()}; }
[[nodiscard]] inline ByteData bytesOf(std::string_view text) { return {text.begin(), text.end()}; }

/// Files in memory, dated by the test's clock. Any thread.
class MemoryStorebagFiles {
 public:
  explicit MemoryStorebagFiles(const Clock& clock) : _clock(clock) {}

  void put(const std::string& name, ByteData bytes);
  void setModificationDate(const std::string& name, TimeValue date);
  [[nodiscard]] std::optional<ByteData> bytes(const std::string& name) const;
  [[nodiscard]] std::optional<TimeValue> modificationDate(const std::string& name) const;
  void remove(const std::string& name);
  /// While true no file can be loaded.
  void setUnreadable(bool unreadable);
  [[nodiscard]] int loads() const;
  [[nodiscard]] std::set<std::string> setAside() const;
  [[nodiscard]] std::set<std::string> unprotected() const;
  /// The cache that stands on these files, which outlive it.
  [[nodiscard]] std::unique_ptr<StorebagDiskCache> cache();

 private:
  friend class MemoryStorebagDiskCache;
  struct File {
    ByteData bytes;
    TimeValue modified;
  };
  const Clock& _clock;
  mutable Lock _lock;
  std::map<std::string, File> _files VELK_GUARDED_BY(_lock);
  std::set<std::string> _setAside VELK_GUARDED_BY(_lock);
  std::set<std::string> _unprotected VELK_GUARDED_BY(_lock);
  bool _unreadable VELK_GUARDED_BY(_lock) = false;
  int _loads VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace velk::test
