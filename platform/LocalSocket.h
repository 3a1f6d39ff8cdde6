// Stream sockets between processes of one machine, with descriptors riding along.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/FileDescriptor.h"
#include "platform/Transfer.h"

namespace velk {

inline constexpr std::string_view kLocalSocketErrorDomain = "LocalSocket";

/// A socket bound to a path, and the lock that keeps a second one away from it.
struct BoundLocalSocket {
  FileDescriptor socket;
  /// Held for as long as the socket listens. The lock file stays behind.
  FileDescriptor lock;
};

/// Binds `path` and listens, mode 0666: whoever may connect is decided by who asks for the credentials. A socket left
/// behind at the path is replaced if nobody answers on it; anything else there is an error. `program` names the
/// service in the error that a second daemon gets. Blocks only for file operations.
[[nodiscard]] Result<BoundLocalSocket> bindLocalSocket(const std::string& path, std::string_view program);

/// Removes the name of a socket bound here, before it is closed and its lock given up.
void removeLocalSocket(const std::string& path);

/// Checks that an inherited descriptor is a listening stream socket of this kind, and makes it non-blocking.
[[nodiscard]] Result<FileDescriptor> adoptLocalSocket(FileDescriptor descriptor);

/// Connects; waits at most `timeout` when the other end's queue is full. The result is non-blocking.
[[nodiscard]] Result<FileDescriptor> connectLocalSocket(const std::string& path, Duration timeout);

/// Two ends of one connection, non-blocking.
[[nodiscard]] Result<std::pair<FileDescriptor, FileDescriptor>> makeLocalSocketPair();

/// Receives into `buffer`, appends descriptors that came along (close-on-exec) to `descriptors`. Never blocks.
/// Fails with EMFILE when descriptors were lost on the way in.
[[nodiscard]] Transfer receiveFromLocalSocket(int socket, std::span<std::uint8_t> buffer,
                                              std::vector<FileDescriptor>& descriptors);

/// Sends what the socket takes; the descriptors (at most 16) go with the first byte. Never blocks, never raises a
/// signal.
[[nodiscard]] Transfer sendToLocalSocket(int socket, std::span<const std::uint8_t> bytes,
                                         std::span<const FileDescriptor> descriptors);

/// Takes a waiting connection: nothing with EAGAIN in `error` when there is none, else with the system's error.
struct AcceptedSocket {
  FileDescriptor socket;
  int error = 0;
};
[[nodiscard]] AcceptedSocket acceptLocalSocket(int listeningSocket);

/// Whether something can be read from (or accepted on) the descriptor at once.
[[nodiscard]] bool isReadable(int descriptor);

/// Ends both directions: the peer reads what was sent, then the end.
void shutDownLocalSocket(int socket);

}  // namespace velk
