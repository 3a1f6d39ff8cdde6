#include "daemon/DaemonProcess.h"

#include <atomic>
#include <vector>

#include "daemon/IdleWatch.h"
#include "daemon/IncomingConnection.h"
#include "daemon/MessageLogFile.h"
#include "daemon/ReportingdAgent.h"
#include "daemon/StorebagService.h"
#include "daemon/WorkingDirectories.h"
#include "device/DeviceEnvironment.h"
#include "ipc/Listener.h"
#include "ipc/Vocabulary.h"
#include "platform/AdaptorBundle.h"
#include "platform/DeviceInformation.h"
#include "platform/Directories.h"
#include "platform/Entitlements.h"
#include "platform/EventLoop.h"
#include "platform/Files.h"
#include "platform/HttpSession.h"
#include "platform/Launch.h"
#include "platform/Log.h"
#include "platform/PowerLog.h"
#include "platform/Process.h"
#include "platform/ThreadPool.h"
#include "platform/UdpSocket.h"
#include "platform/UserDefaults.h"

namespace velk {

namespace {

constexpr Duration kActivatedIdleLimit = std::chrono::seconds(30);
// How long the end of the process waits for sessions to say goodbye, and then for the network to take their last posts.
constexpr Duration kTeardownTime = std::chrono::seconds(5);
constexpr Duration kDeliveryTime = std::chrono::seconds(10);
// How long uploads may take of that: nothing is lost with them, since their files stay with the clients.
constexpr Duration kUploadTime = std::chrono::seconds(2);
// How long calls of the diagnostics adaptor, and reads of clients' files, may then still take.
constexpr Duration kAdaptorTime = std::chrono::seconds(2);
// How far beyond its usual bound the pool may grow while everybody waits for the agent's lock: more than the
// connections that a few users may have.
constexpr std::size_t kEmergencyThreads = 3584;
// Where retired message logs go for support to collect; without it they are deleted.
constexpr std::string_view kLogSpoolSetting = "logSubmissionDirectory";
// The datagram socket of the journal that takes the power log, where it is not the system's own.
constexpr std::string_view kPowerLogSocketSetting = "powerLogSocket";

std::optional<Duration> idleLimit(const DaemonOptions& options, bool activated) {
  if (options.idleExitSeconds) {
    if (*options.idleExitSeconds == 0) return std::nullopt;
    return std::chrono::seconds(*options.idleExitSeconds);
  }
  return activated ? std::optional(kActivatedIdleLimit) : std::nullopt;
}

constexpr char kSessionQueue[] = "com.tavrin.velkreportingd.session";

ThreadPoolOptions poolOptions() {
  ThreadPoolOptions options;
  options.emergencyThreads = kEmergencyThreads;
  // Calls wait for storebags and for room, uploads for servers, foreign code for anything.
  options.patientQueues = {kSessionQueue, "com.tavrin.velkreportingd.uploads", "com.tavrin.VelkReporting.quillAdaptor"};
  options.keptThreads = 1;
  return options;
}

/// Its tasks wait for nobody: one thread is enough to get on.
ThreadPoolOptions storebagPoolOptions() {
  ThreadPoolOptions options;
  options.keptThreads = 1;
  return options;
}

std::string storebagDirectory(const Directories& directories) { return directories.cache + "/storebags"; }

std::string textSetting(const UserDefaults& defaults, std::string_view key) {
  const auto value = defaults.value(key);
  const auto* text = value ? value->string() : nullptr;
  return text != nullptr ? *text : std::string();
}

std::unique_ptr<PowerLog> makePowerLog(const UserDefaults& defaults) {
  const auto socket = textSetting(defaults, kPowerLogSocketSetting);
  return socket.empty() ? makeJournalPowerLog() : makeJournalPowerLog(socket);
}

}  // namespace

/// Everything, in the order in which it is made; the end is the reverse. What stands higher outlives what stands lower.
struct DaemonProcess::Parts {
  Parts(const DaemonOptions& options, process::RunLoop& loop, bool activated);

  [[nodiscard]] bool hasEntitlement(std::string_view name, const Connection& connection);
  [[nodiscard]] bool isOccupied() const {
    return listener && (listener->openConnections() > 0 || listener->hasWaitingConnection());
  }
  [[nodiscard]] Listener::Options listenerOptions();
  void reload();
  /// Of the requests that are under way, after a little time for what a server is about to take.
  void endUploads();
  /// Does not return when one of them does not: a file may lie on a disk of its owner's making.
  void reportUploads() const;
  /// Verification itself says nothing of a key that is missing, and everything that fails for it looks like the
  /// network.
  void reportMissingPublicKey() const;

  process::RunLoop& runLoop;
  const Directories directories;

  /// Above the pool, whose last tasks may still let go of sockets.
  const std::unique_ptr<UdpSocketService> udpSockets;
  const std::unique_ptr<ThreadPool> pool;
  /// For the transport of storebags alone: what a session waits for with the agent's lock held never waits for a thread
  /// behind the sessions that want this lock.
  const std::unique_ptr<ThreadPool> storebagPool;
  const std::unique_ptr<UserDefaults> defaults;
  const std::unique_ptr<DeviceInformation> device;
  const std::unique_ptr<Locale> locale;
  const std::unique_ptr<HttpSessionService> http;
  const std::unique_ptr<RandomSource> random;
  const std::unique_ptr<Consent> consent;
  const std::unique_ptr<ProcessStatistics> statistics;
  const std::unique_ptr<LogSubmission> logSubmission;
  const std::unique_ptr<AdaptorBundle> adaptorBundle;
  const std::unique_ptr<PowerLog> powerLog;
  const DeviceEnvironment environment;
  IdleWatch idleWatch;
  Platform platform;
  Platform storebagPlatform;
  MessageLogFile messageLog;
  const SessionServices services;

  const StorebagPublicKeySource publicKey;
  const std::shared_ptr<StorebagService> storebagService;
  const std::shared_ptr<ReportingdAgent> agent;

  const std::shared_ptr<Queue> acceptQueue;
  const std::shared_ptr<Queue> reloadQueue;
  EventLoop eventLoop;
  Lock entitlementsLock;
  std::shared_ptr<const EntitlementRules> entitlements VELK_GUARDED_BY(entitlementsLock);
  std::unique_ptr<Listener> listener;
};

DaemonProcess::Parts::Parts(const DaemonOptions& options, process::RunLoop& loop, bool activated)
    : runLoop(loop),
      directories(daemonDirectories()),
      udpSockets(makeUdpSocketService()),
      pool(makeThreadPool(poolOptions())),
      storebagPool(makeThreadPool(storebagPoolOptions())),
      defaults(openUserDefaults(kVelkReportingDefaultsSuite, directories.state, directories.configuration)),
      device(makeDeviceInformation(directories.configuration)),
      locale(makeLocale()),
      http(makeHttpSessionService()),
      random(makeRandomSource()),
      consent(makeConsent(*defaults)),
      statistics(makeProcessStatistics()),
      logSubmission(makeLogSubmission(textSetting(*defaults, kLogSpoolSetting))),
      adaptorBundle(makeAdaptorBundle(directories.configuration)),
      powerLog(makePowerLog(*defaults)),
      environment(*defaults, *device),
      idleWatch(
          *pool, idleLimit(options, activated), [this] { return isOccupied(); }, [this] { runLoop.wakeUp(); }),
      platform{systemClock(),  *pool,           *defaults, *device,     *locale,        *http,
               *random,        idleWatch,       *consent,  *statistics, *logSubmission, adaptorBundle.get(),
               powerLog.get(), udpSockets.get()},
      storebagPlatform{systemClock(), *storebagPool, *defaults, *device,     *locale,       *http,
                       *random,       idleWatch,     *consent,  *statistics, *logSubmission},
      messageLog(directories.logs, platform.clock, *logSubmission),
      services{{platform, environment, directories.cache}, messageLog},
      publicKey(storebagPublicKeyFromDirectories(directories.configuration, directories.data)),
      storebagService(StorebagService::make(storebagPlatform, environment,
                                            makeStorebagDiskCache(storebagDirectory(directories)), publicKey)),
      agent(ReportingdAgent::make(
          platform, storebagService,
          [this](ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection) {
            return ReportingdSession::initWithSessionDelegate(delegate, std::move(connection), services);
          })),
      acceptQueue(pool->makeSerialQueue("com.tavrin.velkreportingd.accept")),
      reloadQueue(pool->makeSerialQueue("com.tavrin.velkreportingd.reload")),
      eventLoop("velk-ipc"),
      entitlements(std::make_shared<EntitlementRules>(EntitlementRules::load(directories.configuration))) {}

bool DaemonProcess::Parts::hasEntitlement(std::string_view name, const Connection& connection) {
  std::shared_ptr<const EntitlementRules> rules;
  {
    Guard guard(entitlementsLock);
    rules = entitlements;
  }
  return rules->valueOfEntitlement(name, connection.peer());
}

Listener::Options DaemonProcess::Parts::listenerOptions() {
  Listener::Options options;
  options.loop = &eventLoop;
  options.acceptQueue = acceptQueue;
  options.makeDeliveryQueue = [this] { return pool->makeSerialQueue(kSessionQueue); };
  options.shouldAcceptNewConnection = [this](const std::shared_ptr<Connection>& connection) {
    return agent->shouldAcceptNewConnection(makeIncomingConnection(
        connection, [this](std::string_view name, const Connection& asked) { return hasEntitlement(name, asked); }));
  };
  return options;
}

void DaemonProcess::Parts::reload() {
  auto rules = std::make_shared<const EntitlementRules>(EntitlementRules::load(directories.configuration));
  log::standard("reload: %d entitlement grants; storebags are fetched afresh", rules->grantCount());
  {
    Guard guard(entitlementsLock);
    entitlements.swap(rules);
  }
  reportMissingPublicKey();
  agent->refreshStorebags();
}

void DaemonProcess::Parts::reportMissingPublicKey() const {
  if (publicKey()) return;
  log::error("velkreportingd: there is no usable publicKey.der, neither in %@ nor in %@; no storebag can be verified",
             directories.configuration, directories.data);
}

DaemonProcess::DaemonProcess(std::unique_ptr<Parts> parts) : _parts(std::move(parts)) {}
DaemonProcess::~DaemonProcess() = default;

Result<std::unique_ptr<DaemonProcess>> DaemonProcess::make(const DaemonOptions& options, process::RunLoop& runLoop) {
  auto sockets = launch::takeActivatedSockets();
  const bool activated = !sockets.empty();
  auto parts = std::make_unique<Parts>(options, runLoop, activated);
  const auto& directories = parts->directories;
  if (const auto prepared =
          prepareWorkingDirectories(directories.state, directories.cache, storebagDirectory(directories));
      !prepared) {
    return failure("velkreportingd", kExitCannotCreate,
                   prepared.error().description + " (it must belong to the user that the daemon runs as)");
  }
  auto listener = [&]() -> Result<std::unique_ptr<Listener>> {
    if (activated) return Listener::adopt(std::move(sockets.front()), parts->listenerOptions());
    const auto path =
        options.socketPath.empty() ? parts->directories.runtime + "/" + std::string(kServiceName) : options.socketPath;
    if (options.socketPath.empty()) {
      // Everybody may connect, so everybody may pass through.
      if (const auto made = files::createDirectories(parts->directories.runtime, 0755); !made) {
        return Failure(made.error());
      }
    }
    return Listener::bind(path, parts->listenerOptions());
  }();
  if (!listener) {
    return failure("velkreportingd", kExitUnavailable,
                   "cannot listen for clients: " + listener.error().description +
                       " (another place for the socket is given with --socket)");
  }
  parts->listener = std::move(*listener);
  return std::unique_ptr<DaemonProcess>(new DaemonProcess(std::move(parts)));
}

void DaemonProcess::resume() {
  _parts->reportMissingPublicKey();
  _parts->listener->resume();
  _parts->idleWatch.start();
}

void DaemonProcess::reload() {
  _parts->reloadQueue->async([parts = _parts.get()] { parts->reload(); });
}

bool DaemonProcess::stopsListeningIfIdle() {
  return _parts->idleWatch.isReleased() && _parts->listener->stopIfUnused();
}

void DaemonProcess::Parts::endUploads() {
  if (!services.backends.uploads->waitUntilNone(kUploadTime)) http->endBulk();
}

void DaemonProcess::Parts::reportUploads() const {
  auto& uploads = *services.backends.uploads;
  const bool allEnded = uploads.waitUntilNone(kAdaptorTime);
  if (const auto left = uploads.leftBehind() + uploads.count(); left > 0) {
    log::standard("stop: uploads left behind: %d; their files stay with their clients", left);
  }
  if (allEnded) return;
  log::error("stop: files of clients that are being uploaded cannot be read; the process ends without them");
  process::endNow(kExitSoftware);
}

void DaemonProcess::stop() {
  _parts->idleWatch.stop();
  // Uploads that wait would take minutes, and would then find no transport.
  _parts->services.backends.uploads->stop();
  // Whoever waits for a storebag gets none, so that the agent's lock is free.
  _parts->storebagService->stop();
  // Nobody new. A decision that is being taken right now still counts.
  _parts->listener->stop();
  _parts->acceptQueue->sync([] {});
  // Everybody who is here: the call that runs is answered, then the session ends with its last messages.
  _parts->agent->invalidateAllSessions();
  if (!_parts->agent->waitForTeardowns(kTeardownTime)) {
    log::error("stop: sessions are still busy after %d s and are cut off", kTeardownTime / std::chrono::seconds(1));
  }
  // What the sessions posted.
  _parts->agent->invalidateAllConnectivityHelpers();
  _parts->endUploads();
  if (!_parts->idleWatch.waitUntilReleased(kDeliveryTime)) {
    log::error("stop: posts are still under way after %d s and are cut off", kDeliveryTime / std::chrono::seconds(1));
  }
  if (!_parts->adaptorBundle->stop(kAdaptorTime)) {
    log::error("stop: the diagnostics adaptor does not return from its calls; the process ends without it");
    process::endNow(kExitSoftware);
  }
  // Uploads wait for their answers on threads of the pool.
  _parts->http->stop();
  _parts->reportUploads();
  // The threads: first those that hand work over, then those that do it.
  _parts->eventLoop.stop();
  _parts->pool->stop();
  _parts->storebagPool->stop();
}

}  // namespace velk
