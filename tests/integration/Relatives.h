// Sessions that belong together, each in a process of its own: driven over the wire, or through the installed library.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "tests/integration/Scenario.h"

namespace velk::test {

/// Session info, besides what every session has, that puts a session into the tree of `token`, and `more`.
[[nodiscard]] PropertyDictionary inTree(int level, const PropertyDictionary& more = {},
                                        const std::string& token = "tree");
[[nodiscard]] PropertyDictionary userOf(const std::string& service);

/// Opens a session: its service is its name in what arrives. Returns the three lists, none when no reply came.
[[nodiscard]] PropertyArray openRelative(ControlledSession& session, int clientType, int number,
                                         const std::string& service, const PropertyDictionary& sessionInfo,
                                         bool hasAggregationBlock = false);
/// Gives the session another client name: it looks at its relatives anew. Waits for the reply.
void renameUser(ControlledSession& session, const std::string& service, const std::string& clientName);
[[nodiscard]] PropertyArray flush(ControlledSession& session);
/// Sends an event with {"n": n} and waits for the reply, so that the daemon is done with it.
[[nodiscard]] bool sendNumber(ControlledSession& session, int category, std::int64_t n);

/// The events that arrived of the sessions with that service, in order.
[[nodiscard]] std::vector<PropertyDictionary> eventsOfService(const ReportingServer& server,
                                                              const std::string& service);
/// Waits until that many have arrived of that service.
[[nodiscard]] bool waitForEventsOfService(const ReportingServer& server, const std::string& service, std::size_t count);
/// "_sessionID" of an event.
[[nodiscard]] std::string sessionIDOf(const PropertyDictionary& event);
/// What follows the last full stop of a combined identifier.
[[nodiscard]] std::string ownPart(const std::string& combined);

/// A process that links the library; see clients/aggregating_client.cpp for what it reads and writes.
class AggregatingClient {
 public:
  enum class Block { none, print, throws };
  AggregatingClient(const Daemon& daemon, int clientType, int number, int level, const std::string& service,
                    Block block);

  [[nodiscard]] bool waitUntilReady() { return lines().waitForPart("ready"); }
  void sendNumber(int category, std::int64_t n);
  /// Returns when everything that the daemon had sent it before has been handed to the library.
  [[nodiscard]] bool flush();
  /// The lines that tell of events and the end, so far.
  [[nodiscard]] std::vector<std::string> heard();
  [[nodiscard]] LineCollector& lines() { return _process.output(); }
  [[nodiscard]] ChildProcess& process() { return _process; }
  /// Ends its input and waits: the exit status.
  [[nodiscard]] int finish();

 private:
  ChildProcess _process;
  std::size_t _flushes = 0;
};

}  // namespace velk::test
