#include "session/Flush.h"

#include <atomic>
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
  FlushRound(std::size_t backendCount, MessageLog& messageLog, std::shared_ptr<Queue> logQueue, FlushReply reply)
      : _messageLog(messageLog), _logQueue(std::move(logQueue)), _reply(std::move(reply)), _remaining(backendCount) {}

  /// On any thread, once for each backend. A transport's queue is not kept waiting for the disk: texts are written on
  /// the queue for them, and an answer follows the texts that came before it.
  void backendFinished(const std::string& name, std::optional<std::string> text, std::optional<Error> error) {
    log::standard(session_texts::kInternalFlush, name);
    if (text) write(formatText(session_texts::kMessageLogFlush, {name, *text}));
    auto reply = takeReply(error.has_value());
    if (!reply) return;
    if (!_hasWritten) return reply(std::move(text), std::move(error));
    _logQueue->async([reply = std::move(reply), text = std::move(text), error = std::move(error)]() mutable {
      reply(std::move(text), std::move(error));
    });
  }

 private:
  void write(std::string line) {
    _hasWritten = true;
    _logQueue->async([&messageLog = _messageLog, line = std::move(line)] { messageLog.writeToLogFile(line); });
  }

  /// The reply, if this result is the one to answer it.
  [[nodiscard]] FlushReply takeReply(bool failed) {
    Guard guard(_lock);
    --_remaining;
    if (!_reply || (!failed && _remaining > 0)) return FlushReply();
    return std::exchange(_reply, FlushReply());
  }

  MessageLog& _messageLog;
  const std::shared_ptr<Queue> _logQueue;
  std::atomic<bool> _hasWritten{false};
  Lock _lock;
  FlushReply _reply VELK_GUARDED_BY(_lock);
  std::size_t _remaining VELK_GUARDED_BY(_lock);
};

}  // namespace

void internalFlushMessagesWithCompletion(const SessionBackends* backends, MessageLog& messageLog,
                                         const std::shared_ptr<Queue>& logQueue, FlushReply reply) {
  if (backends == nullptr || backends->empty()) {
    log::standard(session_texts::kInternalFlush, session_texts::kNoBackendsAvailable);
    reply(std::nullopt,
          Error{std::string(kVelkReportingErrorDomain), -1, std::string(session_texts::kNoBackendsAvailable)});
    return;
  }
  const auto round = std::make_shared<FlushRound>(backends->size(), messageLog, logQueue, std::move(reply));
  for (const auto& entry : *backends) {
    entry.backend->flushMessagesWithCompletion(
        BackendFlushCompletion([round, name = entry.name](std::optional<std::string> text, std::optional<Error> error) {
          round->backendFinished(name, std::move(text), std::move(error));
        }));
  }
}

void ClientSession::flushMessagesWithCompletion(FlushReply reply) {
  log::standard(session_texts::kFlushingMessages, sessionID());
  flushBackends(std::move(reply));
}

void ClientSession::flushBackends(FlushReply reply) {
  if (!_flushLogQueue) {
    _flushLogQueue = _services.backends.platform.scheduler.makeSerialQueue("com.tavrin.velkreportingd.flushLog");
  }
  internalFlushMessagesWithCompletion(ownBackends().get(), _services.messageLog, _flushLogQueue, std::move(reply));
}

void ClientSession::finishSessionGracefully() {
  _hasFinishedGracefully = true;
  log::standard(session_texts::kFinishedGracefully, sessionID());
}

}  // namespace velk
