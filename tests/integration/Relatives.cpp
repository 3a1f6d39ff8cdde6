#include "tests/integration/Relatives.h"

namespace velk::test {

PropertyDictionary inTree(int level, const PropertyDictionary& more, const std::string& token) {
  PropertyDictionary info{{"HierarchyToken", PropertyDictionary{{"token", token}, {"level", level}}}};
  info.merge(more);
  return info;
}

PropertyDictionary userOf(const std::string& service) { return {{"_clientName", "Wire"}, {"_serviceName", service}}; }

PropertyArray openRelative(ControlledSession& session, int clientType, int number, const std::string& service,
                           const PropertyDictionary& sessionInfo, bool hasAggregationBlock) {
  PropertyDictionary info{{"ComponentType", clientType}, {"ClientVersion", 3}, {"SessionID", number}};
  info.merge(sessionInfo);
  session.send({{"method", "setSessionInfo"},
                {"sessionInfo", info},
                {"userInfo", userOf(service)},
                {"frameworksToCheck", PropertyArray{}},
                {"hasAggregationBlock", hasAggregationBlock}});
  return session.call({{"method", "startConfigWithCompletionHandler"}});
}

void renameUser(ControlledSession& session, const std::string& service, const std::string& clientName) {
  static_cast<void>(
      session.call({{"method", "fetchStatesWithUserInfo"},
                    {"userInfo", PropertyDictionary{{"_clientName", clientName}, {"_serviceName", service}}}}));
}

PropertyArray flush(ControlledSession& session) { return session.call({{"method", "flushMessagesWithCompletion"}}); }

bool sendNumber(ControlledSession& session, int category, std::int64_t n) {
  return !session.reply(session.sendEvent(category, 1, PropertyDictionary{{"n", n}})).empty();
}

std::vector<PropertyDictionary> eventsOfService(const ReportingServer& server, const std::string& service) {
  std::vector<PropertyDictionary> found;
  for (const auto& event : server.events()) {
    const auto* name = event.string("_serviceName");
    if (name != nullptr && *name == service) found.push_back(event);
  }
  return found;
}

bool waitForEventsOfService(const ReportingServer& server, const std::string& service, std::size_t count) {
  for (;;) {
    const std::size_t posts = server.posts().size();
    if (eventsOfService(server, service).size() >= count) return true;
    if (!server.waitForPosts(posts + 1)) return false;
  }
}

std::string sessionIDOf(const PropertyDictionary& event) {
  const auto* text = event.string("_sessionID");
  return text != nullptr ? *text : "";
}

std::string ownPart(const std::string& combined) { return combined.substr(combined.rfind('.') + 1); }

namespace {

const char* nameOf(AggregatingClient::Block block) {
  switch (block) {
    case AggregatingClient::Block::none:
      return "none";
    case AggregatingClient::Block::print:
      return "print";
    case AggregatingClient::Block::throws:
      return "throw";
  }
  return "";
}

}  // namespace

AggregatingClient::AggregatingClient(const Daemon& daemon, int clientType, int number, int level,
                                     const std::string& service, Block block)
    : _process([&] {
        ChildProcess::Options options;
        options.command = {VELK_AGGREGATING_CLIENT_PROGRAM,
                           std::to_string(clientType),
                           std::to_string(number),
                           "tree",
                           std::to_string(level),
                           service,
                           nameOf(block)};
        options.environment = daemon.environment();
        options.environment["VELKREPORTING_LOG"] = "default";
        return options;
      }()) {}

void AggregatingClient::sendNumber(int category, std::int64_t n) {
  _process.write("send " + std::to_string(category) + " 1 " + std::to_string(n) + "\n");
}

bool AggregatingClient::flush() {
  ++_flushes;
  _process.write("flush\n");
  std::size_t seen = 0;
  return lines().waitFor([&](const std::string& line) { return line == "flushed" && ++seen == _flushes; }).has_value();
}

std::vector<std::string> AggregatingClient::heard() {
  std::vector<std::string> found;
  for (const auto& line : lines().lines()) {
    if (line.starts_with("event ") || line == "end") found.push_back(line);
  }
  return found;
}

int AggregatingClient::finish() {
  _process.closeInput();
  const auto status = _process.wait();
  return status ? *status : -1;
}

}  // namespace velk::test
