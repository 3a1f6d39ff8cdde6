#include <CLI/CLI.hpp>
#include <chrono>
#include <memory>

#include "ipc/Vocabulary.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/DaemonLink.h"
#include "tools/ctl/StatusText.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

// The daemon answers once the fetch of a configuration that is under way has ended, if one is.
constexpr std::chrono::seconds kLongestAnswer{60};

struct StatusOptions {
  std::string socketPath;
  bool tree = false;
};

bool isCode(const Error& error, ConnectionError code) {
  return error.domain == kConnectionErrorDomain && error.code == static_cast<int>(code);
}

/// What to do about a status that could not be had.
void explain(Context& context, const Error& error) {
  if (isCode(error, ConnectionError::ended)) {
    // It answers everybody whom it takes; whom it does not take it gives no reason.
    return context.fail(ExitCode::unavailable,
                        "the daemon ended the connection without an answer. It is stopping, or this user may not "
                        "connect: that takes the entitlements " +
                            std::string(kServiceEntitlement) + " and " + std::string(kStatusEntitlement) +
                            ", granted in entitlements.d of the daemon's configuration directory");
  }
  context.fail(exitCodeForDaemon(error), error.description);
}

void status(Context& context, const StatusOptions& options) {
  auto link = DaemonLink::open(socketPathOr(options.socketPath));
  if (!link) return explain(context, link.error());
  (*link)->resume(nullptr, {});
  const Result<PropertyArray> reply = (*link)->callAndWait(Method::copyStatus, {}, kLongestAnswer);
  if (!reply) return explain(context, reply.error());
  const PropertyDictionary* dictionary = reply->empty() ? nullptr : (*reply)[0].dictionary();
  if (dictionary == nullptr) return context.fail(ExitCode::data, "the daemon's answer is no status");
  context.report(*dictionary, options.tree ? statusTree(*dictionary) : statusText(*dictionary));
}

}  // namespace

void addStatusCommand(CLI::App& app, Context& context) {
  auto options = std::make_shared<StatusOptions>();
  auto* command = app.add_subcommand("status", "Show the daemon's sessions, transports and storebags");
  command->add_option("--socket", options->socketPath, "The daemon's socket");
  command->add_flag("--tree", options->tree, "Draw the sessions under the hierarchies to which they belong");
  command->callback([&context, options] { status(context, *options); });
}

}  // namespace velk::ctl
