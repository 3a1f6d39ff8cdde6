#include "session/Health.h"

#include <string>
#include <string_view>

#include "backends/MemoryEstimate.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"

namespace velk {

namespace {

void addToEntry(PropertyDictionary& report, std::string_view name, std::string_view shortCode, std::uint64_t amount) {
  const std::string key = formatText("%@_%@", {name, shortCode});
  report.set(key, static_cast<std::uint64_t>(integerValue(report.find(key))) + amount);
}

}  // namespace

std::uint64_t addSessionHealthInfo(const ReportingdSession& session, PropertyDictionary& healthReport) {
  const auto info = session.sessionInfo();
  const auto clientType = int32Value(info ? info->find(kVelkReportingSessionInfoClientType) : nullptr);
  const std::string_view shortCode = healthShortCode(clientType);
  const std::uint64_t size = session.batchedEventsSize();
  addToEntry(healthReport, "SessionsCount", shortCode, 1);
  addToEntry(healthReport, "BatchSize", shortCode, size);
  return size;
}

void addSessionsAccumulatedHealthInfoToPayload(PropertyDictionary& payload, const ReportingdSession& endingSession,
                                               const std::vector<std::shared_ptr<ReportingdSession>>& sessionList,
                                               const PropertyDictionary& storebags, const ProcessStatistics& process) {
  std::uint64_t batchedSize = 0;
  // A connection that was never described is no session: it reads the status, say.
  for (const auto& session : sessionList) {
    if (session->sessionInfo()) batchedSize += addSessionHealthInfo(*session, payload);
  }
  batchedSize += addSessionHealthInfo(endingSession, payload);
  const std::uint64_t storebagsSize = memoryEstimate(storebags);
  payload.set("StorebagsCount", storebags.size());
  payload.set("StorebagsSize", storebagsSize);
  payload.set("CalculatedMemoryUsage", batchedSize + storebagsSize);
  payload.set("ProcessMemoryUsage", process.anonymousMemory());
}

}  // namespace velk
