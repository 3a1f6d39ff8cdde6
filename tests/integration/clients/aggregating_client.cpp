// A process that reports through the installed library and tells what its aggregation block hears:
//   aggregating_client CLIENT-TYPE NUMBER TOKEN LEVEL SERVICE none|print|throw
// Reads "send CATEGORY TYPE N" and "flush" from its standard input until that ends; writes a line each, flushed at
// once: "ready", "flushed", "event NUMBER CATEGORY TYPE N CLIENT SERVICE" ("-" for what is absent), "end", "throwing".
#include <cstdio>
#include <cstdlib>
#include <future>
#include <iostream>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>

#include "client/VelkReporting.h"

namespace {

using velk::PropertyDictionary;
using velk::VelkReporting;

void say(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

std::string number(const std::optional<PropertyDictionary>& dictionary, const char* key) {
  const auto* value = dictionary ? dictionary->find(key) : nullptr;
  return value != nullptr ? std::to_string(velk::integerValue(value)) : "-";
}

std::string text(const std::optional<PropertyDictionary>& dictionary, const char* key) {
  const auto* value = dictionary ? dictionary->string(key) : nullptr;
  return value != nullptr ? *value : "-";
}

void hear(const std::optional<PropertyDictionary>& client, double timestamp, std::uint16_t category, std::uint16_t type,
          const std::optional<PropertyDictionary>& payload) {
  if (!client && !payload && timestamp == 0 && category == 0 && type == 0) return say("end");
  say("event " + number(client, "SessionID") + " " + std::to_string(category) + " " + std::to_string(type) + " " +
      number(payload, "n") + " " + text(payload, "_clientName") + " " + text(payload, "_serviceName"));
}

velk::VelkReportingAggregationBlock blockNamed(const std::string& name) {
  if (name == "none") return nullptr;
  if (name == "print") return hear;
  return [](auto&&...) {
    say("throwing");
    throw std::runtime_error("the client's own mistake");
  };
}

bool configure(VelkReporting& client) {
  auto answered = std::make_shared<std::promise<bool>>();
  auto enabled = answered->get_future();
  client.startConfigurationWithCompletionHandler(
      [answered](const auto& backends) { answered->set_value(backends.has_value()); });
  return enabled.get();
}

void flush(VelkReporting& client) {
  auto answered = std::make_shared<std::promise<void>>();
  auto done = answered->get_future();
  client.flushMessagesWithCompletion([answered](const auto&) { answered->set_value(); });
  done.get();
}

void obey(VelkReporting& client, const std::string& line) {
  std::istringstream words(line);
  std::string command;
  unsigned category = 0;
  unsigned type = 0;
  std::int64_t n = 0;
  if (words >> command && command == "flush") {
    flush(client);
    say("flushed");
  } else if (command == "send" && words >> category >> type >> n) {
    client.sendMessageWithCategory(static_cast<std::uint16_t>(category), static_cast<std::uint16_t>(type),
                                   PropertyDictionary{{"n", n}});
  } else {
    say("what is \"" + line + "\"?");
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 7) return 64;
  const PropertyDictionary token{{"token", argv[3]}, {"level", std::atoi(argv[4])}};
  const PropertyDictionary sessionInfo{{"ComponentType", std::atoi(argv[1])},
                                       {"ClientVersion", 3},
                                       {"SessionID", std::atoi(argv[2])},
                                       {"HierarchyToken", token}};
  auto client = VelkReporting::initWithSessionInfo(
      sessionInfo, PropertyDictionary{{"_clientName", "Library"}, {"_serviceName", argv[5]}}, {}, blockNamed(argv[6]));
  if (!client || !configure(*client)) return 69;
  say("ready");
  for (std::string line; std::getline(std::cin, line);) obey(*client, line);
  return 0;
}
