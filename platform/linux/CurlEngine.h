// The one thread on which the process's HTTP requests run: libcurl's multi interface behind an inbox.
// Used by the sessions and tasks of the HTTP session service, which share it.
#pragma once

#include <curl/curl.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/Clock.h"
#include "platform/HttpSession.h"
#include "platform/Lock.h"
#include "platform/linux/RequestLine.h"
#include "platform/linux/RouteLookup.h"
#include "platform/linux/RouteMonitor.h"

namespace velk {

class CurlTask;
class CurlTransfer;

/// The thread is started by the first task and sleeps in one system call while there is nothing to do; connections
/// that nobody used for a minute are closed. It runs no delegates and waits for nobody. `submit` and `unpause` may
/// be called from any thread and never block.
///
/// A task stands in its server's line, then an attempt is made, then it is complete. One that finds no route that it
/// may use waits for a change of the routes and goes back to its place in the line. What stands in lines or waits is
/// bounded in bytes for the whole engine; beyond the bound the oldest task ends with an error.
class CurlEngine {
 public:
  struct Options {
    RouteLookup::Look look = defaultRoutes;
    std::size_t maximumStandingBytes = std::size_t{16} * 1024 * 1024;
  };

  explicit CurlEngine(HttpTrust trust) : CurlEngine(std::move(trust), Options()) {}
  CurlEngine(HttpTrust trust, Options options);
  ~CurlEngine();
  CurlEngine(const CurlEngine&) = delete;
  CurlEngine& operator=(const CurlEngine&) = delete;

  /// Starts the task; its delegate hears how it ended, whatever happens.
  void submit(std::shared_ptr<CurlTask> task);
  /// The task's delegate has caught up with the data: the transfer may go on.
  void unpause(std::shared_ptr<CurlTask> task);
  /// Ends every bulk task with an error, those that are submitted later as well.
  void endBulk();
  /// Ends every task with an error, and the thread. Blocks until it is gone; idempotent; not on the thread itself.
  void stop();

 private:
  struct Command {
    std::shared_ptr<CurlTask> task;
    bool isStart;
  };
  struct EasyFreer {
    void operator()(CURL* easy) const { curl_easy_cleanup(easy); }
  };
  struct MultiFreer {
    void operator()(CURLM* multi) const { curl_multi_cleanup(multi); }
  };
  using Easy = std::unique_ptr<CURL, EasyFreer>;
  using Multi = std::unique_ptr<CURLM, MultiFreer>;

  /// What goes to one server: so much is sent at once, the rest stands in line.
  struct Server {
    bool isBulk = false;
    std::size_t running = 0;
    RequestLine line;
  };
  using Tasks = RequestLine::Tasks;
  struct RoutesAnswer {
    std::uint64_t generation = 0;
    DefaultRoutes routes;
  };

  /// Hands a command to the thread. The error says why that failed: the thread is there no more, or could not be
  /// started, which the next command tries again.
  [[nodiscard]] std::optional<Error> handOver(Command command);
  /// Why there is none; nothing on success.
  [[nodiscard]] std::optional<std::string> startThreadLocked() VELK_REQUIRES(_lock);
  void routesWereLookedUp(std::uint64_t generation, const DefaultRoutes& routes);

  // On the thread.
  void run();
  [[nodiscard]] bool takeCommands(std::vector<Command>& into, std::optional<RoutesAnswer>& answer);
  void start(std::shared_ptr<CurlTask> task);
  void enter(std::shared_ptr<CurlTask> task);
  [[nodiscard]] Server& serverOf(const CurlTask& task);
  [[nodiscard]] bool hasRoom(const Server& server) const;
  void serveLines();
  [[nodiscard]] Server* nextToServe();
  void attempt(const std::shared_ptr<CurlTask>& task);
  void transfer(const std::shared_ptr<CurlTask>& task, long families);
  [[nodiscard]] bool avoidOldConnections(CURL* easy) const;
  void countRunning(const CurlTask& task, bool starts);
  void resumePaused(const CurlTask& task);
  void collectFinished();
  void finished(CURL* easy, CURLcode code);

  // Routes.
  void listenForRoutes();
  void routesHaveChanged();
  void askForRoutes();
  void useLookup(const RoutesAnswer& answer);
  void judgeFailure(const std::shared_ptr<CurlTask>& task);
  void lacksRoute(const std::shared_ptr<CurlTask>& task, Error error);
  void waitForRoute(const std::shared_ptr<CurlTask>& task);
  void waitForLookup(const std::shared_ptr<CurlTask>& task);
  void expireWaiting();

  // What stands in lines or waits.
  void putAside(const std::shared_ptr<CurlTask>& task);
  [[nodiscard]] Tasks takeWaiting(bool awaitsLookup);
  [[nodiscard]] bool mayStand(CurlTask& task);
  void stands(const CurlTask& task);
  void standsNoMore(const CurlTask& task);
  [[nodiscard]] std::shared_ptr<CurlTask> takeOldest();
  void drop(CurlTask& task);
  void reportDropped(bool atOnce);

  void dropEndedBulk();
  void endAll();
  void sleep();
  [[nodiscard]] int sleepMilliseconds() const;
  [[nodiscard]] bool forgetConnections();
  [[nodiscard]] Easy takeEasy();
  void giveEasyBack(Easy easy);

  // Constant after construction.
  const HttpTrust _trust;
  const std::size_t _maximumStandingBytes;

  // The thread's own.
  std::unordered_map<CURL*, std::unique_ptr<CurlTransfer>> _running;
  std::size_t _bulkRunning = 0;
  std::size_t _urgentRunning = 0;
  /// By the server's name, for bulk with a word behind it.
  std::unordered_map<std::string, Server> _servers;
  std::uint64_t _lastNumber = 0;
  /// Tasks that wait for a route, or for a look-up of the routes.
  Tasks _waiting;
  std::size_t _urgentWaiting = 0;
  std::size_t _standingBytes = 0;
  std::size_t _dropped = 0;
  SteadyTime _mayReportDropped = SteadyTime::min();
  /// Open while there are requests, so that no change is missed between an attempt and its failure.
  std::unique_ptr<RouteMonitor> _routeMonitor;
  /// Counts the changes, and the times when some may have been missed.
  std::uint64_t _routeGeneration = 0;
  /// The routes of the present generation, once they have been looked up.
  std::optional<DefaultRoutes> _routes;
  /// The generation of the question that is being answered.
  std::optional<std::uint64_t> _routesAsked;
  SteadyTime _routesChanged = SteadyTime::min();
  std::vector<Easy> _spare;
  bool _mayHaveConnections = false;
  bool _bulkDropped = false;
  SteadyTime _idleSince;

  // Self-synchronised.
  std::atomic<bool> _bulkEnded{false};
  // Guarded by _lock. The multi handle changes on the thread alone, which therefore reads it without the lock.
  Lock _lock;
  Multi _multi;
  std::vector<Command> _inbox VELK_GUARDED_BY(_lock);
  std::optional<RoutesAnswer> _routesAnswer VELK_GUARDED_BY(_lock);
  bool _started VELK_GUARDED_BY(_lock) = false;
  bool _stopping VELK_GUARDED_BY(_lock) = false;
  std::thread _thread;
  // Last: its thread uses what stands above.
  RouteLookup _lookup;
};

}  // namespace velk
