// The answer to `copyStatus`: what people and their tools may know of the running daemon. The agent takes a snapshot
// under its lock, which copies references and numbers only; the report asks everybody for the rest afterwards.
//
// Nothing that clients chose can make the answer larger than a frame: texts are cut, and rows for which there is no
// room are left out, while the counts beside the lists stay true.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "daemon/CorrelatedSessions.h"
#include "foundation/PropertyValue.h"

namespace velk {

class ReportingdSession;
class SharedConnectivityHelpers;

/// Lives on the reader's queue for as long as one report takes. It may hold the last reference to a session that has
/// ended meanwhile: dropping it then only frees memory, for a session's teardown is a call of its own and long done.
struct AgentSnapshot {
  /// In the order in which they were created.
  std::vector<std::shared_ptr<ReportingdSession>> sessions;
  /// Each token's sessions, in the order in which they registered.
  std::vector<std::pair<std::string, CorrelatedSessions::SessionList>> hierarchies;
  PropertyArray storebags;
  /// By client type.
  PropertyDictionary activeClients;
  std::int32_t keepAliveCount = 0;
};

/// A text longer than this many bytes is cut, and ends in an ellipsis then.
inline constexpr std::size_t kMaximumStatusTextBytes = 256;

/// Waits for the state queues of backends and of the agent: call it with no lock held, on none of these queues.
/// `reader` is the session of the connection that asks. As long as it has described no session it is nobody's, and
/// neither it nor the keep-alive reference that it holds is told. May be null.
[[nodiscard]] PropertyDictionary statusReport(const AgentSnapshot& snapshot, const ReportingdSession* reader,
                                              SharedConnectivityHelpers& helpers, std::uint64_t processMemory);

}  // namespace velk
