// The end of a session, from top to bottom.
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/Health.h"
#include "session/LogTexts.h"
#include "session/SessionConstants.h"

namespace velk {

void ClientSession::clientHasGone() {
  if (_clientHasGone.exchange(true)) return;
  std::shared_ptr<ReportingSessionConnectivityHelper> helper;
  {
    Guard guard(_lock);
    helper = _connectivityHelper;
  }
  if (helper) helper->stopWaiting(_sender->number);
}

void ClientSession::invalidate() {
  clientHasGone();
  std::shared_ptr<SessionConnection> connection;
  {
    Guard guard(_lock);
    connection.swap(_connection);
  }
  if (connection) connection->invalidate();
}

void ClientSession::teardown() {
  if (std::exchange(_tornDown, true)) return;
  log::standard(session_texts::kSessionDealloc, sessionID());
  if (ownBackends() && ownSessionInfo()) {
    internalSendMessage(makeHealthPayload(), kInternalCategory, kHealthMessageType);
    flushMessagesWithCompletion(FlushReply());
  }
  shutdownSessionAggregation();
  // Uploads that a client leaves behind still need the transport, and the process.
  _uploads.runBehindUploads([self = std::static_pointer_cast<ClientSession>(shared_from_this())] { self->letGo(); });
}

/// Once, when nobody else uses the session any more: on the connection's queue or, behind uploads, on theirs.
void ClientSession::letGo() {
  returnKeepAlive();
  // After the helper has counted this session: releasing the user info may end the helper, which gives back what it
  // has counted.
  releaseUserInfo();
  releaseEverything();
}

PropertyDictionary ClientSession::makeHealthPayload() {
  PropertyDictionary payload;
  if (_storebagVersion) {
    payload.set("StorebagVersion", *_storebagVersion);
    payload.set("GracefulTermination", _hasFinishedGracefully.load());
  }
  // Holds other sessions. Dropping it drops references only, even the last ones.
  const ReportingAgentState state = _delegate.copyReportingAgentState();
  addSessionsAccumulatedHealthInfoToPayload(payload, *this, state.sessions, state.cachedStorebags,
                                            _services.backends.platform.process);
  return payload;
}

void ClientSession::returnKeepAlive() {
  if (ownHelper()) {
    log::standard(session_texts::kIncrementSessionsServed, sessionID());
    ownHelper()->incrementTotalSessionsServedCount();
    return;
  }
  log::standard(session_texts::kReleaseTransactionWithoutHelper, sessionID());
  Guard guard(_delegate.monitor());
  _delegate.releaseIPCTransactions(1);
}

void ClientSession::releaseEverything() {
  _frameworks.clear();
  publishBackends(nullptr);
  _storebagVersion.reset();
  _digestKey.reset();
  Hierarchy hierarchy;
  std::shared_ptr<SessionConnection> connection;
  Guard guard(_lock);
  std::swap(_hierarchy, hierarchy);
  connection.swap(_connection);
}

}  // namespace velk
