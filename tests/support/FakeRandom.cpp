#include "tests/support/FakeRandom.h"

namespace velk::test {

std::uint32_t FakeRandom::below(std::uint32_t bound) {
  Guard guard(_lock);
  _bounds.push_back(bound);
  if (_numbers.empty()) return _rest % bound;
  const auto number = _numbers.front();
  _numbers.pop_front();
  return number % bound;
}

void FakeRandom::push(std::uint32_t number) {
  Guard guard(_lock);
  _numbers.push_back(number);
}

void FakeRandom::setRest(std::uint32_t number) {
  Guard guard(_lock);
  _rest = number;
}

std::vector<std::uint32_t> FakeRandom::bounds() const {
  Guard guard(_lock);
  return _bounds;
}

}  // namespace velk::test
