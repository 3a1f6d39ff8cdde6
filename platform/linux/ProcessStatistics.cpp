#include <charconv>
#include <string_view>

#include "platform/Files.h"
#include "platform/Platform.h"

namespace velk {
namespace {

class SystemProcessStatistics : public ProcessStatistics {
 public:
  std::uint64_t anonymousMemory() const override {
    const auto bytes = files::read("/proc/self/status", 64 * 1024);
    if (!bytes) return 0;
    const std::string_view text(reinterpret_cast<const char*>(bytes->data()), bytes->size());
    const auto field = text.find("\nRssAnon:");
    if (field == std::string_view::npos) return 0;
    const auto digits = text.find_first_of("0123456789", field);
    if (digits == std::string_view::npos) return 0;
    std::uint64_t kibibytes = 0;
    std::from_chars(text.data() + digits, text.data() + text.size(), kibibytes);
    return kibibytes * 1024;
  }
};

}  // namespace

std::unique_ptr<ProcessStatistics> makeProcessStatistics() { return std::make_unique<SystemProcessStatistics>(); }

}  // namespace velk
