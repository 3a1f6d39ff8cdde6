// One flush of all backends of a session, answered once.
#pragma once

#include "ipc/SessionInterface.h"
#include "session/SessionBackends.h"

namespace velk {

/// Asks every backend to post what it has batched. The first error answers, or else the last result; the others are
/// only logged. Without backends it answers with an error at once. The reply may be empty. When backends drop their
/// completions uncalled and nothing has answered, the reply is dropped with the last of them.
/// Returns when every backend has been asked; answers may come later, on any thread, and hold no session.
void internalFlushMessagesWithCompletion(const SessionBackends* backends, MessageLog& messageLog, FlushReply reply);

}  // namespace velk
