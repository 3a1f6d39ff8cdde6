#include <CLI/CLI.hpp>
#include <memory>

#include "ipc/SessionProxies.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/Conversation.h"
#include "tools/ctl/DaemonLink.h"
#include "tools/ctl/InputLines.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

constexpr int kStandardInput = 0;
// A frame holds a mebibyte; as JSON it may be some times as long.
constexpr std::size_t kMaximumLineBytes = std::size_t{8} * 1024 * 1024;

/// Reads and calls until the input or the connection ends. Ok when it was the input.
ExitCode converse(InputLines& input, Conversation& conversation, tools::JsonLines& lines, DaemonLink& link) {
  std::string line;
  for (int number = 1;; ++number) {
    if (link.hasEnded()) return ExitCode::unavailable;
    if (!lines.good()) return ExitCode::ioError;
    switch (input.next(line)) {
      case InputLines::Event::line:
        if (const double seconds = conversation.take(line, number, link); seconds > 0) {
          (void)input.sleep(std::chrono::duration<double>(seconds));
        }
        break;
      case InputLines::Event::tooLong:
        conversation.complain(number, "the line is too long");
        break;
      case InputLines::Event::end:
        conversation.waitForReplies();
        return link.hasEnded() ? ExitCode::unavailable : ExitCode::ok;
      case InputLines::Event::failed:
        return ExitCode::ioError;
      case InputLines::Event::woken:
        // Only the connection's end wakes it.
        (void)link.hasEnded();
        return ExitCode::unavailable;
    }
  }
}

void session(Context& context, const std::string& socketPath) {
  // What the connection's thread uses stands above the link, which ends that thread.
  tools::JsonLines lines(context.out);
  InputLines input(kStandardInput, kMaximumLineBytes);
  const auto conversation = std::make_shared<Conversation>(lines);
  auto link = DaemonLink::open(socketPathOr(socketPath));
  if (!link) return context.fail(exitCodeForDaemon(link.error()), link.error().description);
  (*link)->resume(std::make_shared<ReplyInterfaceDispatcher>(conversation),
                  [&input, &conversation](DaemonLink::End end) {
                    conversation->announce(end == DaemonLink::End::interrupted ? "interrupted" : "invalidated");
                    input.wake();
                  });
  context.exitCode = converse(input, *conversation, lines, **link);
  (*link)->close();
  if (!lines.good()) context.exitCode = ExitCode::ioError;
}

}  // namespace

void addSessionCommand(CLI::App& app, Context& context) {
  auto socketPath = std::make_shared<std::string>();
  auto* command = app.add_subcommand(
      "session", "Drive a session: one JSON object a line in ({\"method\": M, ...}), one a line out");
  command->add_option("--socket", *socketPath, "The daemon's socket");
  command->callback([&context, socketPath] { session(context, *socketPath); });
}

}  // namespace velk::ctl
