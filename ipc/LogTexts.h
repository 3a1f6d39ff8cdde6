// The lines that connections and the listener write. Nothing in them was chosen by a peer.
#pragma once

#include <string_view>

namespace velk::ipc::texts {

inline constexpr std::string_view kBadFrame = "connection: closing %s: %s";
inline constexpr std::string_view kRefusedCall = "connection: refused method %u of %s: %s";
inline constexpr std::string_view kFurtherRefusals = "connection: further refused calls of %s are not logged";
inline constexpr std::string_view kReplyNotSent = "connection: reply to %s not sent: %s";
inline constexpr std::string_view kUnreadReplies = "connection: closing %s: it does not read its replies";
inline constexpr std::string_view kTooManyConnections = "listener: user %u has %u connections. Further ones are closed";
inline constexpr std::string_view kAcceptRests = "listener: cannot take connections for now: %s";

}  // namespace velk::ipc::texts
