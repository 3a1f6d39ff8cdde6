#include "session/Flush.h"

#include <memory>
#include <utility>

#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"

namespace velk {

namespace {

/// Shared by the completions of one flush. Goes with the last of them, and takes an unanswered reply along.
class FlushRound {
 public:
  FlushRound(std::size_t backendCount, MessageLog& messageLog, FlushReply reply)
      : _messageLog(messageLog), _reply(std::move(reply)), _remaining(backendCount) {}

  /// On any thread, once for each backend.
  void backendFinished(const std::string& name, std::optional<std::string> text, std::optional<Error> error) {
    log::standard(session_texts::kInternalFlush, name);
    if (text) _messageLog.writeToLogFile(formatText(session_texts::kMessageLogFlush, {name, *text}));
    if (auto reply = takeReply(error.has_value())) reply(std::move(text), std::move(error));
  }

 private:
  /// The reply, if this result is the one to answer it.
  [[nodiscard]] FlushReply takeReply(bool failed) {
    Guard guard(_lock);
    --_remaining;
    if (!_reply || (!failed && _remaining > 0)) return FlushReply();
    return std::exchange(_reply, FlushReply());
  }

  MessageLog& _messageLog;
  Lock _lock;
  FlushReply _reply VELK_GUARDED_BY(_lock);
  std::size_t _remaining VELK_GUARDED_BY(_lock);
};

}  // namespace

void internalFlushMessagesWithCompletion(const SessionBackends* backends, MessageLog& messageLog, FlushReply reply) {
  if (backends == nullptr || backends->empty()) {
    log::standard(session_texts::kInternalFlush, session_texts::kNoBackendsAvailable);
    reply(std::nullopt,
          Error{std::string(kVelkReportingErrorDomain), -1, std::string(session_texts::kNoBackendsAvailable)});
    return;
  }
  const auto round = std::make_shared<FlushRound>(backends->size(), messageLog, std::move(reply));
  for (const auto& entry : *backends) {
    entry.backend->flushMessagesWithCompletion(
        BackendFlushCompletion([round, name = entry.name](std::optional<std::string> text, std::optional<Error> error) {
          round->backendFinished(name, std::move(text), std::move(error));
        }));
  }
}

void ClientSession::flushMessagesWithCompletion(FlushReply reply) {
  log::standard(session_texts::kFlushingMessages, sessionID());
  internalFlushMessagesWithCompletion(ownBackends().get(), _services.messageLog, std::move(reply));
}

void ClientSession::finishSessionGracefully() {
  _hasFinishedGracefully = true;
  log::standard(session_texts::kFinishedGracefully, sessionID());
}

}  // namespace velk
