// Reports one event and waits until the daemon has posted it: report_event [CLIENT-TYPE]
//
//   c++ -std=c++20 report_event.cpp $(pkg-config --cflags --libs velkreporting)

#include <velkreporting/VelkReporting.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <memory>

using velk::PropertyDictionary;

int main(int argumentCount, char** arguments) {
  const auto client = velk::VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", argumentCount > 1 ? std::atoi(arguments[1]) : 9},
                         {"ClientVersion", 1},
                         {"SessionID", 2},
                         {"BatchEvents", true}},
      PropertyDictionary{{"_clientName", "Example"}, {"_serviceName", "report_event"}}, {});
  if (!client) {
    std::fprintf(stderr, "report_event: the session info was refused\n");
    return EXIT_FAILURE;
  }
  // Callbacks run on other threads and may come late: what they use, they own.
  const auto configured = std::make_shared<std::promise<bool>>();
  auto enabled = configured->get_future();
  client->startConfigurationWithCompletionHandler(
      [configured](const auto& backends) { configured->set_value(backends && !backends->empty()); });
  bool succeeded = enabled.wait_for(std::chrono::seconds(30)) == std::future_status::ready && enabled.get();
  if (!succeeded) std::fprintf(stderr, "report_event: no backend is enabled; is velkreportingd running?\n");

  velk::Error error;
  client->sendMessageWithCategory(101, 1, PropertyDictionary{{"answer", 42}, {"language", "C++"}}, &error);
  if (error.code != 0) std::fprintf(stderr, "report_event: %s\n", error.description.c_str());

  const auto flushed = std::make_shared<std::promise<bool>>();
  auto posted = flushed->get_future();
  client->flushMessagesWithCompletion([flushed](const auto& reason) {
    if (reason) std::fprintf(stderr, "report_event: %s\n", reason->description.c_str());
    flushed->set_value(!reason);
  });
  succeeded = posted.wait_for(std::chrono::seconds(30)) == std::future_status::ready && posted.get() && succeeded;
  return succeeded && error.code == 0 ? EXIT_SUCCESS : EXIT_FAILURE;
}
