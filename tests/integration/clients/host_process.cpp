// A process that links the library and does what host processes do: forks, becomes another program, exits, has signal
// handlers of its own:
//   host_process [descriptors]
// Reads commands from its standard input until that ends, or until "return"; see `obey`. Writes a line for each of them
// when it is done, flushed at once, its results behind it. With "descriptors" it only lists those that it was started
// with.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <future>
#include <iostream>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "client/VelkReporting.h"
#include "tests/integration/clients/HostItself.h"

namespace {

using namespace host;
using velk::Error;
using velk::PropertyArray;
using velk::PropertyDictionary;
using velk::VelkReporting;

constexpr unsigned kPatienceSeconds = 60;
constexpr int kForkedChild = 9;

/// Ended behind the library's own exit handler, which is there only since the first client.
std::shared_ptr<VelkReporting> ofStaticStorage;

void say(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

/// What a child does with its parent's client: everything must return, and do nothing. The first thing that is wrong,
/// or null.
const char* useParentsClient(VelkReporting& client) {
  Error error;
  const auto isRefused = [&error] { return error.code == kForkedChild; };
  if (!client.sendMessageWithCategory(7, 1, PropertyDictionary{{"n", -1}}, &error) || !isRefused()) return "send";
  const PropertyDictionary message{{"ParametersCategory", 7}, {"ParametersType", 1}};
  if (client.sendMessageWithDictionary(message, &error) || !isRefused()) return "send a dictionary";
  bool called = false;
  client.startConfigurationWithCompletionHandler([&called](const auto&) { called = true; });
  client.fetchReportingStatesWithUserInfo(PropertyDictionary{{"_clientName", "x"}},
                                          [&called](auto&&) { called = true; });
  client.flushMessages();
  client.flushMessagesWithCompletion([&called](const auto&) { called = true; });
  client.updateSharedDataForKey("k", 1);
  client.updateSharedDataWithDictionary({{"k", 1}});
  client.setMessageLoggingBlock([](const auto&) {});
  client.setMessageSentDelegate({});
  client.setEndOfLifeBound(std::chrono::milliseconds(1));
  if (client.messageSentDelegate()) return "the delegate";
  if (!client.isWhitelistedEvent(7) || client.isBlacklistedEvent(7)) return "the lists";
  if (client.serverSupportsFileUpload()) return "file uploads";
  if (client.uploadFileWithURL("/etc/hostname", nullptr)) return "a file";
  if (client.uploadDataArray(PropertyArray{PropertyDictionary{{"a", 1}}}, nullptr)) return "log data";
  if (client.setDigestKey(velk::ByteData{1}, 0)) return "the digest key";
  if (client.registerPeriodicTaskForModule(1, true, true, [](auto*) {})) return "a module";
  if (!client.unregisterPeriodTaskForModule(1)) return "no module";
  client.startLogTimerWithInterval(1, 1, 7, 1);
  client.stopLogTimer();
  client.finishSession();
  if (called) return "a callback";
  // What needs no client is at the child's service, whatever its parent's threads were about.
  const auto root = VelkReporting::newHierarchyTokenFromParentToken(std::nullopt);
  if (!root || !VelkReporting::newHierarchyTokenFromParentToken(*root)) return "a hierarchy token";
  return nullptr;
}

class Host {
 public:
  /// False when it is time to return.
  bool obey(const std::string& line) {
    std::istringstream words(line);
    std::string command;
    words >> command;
    std::string result;
    if (command == "return") return false;
    if (command == "create") {
      int number = 0;
      words >> number;
      create(number);
    } else if (command == "configure") {
      result = configure();
    } else if (command == "bound") {
      int milliseconds = 0;
      words >> milliseconds;
      _client->setEndOfLifeBound(std::chrono::milliseconds(milliseconds));
    } else if (command == "send") {
      int first = 0, count = 0;
      words >> first >> count;
      result = send(first, count);
    } else if (command == "send-forever") {
      int threads = 0;
      words >> threads;
      sendForever(threads);
    } else if (command == "stop-senders") {
      stopSenders();
    } else if (command == "block-a-module") {
      tick([] {
        for (;;) pause();
      });
    } else if (command == "exit-in-a-module") {
      tick([] { std::exit(0); });
    } else if (command == "release-in-a-module") {
      tick([this] { _client.reset(); });
    } else if (command == "fill") {
      result = fill();
    } else if (command == "flush") {
      result = flush();
    } else if (command == "upload") {
      std::string path;
      words >> path;
      result = _client->uploadFileWithURL(path, nullptr) ? " taken" : " refused";
    } else if (command == "one-shot") {
      int n = 0;
      words >> n;
      result = oneShot(n);
    } else if (command == "nested") {
      result = nested();
    } else if (command == "identifier") {
      result = " " + VelkReporting::getPersistentIdentifierForDNU(true);
    } else if (command == "regenerate") {
      VelkReporting::regeneratePersistentIdentifierForDNU(true);
    } else if (command == "release") {
      _client.reset();
    } else if (command == "leave-it-to-a-static") {
      ofStaticStorage = std::move(_client);
    } else if (command == "leave-it-to-an-exit-handler") {
      std::atexit([] { ofStaticStorage.reset(); });
      ofStaticStorage = std::move(_client);
    } else if (command == "leave-it-to-an-inner-static") {
      static std::shared_ptr<VelkReporting> ofInnerStorage;  // ends before the library's own exit handler
      ofInnerStorage = std::move(_client);
    } else if (command == "exit-in-a-callback") {
      _client->flushMessagesWithCompletion([](const auto&) { std::exit(0); });
      for (;;) pause();
    } else if (command == "threads") {
      result = threadNames();
    } else if (command == "descriptors") {
      result = descriptors();
    } else if (command == "actions") {
      result = actions();
    } else if (command == "signal-itself") {
      result = signalItself();
    } else if (command == "break-error-stream") {
      breakErrorStream();
    } else if (command == "signals") {
      result = " " + std::to_string(brokenPipes) + " " + std::to_string(endedChildren);
    } else if (command == "fork") {
      result = forked();
    } else if (command == "fork-and-leave") {
      result = forkedForItself();
    } else if (command == "fork-often") {
      int times = 0;
      words >> times;
      for (int each = 0; each < times && result.empty(); ++each) result = forked();
    } else if (command == "fork-with-its-own") {
      int n = 0;
      words >> n;
      result = forkedWithItsOwn(n);
    } else if (command == "spawn-often") {
      int times = 0;
      std::string path;
      words >> times >> path;
      result = spawnOften(times, path);
    } else if (command == "become-another") {
      say(line);
      execl("/proc/self/exe", "host_process", "descriptors", nullptr);
      std::abort();
    } else if (command == "exit") {
      say(line);
      std::exit(0);
    }
    say(line + result);
    return true;
  }

 private:
  static PropertyDictionary sessionInfo(int number) {
    return {{"ComponentType", 9}, {"ClientVersion", 3}, {"SessionID", number}, {"BatchEvents", true}};
  }
  static PropertyDictionary userInfo() { return {{"_clientName", "Host"}, {"_serviceName", "process"}}; }

  void create(int number) {
    _client = VelkReporting::initWithSessionInfo(sessionInfo(number), userInfo(), {});
    if (!_client) std::exit(69);
  }

  std::string configure() {
    auto answered = std::make_shared<std::promise<bool>>();
    auto enabled = answered->get_future();
    _client->startConfigurationWithCompletionHandler(
        [answered](const auto& backends) { answered->set_value(backends.has_value()); });
    return enabled.get() ? "" : " unanswered";
  }

  std::string send(int first, int count) {
    int refused = 0;
    for (int n = first; n < first + count; ++n) {
      Error error;
      _client->sendMessageWithCategory(7, 1, PropertyDictionary{{"n", n}}, &error);
      refused += error.code != 0 ? 1 : 0;
    }
    return refused == 0 ? "" : " refused " + std::to_string(refused);
  }

  /// Until it is told to stop: of the events' own category, so that they are not counted with the others.
  void sendForever(int threads) {
    _stops = false;
    for (int number = 0; number < threads; ++number) {
      _senders.emplace_back([this, client = _client] {
        for (int round = 0; !_stops; ++round) {
          client->sendMessageWithCategory(8, 1, PropertyDictionary{{"round", round}});
          static_cast<void>(client->serverSupportsFileUpload());
          // A pace that the daemon can keep up with: each flush is a post.
          if (round % 16 == 0) std::this_thread::sleep_for(std::chrono::milliseconds(1));
          if (round % 1024 == 0) client->flushMessages();
        }
      });
    }
  }

  /// Behind the last flush of the senders comes one more event, so that the next flush has something to post.
  void stopSenders() {
    _stops = true;
    for (auto& sender : _senders) sender.join();
    _senders.clear();
    const auto isRefused = [this] {
      Error error;
      _client->sendMessageWithCategory(8, 1, PropertyDictionary{{"round", -1}}, &error);
      return error.code != 0;
    };
    while (isRefused()) std::this_thread::sleep_for(std::chrono::milliseconds(1));  // the daemon is behind
  }

  /// Calls `action` in the callback of a module. Waits until it is called, but not for its end.
  void tick(std::function<void()> action) {
    auto entered = std::make_shared<std::promise<void>>();
    auto isEntered = entered->get_future();
    auto leave = std::make_shared<std::promise<void>>();
    auto mayLeave = leave->get_future().share();
    _client->registerPeriodicTaskForModule(1, true, false, [entered, mayLeave, action = std::move(action)](auto*) {
      entered->set_value();
      mayLeave.wait();  // this object is nobody else's any more
      action();
    });
    _client->startLogTimerWithInterval(3600, 0, 9, 1);
    isEntered.get();
    leave->set_value();
  }

  /// Sends until events are refused, and ten more; how many were taken, and how many were not.
  std::string fill() {
    int taken = 0;
    int refused = 0;
    while (refused < 10) {
      Error error;
      _client->sendMessageWithCategory(7, 1, PropertyDictionary{{"n", taken + 1}}, &error);
      ++(error.code != 0 ? refused : taken);
    }
    return " " + std::to_string(taken) + " " + std::to_string(refused);
  }

  std::string flush() {
    auto answered = std::make_shared<std::promise<int>>();
    auto code = answered->get_future();
    _client->flushMessagesWithCompletion(
        [answered](const auto& error) { answered->set_value(error ? error->code : 0); });
    return " " + std::to_string(code.get());
  }

  std::string oneShot(int n) {
    auto info = sessionInfo(n);
    const bool taken =
        VelkReporting::sendOneMessageWithSessionInfo(info, userInfo(), 7, 1, PropertyDictionary{{"n", n}});
    return taken ? "" : " refused";
  }

  /// Callbacks that wait for the answers to calls that they make.
  std::string nested() {
    auto answered = std::make_shared<std::promise<void>>();
    auto done = answered->get_future();
    auto remaining = std::make_shared<std::atomic<int>>(8);
    for (int number = 0; number < 8; ++number) {
      _client->flushMessagesWithCompletion([this, answered, remaining](const auto&) {
        flush();
        flush();
        if (--*remaining == 0) answered->set_value();
      });
    }
    done.get();
    return "";
  }

  /// A child that uses the client and exits as programs do. Nothing, or what went wrong.
  std::string forked() {
    std::fflush(stdout);
    const pid_t child = fork();
    if (child < 0) return std::string(" fork: ") + std::strerror(errno);
    if (child == 0) {
      alarm(kPatienceSeconds);
      const char* const wrong = useParentsClient(*_client);
      if (wrong != nullptr) {
        static_cast<void>(!write(STDERR_FILENO, wrong, std::strlen(wrong)));
        _exit(1);
      }
      _client.reset();
      std::exit(0);  // all exit handlers of the parent
    }
    return waitFor(child);
  }

  /// A child that does nothing until somebody ends it: its number.
  static std::string forkedForItself() {
    std::fflush(stdout);
    const pid_t child = fork();
    if (child < 0) return std::string(" fork: ") + std::strerror(errno);
    if (child != 0) return " " + std::to_string(child);
    alarm(kPatienceSeconds);
    for (;;) pause();
  }

  /// Nothing, or how the child failed.
  static std::string waitFor(pid_t child) {
    int status = -1;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    if (WIFSIGNALED(status)) return " ended by signal " + std::to_string(WTERMSIG(status));
    return WEXITSTATUS(status) == 0 ? "" : " status " + std::to_string(WEXITSTATUS(status));
  }

  /// A child that makes a client, sends an event, has a child that finds both clients to be others', and exits.
  std::string forkedWithItsOwn(int n) {
    std::fflush(stdout);
    const pid_t child = fork();
    if (child < 0) return std::string(" fork: ") + std::strerror(errno);
    if (child != 0) return waitFor(child);
    alarm(kPatienceSeconds);
    const auto parents = std::move(_client);
    create(n);
    if (!configure().empty() || !send(n, 1).empty()) _exit(1);
    const pid_t grandchild = fork();
    if (grandchild == 0) {
      alarm(kPatienceSeconds);
      if (useParentsClient(*parents) != nullptr || useParentsClient(*_client) != nullptr) _exit(2);
      std::exit(0);
    }
    if (grandchild < 0 || !waitFor(grandchild).empty()) _exit(3);
    std::exit(0);
  }

  /// Other programs, started while a thread has the library open and close what it can. Each tells what it inherited.
  static std::string spawnOften(int times, const std::string& path) {
    std::atomic<bool> stops{false};
    std::thread churning([&] {
      while (!stops) {
        const auto client = VelkReporting::initWithSessionInfo(sessionInfo(99), userInfo(), {});
        client->setEndOfLifeBound(std::chrono::milliseconds(0));
        client->uploadFileWithURL(path, nullptr);
        VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(98), userInfo(), 8, 1, std::nullopt);
      }
    });
    std::string result;
    for (int each = 0; each < times && result.empty(); ++each) {
      std::fflush(stdout);
      const pid_t child = fork();
      if (child == 0) {
        execl("/proc/self/exe", "host_process", "descriptors", nullptr);
        _exit(127);
      }
      result = child < 0 ? " fork failed" : waitFor(child);
    }
    stops = true;
    churning.join();
    return result;
  }

  std::shared_ptr<VelkReporting> _client;
  std::atomic<bool> _stops{false};
  std::vector<std::thread> _senders;
};

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && std::string(argv[1]) == "descriptors") {
    say("started with" + descriptors());
    return 0;
  }
  handleSignals();
  say("started" + threadNames());
  // Of no storage that ends with `exit`: a process that exits has not released it.
  auto* const host = new Host;
  for (std::string line; std::getline(std::cin, line);) {
    if (!host->obey(line)) return 0;
  }
  return 0;
}
