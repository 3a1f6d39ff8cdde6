#include <sys/random.h>

#include <cerrno>
#include <cstdlib>

#include "platform/Platform.h"

namespace velk {
namespace {

std::uint32_t randomNumber() {
  std::uint32_t number = 0;
  for (;;) {
    const ssize_t got = ::getrandom(&number, sizeof number, 0);
    if (got == static_cast<ssize_t>(sizeof number)) return number;
    // Without random numbers nothing of ours is safe; the kernels that we run on always have them.
    if (got < 0 && errno != EINTR) std::abort();
  }
}

class SystemRandomSource : public RandomSource {
 public:
  std::uint32_t below(std::uint32_t bound) override {
    // The numbers that would make the lower results likelier are drawn again.
    const std::uint32_t unfair = (0U - bound) % bound;
    for (;;) {
      const std::uint32_t number = randomNumber();
      if (number >= unfair) return number % bound;
    }
  }
};

}  // namespace

std::unique_ptr<RandomSource> makeRandomSource() { return std::make_unique<SystemRandomSource>(); }

}  // namespace velk
