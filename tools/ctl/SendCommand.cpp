#include <CLI/CLI.hpp>
#include <cstdint>
#include <memory>

#include "foundation/Json.h"
#include "foundation/Uuid.h"
#include "ipc/Vocabulary.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/DaemonLink.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

/// What the daemon answers when it has handed the event on.
constexpr const char* kFinished = "finished";

struct SendOptions {
  std::string socketPath;
  int clientType = 0;
  int clientVersion = 1;
  std::uint32_t sessionNumber = 0;
  std::string clientName;
  std::string serviceName;
  std::uint16_t category = 0;
  std::uint16_t eventType = 0;
  std::string payload;
};

std::uint32_t randomSessionNumber() {
  std::uint32_t number = 0;
  for (const std::uint8_t byte : randomUuid()) number = number * 31 + byte;
  return number;
}

PropertyDictionary userInfoOf(const SendOptions& options) {
  PropertyDictionary userInfo;
  if (!options.clientName.empty()) userInfo.set(kVelkReportingUserInfoClientName, options.clientName);
  if (!options.serviceName.empty()) userInfo.set(kVelkReportingUserInfoServiceName, options.serviceName);
  return userInfo;
}

Result<PropertyValue> payloadOf(const SendOptions& options) {
  if (options.payload.empty()) return PropertyValue();
  Result<PropertyValue> payload = json::parse(options.payload, json::Extensions::tagged);
  if (!payload) return failure("send", 1, "the payload is not JSON: " + payload.error().description);
  if (payload->dictionary() == nullptr) return failure("send", 2, "the payload is not a JSON object");
  return payload;
}

void send(Context& context, const SendOptions& options) {
  const Result<PropertyValue> payload = payloadOf(options);
  if (!payload) return context.fail(ExitCode::data, payload.error().description);
  const PropertyDictionary sessionInfo{
      {kVelkReportingSessionInfoClientType, options.clientType},
      {kVelkReportingSessionInfoClientVersion, options.clientVersion},
      {kVelkReportingSessionInfoSessionID, options.sessionNumber != 0 ? options.sessionNumber : randomSessionNumber()}};

  auto link = DaemonLink::open(socketPathOr(options.socketPath));
  if (!link) return context.fail(exitCodeForDaemon(link.error()), link.error().description);
  (*link)->resume(nullptr, {});
  const Result<PropertyArray> reply = (*link)->callAndWait(
      Method::sendMessageWithSessionInfo,
      {PropertyValue(sessionInfo), PropertyValue(userInfoOf(options)), options.category, options.eventType, *payload});
  if (!reply) return context.fail(exitCodeForDaemon(reply.error()), reply.error().description);
  const std::string* text = reply->empty() ? nullptr : (*reply)[0].string();
  if (text == nullptr || *text != kFinished) {
    return context.fail(ExitCode::unavailable, text != nullptr ? "not sent: " + *text : "not sent");
  }
  context.report({{"reply", *text}}, "The daemon took the event.");
}

}  // namespace

void addSendCommand(CLI::App& app, Context& context) {
  auto options = std::make_shared<SendOptions>();
  auto* command = app.add_subcommand("send", "Send one event");
  command->add_option("--type", options->clientType, "Client type")->required();
  command->add_option("--client-name", options->clientName, "Client name");
  command->add_option("--service", options->serviceName, "Service name");
  command->add_option("--category", options->category, "Event category")->required();
  command->add_option("--event-type", options->eventType, "Event type")->required();
  command->add_option("--payload", options->payload, "Payload: a JSON object");
  command->add_option("--client-version", options->clientVersion, "Client version")->capture_default_str();
  command->add_option("--session", options->sessionNumber, "Session number; random without it");
  command->add_option("--socket", options->socketPath, "The daemon's socket");
  command->callback([&context, options] { send(context, *options); });
}

}  // namespace velk::ctl
