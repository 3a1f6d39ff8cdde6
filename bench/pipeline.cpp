// The whole way of an event, from the send call of a host process through the daemon to an HTTPS server, measured
// beside a floor. README.md says how to run it and how to read the table.
#include <signal.h>

#include <CLI/CLI.hpp>
#include <cstdio>

#include "bench/Floor.h"
#include "bench/PipelineRun.h"
#include "bench/PipelineTable.h"
#include "platform/Log.h"

namespace {

using namespace velk::bench;

struct Options {
  std::vector<std::uint32_t> clients{1, 4};
  std::uint64_t events = 0;
  double rate = 0;
  bool unbatched = false;
  bool json = false;
  RunOptions run;

  // Of the floor's processes.
  std::string role;
  std::string socketPath;
  std::string url;
  std::string caFile;
  std::uint64_t batch = 1;
  std::uint32_t number = 0;
  std::uint64_t senderEvents = 0;
  double senderRate = 0;
};

constexpr std::uint64_t kSaturatedEvents = 200'000;  // over all clients
constexpr double kPacedRate = 5'000;
constexpr double kPacedSeconds = 10;
constexpr double kUnbatchedRate = 400;
constexpr double kUnbatchedSeconds = 5;

Scenario scenario(const char* name, std::uint32_t clients, double totalEvents, double rate, bool unbatched,
                  const Options& options) {
  const auto share = static_cast<std::uint64_t>(totalEvents / clients);
  return {name, clients, options.events != 0 ? options.events : share, rate, unbatched};
}

std::vector<Scenario> scenarios(const Options& options) {
  std::vector<Scenario> list;
  const bool everything = options.rate == 0 && !options.unbatched;
  for (const auto clients : options.clients) {
    if (everything) list.push_back(scenario("saturated", clients, kSaturatedEvents, 0, false, options));
    if (options.rate > 0 && !options.unbatched) {
      list.push_back(scenario("paced", clients, options.rate * kPacedSeconds, options.rate, false, options));
    }
    if (options.unbatched) {
      const double rate = options.rate > 0 ? options.rate : kUnbatchedRate;
      list.push_back(scenario("unbatched", clients, rate * kUnbatchedSeconds, rate, true, options));
    }
  }
  if (everything && options.events == 0) {
    list.push_back(scenario("paced", 1, kPacedRate * kPacedSeconds, kPacedRate, false, options));
    list.push_back(scenario("unbatched", 1, kUnbatchedRate * kUnbatchedSeconds, kUnbatchedRate, true, options));
  }
  return list;
}

int runRole(const Options& options) {
  if (options.role == "floor-agent") {
    return runFloorAgent(options.socketPath, options.url, options.caFile, options.batch);
  }
  return runFloorSender(options.socketPath, options.number, options.senderEvents, options.senderRate);
}

void addRoleOptions(CLI::App& app, Options& options) {
  const std::string hidden;
  app.add_option("--role", options.role)->group(hidden)->check(CLI::IsMember({"floor-agent", "floor-sender"}));
  app.add_option("--socket", options.socketPath)->group(hidden);
  app.add_option("--url", options.url)->group(hidden);
  app.add_option("--ca", options.caFile)->group(hidden);
  app.add_option("--batch", options.batch)->group(hidden);
  app.add_option("--number", options.number)->group(hidden);
  app.add_option("--sender-events", options.senderEvents)->group(hidden);
  app.add_option("--sender-rate", options.senderRate)->group(hidden);
}

}  // namespace

int main(int argumentCount, char** arguments) {
  Options options;
  CLI::App app("Measures events from the send call to an HTTPS sink, through the daemon and through a floor");
  app.add_option("--clients", options.clients, "Numbers of client processes, one run each (1,4)")
      ->delimiter(',')
      ->check(CLI::Range(1, 40));
  app.add_option("--events", options.events, "Events that each client sends (200000 over all clients)");
  app.add_option("--rate", options.rate, "Events a second over all clients (as fast as they are taken)");
  app.add_flag("--unbatched", options.unbatched, "Post each event by itself");
  app.add_flag("--json", options.json, "Print JSON in place of the table");
  app.add_option("--log-level", options.run.logLevel, "The daemon's log level (error, as in the installed service)");
  app.add_option("--daemon-log", options.run.daemonLog, "A file for the daemon's log (it is dropped)");
  app.add_option("--daemon", options.run.daemonProgram, "Another build's daemon");
  app.add_option("--client", options.run.clientProgram, "Another build's bench_client");
  app.add_flag("--keep", options.run.keep, "Leave the daemon's directories behind");
  addRoleOptions(app, options);
  CLI11_PARSE(app, argumentCount, arguments);
  signal(SIGPIPE, SIG_IGN);  // an agent or sender that died is reported where it is missed
  velk::log::setSink(nullptr, velk::log::Level::error);
  if (!options.role.empty()) return runRole(options);

  std::vector<Compared> runs;
  for (const auto& each : scenarios(options)) {
    const auto floor = measureFloor(each, options.run);
    runs.push_back({each, floor, measurePipeline(each, options.run)});
  }
  std::fputs((options.json ? tableAsJson(runs) : table(runs)).c_str(), stdout);
  bool lost = false;
  for (const auto& run : runs) lost = lost || run.floor.lost != 0 || run.pipeline.lost != 0;
  return lost ? 1 : 0;
}
