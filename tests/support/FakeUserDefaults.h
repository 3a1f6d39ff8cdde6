// A user-defaults suite in memory.
#pragma once

#include <atomic>

#include "platform/Lock.h"
#include "platform/UserDefaults.h"

namespace velk::test {

/// Any thread. Writes can be made to fail.
class FakeUserDefaults : public UserDefaults {
 public:
  [[nodiscard]] std::optional<PropertyValue> value(std::string_view key) const override;
  [[nodiscard]] PropertyDictionary allValues() const override;
  [[nodiscard]] Result<void> set(std::string_view key, PropertyValue value) override;
  [[nodiscard]] Result<void> remove(std::string_view key) override;
  [[nodiscard]] Result<PropertyValue> valueOrStore(std::string_view key,
                                                   const std::function<PropertyValue()>& make) override;

  /// `set` without a result to look at, for the arrangement of a test.
  void put(std::string_view key, PropertyValue value);
  void clear();
  /// While true every write fails and changes nothing.
  void setFailsWrites(bool fails) { _failsWrites = fails; }
  [[nodiscard]] int readCount() const { return _reads; }
  [[nodiscard]] int writeCount() const { return _writes; }

 private:
  std::atomic<bool> _failsWrites{false};
  mutable std::atomic<int> _reads{0};
  std::atomic<int> _writes{0};

  mutable Lock _lock;
  PropertyDictionary _values VELK_GUARDED_BY(_lock);
};

}  // namespace velk::test
