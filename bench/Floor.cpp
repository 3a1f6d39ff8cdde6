#include "bench/Floor.h"

#include <curl/curl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "backends/Compression.h"
#include "bench/ClientReport.h"
#include "bench/SampleEvents.h"
#include "foundation/Json.h"
#include "ipc/CborReader.h"
#include "ipc/CborWriter.h"
#include "ipc/FrameReader.h"
#include "ipc/Limits.h"
#include "ipc/MethodTable.h"

namespace velk::bench {

namespace {

[[noreturn]] void fail(const char* what) {
  std::fprintf(stderr, "bench: the floor: %s\n", what);
  std::exit(70);
}

double wallSeconds() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) fail("the socket's path is too long");
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  return address;
}

/// Posts bodies over one connection that stays open.
class Poster {
 public:
  Poster(const std::string& url, const std::string& caFile) : _easy(curl_easy_init()) {
    for (const char* line :
         {"X-Velk-Client-Name: Bench", "X-Velk-Service-Name: pipeline",
          "User-Agent: VelkReporting/8.0 (Server1,1; 12.4)", "X-Velk-Client-Version: 3", "X-Velk-Sender: FLEET",
          "Accept: application/json", "Content-Type: application/json", "Content-Encoding: gzip", "Expect:"}) {
      _headers = curl_slist_append(_headers, line);
    }
    curl_easy_setopt(_easy, CURLOPT_URL, url.c_str());
    curl_easy_setopt(_easy, CURLOPT_CAINFO, caFile.c_str());
    curl_easy_setopt(_easy, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(_easy, CURLOPT_SSL_VERIFYHOST, 2L);
    curl_easy_setopt(_easy, CURLOPT_PROXY, "");
    curl_easy_setopt(_easy, CURLOPT_HTTPHEADER, _headers);
    curl_easy_setopt(_easy, CURLOPT_POST, 1L);
  }
  ~Poster() {
    curl_easy_cleanup(_easy);
    curl_slist_free_all(_headers);
  }
  Poster(const Poster&) = delete;
  Poster& operator=(const Poster&) = delete;

  void post(const std::string& body) {
    curl_easy_setopt(_easy, CURLOPT_POSTFIELDS, body.data());
    curl_easy_setopt(_easy, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
    long status = 0;
    if (curl_easy_perform(_easy) != CURLE_OK || curl_easy_getinfo(_easy, CURLINFO_RESPONSE_CODE, &status) != CURLE_OK ||
        status != 200) {
      fail("a post failed");
    }
  }

 private:
  CURL* _easy;
  curl_slist* _headers = nullptr;
};

/// What every event carries besides its payload. Three values change with each.
PropertyDictionary eventFields() {
  const double now = wallSeconds();
  return {{"_startTS", static_cast<std::int64_t>(now) / 60 * 60},
          {"_sender", "FLEET"},
          {"_clientVersion", 3},
          {"_sessionID", "+SXMEgFMTlKumlmT5i8BpQ=="},
          {"_eventNumber", 1},
          {"_method", kEventCategory},
          {"_status", kEventType},
          {"_clientTS", now},
          {"eventTime", now},
          {"_productFamily", "Server"},
          {"_productModel", "Server1,1"},
          {"_osVersion", "12.4"},
          {"_build", "B77"},
          {"_internal", 2},
          {"_reportVers", "8.0"},
          {"_timezoneOffset", 0},
          {"_clientName", "Bench"},
          {"_serviceName", "pipeline"}};
}

/// One sender's connection and the body that its events wait in.
class Stream {
 public:
  Stream(int socket, std::uint64_t batch, Poster& poster) : _socket(socket), _batch(batch), _poster(poster) {}
  ~Stream() { ::close(_socket); }
  Stream(const Stream&) = delete;
  Stream& operator=(const Stream&) = delete;

  [[nodiscard]] int socket() const { return _socket; }

  /// False at the end.
  bool readSome() {
    std::array<std::uint8_t, ipc::kReceiveBytes> bytes;
    const auto count = ::recv(_socket, bytes.data(), bytes.size(), 0);
    if (count <= 0) {
      post();
      return false;
    }
    _frames.clear();
    if (_reader.consume({bytes.data(), static_cast<std::size_t>(count)}, _frames) != nullptr) fail("a bad frame");
    for (const auto& frame : _frames.frames) take(_frames.body(frame));
    return true;
  }

 private:
  void take(std::span<const std::uint8_t> body) {
    CborReader reader(body);
    std::size_t count = 0;
    std::uint64_t method = 0;
    PropertyValue message;
    if (!reader.readArrayHead(count) || !reader.readUnsigned(method) || !reader.readValue(message) ||
        !reader.readEnd() || message.dictionary() == nullptr) {
      fail("a bad body");
    }
    const PropertyDictionary* payload = message.dictionary()->dictionary("ParametersPayload");
    if (payload == nullptr) fail("an event without a payload");
    append(*payload);
    if (++_events == _batch) post();
  }

  void append(const PropertyDictionary& payload) {
    const double now = wallSeconds();
    *_fields.findMutable("_eventNumber") = static_cast<std::uint16_t>(++_eventNumber);
    *_fields.findMutable("_clientTS") = now;
    *_fields.findMutable("eventTime") = now;
    if (_events == 0) {
      _json = "{\"postTime\":";
      if (!json::write(PropertyValue(now), _json)) fail("writing JSON");
      _json += ",\"clientId\":\"b3c0a0f2-6a2e-4f0e-9d53-0a8f4f7f9b11\",\"events\":[";
    } else {
      _json += ',';
    }
    if (!json::write(payload, _json)) fail("writing JSON");
    const std::size_t end = _json.size() - 1;
    if (!json::write(_fields, _json)) fail("writing JSON");
    _json[end] = ',';         // over the payload's closing brace
    _json.erase(end + 1, 1);  // and without the fields' opening one
  }

  void post() {
    if (_events == 0) return;
    _json += "]}";
    const auto body = gzipDeflate(std::string_view(_json));
    if (!body) fail("gzip");
    _poster.post(*body);
    _events = 0;
  }

  const int _socket;
  const std::uint64_t _batch;
  Poster& _poster;
  ipc::FrameReader _reader;
  ipc::FrameBatch _frames;
  PropertyDictionary _fields = eventFields();
  std::string _json;
  std::uint64_t _events = 0;
  std::uint64_t _eventNumber = 0;
};

int listenAt(const std::string& path) {
  const auto address = addressOf(path);
  const int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (::bind(listener, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener, 64) != 0) {
    fail("listening");
  }
  return listener;
}

std::uint32_t sendOne(int socket, std::vector<std::uint8_t>& frame, const PropertyDictionary& message) {
  const auto begun = std::chrono::steady_clock::now();
  frame.assign(ipc::kFrameHeaderBytes, 0);
  CborWriter writer(frame, ipc::kMaximumFrameBytes);
  writer.beginArray(2);
  writer.unsignedInteger(static_cast<std::uint32_t>(Method::sendMessageWithDictionary));
  writer.value(message);
  ipc::FrameHeader header;
  header.length = static_cast<std::uint32_t>(frame.size() - ipc::kFrameHeaderBytes);
  ipc::writeFrameHeader(header, frame.data());
  for (std::size_t sent = 0; sent < frame.size();) {
    const auto count = ::send(socket, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
    if (count <= 0) fail("sending");
    sent += static_cast<std::size_t>(count);
  }
  return static_cast<std::uint32_t>((std::chrono::steady_clock::now() - begun).count());
}

}  // namespace

std::string deviceConfiguration() {
  return "ProductVersion=12.4\nBuildVersion=B77\nProductType=Server1,1\nHWModelStr=Server1,1\nDeviceName=Server\n";
}

int runFloorAgent(const std::string& socketPath, const std::string& url, const std::string& caFile,
                  std::uint64_t batch) {
  curl_global_init(CURL_GLOBAL_DEFAULT);
  Poster poster(url, caFile);
  const int listener = listenAt(socketPath);
  std::vector<std::unique_ptr<Stream>> streams;
  if (!writeByte(STDOUT_FILENO, kReady)) return 70;
  for (;;) {
    std::vector<pollfd> polled{{STDIN_FILENO, POLLIN, 0}, {listener, POLLIN, 0}};
    for (const auto& stream : streams) polled.push_back({stream->socket(), POLLIN, 0});
    if (::poll(polled.data(), polled.size(), -1) < 0) fail("polling");
    if (polled[0].revents != 0) return 0;
    for (std::size_t at = streams.size(); at-- > 0;) {
      if (polled[at + 2].revents == 0 || streams[at]->readSome()) continue;
      streams.erase(streams.begin() + static_cast<std::ptrdiff_t>(at));
    }
    if (polled[1].revents == 0) continue;
    const int socket = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (socket >= 0) streams.push_back(std::make_unique<Stream>(socket, batch, poster));
  }
}

int runFloorSender(const std::string& socketPath, std::uint32_t client, std::uint64_t events, double rate) {
  const auto address = addressOf(socketPath);
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) fail("connecting");
  ClientReport report;
  report.sendNanoseconds.assign(events, 0);  // written now, so that no page is new while the clock runs
  if (!writeByte(STDOUT_FILENO, kReady) || readByte(STDIN_FILENO) != kGo) return 70;
  report.cpuSecondsBefore = cpuSecondsOfProcess();
  report.begun = steadySeconds();
  std::vector<std::uint8_t> frame;
  for (std::uint64_t event = 0; event < events; ++event) {
    waitForTurn(report.begun, event, rate);
    report.sendNanoseconds[event] = sendOne(socket, frame, sampleMessage(client, event, steadySeconds()));
  }
  report.ended = steadySeconds();
  report.accepted = events;
  ::close(socket);  // the agent posts what is left
  report.cpuSecondsAfter = cpuSecondsOfProcess();
  if (!writeReport(STDOUT_FILENO, report)) return 70;
  while (readByte(STDIN_FILENO) == kAgain) {
    if (!writeByte(STDOUT_FILENO, kReady)) return 70;
  }
  return 0;
}

}  // namespace velk::bench
