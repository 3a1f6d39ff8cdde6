#include "tests/support/FakeDeviceInformation.h"

namespace velk::test {

std::optional<std::string> FakeDeviceInformation::answer(std::string_view key) const {
  Guard guard(_lock);
  ++_asked[std::string(key)];
  const auto found = _answers.find(key);
  return found != _answers.end() ? std::optional(found->second) : std::nullopt;
}

void FakeDeviceInformation::set(std::string_view key, std::string answer) {
  Guard guard(_lock);
  _answers.insert_or_assign(std::string(key), std::move(answer));
}

void FakeDeviceInformation::remove(std::string_view key) {
  Guard guard(_lock);
  _answers.erase(std::string(key));
}

int FakeDeviceInformation::askedCount(std::string_view key) const {
  Guard guard(_lock);
  const auto found = _asked.find(key);
  return found != _asked.end() ? found->second : 0;
}

}  // namespace velk::test
