// A small HTTPS server for tests: loopback, a port of the system's choice, and a throw-away CA of its own, made at
// run time. It also plays servers that misbehave: garbage, silence, answers that break off.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/TimeValue.h"

namespace velk::test {

/// Serves until it is destroyed; the destructor ends open connections and joins its threads (one a connection).
/// All methods may be called from any thread.
class TlsTestServer {
 public:
  struct Request {
    std::string method;
    /// Path and query, as received.
    std::string target;
    std::vector<std::pair<std::string, std::string>> headers;
    /// As received: see `gunzip`.
    std::string body;
    /// Which connection it came over, from 1.
    int connection = 0;

    /// The value of the first header of that name (in any case), or null.
    [[nodiscard]] const std::string* header(std::string_view name) const;
  };

  struct Response {
    int status = 200;
    std::string body;
    /// Content-Length is added.
    std::vector<std::pair<std::string, std::string>> headers;
    /// Passes before the first byte is sent. The end of the server cuts it short.
    Duration delay{};
    /// When not empty: exactly these bytes are sent instead, and the connection is closed.
    std::string raw;
    /// Nothing is ever sent; the connection stays open.
    bool silent = false;
  };

  /// Runs on the connection's thread; may block for a while.
  using Handler = std::function<Response(const Request&)>;

  /// Where a server in a network namespace of its own may listen: no loopback address, and the certificate names it.
  static constexpr const char* kOtherAddress = "192.0.2.1";

  /// Answers 200 without a body until a handler is set. `encrypted` false: plain http. `listens` false: connections are
  /// refused until `startListening`, while the port is the server's already. `address` need not be there yet.
  explicit TlsTestServer(bool encrypted = true, bool listens = true, std::string address = "127.0.0.1");
  ~TlsTestServer();
  TlsTestServer(const TlsTestServer&) = delete;
  TlsTestServer& operator=(const TlsTestServer&) = delete;

  void startListening();

  [[nodiscard]] int port() const;
  /// "https://ADDRESS:PORT" and the path, which begins with a slash. The certificate also names "localhost".
  [[nodiscard]] std::string url(std::string_view path = "/") const;
  /// A PEM file with the CA that signed the certificate, for SSL_CERT_FILE and the like. Removed with the server.
  [[nodiscard]] const std::string& caFile() const;

  void setHandler(Handler handler);
  /// The answer to every request.
  void setResponse(Response response);

  /// What was received so far, in the order of arrival.
  [[nodiscard]] std::vector<Request> requests() const;
  /// False when fewer than `count` requests came in time.
  [[nodiscard]] bool waitForRequests(std::size_t count, Duration limit = std::chrono::seconds(20)) const;
  /// How many connections were accepted.
  [[nodiscard]] int connectionCount() const;
  /// Closes the connections that are open now, and goes on listening.
  void closeConnections();

  /// The text of a gzip file; empty when it is none.
  [[nodiscard]] static std::string gunzip(std::string_view compressed);

 private:
  class Implementation;
  std::unique_ptr<Implementation> _implementation;
};

}  // namespace velk::test
