#include "tools/collector/Program.h"

#include <atomic>
#include <memory>
#include <ostream>
#include <thread>

#include "platform/Clock.h"
#include "platform/Files.h"
#include "tools/CommandLine.h"
#include "tools/JsonLines.h"
#include "tools/collector/Announcer.h"
#include "tools/collector/Collector.h"
#include "tools/collector/CollectorOptions.h"
#include "tools/collector/Dashboard.h"
#include "tools/collector/HttpsServer.h"
#include "tools/collector/PostStore.h"
#include "tools/collector/TestCertificates.h"
#include "tools/collector/UploadStore.h"
#include "tools/collector/Uploads.h"

namespace velk::collector {
namespace {

using tools::ExitCode;

Result<CertificateFiles> certificates(const CollectorOptions& options) {
  if (!options.certificateFile.empty()) {
    return CertificateFiles{options.certificateFile, "", options.certificateFile, options.privateKeyFile};
  }
  return ensureTestCertificates(options.stateDirectory, systemClock().wallTime().seconds);
}

std::string databasePath(const CollectorOptions& options) {
  return options.sink ? std::string() : options.stateDirectory + "/posts.sqlite";
}

Result<std::unique_ptr<PostStore>> openStore(const CollectorOptions& options) {
  if (options.sink) return std::unique_ptr<PostStore>();
  if (Result<void> made = files::createDirectories(options.stateDirectory, 0700); !made) {
    return Failure(std::move(made).error());
  }
  return PostStore::open(databasePath(options));
}

/// Log data needs a place also where no datagrams are taken.
Result<std::unique_ptr<DashboardStore>> openDashboardStore(const CollectorOptions& options) {
  if (options.sink) return std::unique_ptr<DashboardStore>();
  return DashboardStore::open(options.stateDirectory + "/dashboard.sqlite");
}

Result<std::unique_ptr<UploadStore>> openUploadStore(const CollectorOptions& options) {
  if (options.sink) return std::unique_ptr<UploadStore>();
  return UploadStore::open(options.stateDirectory);
}

/// Null when none is asked for.
Result<std::unique_ptr<DashboardListener>> openListener(const CollectorOptions& options, Dashboard& dashboard) {
  if (!options.dashboardPort) return std::unique_ptr<DashboardListener>();
  return DashboardListener::open(options.listenAddress, *options.dashboardPort, options.dashboard,
                                 [&dashboard](const ReceivedDatagram& datagram) { dashboard.take(datagram); });
}

std::string urlOf(const std::string& address, int port) {
  const bool isVersion6 = address.find(':') != std::string::npos;
  return "https://" + (isVersion6 ? "[" + address + "]" : address) + ":" + std::to_string(port);
}

Result<void> writePortFile(const std::string& path, int port) {
  if (path.empty()) return {};
  const std::string text = std::to_string(port) + "\n";
  return files::writeAtomically(path, {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()}, 0644);
}

/// Serves until the signals say stop. False when the server ended by itself.
bool serveUntilStopped(HttpsServer& server, tools::StopSignals& signals) {
  std::atomic<bool> stopped = false;
  bool orderly = false;
  std::thread serving([&] {
    server.serve();
    orderly = stopped;
    signals.wake();
  });
  signals.wait();
  stopped = true;
  server.stop();
  serving.join();
  return orderly;
}

}  // namespace

ExitCode run(std::vector<std::string> arguments, std::ostream& out, std::ostream& error, tools::StopSignals& signals) {
  const auto read = readCollectorOptions(std::move(arguments), out, error);
  if (const ExitCode* code = std::get_if<ExitCode>(&read)) return *code;
  const CollectorOptions& options = std::get<CollectorOptions>(read);
  const auto fail = [&](ExitCode code, const std::string& sentence) {
    return tools::complain(error, "velkcollector", options.json, code, sentence);
  };

  const auto names = certificates(options);
  if (!names) return fail(ExitCode::cannotCreate, names.error().description);
  const auto store = openStore(options);
  if (!store) return fail(ExitCode::cannotCreate, store.error().description);

  tools::JsonLines lines(out);
  Announcer announcer(lines, options.json, options.quiet || options.sink);
  Collector collector(options, store->get(), announcer, systemClock());
  const auto dashboardStore = openDashboardStore(options);
  if (!dashboardStore) return fail(ExitCode::cannotCreate, dashboardStore.error().description);
  Dashboard dashboard(dashboardStore->get(), announcer, systemClock());
  const auto uploadStore = openUploadStore(options);
  if (!uploadStore) return fail(ExitCode::cannotCreate, uploadStore.error().description);
  Uploads uploads(options, uploadStore->get(), announcer, systemClock());
  auto server = HttpsServer::make(collector, dashboard, uploads, names->serverPath, names->serverKeyPath);
  if (!server) return fail(ExitCode::configuration, server.error().description);
  const Result<int> port = (*server)->bind(options.listenAddress, options.port);
  if (!port) return fail(ExitCode::unavailable, port.error().description);
  const auto listener = openListener(options, dashboard);
  if (!listener) return fail(ExitCode::unavailable, listener.error().description);
  if (const Result<void> written = writePortFile(options.portFile, *port); !written) {
    return fail(ExitCode::cannotCreate, written.error().description);
  }

  const auto dashboardPort = *listener ? std::optional((*listener)->port()) : std::nullopt;
  announcer.listening(urlOf(options.listenAddress, *port), *port, names->caPath, databasePath(options), dashboardPort);
  if (*listener) (*listener)->start();
  const bool orderly = serveUntilStopped(**server, signals);
  if (*listener) (*listener)->stop();
  announcer.stopped(collector.totals());
  if (!orderly) return fail(ExitCode::ioError, "the server can take no connections any longer");
  return lines.good() ? ExitCode::ok : fail(ExitCode::ioError, "standard output took no more: lines are missing");
}

}  // namespace velk::collector
