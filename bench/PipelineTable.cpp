#include "bench/PipelineTable.h"

#include <cstdio>

#include "foundation/Json.h"

namespace velk::bench {

namespace {

std::string row(const Scenario& scenario, const char* who, const Measured& run) {
  char line[320];
  std::snprintf(line, sizeof line,
                "%-12s %3u %-7s %9.0f %5llu | %7.2f %7.2f %7.2f | %6.1f %6.1f %6.1f | %6.1f %6.1f | %7.2f %8.2f %9.1f "
                "| %9.2f\n",
                scenario.name.c_str(), scenario.clients, who, run.eventsPerSecond,
                static_cast<unsigned long long>(run.lost), run.clientMicroseconds, run.agentMicroseconds,
                run.cpuMicroseconds(), run.agentPeakMegabytes, run.agentIdleMegabytes, run.clientPeakMegabytes,
                run.wireBytes, run.jsonBytes, run.sendP50, run.sendP99, run.sendMax, run.arrivalP50);
  return line;
}

double ratio(double of, double to) { return to > 0 ? of / to : 0; }

std::string ratios(const Measured& run, const Measured& floor) {
  char line[320];
  std::snprintf(
      line, sizeof line, "%-12s %3s %-7s %8.2fx %5s | %6.2fx %6.2fx %6.2fx | %20s | %13s | %26s | %8.2fx\n", "", "",
      ": floor", ratio(run.eventsPerSecond, floor.eventsPerSecond), "",
      ratio(run.clientMicroseconds, floor.clientMicroseconds), ratio(run.agentMicroseconds, floor.agentMicroseconds),
      ratio(run.cpuMicroseconds(), floor.cpuMicroseconds()), "", "", "", ratio(run.arrivalP50, floor.arrivalP50));
  return line;
}

PropertyDictionary dictionary(const Measured& run) {
  return {{"sent", run.sent},
          {"lost", run.lost},
          {"duplicates", run.duplicates},
          {"refusals", run.refusals},
          {"posts", run.posts},
          {"connections", run.connections},
          {"eventsPerSecond", run.eventsPerSecond},
          {"clientMicroseconds", run.clientMicroseconds},
          {"agentMicroseconds", run.agentMicroseconds},
          {"cpuMicroseconds", run.cpuMicroseconds()},
          {"wireBytes", run.wireBytes},
          {"jsonBytes", run.jsonBytes},
          {"agentPeakMegabytes", run.agentPeakMegabytes},
          {"agentIdleMegabytes", run.agentIdleMegabytes},
          {"agentIdleAnonymousMegabytes", run.agentIdleAnonymousMegabytes},
          {"clientPeakMegabytes", run.clientPeakMegabytes},
          {"sendP50Microseconds", run.sendP50},
          {"sendP99Microseconds", run.sendP99},
          {"sendMaxMicroseconds", run.sendMax},
          {"arrivalP50Milliseconds", run.arrivalP50}};
}

}  // namespace

std::string table(const std::vector<Compared>& runs) {
  std::string text =
      "                                         | CPU us an event         | resident MB          | bytes/event   | "
      "send "
      "call us               | send to\n"
      "run          cli who      events/s  lost |  client   agent    both |   peak   idle client |   wire   JSON |     "
      "p50      p99       max |  sink ms\n";
  for (const auto& run : runs) {
    text += row(run.scenario, "floor", run.floor);
    text += row(run.scenario, "daemon", run.pipeline);
    text += ratios(run.pipeline, run.floor);
  }
  return text;
}

std::string tableAsJson(const std::vector<Compared>& runs) {
  PropertyArray array;
  for (const auto& run : runs) {
    array.append(PropertyDictionary{{"run", run.scenario.name},
                                    {"clients", run.scenario.clients},
                                    {"eventsPerClient", run.scenario.eventsPerClient},
                                    {"rate", run.scenario.rate},
                                    {"floor", dictionary(run.floor)},
                                    {"daemon", dictionary(run.pipeline)},
                                    {"cpuRatio", ratio(run.pipeline.cpuMicroseconds(), run.floor.cpuMicroseconds())},
                                    {"arrivalRatio", ratio(run.pipeline.arrivalP50, run.floor.arrivalP50)}});
  }
  std::string text;
  if (!json::write(PropertyDictionary{{"runs", array}}, text)) return {};
  return text + "\n";
}

}  // namespace velk::bench
