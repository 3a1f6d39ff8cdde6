// Reports this machine's load, memory, disk and network counters through four sessions of three client types, until
// it is told to stop (SIGINT, SIGTERM) or --seconds have passed. Ends with a line of JSON: how many events it sent.

#include <signal.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "client/VelkReporting.h"
#include "examples/MachineFacts.h"

namespace {

using velk::PropertyDictionary;
using velk::VelkReporting;

struct Source {
  int clientType;
  const char* service;
  std::uint16_t category;
  std::function<PropertyDictionary()> facts;
  std::shared_ptr<VelkReporting> client;
};

std::vector<Source> makeSources() {
  return {{28, "load", 101, velk::examples::loadFacts, nullptr},
          {28, "memory", 102, velk::examples::memoryFacts, nullptr},
          {15, "disk", 103, velk::examples::diskFacts, nullptr},
          {18, "network", 104, velk::examples::networkFacts, nullptr}};
}

bool open(Source& source, std::uint32_t sessionNumber) {
  source.client = VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", source.clientType},
                         {"ClientVersion", 1},
                         {"SessionID", sessionNumber},
                         {"BatchEvents", true}},
      PropertyDictionary{{"_clientName", "Machine"}, {"_serviceName", source.service}}, {});
  if (!source.client) return false;
  auto configured = std::make_shared<std::promise<std::size_t>>();
  auto enabled = configured->get_future();
  source.client->startConfigurationWithCompletionHandler(
      [configured](const auto& backends) { configured->set_value(backends ? backends->size() : 0); });
  const bool answered = enabled.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  const std::size_t backends = answered ? enabled.get() : 0;
  if (backends == 0) {
    std::fprintf(stderr,
                 "report_machine: no backend is enabled for \"%s\": is velkreportingd running, and has it a "
                 "storebag for client type %d?\n",
                 source.service, source.clientType);
  }
  return backends != 0;
}

void flush(VelkReporting& client) {
  auto flushed = std::make_shared<std::promise<void>>();
  auto done = flushed->get_future();
  client.flushMessagesWithCompletion([flushed](const auto&) { flushed->set_value(); });
  done.wait_for(std::chrono::seconds(10));
}

bool waitedWithoutSignal(const sigset_t& signals, std::chrono::milliseconds time) {
  const timespec wait{time.count() / 1000, (time.count() % 1000) * 1'000'000};
  return sigtimedwait(&signals, nullptr, &wait) < 0;
}

}  // namespace

int main(int argumentCount, char** arguments) {
  double seconds = 0;
  for (int at = 1; at + 1 < argumentCount; at += 2) {
    if (std::strcmp(arguments[at], "--seconds") == 0) seconds = std::atof(arguments[at + 1]);
  }
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);

  auto sources = makeSources();
  std::uint32_t sessionNumber = 1;
  for (auto& source : sources) {
    if (!open(source, sessionNumber++)) return 69;
  }
  std::size_t sent = 0;
  const auto begun = std::chrono::steady_clock::now();
  const auto isOver = [&] {
    return seconds > 0 && std::chrono::steady_clock::now() - begun > std::chrono::duration<double>(seconds);
  };
  do {
    for (auto& source : sources) {
      if (source.client->sendMessageWithDictionary({{"ParametersCategory", source.category},
                                                    {"ParametersType", 1},
                                                    {"ParametersPayload", source.facts()},
                                                    {"ParametersFlag", 0}})) {
        ++sent;
      }
    }
  } while (waitedWithoutSignal(signals, std::chrono::milliseconds(500)) && !isOver());

  for (auto& source : sources) {
    flush(*source.client);
    source.client->finishSession();
    source.client.reset();
  }
  std::printf("{\"sent\":%zu}\n", sent);
  return 0;
}
