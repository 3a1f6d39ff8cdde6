#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "foundation/Format.h"
#include "foundation/JsonLine.h"
#include "platform/BlockingScope.h"
#include "platform/FileDescriptor.h"
#include "platform/PowerLog.h"

namespace velk {
namespace {

constexpr std::string_view kProgram = "velkreportingd";
/// Syslog's "informational".
constexpr std::string_view kEntryPriority = "6";
/// How long a journal that has fallen behind is waited for.
constexpr timeval kPatience{0, 100'000};

/// In the form that needs no assumption on the value: name, newline, 64 bits of length (little-endian), value, newline.
void appendField(std::string& entry, std::string_view name, std::string_view value) {
  entry.append(name).push_back('\n');
  for (int shift = 0; shift < 64; shift += 8) {
    entry.push_back(static_cast<char>(static_cast<std::uint64_t>(value.size()) >> shift));
  }
  entry.append(value).push_back('\n');
}

bool writeAll(int descriptor, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t written = ::write(descriptor, bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(written));
  }
  return true;
}

/// The entry in memory that nobody can change any more, which is what the journal asks of a descriptor.
FileDescriptor sealedMemory(std::string_view entry) {
  FileDescriptor memory(::memfd_create("velkreporting-journal-entry", MFD_CLOEXEC | MFD_ALLOW_SEALING));
  if (!memory || !writeAll(memory.get(), entry)) return {};
  if (::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL) != 0) return {};
  return memory;
}

class JournalPowerLog final : public PowerLog {
 public:
  explicit JournalPowerLog(const std::string& socketPath) {
    _address.sun_family = AF_UNIX;
    // A path that does not fit names no socket.
    if (socketPath.size() < sizeof _address.sun_path) socketPath.copy(_address.sun_path, socketPath.size());
  }

  void logRegisteredEvent(std::uint32_t clientIdentifier, std::string_view eventName,
                          const PropertyDictionary& event) override {
    namespace fields = power_log_fields;
    std::string entry;
    appendField(entry, fields::kMessage, withoutControlCharacters(eventName));
    appendField(entry, fields::kMessageID, kPowerLogMessageID);
    appendField(entry, fields::kPriority, kEntryPriority);
    appendField(entry, fields::kIdentifier, kProgram);
    appendField(entry, fields::kClient, std::to_string(clientIdentifier));
    appendField(entry, fields::kEvent, withoutControlCharacters(eventName));
    appendField(entry, fields::kPayload, json::line(event));
    send(entry);
  }

 private:
  void send(std::string& entry) const {
    const BlockingScope blocking;
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    if (!socket) return;
    static_cast<void>(::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience));
    if (sendBytes(socket.get(), entry)) return;
    // Too large for a datagram: it goes as a descriptor, and the datagram is empty.
    if (errno != EMSGSIZE && errno != ENOBUFS) return;
    if (const auto memory = sealedMemory(entry)) sendDescriptor(socket.get(), memory.get());
  }

  bool sendBytes(int socket, std::string& entry) const {
    iovec bytes{entry.data(), entry.size()};
    msghdr message = emptyMessage();
    message.msg_iov = &bytes;
    message.msg_iovlen = 1;
    return ::sendmsg(socket, &message, MSG_NOSIGNAL) >= 0;
  }

  void sendDescriptor(int socket, int descriptor) const {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptor)] = {};
    msghdr message = emptyMessage();
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr* const header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof descriptor);
    std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
    // Nobody examines whether an entry was taken.
    static_cast<void>(::sendmsg(socket, &message, MSG_NOSIGNAL));
  }

  [[nodiscard]] msghdr emptyMessage() const {
    msghdr message{};
    message.msg_name = const_cast<sockaddr_un*>(&_address);
    message.msg_namelen = sizeof _address;
    return message;
  }

  sockaddr_un _address{};
};

}  // namespace

std::unique_ptr<PowerLog> makeJournalPowerLog(const std::string& socketPath) {
  return std::make_unique<JournalPowerLog>(socketPath);
}

}  // namespace velk
