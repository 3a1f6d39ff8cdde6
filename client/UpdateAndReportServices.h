// One module's registration for periodic tasks. Made by `registerPeriodicTaskForModule`, shared by the table of
// registrations and by the ticks that began while it was in there; what the callback owns ends with the last of them.
#pragma once

#include <functional>
#include <utility>

#include "foundation/PropertyValue.h"

namespace velk {

/// Called with nothing when the module is to update its measurements; with a dictionary, empty and the module's alone
/// until it returns, when it is to fill in its statistics: numbers, texts and the like under keys that it shares with
/// other modules; dictionaries and arrays under one key are joined, of other values the last to come stays. On any
/// thread, perhaps at the same time as other modules'. One that throws has added nothing, which costs an error line;
/// one that does not return holds up all calls of its client.
using VelkReportingServiceBlock = std::function<void(PropertyDictionary* statistics)>;

/// Immutable: any thread.
class UpdateAndReportServices {
 public:
  UpdateAndReportServices(bool needToUpdate, bool needToReport, VelkReportingServiceBlock service)
      : _update(needToUpdate), _report(needToReport), _block(std::move(service)) {}

  [[nodiscard]] bool update() const noexcept { return _update; }
  [[nodiscard]] bool report() const noexcept { return _report; }
  [[nodiscard]] const VelkReportingServiceBlock& block() const noexcept { return _block; }

 private:
  const bool _update;
  const bool _report;
  const VelkReportingServiceBlock _block;
};

}  // namespace velk
