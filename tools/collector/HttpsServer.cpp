#include "tools/collector/HttpsServer.h"

#include <httplib.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "tools/collector/TlsConnections.h"

namespace velk::collector {
namespace {

// A connection keeps a thread while it lives; daemons keep theirs open between posts.
constexpr std::size_t kThreads = 64;
constexpr std::time_t kKeepAliveSeconds = 60;
constexpr std::size_t kRequestsPerConnection = 1'000'000;
constexpr std::time_t kTransferTimeoutSeconds = 30;
constexpr const char* kPackedMark = "X-Collector-Content-Encoding";

// The library puts the ends of the connection among what the peer sent.
bool isOfTheLibrary(const std::string& name) {
  return name == "LOCAL_ADDR" || name == "LOCAL_PORT" || name == "REMOTE_ADDR" || name == "REMOTE_PORT";
}

HeaderList headersOf(const httplib::Request& request) {
  HeaderList headers;
  for (const auto& header : request.headers) {
    if (isOfTheLibrary(header.first)) continue;
    headers.emplace_back(header.first == kPackedMark ? "Content-Encoding" : header.first, header.second);
  }
  return headers;
}

void send(const Answer& answer, httplib::Response& response) {
  response.status = answer.status;
  for (const auto& header : answer.headers) response.set_header(header.first, header.second);
  if (answer.status != 304) response.set_content(answer.body, answer.contentType);
}

// The library would unpack gzip without a bound; it leaves encodings alone that it does not see.
void hideContentEncoding(const httplib::Request& request) {
  auto& headers = const_cast<httplib::Request&>(request).headers;
  const auto encoding = headers.find("Content-Encoding");
  if (encoding != headers.end()) {
    headers.emplace(kPackedMark, encoding->second);
    headers.erase("Content-Encoding");
  }
}

// The library would read a body into memory for which there is no route, and one may be as large as an upload.
httplib::Server::HandlerResponse beforeRouting(const httplib::Request& request, httplib::Response& response) {
  const bool isKnown = request.method == "GET" || request.method == "HEAD" || request.method == "POST";
  if (!isKnown || request.path.empty() || request.path.front() != '/') {
    response.status = isKnown ? 400 : 405;
    response.set_header("Connection", "close");
    return httplib::Server::HandlerResponse::Handled;
  }
  hideContentEncoding(request);
  return httplib::Server::HandlerResponse::Unhandled;
}

// Only the address may be taken again at once after a restart; two collectors never share a port.
void setSocketOptions(int socket) {
  const int yes = 1;
  (void)::setsockopt(socket, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof(yes));
}

class Server final : public HttpsServer {
 public:
  Server(Collector& collector, Dashboard& dashboard, Uploads& uploads, const std::string& certificatePath,
         const std::string& keyPath)
      : _collector(collector),
        _dashboard(dashboard),
        _uploads(uploads),
        _server(certificatePath.c_str(), keyPath.c_str()) {}

  [[nodiscard]] bool isUsable() const { return _server.is_valid(); }

  void configure() {
    SSL_CTX_set_min_proto_version(_server.ssl_context(), TLS1_2_VERSION);
    _connections.watch(_server.ssl_context());
    _server.new_task_queue = [] { return new httplib::ThreadPool(kThreads); };
    _server.set_socket_options(&setSocketOptions);
    _server.set_tcp_nodelay(true);
    _server.set_keep_alive_max_count(kRequestsPerConnection);
    _server.set_keep_alive_timeout(kKeepAliveSeconds);
    _server.set_read_timeout(kTransferTimeoutSeconds);
    _server.set_write_timeout(kTransferTimeoutSeconds);
    _server.set_payload_max_length(kMaximumUploadBytes);
    _server.set_pre_routing_handler(&beforeRouting);
    addRoutes();
  }

  Result<int> bind(const std::string& address, int port) override {
    const int bound = port == 0 ? _server.bind_to_any_port(address) : (_server.bind_to_port(address, port) ? port : -1);
    if (bound > 0) return bound;
    return failure(
        "collector", 1,
        "cannot listen on " + address + " port " + std::to_string(port) +
            ": the address is not this machine's, or the port is taken or not allowed. --listen names another "
            "address, --port another port; 0 takes one that is free");
  }

  void serve() override {
    _server.listen_after_bind();
    _ended = true;
  }

  void stop() override {
    _collector.stop();
    // The library forgets a stop that comes before it listens.
    while (!_server.is_running() && !_ended) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    _server.stop();
    _connections.endReading();
  }

 private:
  void addRoutes() {
    _server.Get("/(?:storebags|bags)/vindle/([^/]+)", [this](const auto& request, auto& response) {
      const auto since = request.headers.find("If-Modified-Since");
      send(_collector.storebag(request.matches[1], since != request.headers.end() ? &since->second : nullptr),
           response);
    });
    _server.Get("/stats", [this](const auto&, auto& response) { send(_collector.stats(), response); });
    _server.Get("/logdata/([0-9]+)", [this](const auto& request, auto& response) {
      send(_dashboard.logData(request.matches[1]), response);
    });
    _server.Post("/logdata", [this](const httplib::Request& request, httplib::Response& response,
                                    const httplib::ContentReader& reader) {
      takeBody(request, response, reader,
               [&](const std::string& wire) { return _dashboard.postLogData(headersOf(request), wire); });
    });
    _server.Post("/upload", [this](const httplib::Request& request, httplib::Response& response,
                                   const httplib::ContentReader& reader) { takeUpload(request, response, reader); });
    _server.Post("/.*", [this](const httplib::Request& request, httplib::Response& response,
                               const httplib::ContentReader& reader) { takePost(request, response, reader); });
  }

  void takePost(const httplib::Request& request, httplib::Response& response, const httplib::ContentReader& reader) {
    takeBody(request, response, reader,
             [&](const std::string& wire) { return _collector.post(request.path, headersOf(request), wire); });
  }

  void takeUpload(const httplib::Request& request, httplib::Response& response, const httplib::ContentReader& reader) {
    const auto upload = _uploads.begin();
    const bool whole = reader([&](const char* bytes, std::size_t count) { return upload->take({bytes, count}); });
    send(_uploads.end(*upload, whole, request.target), response);
    if (!whole) response.set_header("Connection", "close");
  }

  template <class Take>
  void takeBody(const httplib::Request& request, httplib::Response& response, const httplib::ContentReader& reader,
                const Take& take) {
    std::string wire;
    const bool whole = reader([&wire](const char* bytes, std::size_t count) {
      if (wire.size() + count > PostBounds{}.wireBytes) return false;
      wire.append(bytes, count);
      return true;
    });
    send(whole ? take(wire) : _collector.unreadablePost(request.path), response);
    if (!whole) response.set_header("Connection", "close");
  }

  Collector& _collector;
  Dashboard& _dashboard;
  Uploads& _uploads;
  TlsConnections _connections;
  httplib::SSLServer _server;
  std::atomic<bool> _ended = false;
};

}  // namespace

Result<std::unique_ptr<HttpsServer>> HttpsServer::make(Collector& collector, Dashboard& dashboard, Uploads& uploads,
                                                       const std::string& certificatePath, const std::string& keyPath) {
  auto server = std::make_unique<Server>(collector, dashboard, uploads, certificatePath, keyPath);
  if (!server->isUsable()) {
    return failure("collector", 2,
                   "cannot use the certificate " + certificatePath + " with the key " + keyPath +
                       ": a file cannot be read, or they do not belong together");
  }
  server->configure();
  return server;
}

}  // namespace velk::collector
