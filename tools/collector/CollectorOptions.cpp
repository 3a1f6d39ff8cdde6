#include "tools/collector/CollectorOptions.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <filesystem>
#include <ostream>

#include "platform/Directories.h"
#include "tools/CommandLine.h"
#include "tools/collector/DigestKey.h"

namespace velk::collector {
namespace {

constexpr double kLongestDelaySeconds = 3600;

struct CommandLine {
  CollectorOptions options;
  std::string digestKey;
  int storebagStatus = 0;
  int postStatus = 0;
  bool dashboard = false;
  int dashboardPort = 0;
};

// A range lets "nan" pass.
std::string whyNoNumber(const std::string& text) {
  return CLI::detail::to_lower(text).find("nan") == std::string::npos ? "" : text + " is not a number";
}

void describe(CLI::App& app, CommandLine& line) {
  CollectorOptions& options = line.options;
  app.add_option("--listen", options.listenAddress, "Address to listen on")->capture_default_str();
  app.add_option("--port", options.port, "Port to listen on; 0: one that is free, which is printed")
      ->check(CLI::Range(0, 65535))
      ->capture_default_str();
  app.add_option("--state", options.stateDirectory, "Directory of the certificates and the database");
  app.add_option("--storebags", options.storebagDirectory, "Directory of signed storebags, one file per name");
  app.add_option("--max-age", options.maxAgeSeconds, "Seconds for which a storebag may be kept")
      ->check(CLI::Range(0, 86400 * 365))
      ->capture_default_str();
  app.add_option("--digest-key", line.digestKey, "Key that posts must be signed with: hexadecimal, or a file");
  auto* certificate =
      app.add_option("--certificate", options.certificateFile, "Certificate chain (PEM) instead of the test one");
  auto* key = app.add_option("--private-key", options.privateKeyFile, "Its private key (PEM)");
  certificate->needs(key);
  key->needs(certificate);
  app.add_option("--port-file", options.portFile, "File to write the port to, once connections are taken");
  app.add_flag("--dashboard", line.dashboard, "Take dashboard datagrams, on a free port, which is printed");
  app.add_option("--dashboard-port", line.dashboardPort, "Port to take dashboard datagrams on; 0: one that is free")
      ->check(CLI::Range(0, 65535));
  app.add_flag("--json", options.json, "Print one JSON object a line");
  app.add_flag("--quiet", options.quiet, "Do not print posts, events and storebags");
  app.add_flag("--sink", options.sink, "Only count posts and events: store and show nothing");
}

void describeFaults(CLI::App& app, CommandLine& line) {
  app.add_option("--delay", line.options.storebagDelaySeconds, "Seconds to wait before a storebag is answered")
      ->check(CLI::Range(0.0, kLongestDelaySeconds))
      ->check(&whyNoNumber)
      ->group("Faults for tests");
  app.add_option("--storebag-status", line.storebagStatus, "Answer requests for storebags with this status")
      ->check(CLI::Range(200, 599))
      ->group("Faults for tests");
  app.add_option("--post-status", line.postStatus, "Answer posts with this status, and keep none of them")
      ->check(CLI::Range(200, 599))
      ->group("Faults for tests");
}

void describeDashboardFaults(CLI::App& app, DashboardFaults& faults) {
  app.add_option("--dashboard-drop", faults.drop, "Fraction of the datagrams to lose")
      ->check(CLI::Range(0.0, 1.0))
      ->check(&whyNoNumber)
      ->group("Faults for tests");
  app.add_option("--dashboard-drop-acks", faults.dropAcknowledgements, "Fraction of the acknowledgements to lose")
      ->check(CLI::Range(0.0, 1.0))
      ->check(&whyNoNumber)
      ->group("Faults for tests");
  app.add_option("--dashboard-seed", faults.seed, "What the losses follow from")
      ->capture_default_str()
      ->group("Faults for tests");
  app.add_option("--dashboard-ack-delay", faults.acknowledgementDelaySeconds,
                 "Seconds to wait before a datagram is acknowledged")
      ->check(CLI::Range(0.0, kLongestDelaySeconds))
      ->check(&whyNoNumber)
      ->group("Faults for tests");
}

void fillDefaults(CommandLine& line, bool dashboardPortGiven) {
  CollectorOptions& options = line.options;
  if (options.stateDirectory.empty()) options.stateDirectory = clientDirectories().state + "/collector";
  while (options.stateDirectory.size() > 1 && options.stateDirectory.back() == '/') options.stateDirectory.pop_back();
  if (options.storebagDirectory.empty()) options.storebagDirectory = options.stateDirectory + "/storebags";
  // The path of the authority is printed for others, who may stand elsewhere.
  std::error_code ignored;
  const auto absolute = std::filesystem::absolute(options.stateDirectory, ignored);
  if (!absolute.empty()) options.stateDirectory = absolute.lexically_normal().string();
  if (line.storebagStatus != 0) options.storebagStatus = line.storebagStatus;
  if (line.postStatus != 0) options.postStatus = line.postStatus;
  if (line.dashboard || dashboardPortGiven) options.dashboardPort = line.dashboardPort;
}

}  // namespace

std::variant<CollectorOptions, tools::ExitCode> readCollectorOptions(std::vector<std::string> arguments,
                                                                     std::ostream& out, std::ostream& error) {
  CLI::App app("The other end of the reporting daemon: serves storebags, takes event posts over HTTPS.",
               "velkcollector");
  CommandLine line;
  describe(app, line);
  describeFaults(app, line);
  describeDashboardFaults(app, line.options.dashboard);
  const bool json = tools::asksForJson(arguments);
  std::reverse(arguments.begin(), arguments.end());
  try {
    app.parse(std::move(arguments));
  } catch (const CLI::ParseError& problem) {
    return tools::finishParsing(app, problem, json, out, error);
  }
  fillDefaults(line, app.count("--dashboard-port") > 0);
  if (!line.digestKey.empty()) {
    Result<ByteData> key = digestKeyFromArgument(line.digestKey);
    if (!key) {
      return tools::complain(error, "velkcollector", json, tools::ExitCode::noInput, key.error().description);
    }
    line.options.digestKey = std::move(*key);
  }
  return std::move(line.options);
}

}  // namespace velk::collector
