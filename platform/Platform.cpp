#include "platform/Platform.h"

#include "platform/UserDefaults.h"

namespace velk {
namespace {

class SuiteConsent : public Consent {
 public:
  explicit SuiteConsent(const UserDefaults& defaults) : _defaults(defaults) {}

  bool diagnosticsAndUsageEnabled() const override {
    const auto setting = _defaults.value(kDiagnosticsAndUsageSetting);
    return setting && booleanValue(&*setting);
  }

 private:
  const UserDefaults& _defaults;
};

}  // namespace

std::unique_ptr<Consent> makeConsent(const UserDefaults& defaults) { return std::make_unique<SuiteConsent>(defaults); }

}  // namespace velk
