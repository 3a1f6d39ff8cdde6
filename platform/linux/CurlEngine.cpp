#include "platform/linux/CurlEngine.h"

#include <algorithm>
#include <limits>
#include <mutex>

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

SteadyTime now() { return std::chrono::steady_clock::now(); }

Error ended(const CurlTask& task) {
  return {kHttpErrorDomain, CURLE_ABORTED_BY_CALLBACK, task.address().host + ": the HTTP session service has ended"};
}

Error outOfMemory(const CurlTask& task) {
  return {kHttpErrorDomain, CURLE_OUT_OF_MEMORY, task.address().host + ": the request could not be set up"};
}

/// The families over which a request that must not use a mobile network may leave; nothing when there are none.
std::optional<long> familiesWithoutMobile() {
  const auto routes = defaultRoutes();
  const bool mobile4 = routes.ipv4 && isMobileInterface(*routes.ipv4);
  const bool mobile6 = routes.ipv6 && isMobileInterface(*routes.ipv6);
  if (!mobile4 && !mobile6) return CURL_IPRESOLVE_WHATEVER;
  if (routes.ipv4 && !mobile4) return CURL_IPRESOLVE_V4;
  if (routes.ipv6 && !mobile6) return CURL_IPRESOLVE_V6;
  return std::nullopt;
}

}  // namespace

CurlEngine::CurlEngine(HttpTrust trust) : _trust(std::move(trust)) {}

CurlEngine::~CurlEngine() { stop(); }

void CurlEngine::submit(std::shared_ptr<CurlTask> task) {
  if (!handOver({task, true})) task->complete(ended(*task));
}

// A task whose engine has gone was completed by it.
void CurlEngine::unpause(std::shared_ptr<CurlTask> task) { (void)handOver({std::move(task), false}); }

void CurlEngine::endBulk() {
  Guard guard(_lock);
  _bulkEnded = true;
  if (_started && !_stopping) curl_multi_wakeup(_multi.get());
}

bool CurlEngine::handOver(Command command) {
  Guard guard(_lock);
  if (_stopping || (!_started && !startThreadLocked())) return false;
  _inbox.push_back(std::move(command));
  curl_multi_wakeup(_multi.get());
  return true;
}

bool CurlEngine::startThreadLocked() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
  forgetConnections();
  if (!_multi) return false;
  auto thread = startThread("http", [this] { run(); });
  if (!thread) return false;
  _thread = std::move(*thread);
  _started = true;
  return true;
}

void CurlEngine::stop() {
  {
    Guard guard(_lock);
    _stopping = true;
    if (!_started) return;
    curl_multi_wakeup(_multi.get());
  }
  if (_thread.joinable()) _thread.join();
}

void CurlEngine::run() {
  std::vector<Command> commands;
  while (takeCommands(commands)) {
    dropEndedBulk();
    for (auto& command : commands) {
      if (command.isStart) {
        start(std::move(command.task));
      } else {
        resumePaused(*command.task);
      }
    }
    commands.clear();
    int count = 0;
    curl_multi_perform(_multi.get(), &count);
    collectFinished();
    serveLines();
    expireWaiting();
    sleep();
  }
  endAll();
}

// False when the engine is to stop.
bool CurlEngine::takeCommands(std::vector<Command>& into) {
  Guard guard(_lock);
  into.swap(_inbox);
  if (!_stopping) return true;
  _inbox.insert(_inbox.begin(), std::make_move_iterator(into.begin()), std::make_move_iterator(into.end()));
  into.clear();
  return false;
}

void CurlEngine::start(std::shared_ptr<CurlTask> task) {
  if (_bulkDropped && task->request().isBulk) return task->complete(ended(*task));
  _mayHaveConnections = true;
  _idleSince = now();
  enter(std::move(task));
}

void CurlEngine::enter(std::shared_ptr<CurlTask> task) {
  auto& server = serverOf(*task);
  if (server.line.empty() && hasRoom(server)) return attempt(std::move(task));
  _lineExpires = std::min(_lineExpires, task->deadline());
  server.line.push_back({++_lastInLine, std::move(task)});
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
  return server.isBulk ? _bulkRunning < kMaximumBulkRequests : _running.size() - _bulkRunning < kMaximumRequests;
}

/// Lets those in line go on where others have finished, and forgets servers that nobody talks to.
void CurlEngine::serveLines() {
  if (_lineExpires <= now()) expireLines();
  while (auto* server = nextToServe()) {
    auto task = std::move(server->line.front().task);
    server->line.pop_front();
    attempt(std::move(task));
  }
  std::erase_if(_servers, [](const auto& entry) { return entry.second.running == 0 && entry.second.line.empty(); });
}

/// Of those servers for which there is room the one for which somebody has waited for longest.
CurlEngine::Server* CurlEngine::nextToServe() {
  Server* next = nullptr;
  for (auto& [name, server] : _servers) {
    if (server.line.empty() || !hasRoom(server)) continue;
    if (next == nullptr || server.line.front().number < next->line.front().number) next = &server;
  }
  return next;
}

void CurlEngine::expireLines() {
  const auto time = now();
  _lineExpires = SteadyTime::max();
  for (auto& [name, server] : _servers) {
    std::erase_if(server.line, [&](const InLine& inLine) {
      const auto& task = inLine.task;
      if (task->deadline() > time) {
        _lineExpires = std::min(_lineExpires, task->deadline());
        return false;
      }
      task->complete(Error{kHttpErrorDomain, CURLE_OPERATION_TIMEDOUT,
                           task->address().host + ": too many requests before it within the request's time"});
      return true;
    });
  }
}

void CurlEngine::attempt(std::shared_ptr<CurlTask> task) {
  long families = CURL_IPRESOLVE_WHATEVER;
  if (!task->request().allowsCellularAccess && !task->address().isLoopback()) {
    const auto allowed = familiesWithoutMobile();
    if (!allowed) {
      task->complete(Error{kHttpErrorDomain, CURLE_COULDNT_CONNECT,
                           task->address().host + ": the only way out is a mobile network, which may not be used"});
      return;
    }
    families = *allowed;
  }
  auto easy = takeEasy();
  auto transfer = std::make_unique<CurlTransfer>(task, easy.get());
  if (!easy || !transfer->configure(_trust, now()) ||
      curl_easy_setopt(easy.get(), CURLOPT_IPRESOLVE, families) != CURLE_OK ||
      curl_multi_add_handle(_multi.get(), easy.get()) != CURLM_OK) {
    task->complete(outOfMemory(*task));
    return;
  }
  countRunning(*task, true);
  CURL* const key = easy.release();
  _running.emplace(key, std::move(transfer));
}

void CurlEngine::countRunning(const CurlTask& task, bool starts) {
  auto& server = serverOf(task);
  const auto count = [starts](std::size_t& number) { starts ? ++number : --number; };
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

// The first attempt that finds no network opens the monitor and is repeated at once, so that a route that came in
// between is not missed.
void CurlEngine::finished(CURL* handle, CURLcode code) {
  Easy easy(handle);
  const auto found = _running.find(handle);
  const auto transfer = std::move(found->second);
  _running.erase(found);
  const auto task = transfer->task();
  countRunning(*task, false);
  const bool waits = task->configuration().waitsForConnectivity && transfer->failedForLackOfNetwork(code);
  const auto error = transfer->error(code);
  curl_multi_remove_handle(_multi.get(), handle);
  giveEasyBack(std::move(easy));
  if (!waits) {
    task->complete(error);
  } else if (_routes) {
    _waiting.push_back(task);
  } else {
    _routes = std::make_unique<RouteMonitor>();
    enter(task);
  }
}

void CurlEngine::retryWaiting() {
  for (auto& task : std::exchange(_waiting, {})) enter(std::move(task));
}

void CurlEngine::expireWaiting() {
  const auto time = now();
  const auto expired = std::stable_partition(_waiting.begin(), _waiting.end(),
                                             [&](const auto& task) { return task->deadline() > time; });
  for (auto task = expired; task != _waiting.end(); ++task) {
    (*task)->complete(Error{kHttpErrorDomain, CURLE_OPERATION_TIMEDOUT,
                            (*task)->address().host + ": no network within the request's time"});
  }
  _waiting.erase(expired, _waiting.end());
  if (_waiting.empty() && _running.empty()) _routes.reset();
}

void CurlEngine::sleep() {
  const bool busy = !_running.empty() || !_waiting.empty();
  if (busy) _idleSince = now();
  curl_waitfd routes{_routes ? _routes->descriptor() : -1, CURL_WAIT_POLLIN, 0};
  const bool watches = routes.fd >= 0;
  curl_multi_poll(_multi.get(), &routes, watches ? 1 : 0, sleepMilliseconds(), nullptr);
  if (watches && _routes->drain()) retryWaiting();
  if (!busy && _mayHaveConnections && now() - _idleSince >= kConnectionLinger) {
    Guard guard(_lock);
    if (_inbox.empty()) forgetConnections();
  }
}

// Without work there is one wake-up, to let connections go; then none.
int CurlEngine::sleepMilliseconds() const {
  constexpr int kForEver = std::numeric_limits<int>::max();
  auto until = SteadyTime::max();
  if (_running.empty() && _waiting.empty() && _mayHaveConnections) until = _idleSince + kConnectionLinger;
  for (const auto& task : _waiting) until = std::min(until, task->deadline());
  until = std::min(until, _lineExpires);
  if (until == SteadyTime::max()) return kForEver;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, kForEver));
}

// A fresh multi handle: connections, resolved names and buffers of the old one are given back. Called with the lock
// held, which keeps others from waking a handle that goes.
void CurlEngine::forgetConnections() {
  _spare.clear();
  _multi.reset(curl_multi_init());
  _mayHaveConnections = false;
  if (!_multi) return;
  curl_multi_setopt(_multi.get(), CURLMOPT_MAXCONNECTS, kMaximumIdleConnections);
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
  std::erase_if(_waiting, dropped);
  for (auto& [name, server] : _servers) {
    std::erase_if(server.line, [&](const InLine& inLine) { return dropped(inLine.task); });
  }
}

void CurlEngine::endAll() {
  for (auto& [easy, transfer] : _running) {
    curl_multi_remove_handle(_multi.get(), easy);
    transfer->task()->complete(ended(*transfer->task()));
    curl_easy_cleanup(easy);
  }
  _running.clear();
  for (const auto& task : std::exchange(_waiting, {})) task->complete(ended(*task));
  for (const auto& [name, server] : std::exchange(_servers, {})) {
    for (const auto& inLine : server.line) inLine.task->complete(ended(*inLine.task));
  }
  std::vector<Command> commands;
  {
    Guard guard(_lock);
    commands.swap(_inbox);
  }
  for (const auto& command : commands) command.task->complete(ended(*command.task));
  _routes.reset();
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
