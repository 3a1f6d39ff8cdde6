// The one thread on which the process's HTTP requests run: libcurl's multi interface behind an inbox.
// Used by the sessions and tasks of the HTTP session service, which share it.
#pragma once

#include <curl/curl.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/Clock.h"
#include "platform/HttpSession.h"
#include "platform/Lock.h"
#include "platform/linux/RouteMonitor.h"

namespace velk {

class CurlTask;
class CurlTransfer;

/// The thread is started by the first task and sleeps in one system call while there is nothing to do; connections
/// that nobody used for a minute are closed. It runs no delegates and waits for nobody. `submit` and `unpause` may
/// be called from any thread and never block.
class CurlEngine {
 public:
  explicit CurlEngine(HttpTrust trust);
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

  struct InLine {
    /// The smaller, the longer it has waited.
    std::uint64_t number;
    std::shared_ptr<CurlTask> task;
  };
  /// What goes to one server: so much is sent at once, the rest stands in line.
  struct Server {
    bool isBulk = false;
    std::size_t running = 0;
    std::deque<InLine> line;
  };

  /// Hands a command to the thread; gives it back when the thread is (or cannot be) there no more.
  [[nodiscard]] bool handOver(Command command);
  bool startThreadLocked() VELK_REQUIRES(_lock);

  // On the thread.
  void run();
  [[nodiscard]] bool takeCommands(std::vector<Command>& into);
  void start(std::shared_ptr<CurlTask> task);
  void enter(std::shared_ptr<CurlTask> task);
  [[nodiscard]] Server& serverOf(const CurlTask& task);
  [[nodiscard]] bool hasRoom(const Server& server) const;
  void serveLines();
  [[nodiscard]] Server* nextToServe();
  void expireLines();
  void attempt(std::shared_ptr<CurlTask> task);
  void countRunning(const CurlTask& task, bool starts);
  void resumePaused(const CurlTask& task);
  void collectFinished();
  void finished(CURL* easy, CURLcode code);
  void retryWaiting();
  void expireWaiting();
  void dropEndedBulk();
  void endAll();
  void sleep();
  [[nodiscard]] int sleepMilliseconds() const;
  void forgetConnections();
  [[nodiscard]] Easy takeEasy();
  void giveEasyBack(Easy easy);

  // Constant after construction.
  const HttpTrust _trust;

  // The thread's own.
  std::unordered_map<CURL*, std::unique_ptr<CurlTransfer>> _running;
  std::size_t _bulkRunning = 0;
  /// By the server's name, for bulk with a word behind it. When the first of those in line may have to leave it.
  std::unordered_map<std::string, Server> _servers;
  std::uint64_t _lastInLine = 0;
  SteadyTime _lineExpires = SteadyTime::max();
  /// Tasks that wait for a network; while there are any, the monitor is open.
  std::vector<std::shared_ptr<CurlTask>> _waiting;
  std::unique_ptr<RouteMonitor> _routes;
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
  bool _started VELK_GUARDED_BY(_lock) = false;
  bool _stopping VELK_GUARDED_BY(_lock) = false;
  std::thread _thread;
};

}  // namespace velk
