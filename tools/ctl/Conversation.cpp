#include "tools/ctl/Conversation.h"

#include <algorithm>
#include <memory>

#include "foundation/Uuid.h"

namespace velk::ctl {
namespace {

template <class Value>
PropertyValue valueOrNull(std::optional<Value>&& value) {
  return value ? PropertyValue(std::move(*value)) : PropertyValue();
}

bool isBlank(std::string_view line) { return line.find_first_not_of(" \t\r") == std::string_view::npos; }

// A method without a reply is called with an acknowledgement, which tells when the daemon refuses the arguments.
// When it does not come because the connection ended, nobody had asked for it.
bool isWorthTelling(const MethodDescription& method, const Error& error) {
  return method.replyCount > 0 ||
         (error.domain == kConnectionErrorDomain && error.code == static_cast<int>(ConnectionError::refused));
}

// The wire gives an error as a list; people get its parts by name.
PropertyArray withErrorsNamed(const MethodDescription& method, PropertyArray reply) {
  const bool endsInError =
      method.method == Method::flushMessagesWithCompletion || method.method == Method::uploadLogData;
  if (!endsInError || reply.size() != 2) return reply;
  const PropertyArray* parts = reply[1].array();
  if (parts == nullptr || parts->size() != 3) return reply;
  PropertyDictionary error{{"domain", (*parts)[0]}, {"code", (*parts)[1]}, {"description", (*parts)[2]}};
  reply.mutableAt(1) = std::move(error);
  return reply;
}

}  // namespace

double Conversation::take(std::string_view line, int lineNumber, SessionWire& wire) {
  if (isBlank(line)) return 0;
  const Result<SessionLine> read = readSessionLine(line);
  if (!read) {
    complain(lineNumber, read.error().description);
    return 0;
  }
  if (const SessionWait* wait = std::get_if<SessionWait>(&*read)) return wait->seconds;
  call(std::get<SessionCall>(*read), lineNumber, wire);
  return 0;
}

void Conversation::call(const SessionCall& call, int lineNumber, SessionWire& wire) {
  PropertyArray arguments = call.arguments;
  std::vector<FileDescriptor> descriptors;
  std::shared_ptr<const FileToHandOver> file;
  if (call.path) {
    Result<FileToHandOver> opened = FileToHandOver::open(*call.path);
    if (!opened) return complain(lineNumber, opened.error().description);
    Result<FileDescriptor> descriptor = opened->descriptor();
    if (!descriptor) return complain(lineNumber, descriptor.error().description);
    file = std::make_shared<const FileToHandOver>(std::move(*opened));
    descriptors.push_back(std::move(*descriptor));
    // The token that names the descriptor travels as bytes.
    const std::string token = randomUuidText();
    arguments.append(ByteData(token.begin(), token.end()));
  }
  countReply(1);
  const MethodDescription method = call.method;
  const Result<void> sent = wire.call(
      method, arguments,
      [this, method, lineNumber, file](Result<PropertyArray> reply) {
        if (file && reply) removeIfDelivered(*file, *reply);
        hear(method, lineNumber, reply);
        countReply(-1);
      },
      std::move(descriptors));
  if (sent) return;
  complain(lineNumber, sent.error().description);
  countReply(-1);
}

// What a server says that it has is removed, with the rights of whoever runs this. The second value is for this end
// alone: people get the one that the method is known to answer.
void Conversation::removeIfDelivered(const FileToHandOver& file, PropertyArray& reply) {
  const bool isDelivered = reply.size() > 1 && booleanValue(&reply[1]);
  if (!reply.empty()) reply = PropertyArray{reply[0]};
  // One that may not be removed, or that another has taken the place of, stays: nobody asked for more than the upload.
  if (isDelivered) (void)file.removeIfUnchanged();
}

void Conversation::hear(const MethodDescription& method, int lineNumber, const Result<PropertyArray>& reply) {
  if (!reply) {
    if (!isWorthTelling(method, reply.error())) return;
    return _lines.write({{"error", reply.error().description}, {"line", lineNumber}, {"method", method.name}});
  }
  if (method.replyCount == 0) return;
  _lines.write({{"method", method.name}, {"line", lineNumber}, {"reply", withErrorsNamed(method, *reply)}});
}

void Conversation::complain(int lineNumber, const std::string& why) {
  _lines.write({{"error", why}, {"line", lineNumber}});
}

void Conversation::announce(std::string_view name) { _lines.write({{"event", name}}); }

void Conversation::sendMessageToClient(std::optional<PropertyDictionary> sessionInfo, double timestamp,
                                       std::uint16_t category, std::uint16_t type,
                                       std::optional<PropertyDictionary> payload) {
  _lines.write({{"event", "sendMessageToClient"},
                {"sessionInfo", valueOrNull(std::move(sessionInfo))},
                {"timestamp", timestamp},
                {"category", category},
                {"type", type},
                {"payload", valueOrNull(std::move(payload))}});
}

void Conversation::countReply(int change) {
  Guard guard(_lock);
  _pending += change;
  if (_pending == 0) _allHeard.notifyAll();
}

void Conversation::waitForReplies() {
  Guard guard(_lock);
  while (_pending > 0) _allHeard.wait(_lock);
}

}  // namespace velk::ctl
