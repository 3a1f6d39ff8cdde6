#include <CLI/CLI.hpp>
#include <memory>

#include "tools/ctl/Commands.h"
#include "tools/ctl/DaemonLink.h"
#include "tools/ctl/StatusText.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

void status(Context& context, const std::string& socketPath) {
  auto link = DaemonLink::open(socketPathOr(socketPath));
  if (!link) return context.fail(exitCodeForDaemon(link.error()), link.error().description);
  (*link)->resume(nullptr, {});
  const Result<PropertyArray> reply = (*link)->callAndWait(Method::copyStatus, {});
  if (!reply) return context.fail(exitCodeForDaemon(reply.error()), reply.error().description);
  const PropertyDictionary* dictionary = reply->empty() ? nullptr : (*reply)[0].dictionary();
  if (dictionary == nullptr) return context.fail(ExitCode::data, "the daemon's answer is no status");
  context.report(*dictionary, statusText(*dictionary));
}

}  // namespace

void addStatusCommand(CLI::App& app, Context& context) {
  auto socketPath = std::make_shared<std::string>();
  auto* command = app.add_subcommand("status", "Show what the daemon is doing");
  command->add_option("--socket", *socketPath, "The daemon's socket");
  command->callback([&context, socketPath] { status(context, *socketPath); });
}

}  // namespace velk::ctl
