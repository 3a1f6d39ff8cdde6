#include "daemon/DaemonProcess.h"

#include <algorithm>
#include <cstdint>
#include <vector>

#include "daemon/CoalescedTask.h"
#include "daemon/FrameworkVersion.h"
#include "daemon/IdleWatch.h"
#include "daemon/IncomingConnection.h"
#include "daemon/MessageLogFile.h"
#include "daemon/ReportingdAgent.h"
#include "daemon/StopDeadline.h"
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
// The end of the process, from its beginning: until when it waits for decisions about connections, for sessions to say
// goodbye, for the network to take their last posts, for calls of the diagnostics adaptor, and for reads of clients'
// files. Later waits have what the earlier ones left; the posts have two seconds at the least.
constexpr Duration kDecisionsUntil = std::chrono::milliseconds(500);
constexpr Duration kTeardownsUntil = std::chrono::milliseconds(1500);
constexpr Duration kDeliveriesUntil = std::chrono::milliseconds(3800);
constexpr Duration kAdaptorUntil = std::chrono::milliseconds(4100);
constexpr Duration kFilesUntil = std::chrono::milliseconds(4400);
// Then the process ends, whatever its threads do.
constexpr Duration kEndUntil = std::chrono::milliseconds(4700);
// How long uploads may take of that: nothing is lost with them, since their files stay with the clients.
constexpr Duration kUploadTime = std::chrono::seconds(1);
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

/// One thread that never ends: an answer for which the agent's lock is held must not depend on a thread that the system
/// may refuse. One is enough, because no task there waits for another.
ThreadPoolOptions storebagPoolOptions() {
  ThreadPoolOptions options;
  options.runningThreads = 1;
  options.maximumThreads = 1;
  options.keptThreads = 1;
  return options;
}

std::int64_t milliseconds(Duration duration) { return duration / std::chrono::milliseconds(1); }

std::string storebagDirectory(const Directories& directories) { return directories.cache + "/storebags"; }

std::string textSetting(const UserDefaults& defaults, std::string_view key) {
  const auto value = defaults.value(key);
  const auto* text = value ? value->string() : nullptr;
  return text != nullptr ? *text : std::string();
}

LoadedEntitlements loadEntitlements(const std::string& configurationDirectory) {
  auto loaded = EntitlementRules::load(configurationDirectory);
  for (const auto& problem : loaded.unreadable) log::error("Entitlements: %@", problem);
  return loaded;
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
  [[nodiscard]] std::shared_ptr<const EntitlementRules> currentEntitlements();
  [[nodiscard]] bool isOccupied() const {
    return std::any_of(listeners.begin(), listeners.end(), [](const auto& listener) {
      return listener->openConnections() > 0 || listener->hasWaitingConnection();
    });
  }
  [[nodiscard]] Listener::Options listenerOptions();
  /// On every socket of the service manager, or on one of our own.
  [[nodiscard]] Result<void> listen(std::vector<FileDescriptor> sockets, const std::string& socketPath);
  void reload();
  /// Verification itself says nothing of a key that is missing, and everything that fails for it looks like the
  /// network.
  void reportMissingPublicKey() const;

  // The steps of the end, in order.
  void stopTakingConnections();
  void endSessions();
  /// Uploads have a little time for what a server is about to take; their requests end then.
  void deliverPosts();
  /// Does not return when one of them does not: a client's file may lie on a disk of its owner's making.
  void endForeignCalls();
  void joinThreads();
  /// Until `offset` after the beginning of the end.
  [[nodiscard]] Duration leftUntil(Duration offset) const { return stopDeadline.leftUntil(offset); }

  process::RunLoop& runLoop;
  const Directories directories;
  StopDeadline stopDeadline{kEndUntil, [] { process::endNow(kExitSoftware); }};

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
  EventLoop eventLoop;
  CoalescedTask reloading;
  Lock entitlementsLock;
  std::shared_ptr<const EntitlementRules> entitlements VELK_GUARDED_BY(entitlementsLock);
  std::vector<std::unique_ptr<Listener>> listeners;
};

DaemonProcess::Parts::Parts(const DaemonOptions& options, process::RunLoop& loop, bool activated)
    : runLoop(loop),
      directories(daemonDirectories()),
      udpSockets(makeUdpSocketService()),
      pool(makeThreadPool(poolOptions())),
      storebagPool(makeThreadPool(storebagPoolOptions())),
      defaults(openUserDefaults(kVelkReportingDefaultsSuite, directories.state, directories.configuration)),
      device(makeDeviceInformation(directories.configuration)),
      locale(makeLocale(openUserDefaults(kTimeDefaultsSuite, directories.state, directories.configuration))),
      http(makeHttpSessionService()),
      random(makeRandomSource()),
      consent(makeConsent(*defaults)),
      statistics(makeProcessStatistics()),
      logSubmission(makeLogSubmission(textSetting(*defaults, kLogSpoolSetting))),
      adaptorBundle(makeAdaptorBundle(directories.configuration)),
      powerLog(makePowerLog(*defaults)),
      environment(*defaults, *device, installedFrameworkVersion(directories.data)),
      idleWatch(
          *pool, idleLimit(options, activated), [this] { return isOccupied(); }, [this] { runLoop.wakeUp(); }),
      platform{systemClock(),  *pool,           *defaults, *device,     *locale,        *http,
               *random,        idleWatch,       *consent,  *statistics, *logSubmission, adaptorBundle.get(),
               powerLog.get(), udpSockets.get()},
      storebagPlatform{systemClock(), *storebagPool, *defaults, *device,     *locale,       *http,
                       *random,       idleWatch,     *consent,  *statistics, *logSubmission},
      messageLog(directories.logs, platform.clock, *logSubmission,
                 pool->makeSerialQueue("com.tavrin.velkreportingd.expiredLogs")),
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
      eventLoop("velk-ipc"),
      reloading(pool->makeSerialQueue("com.tavrin.velkreportingd.reload"), [this] { reload(); }),
      entitlements(std::make_shared<EntitlementRules>(loadEntitlements(directories.configuration).rules)) {}

std::shared_ptr<const EntitlementRules> DaemonProcess::Parts::currentEntitlements() {
  Guard guard(entitlementsLock);
  return entitlements;
}

bool DaemonProcess::Parts::hasEntitlement(std::string_view name, const Connection& connection) {
  return currentEntitlements()->valueOfEntitlement(name, connection.peer());
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
  options.dependsOnExecutable = [this](const PeerCredentials& peer) {
    return currentEntitlements()->dependOnExecutable(peer);
  };
  return options;
}

void DaemonProcess::Parts::reload() {
  auto loaded = loadEntitlements(directories.configuration);
  if (loaded.unreadable.empty()) {
    log::standard("reload: %d entitlement grants; storebags are fetched afresh", loaded.rules.grantCount());
    auto rules = std::make_shared<const EntitlementRules>(std::move(loaded.rules));
    Guard guard(entitlementsLock);
    entitlements.swap(rules);
  } else {
    // Half of the rules would lock out clients that the administrator let in.
    log::error("reload: not all entitlements can be read: the old ones stay; storebags are fetched afresh");
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
  if (const auto listening = parts->listen(std::move(sockets), options.socketPath); !listening) {
    return failure("velkreportingd", kExitUnavailable,
                   "cannot listen for clients: " + listening.error().description +
                       " (another place for the socket is given with --socket)");
  }
  return std::unique_ptr<DaemonProcess>(new DaemonProcess(std::move(parts)));
}

Result<void> DaemonProcess::Parts::listen(std::vector<FileDescriptor> sockets, const std::string& socketPath) {
  for (auto& socket : sockets) {
    auto adopted = Listener::adopt(std::move(socket), listenerOptions());
    if (!adopted) return Failure(adopted.error());
    listeners.push_back(std::move(*adopted));
  }
  if (!listeners.empty()) return {};
  if (socketPath.empty()) {
    // Every user may connect, so every user may pass through.
    if (auto made = files::createDirectories(directories.runtime, 0755); !made) return made;
  }
  const auto path = socketPath.empty() ? directories.runtime + "/" + std::string(kServiceName) : socketPath;
  auto bound = Listener::bind(path, listenerOptions());
  if (!bound) return Failure(bound.error());
  listeners.push_back(std::move(*bound));
  return {};
}

Result<void> DaemonProcess::resume() {
  _parts->reportMissingPublicKey();
  if (const auto prepared = _parts->stopDeadline.prepare(); !prepared) {
    return failure("velkreportingd", kExitOsError, prepared.error().description);
  }
  for (const auto& listener : _parts->listeners) {
    if (const auto resumed = listener->resume(); !resumed) {
      return failure("velkreportingd", kExitUnavailable, "cannot listen for clients: " + resumed.error().description);
    }
  }
  _parts->idleWatch.start();
  return {};
}

void DaemonProcess::reload() { _parts->reloading.request(); }

bool DaemonProcess::stopsListeningIfIdle() {
  return _parts->idleWatch.isReleased() && Listener::stopIfUnused(_parts->listeners);
}

void DaemonProcess::Parts::stopTakingConnections() {
  stopDeadline.expect("the event loop", "nothing was taken down yet; what sessions hold is lost");
  for (const auto& listener : listeners) listener->stop();
  // A decision that is being taken right now still counts.
  for (const auto& listener : listeners) {
    if (listener->waitUntilDecided(leftUntil(kDecisionsUntil))) continue;
    log::error("stop: a decision about a connection is still being taken after %d ms; that client gets no session",
               milliseconds(kDecisionsUntil));
  }
}

void DaemonProcess::Parts::endSessions() {
  // Every session: the call that runs is answered, then the session ends with its last messages.
  stopDeadline.expect("the agent's lock", "what sessions have not posted is lost");
  agent->invalidateAllSessions();
  stopDeadline.expect("sessions that end", "what they have not posted is lost");
  if (agent->waitForTeardowns(leftUntil(kTeardownsUntil))) return;
  log::error("stop: sessions are still busy after %d ms and are cut off: what they have not posted is lost",
             milliseconds(kTeardownsUntil));
}

void DaemonProcess::Parts::deliverPosts() {
  stopDeadline.expect("posts to their servers", "their events are lost");
  agent->invalidateAllConnectivityHelpers();
  if (!services.backends.uploads->waitUntilNone(kUploadTime)) http->endBulk();
  if (idleWatch.waitUntilReleased(leftUntil(kDeliveriesUntil))) return;
  log::error("stop: posts are still under way after %d ms and are cut off: their events are lost",
             milliseconds(kDeliveriesUntil));
}

void DaemonProcess::Parts::endForeignCalls() {
  stopDeadline.expect("the diagnostics adaptor", "the events of its calls are lost");
  if (!adaptorBundle->stop(leftUntil(kAdaptorUntil))) {
    log::error(
        "stop: the diagnostics adaptor does not return from its calls; the process ends without it after %d ms: "
        "the events of these calls are lost",
        milliseconds(kAdaptorUntil));
    process::endNow(kExitSoftware);
  }
  // Uploads wait for their answers on threads of the pool.
  stopDeadline.expect("the HTTP thread, which may be asking for a server's address", "nothing");
  http->stop();
  auto& uploads = *services.backends.uploads;
  const bool allEnded = uploads.waitUntilNone(leftUntil(kFilesUntil));
  if (const auto left = uploads.leftBehind() + uploads.count(); left > 0) {
    log::standard("stop: uploads left behind: %d; their files stay with their clients", left);
  }
  if (allEnded) return;
  log::error("stop: files of clients that are being uploaded cannot be read; the process ends without them after %d ms",
             milliseconds(kFilesUntil));
  process::endNow(kExitSoftware);
}

/// First those that hand work over, then those that do it.
void DaemonProcess::Parts::joinThreads() {
  stopDeadline.expect("the event loop", "nothing");
  eventLoop.stop();
  stopDeadline.expect("a thread that does not return from the system (a disk, a name service)", "nothing");
  pool->stop();
  storebagPool->stop();
}

void DaemonProcess::stop() {
  _parts->stopDeadline.begin();
  _parts->idleWatch.stop();
  // Uploads that wait would take minutes, and would then find no transport.
  _parts->services.backends.uploads->stop();
  // Whoever waits for a storebag gets none, so that the agent's lock is free.
  _parts->storebagService->stop();
  _parts->stopTakingConnections();
  _parts->endSessions();
  _parts->deliverPosts();
  _parts->endForeignCalls();
  _parts->joinThreads();
}

}  // namespace velk
