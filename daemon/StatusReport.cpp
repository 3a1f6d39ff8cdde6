#include "daemon/StatusReport.h"

#include "daemon/SharedConnectivityHelpers.h"
#include "foundation/Text.h"
#include "ipc/Limits.h"
#include "session/ReportingdSession.h"

namespace velk {

namespace {

/// Room in the answer, which must fit into a frame as a whole.
struct Allowance {
  std::size_t bytes;
  std::size_t values;

  /// False, and nothing is taken, when `value` does not fit.
  [[nodiscard]] bool take(const PropertyValue& value);
};

// The lists share the frame; what is left of it is for the plain numbers beside them.
constexpr Allowance kForSessions{600 * 1024, 40'000};
constexpr Allowance kForHierarchies{128 * 1024, 8'000};
constexpr Allowance kForHelpers{160 * 1024, 8'000};
constexpr Allowance kForStorebags{64 * 1024, 2'000};
constexpr std::size_t kForTheRest = 16 * 1024;
static_assert(kForSessions.bytes + kForHierarchies.bytes + kForHelpers.bytes + kForStorebags.bytes + kForTheRest <=
              ipc::kMaximumFrameBytes);
static_assert(kForSessions.values + kForHierarchies.values + kForHelpers.values + kForStorebags.values <
              ipc::kMaximumEntries);
// No more rows than could fit, so that nobody collects what is thrown away afterwards.
constexpr std::size_t kMaximumHelperRows = 1'024;
constexpr std::size_t kMaximumSessionsOfAHierarchy = 1'024;

constexpr std::size_t kHeadBytes = 9;

/// At least what the value takes on the wire.
Allowance cost(const PropertyValue& value) {
  Allowance sum{kHeadBytes, 1};
  const auto add = [&sum](const PropertyValue& element) {
    const Allowance more = cost(element);
    sum.bytes += more.bytes;
    sum.values += more.values;
  };
  if (const auto* text = value.string()) {
    sum.bytes += text->size();
  } else if (const auto* array = value.array()) {
    for (const auto& element : *array) add(element);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) {
      sum.bytes += kHeadBytes + entry.key.size();
      add(entry.value);
    }
  }
  return sum;
}

bool Allowance::take(const PropertyValue& value) {
  const Allowance needed = cost(value);
  if (needed.bytes > bytes || needed.values > values) return false;
  bytes -= needed.bytes;
  values -= needed.values;
  return true;
}

std::string cut(const std::string& text) {
  // A signed configuration may hold text that no encoding allows.
  if (!isUtf8(text)) return "(not text)";
  if (text.size() <= kMaximumStatusTextBytes) return text;
  return std::string(utf8Prefix(text, kMaximumStatusTextBytes)) + "\u2026";
}

/// The row with every text in it cut.
PropertyValue cut(const PropertyValue& value) {
  if (const auto* text = value.string()) return cut(*text);
  if (const auto* array = value.array()) {
    PropertyArray elements;
    for (const auto& element : *array) elements.append(cut(element));
    return elements;
  }
  if (const auto* dictionary = value.dictionary()) {
    PropertyDictionary entries;
    for (const auto& entry : *dictionary) entries.set(cut(entry.key), cut(entry.value));
    return entries;
  }
  return value;
}

PropertyArray rowsWithin(Allowance room, const PropertyArray& rows) {
  PropertyArray fitting;
  for (const auto& row : rows) {
    auto shortened = cut(row);
    if (!room.take(shortened)) break;
    fitting.append(std::move(shortened));
  }
  return fitting;
}

PropertyArray sessionRows(const AgentSnapshot& snapshot, const ReportingdSession* left) {
  PropertyArray rows;
  Allowance room = kForSessions;
  for (const auto& session : snapshot.sessions) {
    if (session.get() == left) continue;
    auto row = cut(session->statusDictionary());
    if (!room.take(row)) break;
    rows.append(std::move(row));
  }
  return rows;
}

PropertyArray identifiers(const CorrelatedSessions::SessionList& sessions) {
  PropertyArray list;
  for (const auto& session : sessions) {
    if (list.size() == kMaximumSessionsOfAHierarchy) break;
    list.append(session->sessionIDString());
  }
  return list;
}

PropertyArray hierarchyRows(const AgentSnapshot& snapshot) {
  PropertyArray rows;
  Allowance room = kForHierarchies;
  for (const auto& [token, sessions] : snapshot.hierarchies) {
    PropertyDictionary row{
        {"token", cut(token)}, {"sessionCount", sessions.size()}, {"sessions", identifiers(sessions)}};
    if (!room.take(row)) break;
    rows.append(std::move(row));
  }
  return rows;
}

}  // namespace

PropertyDictionary statusReport(const AgentSnapshot& snapshot, const ReportingdSession* reader,
                                SharedConnectivityHelpers& helpers, std::uint64_t processMemory) {
  // Whoever only looks does not belong to what it looks at.
  const ReportingdSession* left = reader != nullptr && !reader->sessionInfo() ? reader : nullptr;
  const int leftOut = left != nullptr ? 1 : 0;
  PropertyDictionary status;
  status.set("version", VELK_VERSION);
  status.set("keepAliveCount", snapshot.keepAliveCount - leftOut);
  status.set("processMemory", processMemory);
  status.set("sessionCount", snapshot.sessions.size() - static_cast<std::size_t>(leftOut));
  status.set("sessions", sessionRows(snapshot, left));
  status.set("hierarchyCount", snapshot.hierarchies.size());
  status.set("hierarchies", hierarchyRows(snapshot));
  status.set("helperCount", helpers.count());
  status.set("helpers", rowsWithin(kForHelpers, helpers.status(kMaximumHelperRows)));
  status.set("storebags", rowsWithin(kForStorebags, snapshot.storebags));
  status.set("activeClients", snapshot.activeClients);
  return status;
}

}  // namespace velk
