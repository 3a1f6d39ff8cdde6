#include "tests/integration/WireSession.h"

#include <stdexcept>

#include "foundation/Json.h"
#include "platform/Semaphore.h"

namespace velk::test {

WireSession::WireSession(const Daemon& daemon, EventLoop& loop) {
  auto connection = Connection::connect(daemon.socketPath(), loop, loop.makeLoopQueue("wiresession"));
  if (!connection) throw std::runtime_error(connection.error().description);
  _connection = std::move(*connection);
  _connection->resume();
}

WireSession::~WireSession() { _connection->closeAfterSending(); }

void WireSession::describe(const PropertyDictionary& sessionInfo, const std::optional<PropertyDictionary>& userInfo) {
  proxy().setSessionInfo(sessionInfo, userInfo, {}, false);
}

void WireSession::startConfiguration() { proxy().startConfigWithCompletionHandler({}); }

std::optional<PropertyArray> WireSession::configure() {
  struct Answer {
    Semaphore given;
    std::optional<PropertyArray> enabled;
  };
  auto answer = std::make_shared<Answer>();
  SessionInterfaceProxy(_connection, [answer](const Error&) {
    answer->given.signal();
  }).startConfigWithCompletionHandler([answer](std::optional<PropertyArray> enabled, const auto&, const auto&) {
    answer->enabled = std::move(enabled);
    answer->given.signal();
  });
  return answer->given.waitFor(kPatience) ? answer->enabled : std::nullopt;
}

void WireSession::send(int category, int type, const PropertyDictionary& payload) {
  proxy().sendMessageWithDictionary({{"ParametersCategory", category},
                                     {"ParametersType", type},
                                     {"ParametersFlag", 0},
                                     {"ParametersPayload", payload}},
                                    {});
}

void WireSession::finish() { proxy().finishSessionGracefully(); }

bool WireSession::waitUntilSent() { return _connection->waitUntilSent(kPatience); }

PropertyDictionary statusOf(const Daemon& daemon) {
  const auto finished = runControl(daemon, {"--json", "status"});
  const auto value = json::parse(finished.output, json::Extensions::tagged);
  return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
}

namespace {

bool isEmpty(const PropertyDictionary& status, int bystanders) {
  const auto holds = [&](const char* count, int expected) {
    return status.contains(count) && integerValue(status.find(count)) == expected;
  };
  const auto* active = status.dictionary("activeClients");
  return holds("sessionCount", bystanders) && holds("keepAliveCount", bystanders) && holds("hierarchyCount", 0) &&
         holds("helperCount", 0) && active != nullptr && active->empty();
}

}  // namespace

PropertyDictionary whatIsLeft(const Daemon& daemon, int bystanders) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  for (;;) {
    const auto status = statusOf(daemon);
    if (isEmpty(status, bystanders)) return {};
    if (std::chrono::steady_clock::now() >= deadline) return status;
  }
}

}  // namespace velk::test
