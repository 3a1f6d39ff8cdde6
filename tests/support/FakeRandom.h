// Random numbers that a test chooses.
#pragma once

#include <deque>
#include <vector>

#include "platform/Lock.h"
#include "platform/Platform.h"

namespace velk::test {

/// Any thread. Hands out the numbers that were queued, then `rest`; each modulo the bound. Remembers the bounds.
class FakeRandom : public RandomSource {
 public:
  [[nodiscard]] std::uint32_t below(std::uint32_t bound) override;

  void push(std::uint32_t number);
  void setRest(std::uint32_t number);
  [[nodiscard]] std::vector<std::uint32_t> bounds() const;

 private:
  mutable Lock _lock;
  std::deque<std::uint32_t> _numbers VELK_GUARDED_BY(_lock);
  std::uint32_t _rest VELK_GUARDED_BY(_lock) = 0;
  std::vector<std::uint32_t> _bounds VELK_GUARDED_BY(_lock);
};

}  // namespace velk::test
