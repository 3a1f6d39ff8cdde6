#include "platform/linux/CurlEngine.h"

#include <algorithm>
#include <limits>
#include <mutex>
#include <system_error>

#include "platform/Log.h"
#include "platform/NativeThread.h"
#include "platform/linux/CurlSession.h"
#include "platform/linux/CurlTransfer.h"

namespace velk {
namespace {

constexpr Duration kConnectionLinger = std::chrono::seconds(60);
/// Requests at once, each of which has a connection at most. The library's own bounds are not used: under load it
/// forgets requests that wait for a connection now and then, until they time out.
constexpr std::size_t kMaximumRequestsPerServer = 8;
constexpr std::size_t kMaximumRequests = 64;
/// Beside those: uploads may take an hour each.
constexpr std::size_t kMaximumBulkRequests = 24;
/// With the first request to each server that has none under way.
constexpr std::size_t kMaximumRequestsWithFirstOnes = 256;
constexpr long kMaximumIdleConnections = 16;
constexpr std::size_t kMaximumSpareHandles = 4;
constexpr Duration kDropReportInterval = std::chrono::seconds(60);

SteadyTime now() { return std::chrono::steady_clock::now(); }

Error ended(const CurlTask& task) {
  return {kHttpErrorDomain, CURLE_ABORTED_BY_CALLBACK, task.address().host + ": the HTTP session service has ended"};
}

Error outOfMemory(const CurlTask& task) {
  return {kHttpErrorDomain, CURLE_OUT_OF_MEMORY, task.address().host + ": the request could not be set up"};
}

/// The families over which a request that must not use a mobile network may leave; nothing when there are none.
std::optional<long> familiesWithoutMobile(const DefaultRoutes& routes) {
  if (!routes.isMobile4 && !routes.isMobile6) return CURL_IPRESOLVE_WHATEVER;
  if (routes.ipv4 && !routes.isMobile4) return CURL_IPRESOLVE_V4;
  if (routes.ipv6 && !routes.isMobile6) return CURL_IPRESOLVE_V6;
  return std::nullopt;
}

/// What a task counts for while it stands in line or waits. Urgent ones wait for seconds only.
std::size_t standingBytes(const CurlTask& task) {
  constexpr std::size_t kLeast = 1024;
  const auto& request = task.request();
  if (request.isUrgent) return 0;
  return std::max(kLeast, request.body ? request.body->size() : 0);
}

}  // namespace

CurlEngine::CurlEngine(HttpTrust trust, Options options)
    : _trust(std::move(trust)),
      _maximumStandingBytes(options.maximumStandingBytes),
      _lookup(std::move(options.look), [this](std::uint64_t generation, const DefaultRoutes& routes) {
        routesWereLookedUp(generation, routes);
      }) {}

CurlEngine::~CurlEngine() { stop(); }

void CurlEngine::submit(std::shared_ptr<CurlTask> task) {
  if (auto failure = handOver({task, true})) task->complete(std::move(failure));
}

// A task whose engine has gone was completed by it.
void CurlEngine::unpause(std::shared_ptr<CurlTask> task) { (void)handOver({std::move(task), false}); }

void CurlEngine::endBulk() {
  Guard guard(_lock);
  _bulkEnded = true;
  if (_started && !_stopping) curl_multi_wakeup(_multi.get());
}

std::optional<Error> CurlEngine::handOver(Command command) {
  Guard guard(_lock);
  if (_stopping) return ended(*command.task);
  if (!_started) {
    if (const auto why = startThreadLocked()) {
      return Error{kHttpErrorDomain, CURLE_FAILED_INIT, command.task->address().host + ": " + *why};
    }
  }
  _inbox.push_back(std::move(command));
  curl_multi_wakeup(_multi.get());
  return std::nullopt;
}

std::optional<std::string> CurlEngine::startThreadLocked() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
  if (!_multi && !forgetConnections()) return "no descriptors or no memory for the HTTP thread";
  auto thread = startThread("http", [this] { run(); });
  if (!thread) return "no HTTP thread: " + thread.error().description;
  _thread = std::move(*thread);
  _started = true;
  return std::nullopt;
}

void CurlEngine::routesWereLookedUp(std::uint64_t generation, const DefaultRoutes& routes) {
  Guard guard(_lock);
  if (_stopping) return;
  _routesAnswer = RoutesAnswer{generation, routes};
  curl_multi_wakeup(_multi.get());
}

void CurlEngine::stop() {
  {
    Guard guard(_lock);
    _stopping = true;
    if (!_started) return;
    curl_multi_wakeup(_multi.get());
  }
  if (_thread.joinable()) _thread.join();
  _lookup.stop();
}

void CurlEngine::run() {
  std::vector<Command> commands;
  std::optional<RoutesAnswer> answer;
  while (takeCommands(commands, answer)) {
    dropEndedBulk();
    for (auto& command : commands) {
      if (command.isStart) {
        start(std::move(command.task));
      } else {
        resumePaused(*command.task);
      }
    }
    commands.clear();
    if (answer) useLookup(*answer);
    int count = 0;
    curl_multi_perform(_multi.get(), &count);
    collectFinished();
    serveLines();
    expireWaiting();
    reportDropped(false);
    sleep();
  }
  endAll();
}

// False when the engine is to stop.
bool CurlEngine::takeCommands(std::vector<Command>& into, std::optional<RoutesAnswer>& answer) {
  Guard guard(_lock);
  into.swap(_inbox);
  answer = std::exchange(_routesAnswer, std::nullopt);
  if (!_stopping) return true;
  _inbox.insert(_inbox.begin(), std::make_move_iterator(into.begin()), std::make_move_iterator(into.end()));
  into.clear();
  return false;
}

void CurlEngine::start(std::shared_ptr<CurlTask> task) {
  if (_bulkDropped && task->request().isBulk) return task->complete(ended(*task));
  task->place().number = ++_lastNumber;
  _mayHaveConnections = true;
  _idleSince = now();
  enter(std::move(task));
}

/// To the attempt, or to the task's place in its server's line.
void CurlEngine::enter(std::shared_ptr<CurlTask> task) {
  if (task->request().isUrgent) return attempt(task);
  auto& server = serverOf(*task);
  if (server.line.empty() && hasRoom(server)) return attempt(task);
  if (!mayStand(*task)) return;
  server.line.add(task);
  stands(*task);
}

CurlEngine::Server& CurlEngine::serverOf(const CurlTask& task) {
  const auto& name = task.address().server;
  const bool isBulk = task.request().isBulk;
  auto& server = _servers[isBulk ? name + " bulk" : name];
  server.isBulk = isBulk;
  return server;
}

/// Servers that are slow to answer keep what they have; whoever has nothing yet gets a first request beside them.
bool CurlEngine::hasRoom(const Server& server) const {
  if (server.running == 0) return _running.size() < kMaximumRequestsWithFirstOnes;
  if (server.running >= kMaximumRequestsPerServer) return false;
  if (server.isBulk) return _bulkRunning < kMaximumBulkRequests;
  return _running.size() - _bulkRunning - _urgentRunning < kMaximumRequests;
}

/// Lets those in line go on where others have finished, and forgets servers that nobody talks to.
void CurlEngine::serveLines() {
  while (auto* server = nextToServe()) {
    const auto task = server->line.takeNext();
    standsNoMore(*task);
    attempt(task);
  }
  std::erase_if(_servers, [](const auto& entry) { return entry.second.running == 0 && entry.second.line.empty(); });
}

/// Of those servers for which there is room the one for which the next in turn has waited for longest.
CurlEngine::Server* CurlEngine::nextToServe() {
  Server* next = nullptr;
  std::uint64_t smallest = std::numeric_limits<std::uint64_t>::max();
  for (auto& [name, server] : _servers) {
    if (server.line.empty() || !hasRoom(server)) continue;
    const auto number = server.line.next().place().number;
    if (number >= smallest) continue;
    smallest = number;
    next = &server;
  }
  return next;
}

void CurlEngine::attempt(const std::shared_ptr<CurlTask>& task) {
  if (task->address().isLoopback()) return transfer(task, CURL_IPRESOLVE_WHATEVER);
  listenForRoutes();
  task->place().routeGeneration = _routeGeneration;
  if (task->request().allowsCellularAccess) return transfer(task, CURL_IPRESOLVE_WHATEVER);
  if (!_routes) return waitForLookup(task);
  if (const auto families = familiesWithoutMobile(*_routes)) return transfer(task, *families);
  lacksRoute(task, Error{kHttpErrorDomain, CURLE_COULDNT_CONNECT,
                         task->address().host + ": the only way out is a mobile network, which may not be used"});
}

void CurlEngine::transfer(const std::shared_ptr<CurlTask>& task, long families) {
  auto easy = takeEasy();
  auto transfer = std::make_unique<CurlTransfer>(task, easy.get());
  if (!easy || !transfer->configure(_trust, now()) ||
      curl_easy_setopt(easy.get(), CURLOPT_IPRESOLVE, families) != CURLE_OK ||
      (!task->address().isLoopback() && !avoidOldConnections(easy.get())) ||
      curl_multi_add_handle(_multi.get(), easy.get()) != CURLM_OK) {
    task->complete(outOfMemory(*task));
    return;
  }
  countRunning(*task, true);
  CURL* const key = easy.release();
  _running.emplace(key, std::move(transfer));
}

/// A connection from before the last change of the routes may lead nowhere. The library counts whole seconds, so one
/// that is a little younger may be avoided as well.
bool CurlEngine::avoidOldConnections(CURL* easy) const {
  if (_routesChanged == SteadyTime::min()) return true;
  const long age = static_cast<long>(std::chrono::floor<std::chrono::seconds>(now() - _routesChanged).count()) - 1;
  const auto result = age > 0 ? curl_easy_setopt(easy, CURLOPT_MAXLIFETIME_CONN, age)
                              : curl_easy_setopt(easy, CURLOPT_FRESH_CONNECT, 1L);
  return result == CURLE_OK;
}

void CurlEngine::countRunning(const CurlTask& task, bool starts) {
  const auto count = [starts](std::size_t& number) { starts ? ++number : --number; };
  if (task.request().isUrgent) return count(_urgentRunning);
  auto& server = serverOf(task);
  count(server.running);
  if (server.isBulk) count(_bulkRunning);
}

void CurlEngine::resumePaused(const CurlTask& task) {
  const auto found = std::find_if(_running.begin(), _running.end(),
                                  [&](const auto& entry) { return entry.second->task().get() == &task; });
  if (found != _running.end()) curl_easy_pause(found->first, CURLPAUSE_CONT);
}

void CurlEngine::collectFinished() {
  int left = 0;
  while (const CURLMsg* message = curl_multi_info_read(_multi.get(), &left)) {
    if (message->msg == CURLMSG_DONE) finished(message->easy_handle, message->data.result);
  }
}

void CurlEngine::finished(CURL* handle, CURLcode code) {
  using LacksRoute = CurlTransfer::LacksRoute;
  Easy easy(handle);
  const auto found = _running.find(handle);
  const auto transfer = std::move(found->second);
  _running.erase(found);
  const auto task = transfer->task();
  countRunning(*task, false);
  auto error = transfer->error(code);
  const bool mayWait = error && task->configuration().waitsForConnectivity;
  const auto lacks = mayWait ? transfer->lacksRoute(code) : LacksRoute::no;
  curl_multi_remove_handle(_multi.get(), handle);
  giveEasyBack(std::move(easy));
  if (lacks == LacksRoute::no) return task->complete(std::move(error));
  if (lacks == LacksRoute::yes) return lacksRoute(task, *std::move(error));
  task->place().failure = std::move(error);
  _routes ? judgeFailure(task) : waitForLookup(task);
}

void CurlEngine::listenForRoutes() {
  if (_routeMonitor) return;
  auto monitor = std::make_unique<RouteMonitor>();
  if (monitor->descriptor() < 0) return;
  _routeMonitor = std::move(monitor);
  ++_routeGeneration;
  _routes.reset();
}

/// All that wait for another route are judged anew.
void CurlEngine::routesHaveChanged() {
  ++_routeGeneration;
  _routes.reset();
  _routesChanged = now();
  for (auto& [number, task] : takeWaiting(false)) enter(task);
}

void CurlEngine::askForRoutes() {
  if (_routesAsked == _routeGeneration) return;
  _routesAsked = _routeGeneration;
  _lookup.ask(_routeGeneration);
}

// An answer from before the last change may be wrong. Without a monitor the next question needs an answer of its own.
void CurlEngine::useLookup(const RoutesAnswer& answer) {
  if (answer.generation != _routeGeneration) {
    if (_routesAsked == answer.generation) askForRoutes();
    return;
  }
  _routesAsked.reset();
  _routes = answer.routes;
  for (auto& [number, task] : takeWaiting(true)) {
    task->place().failure ? judgeFailure(task) : enter(task);
  }
  if (!_routeMonitor) _routes.reset();
}

/// The routes are known and tell whether the failure is for want of one.
void CurlEngine::judgeFailure(const std::shared_ptr<CurlTask>& task) {
  auto error = *std::exchange(task->place().failure, std::nullopt);
  if (task->place().routeGeneration != _routeGeneration) return enter(task);
  if (!_routes->any()) return lacksRoute(task, std::move(error));
  if (_routes->failure != 0) {
    error.description += " (the routes are unknown: " + std::generic_category().message(_routes->failure) + ")";
  }
  task->complete(std::move(error));
}

/// Without a monitor a route would never be heard of: nothing waits then. A change since the attempt began is worth
/// another attempt. The others in line that may use no more than this task need none of their own to find the same.
void CurlEngine::lacksRoute(const std::shared_ptr<CurlTask>& task, Error error) {
  if (!task->configuration().waitsForConnectivity || !_routeMonitor) return task->complete(std::move(error));
  if (task->place().routeGeneration != _routeGeneration) return enter(task);
  waitForRoute(task);
  if (task->request().isUrgent) return;
  const bool allowsCellular = task->request().allowsCellularAccess;
  auto others = serverOf(*task).line.takeIf([&](const CurlTask& other) {
    return other.request().allowsCellularAccess == allowsCellular && other.configuration().waitsForConnectivity;
  });
  for (auto& [number, other] : others) {
    standsNoMore(*other);
    waitForRoute(other);
  }
}

void CurlEngine::waitForRoute(const std::shared_ptr<CurlTask>& task) {
  task->place().awaitsLookup = false;
  if (!std::exchange(task->place().hasWaited, true)) task->announceWaiting();
  putAside(task);
}

void CurlEngine::waitForLookup(const std::shared_ptr<CurlTask>& task) {
  task->place().awaitsLookup = true;
  putAside(task);
  askForRoutes();
}

void CurlEngine::putAside(const std::shared_ptr<CurlTask>& task) {
  if (!mayStand(*task)) return;
  _waiting.emplace(task->place().number, task);
  stands(*task);
}

CurlEngine::Tasks CurlEngine::takeWaiting(bool awaitsLookup) {
  Tasks taken;
  for (auto entry = _waiting.begin(); entry != _waiting.end();) {
    const auto current = entry++;
    if (current->second->place().awaitsLookup != awaitsLookup) continue;
    standsNoMore(*current->second);
    taken.insert(_waiting.extract(current));
  }
  return taken;
}

/// Urgent tasks alone have a deadline.
void CurlEngine::expireWaiting() {
  if (_urgentWaiting == 0) return;
  const auto time = now();
  std::erase_if(_waiting, [&](const auto& entry) {
    const auto& task = entry.second;
    if (task->deadline() > time) return false;
    standsNoMore(*task);
    task->complete(Error{kHttpErrorDomain, CURLE_OPERATION_TIMEDOUT,
                         task->address().host + ": no network within the request's time"});
    return true;
  });
}

/// A task that would not fit alone ends instead of all others.
bool CurlEngine::mayStand(CurlTask& task) {
  if (standingBytes(task) <= _maximumStandingBytes) return true;
  drop(task);
  return false;
}

/// The task has been put where it stands.
void CurlEngine::stands(const CurlTask& task) {
  _standingBytes += standingBytes(task);
  if (task.request().isUrgent) ++_urgentWaiting;
  while (_standingBytes > _maximumStandingBytes) {
    const auto oldest = takeOldest();
    standsNoMore(*oldest);
    drop(*oldest);
  }
}

void CurlEngine::standsNoMore(const CurlTask& task) {
  _standingBytes -= standingBytes(task);
  if (task.request().isUrgent) --_urgentWaiting;
}

/// Of all that stand in lines or wait and count for something; there is one.
std::shared_ptr<CurlTask> CurlEngine::takeOldest() {
  const auto waiting = std::find_if(_waiting.begin(), _waiting.end(),
                                    [](const auto& entry) { return !entry.second->request().isUrgent; });
  RequestLine* line = nullptr;
  auto oldest = waiting != _waiting.end() ? waiting->first : std::numeric_limits<std::uint64_t>::max();
  for (auto& [name, server] : _servers) {
    if (server.line.empty() || server.line.oldestNumber() >= oldest) continue;
    line = &server.line;
    oldest = line->oldestNumber();
  }
  if (line != nullptr) return line->takeOldest();
  auto task = std::move(waiting->second);
  _waiting.erase(waiting);
  return task;
}

void CurlEngine::drop(CurlTask& task) {
  ++_dropped;
  task.complete(Error{kHttpErrorDomain, CURLE_OUT_OF_MEMORY,
                      task.address().host + ": dropped, because too much waits to be sent"});
}

void CurlEngine::reportDropped(bool atOnce) {
  const auto time = now();
  if (_dropped == 0 || (!atOnce && time < _mayReportDropped)) return;
  _mayReportDropped = time + kDropReportInterval;
  log::error("HttpSessionService: more than %llu bytes wait to be sent; %llu of the oldest requests were dropped",
             _maximumStandingBytes, std::exchange(_dropped, 0));
}

void CurlEngine::sleep() {
  const bool busy = !_running.empty() || !_waiting.empty();
  if (busy) _idleSince = now();
  curl_waitfd routes{_routeMonitor ? _routeMonitor->descriptor() : -1, CURL_WAIT_POLLIN, 0};
  curl_multi_poll(_multi.get(), &routes, _routeMonitor ? 1 : 0, sleepMilliseconds(), nullptr);
  if (_routeMonitor && _routeMonitor->drain()) routesHaveChanged();
  if (!busy && _mayHaveConnections && now() - _idleSince >= kConnectionLinger) {
    Guard guard(_lock);
    if (!_inbox.empty()) return;
    _routeMonitor.reset();
    _routes.reset();
    if (!forgetConnections()) _idleSince = now();
  }
}

// Without work there is one wake-up, to let connections go; then none.
int CurlEngine::sleepMilliseconds() const {
  constexpr int kForEver = std::numeric_limits<int>::max();
  auto until = SteadyTime::max();
  if (_running.empty() && _waiting.empty() && _mayHaveConnections) until = _idleSince + kConnectionLinger;
  if (_urgentWaiting > 0) {
    for (const auto& [number, task] : _waiting) until = std::min(until, task->deadline());
  }
  if (_dropped > 0) until = std::min(until, _mayReportDropped);
  if (until == SteadyTime::max()) return kForEver;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, kForEver));
}

// A fresh multi handle: connections, resolved names and buffers of the old one are given back, which stays when the
// system has nothing left for a new one. Called with the lock held, which keeps others from waking a handle that goes.
bool CurlEngine::forgetConnections() {
  _spare.clear();
  Multi multi(curl_multi_init());
  // A handle that cannot be woken is made all the same when there are no descriptors.
  if (!multi || curl_multi_wakeup(multi.get()) != CURLM_OK) return false;
  curl_multi_setopt(multi.get(), CURLMOPT_MAXCONNECTS, kMaximumIdleConnections);
  _multi = std::move(multi);
  _mayHaveConnections = false;
  _routesChanged = SteadyTime::min();
  return true;
}

/// Once: what comes later does not start.
void CurlEngine::dropEndedBulk() {
  if (!_bulkEnded || std::exchange(_bulkDropped, true)) return;
  const auto dropped = [](const std::shared_ptr<CurlTask>& task) {
    if (!task->request().isBulk) return false;
    task->complete(ended(*task));
    return true;
  };
  for (auto running = _running.begin(); running != _running.end();) {
    if (!dropped(running->second->task())) {
      ++running;
      continue;
    }
    countRunning(*running->second->task(), false);
    curl_multi_remove_handle(_multi.get(), running->first);
    giveEasyBack(Easy(running->first));
    running = _running.erase(running);
  }
  const auto isBulk = [](const CurlTask& task) { return task.request().isBulk; };
  std::erase_if(_waiting, [&](const auto& entry) {
    if (!dropped(entry.second)) return false;
    standsNoMore(*entry.second);
    return true;
  });
  for (auto& [name, server] : _servers) {
    for (const auto& [number, task] : server.line.takeIf(isBulk)) {
      standsNoMore(*task);
      dropped(task);
    }
  }
}

void CurlEngine::endAll() {
  for (auto& [easy, transfer] : _running) {
    curl_multi_remove_handle(_multi.get(), easy);
    transfer->task()->complete(ended(*transfer->task()));
    curl_easy_cleanup(easy);
  }
  _running.clear();
  for (const auto& [number, task] : std::exchange(_waiting, {})) task->complete(ended(*task));
  const auto all = [](const CurlTask&) { return true; };
  for (auto& [name, server] : _servers) {
    for (const auto& [number, task] : server.line.takeIf(all)) task->complete(ended(*task));
  }
  _servers.clear();
  reportDropped(true);
  std::vector<Command> commands;
  {
    Guard guard(_lock);
    commands.swap(_inbox);
  }
  for (const auto& command : commands) command.task->complete(ended(*command.task));
  _routeMonitor.reset();
  _spare.clear();
  Guard guard(_lock);
  _multi.reset();
}

CurlEngine::Easy CurlEngine::takeEasy() {
  if (_spare.empty()) return Easy(curl_easy_init());
  auto easy = std::move(_spare.back());
  _spare.pop_back();
  return easy;
}

void CurlEngine::giveEasyBack(Easy easy) {
  if (_spare.size() >= kMaximumSpareHandles) return;
  curl_easy_reset(easy.get());
  _spare.push_back(std::move(easy));
}

}  // namespace velk
