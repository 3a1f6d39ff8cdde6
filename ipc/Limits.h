// The bounds of the wire. What a peer may cost us is decided here, each number with its reason.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>

namespace velk::ipc {

/// The most bytes of a frame's body. The largest honest bodies are log-data arrays and the readable text of a flush,
/// which stay below a few hundred kilobytes.
inline constexpr std::size_t kMaximumFrameBytes = 1024 * 1024;

/// How deep containers may nest in a body. Decoding recurses once a level; honest values nest fewer than ten deep.
inline constexpr int kMaximumDepth = 32;

/// Values in one body, all levels together. One byte on the wire becomes some 40 in memory: this holds the
/// amplification of a frame below 3 MiB for the values themselves.
inline constexpr std::size_t kMaximumEntries = 65'536;

/// Keys in one map. Looking for a key given twice costs a hash look-up; keys that collide on purpose cost at most
/// this number squared in comparisons, some tens of milliseconds.
inline constexpr std::size_t kMaximumKeysInMap = 4096;

/// One file travels with an upload; the rest is room for a second operation of that kind.
inline constexpr std::size_t kMaximumDescriptorsPerFrame = 4;

/// Descriptors that were received and not yet handed to a method, for one connection: then the socket is not read.
/// Together with the connections of a user it bounds what one user can take of the process's table.
inline constexpr std::size_t kMaximumUnclaimedDescriptors = 16;

/// Received bytes whose frames have not run yet, for one connection. At this many the socket is no longer read until
/// half of them have run, so that the peer's own outbox fills and its sends are refused: nothing is lost in between.
inline constexpr std::size_t kMaximumUnreadBytes = 512 * 1024;

/// Received bytes of one connection that count towards nothing else: small frames get through, whoever takes the room.
inline constexpr std::size_t kFreeUnreadBytes = 32 * 1024;

/// Beyond those, received bytes that have not run yet and frames that have begun (as long as they will be), for all
/// connections and for those of one user. A connection for which there is no room is not read until there is.
inline constexpr std::size_t kMaximumUnreadBytesOfAll = 64 * 1024 * 1024;
inline constexpr std::size_t kMaximumUnreadBytesOfUser = 16 * 1024 * 1024;

/// How long the rest of a frame may take while others wait for its room. Then the connection is ended.
inline constexpr std::chrono::seconds kFrameTimeWhileOthersWait{2};

/// How much is taken from a socket at once.
inline constexpr std::size_t kReceiveBytes = 64 * 1024;

/// Bytes that wait to be sent, for one connection. A call that does not fit is refused with an error. One frame of
/// the largest size always fits into an empty outbox.
inline constexpr std::size_t kMaximumOutboxBytes = 2 * 1024 * 1024;

/// Above this many bytes in the outbox no further call that wants a reply is run: a peer that does not read its
/// replies is not served.
inline constexpr std::size_t kOutboxBytesToPauseCalls = 1024 * 1024;

/// How far replies may use the outbox; a reply beyond that ends the connection. The end of aggregation may as well:
/// some twenty bytes that an aggregator waits for, however slowly it reads.
inline constexpr std::size_t kMaximumOutboxBytesWithReplies = 2 * kMaximumOutboxBytes;

/// Unsent bytes of one connection that count towards nothing else.
inline constexpr std::size_t kFreeOutboxBytes = 64 * 1024;

/// Beyond those, unsent bytes of all connections and of those of one user. From half of it on calls of connections that
/// have such bytes are paused; a reply beyond it ends the connection that has not read its replies for the longest.
inline constexpr std::size_t kMaximumOutboxBytesOfAll = 64 * 1024 * 1024;
inline constexpr std::size_t kMaximumOutboxBytesOfUser = 16 * 1024 * 1024;

/// Calls of one connection that wait for a reply. A call beyond is refused with an error.
inline constexpr std::size_t kMaximumPendingReplies = 65'536;

/// Frames run in one turn of a connection's queue, before others that share its threads get theirs.
inline constexpr std::size_t kMaximumFramesPerTurn = 256;

/// Open connections of one user: some hundred processes that report, with room to spare, and no more than a fraction
/// of the descriptors that a daemon may have. Further ones are closed unread.
inline constexpr std::size_t kMaximumConnectionsPerUser = 512;

/// Look-ups of programs that may be under way for the peers of one user. A program may lie on a disk that does not
/// answer: each such look-up keeps a thread, and further peers of that user wait behind them.
inline constexpr std::size_t kMaximumLookUpsPerUser = 4;

/// Bytes of a text that answers a call: the text of what was posted may be longer, and a part of it says more than an
/// error. The rest of the frame is for what stands beside it.
inline constexpr std::size_t kMaximumReplyTextBytes = kMaximumFrameBytes - 16 * 1024;

/// Bytes of an error's text on the wire.
inline constexpr std::size_t kMaximumErrorTextBytes = 4096;

/// How long a connection that was ended here may take to send what is left.
inline constexpr std::chrono::seconds kDrainTime{1};

/// How long accepting rests after the process ran out of descriptors or memory.
inline constexpr std::chrono::milliseconds kAcceptRest{200};

/// How long a connect may wait for room in the other end's queue.
inline constexpr std::chrono::seconds kConnectTime{1};

}  // namespace velk::ipc
