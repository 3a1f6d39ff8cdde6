// One measured run of the pipeline: sending processes, an agent (the real daemon, or the floor), and the sink.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace velk::bench {

struct Scenario {
  std::string name;
  std::uint32_t clients = 1;
  std::uint64_t eventsPerClient = 0;
  double rate = 0;  ///< events a second over all clients; 0: as fast as they are taken
  bool unbatched = false;
};

struct RunOptions {
  std::string daemonProgram = VELK_DAEMON_PROGRAM;
  std::string clientProgram = VELK_BENCH_CLIENT_PROGRAM;
  std::string logLevel = "error";  ///< the daemon's; as in the installed service
  std::string daemonLog;           ///< a file for its lines; empty: they are dropped
  bool keep = false;               ///< the directories stay
};

struct Measured {
  std::uint64_t sent = 0;
  std::uint64_t lost = 0;
  std::uint64_t duplicates = 0;
  std::uint64_t refusals = 0;
  std::uint64_t posts = 0;
  int connections = 0;
  double eventsPerSecond = 0;     ///< from the first send to the last arrival
  double clientMicroseconds = 0;  ///< of CPU, an event
  double agentMicroseconds = 0;   ///< of CPU, an event
  double wireBytes = 0;           ///< of posts, an event
  double jsonBytes = 0;           ///< before compression, an event
  double agentPeakMegabytes = 0;
  double agentIdleMegabytes = 0;           ///< a second after the last client went
  double agentIdleAnonymousMegabytes = 0;  ///< of that, what is no file's
  double clientPeakMegabytes = 0;          ///< the largest client
  double sendP50 = 0;                      ///< microseconds
  double sendP99 = 0;
  double sendMax = 0;
  double arrivalP50 = 0;  ///< milliseconds from the call to the arrival of the event's post

  [[nodiscard]] double cpuMicroseconds() const { return clientMicroseconds + agentMicroseconds; }
};

/// Each starts everything anew and ends it. Progress goes to the standard error stream; a run that cannot be made ends
/// the program with a sentence.
[[nodiscard]] Measured measureFloor(const Scenario& scenario, const RunOptions& options);
[[nodiscard]] Measured measurePipeline(const Scenario& scenario, const RunOptions& options);

}  // namespace velk::bench
