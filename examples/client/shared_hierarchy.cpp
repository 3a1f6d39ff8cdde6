// A parent process sees the events of its child: shared_hierarchy [CLIENT-TYPE]
//
// The parent makes a token, opens a session with it and starts a child; the child makes a token below the parent's,
// opens a session of its own and reports an event. The daemon links the two: the parent is handed the child's event,
// whether or not a backend takes it.

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velkreporting/VelkReporting.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <memory>
#include <semaphore>
#include <string>

using velk::PropertyDictionary;
using velk::VelkReporting;

namespace {

constexpr auto kPatience = std::chrono::seconds(30);

void complain(const char* text) { std::fprintf(stderr, "shared_hierarchy: %s\n", text); }

/// A session that the daemon has configured, or none.
std::shared_ptr<VelkReporting> openSession(int type, int number, const PropertyDictionary& token,
                                           velk::VelkReportingAggregationBlock block) {
  auto client = VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", type}, {"SessionID", number}, {"HierarchyToken", token}},
      PropertyDictionary{{"_clientName", "Example"}}, {}, std::move(block));
  if (!client) {
    complain("the session info was refused");
    return nullptr;
  }
  const auto configured = std::make_shared<std::promise<bool>>();
  auto answer = configured->get_future();
  client->startConfigurationWithCompletionHandler(
      [configured](const auto& backends) { configured->set_value(backends.has_value()); });
  if (answer.wait_for(kPatience) == std::future_status::ready && answer.get()) return client;
  complain("the session is not configured; is velkreportingd running?");
  return nullptr;
}

/// Its token stands one level below the one that it was given.
int runChild(int type, const char* parentToken) {
  const auto token =
      VelkReporting::newHierarchyTokenFromParentToken(PropertyDictionary{{"token", parentToken}, {"level", 0}});
  const auto client = openSession(type, 8, *token, nullptr);
  if (!client) return EXIT_FAILURE;
  velk::Error error;
  client->sendMessageWithCategory(105, 1, PropertyDictionary{{"from", "the child"}}, &error);
  if (error.code != 0) complain(error.description.c_str());
  return error.code == 0 ? EXIT_SUCCESS : EXIT_FAILURE;  // the last reference sends what is queued
}

int runParent(int type) {
  const auto token = VelkReporting::newHierarchyTokenFromParentToken(std::nullopt);
  const auto aggregated = std::make_shared<std::binary_semaphore>(0);
  const auto client = openSession(
      type, 7, *token,
      [aggregated](const auto& from, double, std::uint16_t category, std::uint16_t eventType, const auto& payload) {
        if (!from || !payload || payload->string("from") == nullptr) return;  // the daemon's own, and the last call
        std::printf("event %u/%u of session %lld: from %s\n", category, eventType,
                    static_cast<long long>(velk::integerValue(from->find("SessionID"))),
                    payload->string("from")->c_str());
        std::fflush(stdout);
        aggregated->release();
      });
  if (!client) return EXIT_FAILURE;

  // A new program: a process that was merely forked cannot report through what its parent made.
  std::string program = "/proc/self/exe";
  std::string typeText = std::to_string(type);
  std::string tokenText = *token->string("token");
  char* arguments[] = {program.data(), typeText.data(), tokenText.data(), nullptr};
  pid_t child = 0;
  int status = 0;
  if (posix_spawn(&child, program.c_str(), nullptr, nullptr, arguments, environ) != 0 ||
      waitpid(child, &status, 0) != child || status != 0) {
    complain("the child failed");
    return EXIT_FAILURE;
  }
  if (aggregated->try_acquire_for(kPatience)) return EXIT_SUCCESS;
  complain("the child's event did not come");
  return EXIT_FAILURE;
}

}  // namespace

int main(int argumentCount, char** arguments) {
  const int type = argumentCount > 1 ? std::atoi(arguments[1]) : 9;
  return argumentCount > 2 ? runChild(type, arguments[2]) : runParent(type);
}
