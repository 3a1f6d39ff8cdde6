// A device that is what a test says it is.
#pragma once

#include <map>

#include "platform/DeviceInformation.h"
#include "platform/Lock.h"

namespace velk::test {

/// Any thread. Answers nothing until told.
class FakeDeviceInformation : public DeviceInformation {
 public:
  [[nodiscard]] std::optional<std::string> answer(std::string_view key) const override;

  void set(std::string_view key, std::string answer);
  void remove(std::string_view key);
  /// How often this key was asked for.
  [[nodiscard]] int askedCount(std::string_view key) const;

 private:
  mutable Lock _lock;
  std::map<std::string, std::string, std::less<>> _answers VELK_GUARDED_BY(_lock);
  mutable std::map<std::string, int, std::less<>> _asked VELK_GUARDED_BY(_lock);
};

}  // namespace velk::test
