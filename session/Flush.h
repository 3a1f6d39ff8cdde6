// One flush of all backends of a session, answered once.
#pragma once

#include <memory>

#include "ipc/SessionInterface.h"
#include "platform/Queue.h"
#include "session/SessionBackends.h"

namespace velk {

/// Asks every backend to post what it has batched. The first error answers, or else the last result; the others are
/// only logged. Without backends it answers with an error at once. The reply may be empty. When backends drop their
/// completions uncalled and nothing has answered, the reply is dropped with the last of them.
/// Returns when every backend has been asked; answers may come later, on any thread, and hold no session. Texts are
/// written to the message log on `logQueue`, each before an answer that comes after it.
void internalFlushMessagesWithCompletion(const SessionBackends* backends, MessageLog& messageLog,
                                         const std::shared_ptr<Queue>& logQueue, FlushReply reply);

}  // namespace velk
