// Which class a storebag section's name stands for.
#include <array>
#include <string_view>

#include "backends/DashboardBackend.h"
#include "backends/HTTPSPostBackend.h"
#include "backends/LogTexts.h"
#include "backends/PowerLogBackend.h"
#include "backends/QuillBackend.h"
#include "backends/UploadBackend.h"
#include "backends/VelkReportingBackend.h"
#include "device/DeviceEnvironment.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

/// The one family of devices without diagnostics-service backend.
constexpr std::string_view kProductTypeWithoutQuill = "Hollin";

struct Section {
  const BackendContext& context;
  const std::string& name;
  const PropertyValue& profile;
  const std::optional<std::string>& productFamily;
  std::int32_t clientType;
};

using Maker = std::shared_ptr<VelkReportingBackend> (*)(const Section&);

std::shared_ptr<VelkReportingBackend> makeHTTPSPostBackend(const Section& section) {
  return HTTPSPostBackend::initWithName(section.context, section.name, section.profile, section.productFamily);
}

std::shared_ptr<VelkReportingBackend> makeDashboardBackend(const Section& section) {
  return DashboardBackend::initWithName(section.context, section.name, section.profile, section.productFamily);
}

std::shared_ptr<VelkReportingBackend> makeUploadBackend(const Section& section) {
  return UploadBackend::initWithName(section.context, section.name, section.profile, section.productFamily);
}

std::shared_ptr<VelkReportingBackend> makePowerLogBackend(const Section& section) {
  return PowerLogBackend::initWithName(section.context, section.name, section.profile, section.productFamily);
}

std::shared_ptr<VelkReportingBackend> makeQuillBackend(const Section& section) {
  return QuillBackend::initWithName(section.context, section.name, section.profile, section.productFamily,
                                    section.clientType);
}

struct Row {
  std::string_view name;
  bool isSubstring;
  Maker make;
};

// Tested from the top.
constexpr std::array kRows{
    Row{kVelkReportingBackendDashboard, false, makeDashboardBackend},
    Row{kVelkReportingBackendUploadServer, false, makeUploadBackend},
    Row{kVelkReportingBackendHTTPPost, true, makeHTTPSPostBackend},
    Row{kVelkReportingBackendHTTPPost2, false, makeHTTPSPostBackend},
    Row{kVelkReportingBackendPowerlog, false, makePowerLogBackend},
    Row{kVelkReportingBackendQRS, false, makeHTTPSPostBackend},
    Row{kVelkReportingBackendQuill, false, makeQuillBackend},
};

bool standsFor(const Row& row, const Section& section) {
  if (row.isSubstring) return section.name.find(row.name) != std::string::npos;
  if (section.name != row.name) return false;
  return row.name != kVelkReportingBackendQuill ||
         section.context.environment.productType() != kProductTypeWithoutQuill;
}

}  // namespace

std::shared_ptr<VelkReportingBackend> newBackendWithName(const BackendContext& context, const std::string& name,
                                                         const PropertyValue& profile,
                                                         const std::optional<std::string>& productFamily,
                                                         std::int32_t clientType) {
  const Section section{context, name, profile, productFamily, clientType};
  for (const Row& row : kRows) {
    if (standsFor(row, section)) return row.make(section);
  }
  log::error(backend_texts::kUnknownBackend, name);
  return nullptr;
}

}  // namespace velk
