// What a session reports about the daemon when it ends.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/Platform.h"
#include "session/ReportingdSession.h"

namespace velk {

/// Counts the session under its component's keys. Answers the size of its batched events.
std::uint64_t addSessionHealthInfo(const ReportingdSession& session, PropertyDictionary& healthReport);

/// The counts of all sessions of the list that have been described and, in addition, of the ending one; the storebags
/// in memory; the memory that this makes, and that the process really uses. Waits for the sessions' state queues.
void addSessionsAccumulatedHealthInfoToPayload(PropertyDictionary& payload, const ReportingdSession& endingSession,
                                               const std::vector<std::shared_ptr<ReportingdSession>>& sessionList,
                                               const PropertyDictionary& storebags, const ProcessStatistics& process);

}  // namespace velk
