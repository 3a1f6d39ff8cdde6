#include "bench/BenchSink.h"

#include <arpa/inet.h>
#include <netinet/tcp.h>
#include <signal.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zlib.h>

#include <cstdio>
#include <cstdlib>
#include <set>
#include <thread>
#include <unordered_set>

#include "bench/BenchCertificate.h"
#include "bench/SampleEvents.h"

namespace velk::bench {

namespace {

struct SslFreer {
  void operator()(SSL* ssl) const { SSL_free(ssl); }
};
using Ssl = std::unique_ptr<SSL, SslFreer>;

struct Head {
  bool isGet = false;
  bool isCompressed = false;
  std::size_t bodyBytes = 0;
};

/// `text` is the request's head with its last empty line.
Head parsed(const std::string& text) {
  Head head;
  head.isGet = text.compare(0, 4, "GET ") == 0;
  for (std::size_t at = text.find("\r\n"); at != std::string::npos; at = text.find("\r\n", at)) {
    at += 2;
    const char* line = text.c_str() + at;
    if (strncasecmp(line, "Content-Length:", 15) == 0) head.bodyBytes = std::strtoull(line + 15, nullptr, 10);
    if (strncasecmp(line, "Content-Encoding: gzip", 22) == 0) head.isCompressed = true;
  }
  return head;
}

std::string gunzipped(const std::string& compressed) {
  z_stream stream{};
  std::string text;
  if (inflateInit2(&stream, 15 + 16) != Z_OK) return text;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  stream.avail_in = static_cast<uInt>(compressed.size());
  int status = Z_OK;
  while (status == Z_OK) {
    char buffer[65536];
    stream.next_out = reinterpret_cast<Bytef*>(buffer);
    stream.avail_out = sizeof buffer;
    status = inflate(&stream, Z_NO_FLUSH);
    text.append(buffer, sizeof buffer - stream.avail_out);
  }
  inflateEnd(&stream);
  return status == Z_STREAM_END ? text : std::string();
}

/// The number behind `"key":`, from `at` on; moves `at` behind it. Compact JSON only.
bool nextNumber(const std::string& json, const char* quotedKey, std::size_t& at, double& number) {
  const std::size_t found = json.find(quotedKey, at);
  if (found == std::string::npos) return false;
  const char* begin = json.c_str() + found + std::char_traits<char>::length(quotedKey);
  char* end = nullptr;
  number = std::strtod(begin, &end);
  at = static_cast<std::size_t>(end - json.c_str());
  return true;
}

}  // namespace

struct BenchSink::Server {
  Server(BenchSink& owner, const std::string& caFile) : sink(owner), context(makeServerContext(caFile)) {
    listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    auto* generic = reinterpret_cast<sockaddr*>(&address);
    if (::bind(listener, generic, size) != 0 || ::listen(listener, 128) != 0) {
      std::perror("bench: listening on loopback");
      std::exit(71);
    }
    ::getsockname(listener, generic, &size);
    port = ntohs(address.sin_port);
    acceptor = std::thread([this] { acceptConnections(); });
  }

  ~Server() {
    ::shutdown(listener, SHUT_RDWR);
    acceptor.join();
    {
      Guard guard(lock);
      for (const int socket : sockets) ::shutdown(socket, SHUT_RDWR);
    }
    for (auto& thread : threads) thread.join();
    ::close(listener);
  }

  void acceptConnections() {
    for (;;) {
      const int socket = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
      if (socket < 0) return;
      const int yes = 1;
      ::setsockopt(socket, IPPROTO_TCP, TCP_NODELAY, &yes, sizeof yes);
      ++sink._connections;
      Guard guard(lock);
      sockets.insert(socket);
      threads.emplace_back([this, socket] { serve(socket); });
    }
  }

  void serve(int socket) {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    {
      const Ssl ssl(SSL_new(context.get()));
      SSL_set_fd(ssl.get(), socket);
      std::string buffer;
      if (SSL_accept(ssl.get()) == 1) {
        while (serveOne(*ssl, buffer)) {
        }
      }
    }
    Guard guard(lock);
    sockets.erase(socket);
    ::close(socket);
  }

  static bool fill(SSL& ssl, std::string& buffer) {
    char bytes[16384];
    const int count = SSL_read(&ssl, bytes, sizeof bytes);
    if (count <= 0) return false;
    buffer.append(bytes, static_cast<std::size_t>(count));
    return true;
  }

  bool serveOne(SSL& ssl, std::string& buffer) {
    std::size_t end;
    while ((end = buffer.find("\r\n\r\n")) == std::string::npos) {
      if (!fill(ssl, buffer)) return false;
    }
    end += 4;
    const Head head = parsed(buffer.substr(0, end));
    while (buffer.size() < end + head.bodyBytes) {
      if (!fill(ssl, buffer)) return false;
    }
    if (head.isGet) return answerStorebag(ssl, buffer, end);
    sink.take({buffer.substr(end, head.bodyBytes), head.isCompressed, steadySeconds()}, end);
    buffer.erase(0, end + head.bodyBytes);
    static constexpr std::string_view kAnswer = "HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n";
    return SSL_write(&ssl, kAnswer.data(), static_cast<int>(kAnswer.size())) > 0;
  }

  bool answerStorebag(SSL& ssl, std::string& buffer, std::size_t end) const {
    buffer.erase(0, end);
    const std::string answer =
        "HTTP/1.1 200 OK\r\nCache-Control: max-age=600\r\nContent-Length: " + std::to_string(sink._storebag.size()) +
        "\r\n\r\n" + sink._storebag;
    return SSL_write(&ssl, answer.data(), static_cast<int>(answer.size())) > 0;
  }

  BenchSink& sink;
  const ServerContext context;
  int listener = -1;
  int port = 0;
  std::thread acceptor;
  std::vector<std::thread> threads;  // the acceptor's, then the destructor's
  Lock lock;
  std::set<int> sockets VELK_GUARDED_BY(lock);
};

BenchSink::BenchSink(const std::string& caFile) : _server(std::make_unique<Server>(*this, caFile)) {}
BenchSink::~BenchSink() = default;

std::string BenchSink::url(const std::string& path) const {
  return "https://127.0.0.1:" + std::to_string(_server->port) + path;
}

void BenchSink::take(Arrival arrival, std::size_t headBytes) {
  _bytes += arrival.body.size() + headBytes;
  ++_posts;
  Guard guard(_lock);
  _arrivals.push_back(std::move(arrival));
}

BenchSink::Counted BenchSink::count() const {
  Counted counted;
  std::unordered_set<std::uint64_t> seen;
  Guard guard(_lock);
  for (const auto& arrival : _arrivals) {
    const std::string json = arrival.isCompressed ? gunzipped(arrival.body) : arrival.body;
    counted.jsonBytes += json.size();
    counted.lastArrival = std::max(counted.lastArrival, arrival.at);
    std::size_t at = 0;
    double client = 0;
    double sequence = 0;
    double sentAt = 0;
    while (nextNumber(json, "\"client\":", at, client) && nextNumber(json, "\"sequence\":", at, sequence) &&
           nextNumber(json, "\"sentAt\":", at, sentAt)) {
      const auto identity = (static_cast<std::uint64_t>(client) << 48) | static_cast<std::uint64_t>(sequence);
      if (!seen.insert(identity).second) {
        ++counted.duplicates;
        continue;
      }
      ++counted.events;
      counted.latencies.push_back(arrival.at - sentAt);
    }
  }
  return counted;
}

}  // namespace velk::bench
