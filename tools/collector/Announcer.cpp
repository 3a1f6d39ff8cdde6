#include "tools/collector/Announcer.h"

#include "foundation/Format.h"

namespace velk::collector {
namespace {

template <class Value>
PropertyValue valueOrNull(const std::optional<Value>& value) {
  return value ? PropertyValue(*value) : PropertyValue();
}

PropertyDictionary objectOfEvent(std::int64_t post, const PropertyDictionary& event) {
  const EventFields fields = eventFields(event);
  return {{"event", "event"},
          {"post", post},
          {"sender", valueOrNull(fields.sender)},
          {"method", valueOrNull(fields.method)},
          {"status", valueOrNull(fields.status)},
          {"eventNumber", valueOrNull(fields.eventNumber)},
          {"session", valueOrNull(fields.session)},
          {"body", event}};
}

// What the client said, without what was stamped on it on the way.
PropertyDictionary payloadOf(const PropertyDictionary& event) {
  PropertyDictionary payload;
  for (const PropertyDictionary::Entry& entry : event) {
    if (!entry.key.empty() && entry.key.front() != '_' && entry.key != "eventTime") payload.set(entry.key, entry.value);
  }
  return payload;
}

std::string wordsOfEvent(const PropertyDictionary& event) {
  const EventFields fields = eventFields(event);
  const auto text = [](const std::optional<std::int64_t>& number) { return number ? std::to_string(*number) : "-"; };
  return "  " + withoutControlCharacters(fields.sender.value_or("-")) + " " + text(fields.method) + "/" +
         text(fields.status) + " #" + text(fields.eventNumber) + "  " +
         withoutControlCharacters(tools::jsonText(payloadOf(event))) + "\n";
}

std::string count(std::uint64_t number, const char* noun) {
  return std::to_string(number) + " " + noun + (number == 1 ? "" : "s");
}

}  // namespace

PropertyDictionary dictionaryOf(const Totals& totals) {
  return {{"posts", totals.posts},         {"events", totals.events},   {"bytes", totals.bytes},
          {"wireBytes", totals.wireBytes}, {"refused", totals.refused}, {"storebags", totals.storebags}};
}

void Announcer::say(const PropertyDictionary& object, const std::string& words) {
  _lines.writeText((_json ? tools::jsonText(object) : words) + "\n");
}

void Announcer::listening(const std::string& url, int port, const std::string& caPath, const std::string& databasePath,
                          std::optional<int> dashboardPort) {
  PropertyDictionary object{
      {"event", "listening"}, {"url", url}, {"port", port}, {"ca", caPath}, {"database", databasePath}};
  if (dashboardPort) object.set("dashboardPort", *dashboardPort);
  say(object,
      "Listening on " + url + "\n  trust it with: SSL_CERT_FILE=" + caPath +
          (databasePath.empty() ? std::string("\n  counting only") : "\n  keeping posts in: " + databasePath) +
          (dashboardPort ? "\n  dashboard datagrams on port " + std::to_string(*dashboardPort) : std::string()));
}

void Announcer::post(std::int64_t number, const std::string& path, const ReceivedPost& post, bool digestChecked) {
  if (_quiet) return;
  std::string lines;
  if (_json) {
    lines = tools::jsonText({{"event", "post"},
                             {"post", number},
                             {"path", path},
                             {"clientId", post.clientId},
                             {"postTime", post.postTime},
                             {"events", post.events.size()},
                             {"bytes", post.bodyBytes},
                             {"wireBytes", post.wireBytes},
                             {"digest", digestChecked ? "good" : "unchecked"}}) +
            "\n";
    for (const PropertyDictionary& event : post.events) lines += tools::jsonText(objectOfEvent(number, event)) + "\n";
  } else {
    lines = "Post " + std::to_string(number) + " to " + withoutControlCharacters(path) + ": " +
            count(post.events.size(), "event") + ", " + count(post.bodyBytes, "byte") + " (" +
            std::to_string(post.wireBytes) + " on the wire)" + (digestChecked ? ", digest good" : "") + "\n";
    for (const PropertyDictionary& event : post.events) lines += wordsOfEvent(event);
  }
  _lines.writeText(lines);
}

void Announcer::upload(std::int64_t number, const std::string& name, std::uint64_t fileBytes, std::uint64_t wireBytes) {
  if (_quiet) return;
  say({{"event", "upload"}, {"upload", number}, {"name", name}, {"bytes", fileBytes}, {"wireBytes", wireBytes}},
      "Upload " + std::to_string(number) + ": " + withoutControlCharacters(name) + ", " + count(fileBytes, "byte") +
          " (" + std::to_string(wireBytes) + " on the wire)");
}

void Announcer::refused(const std::string& path, int status, const std::string& reason) {
  say({{"event", "refused"}, {"path", path}, {"status", status}, {"reason", reason}},
      "Refused a post to " + withoutControlCharacters(path) + " with " + std::to_string(status) + ": " +
          withoutControlCharacters(reason));
}

void Announcer::storebag(const std::string& name, int status) {
  if (_quiet) return;
  say({{"event", "storebag"}, {"name", name}, {"status", status}},
      "Storebag " + withoutControlCharacters(name) + ": " + std::to_string(status));
}

void Announcer::datagram(const ReceivedDatagram& datagram) {
  if (_quiet) return;
  const dashboard::Header& header = datagram.header;
  const std::string_view device(header.deviceIdentifier.data(), header.deviceIdentifier.size());
  const std::string fate(nameOf(datagram.fate));
  say({{"event", "datagram"},
       {"fate", fate},
       {"eventNumber", header.eventNumber},
       {"sent", header.seconds + header.fourMilliseconds * dashboard::kFourMilliseconds / 1000.0},
       {"component", header.component},
       {"majorVersion", header.majorVersion},
       {"session", header.sessionID},
       {"clientVersion", header.clientVersion},
       {"method", header.method},
       {"status", header.respCode},
       {"device", device.substr(0, device.find('\0'))},
       {"flags", header.flags},
       {"text", datagram.text}},
      "Datagram " + std::to_string(header.eventNumber) + " (" + fate + ") of component " +
          std::to_string(header.component) + ", session " + std::to_string(header.sessionID) + ": " +
          std::to_string(header.method) + "/" + std::to_string(header.respCode) +
          withoutControlCharacters(datagram.text));
}

void Announcer::logData(std::int64_t number, std::size_t entries, std::size_t bytes, const std::string& location) {
  if (_quiet) return;
  say({{"event", "logData"}, {"number", number}, {"entries", entries}, {"bytes", bytes}, {"location", location}},
      "Log data " + std::to_string(number) + ": " + std::to_string(entries) + " entries, " + count(bytes, "byte") +
          ", to be seen at " + location);
}

void Announcer::stopped(const Totals& totals) {
  PropertyDictionary object{{"event", "stopped"}};
  object.merge(dictionaryOf(totals));
  say(object, "Stopped. " + count(totals.events, "event") + " in " + count(totals.posts, "post") + ", " +
                  count(totals.bytes, "byte") + " (" + std::to_string(totals.wireBytes) + " on the wire), " +
                  std::to_string(totals.refused) + " refused.");
}

}  // namespace velk::collector
