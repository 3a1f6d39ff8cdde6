#include "tests/support/TlsTestServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zlib.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <set>
#include <thread>

#include "foundation/Text.h"
#include "platform/FileDescriptor.h"
#include "platform/Lock.h"

namespace velk::test {
namespace {

template <class Type, void (*Free)(Type*)>
struct Freer {
  void operator()(Type* object) const { Free(object); }
};
using Key = std::unique_ptr<EVP_PKEY, Freer<EVP_PKEY, EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Freer<X509, X509_free>>;
using Context = std::unique_ptr<SSL_CTX, Freer<SSL_CTX, SSL_CTX_free>>;
using Ssl = std::unique_ptr<SSL, Freer<SSL, SSL_free>>;

void require(bool condition, const char* what) {
  if (condition) return;
  std::fprintf(stderr, "test server: %s failed\n", what);
  std::abort();
}

void addExtension(X509* certificate, X509* issuer, int kind, const char* value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, kind, value);
  require(extension != nullptr && X509_add_ext(certificate, extension, -1) == 1, "certificate extension");
  X509_EXTENSION_free(extension);
}

/// Signed by `issuerKey` in the name of `issuer` (null: by itself).
Certificate makeCertificate(const char* name, EVP_PKEY* key, X509* issuer, EVP_PKEY* issuerKey) {
  Certificate certificate(X509_new());
  X509_set_version(certificate.get(), 2);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate.get()), issuer != nullptr ? 2 : 1);
  X509_gmtime_adj(X509_getm_notBefore(certificate.get()), -3600);
  X509_gmtime_adj(X509_getm_notAfter(certificate.get()), 86400);
  X509_set_pubkey(certificate.get(), key);
  X509_NAME_add_entry_by_txt(X509_get_subject_name(certificate.get()), "CN", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char*>(name), -1, -1, 0);
  X509* signer = issuer != nullptr ? issuer : certificate.get();
  X509_set_issuer_name(certificate.get(), X509_get_subject_name(signer));
  if (issuer == nullptr) {
    addExtension(certificate.get(), signer, NID_basic_constraints, "critical,CA:TRUE");
    addExtension(certificate.get(), signer, NID_key_usage, "critical,keyCertSign,cRLSign");
  } else {
    addExtension(certificate.get(), signer, NID_subject_alt_name, "DNS:localhost,IP:127.0.0.1,IP:::1,IP:192.0.2.1");
  }
  require(X509_sign(certificate.get(), issuerKey, EVP_sha256()) > 0, "signing");
  return certificate;
}

std::string writeCa(X509* ca) {
  std::string path = "/tmp/velk-test-ca-XXXXXX";
  FILE* file = ::fdopen(::mkstemp(path.data()), "w");
  require(file != nullptr && PEM_write_X509(file, ca) == 1, "writing the CA");
  std::fclose(file);
  return path;
}

/// Bytes in and out of one connection, encrypted or not.
class Stream {
 public:
  Stream(int socket, SSL_CTX* context) : _socket(socket) {
    if (context == nullptr) return;
    _ssl.reset(SSL_new(context));
    SSL_set_fd(_ssl.get(), socket);
  }
  bool accept() { return !_ssl || SSL_accept(_ssl.get()) == 1; }
  bool read(std::string& into) {
    char buffer[16384];
    const auto count = _ssl ? SSL_read(_ssl.get(), buffer, sizeof buffer)
                            : static_cast<int>(::recv(_socket, buffer, sizeof buffer, 0));
    if (count <= 0) return false;
    into.append(buffer, static_cast<std::size_t>(count));
    return true;
  }
  bool write(std::string_view bytes) {
    while (!bytes.empty()) {
      const auto size = std::min<std::size_t>(bytes.size(), 65536);
      const auto count = _ssl ? SSL_write(_ssl.get(), bytes.data(), static_cast<int>(size))
                              : static_cast<int>(::send(_socket, bytes.data(), size, MSG_NOSIGNAL));
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return true;
  }
  void close() {
    if (_ssl) SSL_shutdown(_ssl.get());
  }

 private:
  const int _socket;
  Ssl _ssl;
};

bool parseHead(std::string_view head, TlsTestServer::Request& request) {
  const auto lines = split(head, '\n');
  const auto words = split(lines.front(), ' ');
  if (words.size() < 3) return false;
  request.method = words[0];
  request.target = words[1];
  for (std::size_t i = 1; i < lines.size(); ++i) {
    auto line = lines[i];
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    const auto colon = line.find(':');
    if (colon == std::string_view::npos) continue;
    auto value = line.substr(colon + 1);
    while (!value.empty() && value.front() == ' ') value.remove_prefix(1);
    request.headers.emplace_back(line.substr(0, colon), value);
  }
  return true;
}

/// Reads one request with a body of a stated length; `buffer` keeps what came behind it.
bool readRequest(Stream& stream, std::string& buffer, TlsTestServer::Request& request) {
  std::size_t end;
  while ((end = buffer.find("\r\n\r\n")) == std::string::npos) {
    if (!stream.read(buffer)) return false;
  }
  if (!parseHead(std::string_view(buffer).substr(0, end), request)) return false;
  buffer.erase(0, end + 4);
  const auto* length = request.header("Content-Length");
  const std::size_t size = length != nullptr ? std::strtoull(length->c_str(), nullptr, 10) : 0;
  while (buffer.size() < size) {
    if (!stream.read(buffer)) return false;
  }
  request.body = buffer.substr(0, size);
  buffer.erase(0, size);
  return true;
}

std::string serialised(const TlsTestServer::Response& response) {
  std::string text = "HTTP/1.1 " + std::to_string(response.status) + " Test\r\n";
  for (const auto& [name, value] : response.headers) text += name + ": " + value + "\r\n";
  if (response.status != 304) text += "Content-Length: " + std::to_string(response.body.size()) + "\r\n";
  return text + "\r\n" + response.body;
}

}  // namespace

const std::string* TlsTestServer::Request::header(std::string_view name) const {
  for (const auto& header : headers) {
    if (equalsIgnoringCase(header.first, name)) return &header.second;
  }
  return nullptr;
}

class TlsTestServer::Implementation {
 public:
  Implementation(bool encrypted, bool listens, std::string at) : address(std::move(at)) {
    if (encrypted) makeContext();
    bind();
    if (listens) startListening();
  }

  ~Implementation() {
    {
      Guard guard(lock);
      _stopping = true;
    }
    changed.notifyAll();
    ::shutdown(_listener.get(), SHUT_RDWR);
    if (_acceptor.joinable()) _acceptor.join();
    closeConnections();
    for (auto& thread : _threads) thread.join();
    if (!caFile.empty()) ::unlink(caFile.c_str());
  }

  void startListening() {
    require(::listen(_listener.get(), 128) == 0, "listening");
    _acceptor = std::thread([this] { acceptConnections(); });
  }

  void closeConnections() {
    Guard guard(lock);
    for (const int socket : _sockets) ::shutdown(socket, SHUT_RDWR);
  }

  [[nodiscard]] bool isEncrypted() const { return _context != nullptr; }

  const std::string address;
  int port = 0;
  std::string caFile;
  mutable Lock lock;
  mutable Condition changed;
  Handler handler VELK_GUARDED_BY(lock);
  std::vector<Request> requests VELK_GUARDED_BY(lock);
  int connectionCount VELK_GUARDED_BY(lock) = 0;

 private:
  void makeContext() {
    const Key caKey(EVP_EC_gen("P-256"));
    // Of its own, so that a program may believe several.
    static std::atomic<int> number{0};
    const std::string name = "Test CA " + std::to_string(++number);
    const auto ca = makeCertificate(name.c_str(), caKey.get(), nullptr, caKey.get());
    const Key key(EVP_EC_gen("P-256"));
    const auto certificate = makeCertificate("localhost", key.get(), ca.get(), caKey.get());
    caFile = writeCa(ca.get());
    _context.reset(SSL_CTX_new(TLS_server_method()));
    SSL_CTX_use_certificate(_context.get(), certificate.get());
    SSL_CTX_use_PrivateKey(_context.get(), key.get());
  }

  void bind() {
    _listener = FileDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in name{};
    name.sin_family = AF_INET;
    ::inet_pton(AF_INET, address.c_str(), &name.sin_addr);
    socklen_t size = sizeof name;
    auto* generic = reinterpret_cast<sockaddr*>(&name);
    const int allowed = 1;
    ::setsockopt(_listener.get(), IPPROTO_IP, IP_FREEBIND, &allowed, sizeof allowed);
    require(::bind(_listener.get(), generic, size) == 0, "taking a port");
    ::getsockname(_listener.get(), generic, &size);
    port = ntohs(name.sin_port);
  }

  void acceptConnections() {
    for (;;) {
      const int socket = ::accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC);
      Guard guard(lock);
      if (socket < 0 || _stopping) {
        if (socket >= 0) ::close(socket);
        return;
      }
      _sockets.insert(socket);
      _threads.emplace_back([this, socket, number = ++connectionCount] { serve(socket, number); });
    }
  }

  void serve(int socket, int number) {
    ignorePipeSignals();
    {
      Stream stream(socket, _context.get());
      std::string buffer;
      if (stream.accept()) {
        while (serveOne(stream, buffer, number)) {
        }
        stream.close();
      }
    }
    Guard guard(lock);
    _sockets.erase(socket);
    ::close(socket);
  }

  // A peer that hangs up must not end the test program.
  static void ignorePipeSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
  }

  bool serveOne(Stream& stream, std::string& buffer, int number) {
    Request request;
    if (!readRequest(stream, buffer, request)) return false;
    request.connection = number;
    Handler current;
    {
      Guard guard(lock);
      requests.push_back(request);
      current = handler;
    }
    changed.notifyAll();
    const auto response = current ? current(request) : Response{};
    if (!waitUnlessStopping(response.delay)) return false;
    if (response.silent) return stream.read(buffer);
    if (response.raw.empty()) return stream.write(serialised(response));
    stream.write(response.raw);
    return false;
  }

  bool waitUnlessStopping(Duration delay) {
    const auto deadline = std::chrono::steady_clock::now() + delay;
    Guard guard(lock);
    while (!_stopping && std::chrono::steady_clock::now() < deadline) changed.waitUntil(lock, deadline);
    return !_stopping;
  }

  FileDescriptor _listener;
  Context _context;
  std::thread _acceptor;
  // Joined after the acceptor has ended.
  std::vector<std::thread> _threads;
  std::set<int> _sockets VELK_GUARDED_BY(lock);
  bool _stopping VELK_GUARDED_BY(lock) = false;
};

TlsTestServer::TlsTestServer(bool encrypted, bool listens, std::string address)
    : _implementation(std::make_unique<Implementation>(encrypted, listens, std::move(address))) {}
TlsTestServer::~TlsTestServer() = default;

void TlsTestServer::startListening() { _implementation->startListening(); }

int TlsTestServer::port() const { return _implementation->port; }

std::string TlsTestServer::url(std::string_view path) const {
  std::string url = _implementation->isEncrypted() ? "https" : "http";
  url.append("://").append(_implementation->address).append(":").append(std::to_string(port())).append(path);
  return url;
}

const std::string& TlsTestServer::caFile() const { return _implementation->caFile; }

void TlsTestServer::setHandler(Handler handler) {
  Guard guard(_implementation->lock);
  _implementation->handler = std::move(handler);
}

void TlsTestServer::setResponse(Response response) {
  setHandler([response = std::move(response)](const Request&) { return response; });
}

std::vector<TlsTestServer::Request> TlsTestServer::requests() const {
  Guard guard(_implementation->lock);
  return _implementation->requests;
}

bool TlsTestServer::waitForRequests(std::size_t count, Duration limit) const {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(_implementation->lock);
  while (_implementation->requests.size() < count) {
    if (!_implementation->changed.waitUntil(_implementation->lock, deadline)) {
      return _implementation->requests.size() >= count;
    }
  }
  return true;
}

int TlsTestServer::connectionCount() const {
  Guard guard(_implementation->lock);
  return _implementation->connectionCount;
}

void TlsTestServer::closeConnections() { _implementation->closeConnections(); }

std::string TlsTestServer::gunzip(std::string_view compressed) {
  z_stream stream{};
  if (inflateInit2(&stream, 15 + 16) != Z_OK) return {};
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  stream.avail_in = static_cast<uInt>(compressed.size());
  std::string text;
  int status = Z_OK;
  while (status == Z_OK) {
    char buffer[16384];
    stream.next_out = reinterpret_cast<Bytef*>(buffer);
    stream.avail_out = sizeof buffer;
    status = inflate(&stream, Z_NO_FLUSH);
    text.append(buffer, sizeof buffer - stream.avail_out);
  }
  inflateEnd(&stream);
  return status == Z_STREAM_END ? text : std::string();
}

}  // namespace velk::test
