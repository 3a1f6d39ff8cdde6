// Servers that mean no good, or cannot do better: every request to them ends.
#include <arpa/inet.h>
#include <sys/socket.h>

#include <atomic>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

#include "platform/FileDescriptor.h"
#include "tests/unit/platform/HttpFixture.h"

namespace velk {
namespace {

using test::TlsTestServer;
using namespace std::chrono_literals;

/// A listener that does with each connection what it is told, and nothing with those that it was not told to take.
class PlainListener {
 public:
  /// Runs on a thread for each connection, which ends with the call.
  using Serve = std::function<void(PlainListener& self, int socket)>;

  /// Takes no connection at all without `serve`.
  explicit PlainListener(Serve serve = {})
      : _serve(std::move(serve)), _listener(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    auto* const generic = reinterpret_cast<sockaddr*>(&address);
    EXPECT_EQ(::bind(_listener.get(), generic, size), 0);
    EXPECT_EQ(::listen(_listener.get(), 16), 0);
    EXPECT_EQ(::getsockname(_listener.get(), generic, &size), 0);
    _port = ntohs(address.sin_port);
    if (_serve) _acceptor = std::thread([this] { accept(); });
  }
  ~PlainListener() {
    _stopping = true;
    ::shutdown(_listener.get(), SHUT_RDWR);
    if (_acceptor.joinable()) _acceptor.join();
    for (auto& thread : _threads) thread.join();
  }
  PlainListener(const PlainListener&) = delete;
  PlainListener& operator=(const PlainListener&) = delete;

  [[nodiscard]] std::string url() const { return "http://127.0.0.1:" + std::to_string(_port) + "/"; }
  /// Bytes again and again until nobody takes them, or the listener ends.
  void repeat(int socket, const std::string& bytes, Duration pause) {
    while (!_stopping && ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL) > 0)
      std::this_thread::sleep_for(pause);
  }

 private:
  void accept() {
    for (;;) {
      FileDescriptor socket(::accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
      if (!socket) return;
      _threads.emplace_back([this, socket = std::move(socket)] { _serve(*this, socket.get()); });
    }
  }

  const Serve _serve;
  const FileDescriptor _listener;
  int _port = 0;
  std::atomic<bool> _stopping{false};
  std::vector<std::thread> _threads;
  std::thread _acceptor;
};

class HttpHostileServerTest : public HttpSessionTest {
 protected:
  [[nodiscard]] HttpRequest plainRequest(const std::string& url, Duration timeout = std::chrono::seconds(20)) const {
    auto get = request();
    get.url = url;
    get.requiresHttps = false;
    get.timeout = timeout;
    return get;
  }
};

TEST_F(HttpHostileServerTest, AServerThatTakesNoConnectionEndsTheTaskAtItsTimeout) {
  PlainListener deaf;
  const auto& outcome = fetch(plainRequest(deaf.url(), 200ms));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
}

TEST_F(HttpHostileServerTest, AServerThatSaysNothingOnAnEncryptedLineEndsTheTaskAtItsTimeout) {
  PlainListener deaf;
  auto get = request();
  get.url = "https" + deaf.url().substr(4);
  get.timeout = 200ms;
  const auto& outcome = fetch(std::move(get));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
}

TEST_F(HttpHostileServerTest, AServerThatClosesAtOnceIsAnErrorAtOnce) {
  PlainListener closing([](PlainListener&, int) {});
  for (int number = 0; number < 20; ++number) {
    const auto& outcome = fetch(plainRequest(closing.url()));
    ASSERT_TRUE(outcome.error);
    EXPECT_NE(outcome.error->code, 28) << "it is no question of time";
  }
}

TEST_F(HttpHostileServerTest, InterimAnswersWithoutEndAreTooMany) {
  PlainListener interim(
      [](PlainListener& self, int socket) { self.repeat(socket, "HTTP/1.1 102 Processing\r\nX: y\r\n\r\n", 0s); });
  const auto& outcome = fetch(plainRequest(interim.url()));
  ASSERT_TRUE(outcome.error);
  EXPECT_NE(outcome.error->code, 28) << "it is no question of time";
  EXPECT_EQ(outcome.response, nullptr);
}

TEST_F(HttpHostileServerTest, AnswersThatTrickleEndAtTheTimeout) {
  PlainListener head([](PlainListener& self, int socket) { self.repeat(socket, "H", 5ms); });
  EXPECT_TRUE(fetch(plainRequest(head.url(), 200ms)).error);

  PlainListener body([](PlainListener& self, int socket) {
    const std::string begin = "HTTP/1.1 200 OK\r\nContent-Length: 1000000\r\n\r\n";
    static_cast<void>(!::send(socket, begin.data(), begin.size(), MSG_NOSIGNAL));  // the client may have gone by then
    self.repeat(socket, "x", 5ms);
  });
  const auto& outcome = fetch(plainRequest(body.url(), 200ms));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
}

TEST_F(HttpHostileServerTest, ABodyThatNobodyReadsEndsTheTaskAtItsTimeout) {
  PlainListener deaf;
  auto post = plainRequest(deaf.url(), 300ms);
  post.method = "POST";
  post.body = std::make_shared<const std::string>(std::size_t{32} * 1024 * 1024, 'x');
  const auto& outcome = fetch(std::move(post));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
}

// Each has a line of its own, and what is kept of it goes with its last request.
TEST_F(HttpHostileServerTest, HundredsOfServersAreServedAtOnce) {
  std::vector<std::unique_ptr<PlainListener>> silent;
  for (int number = 0; number < 200; ++number) {
    silent.push_back(std::make_unique<PlainListener>());
    start(plainRequest(silent.back()->url(), 2s), "silent");
  }
  EXPECT_FALSE(fetch(request()).error);
  ASSERT_TRUE(waitForCompletions(201));
  EXPECT_EQ(_delegate->outcomes["silent"].completions, 200);
}

TEST_F(HttpHostileServerTest, TheEndOfTheServiceWaitsForNoServer) {
  PlainListener deaf;
  for (int number = 0; number < 20; ++number) start(plainRequest(deaf.url(), 3600s), "task");
  _service->stop();
  ASSERT_TRUE(waitForCompletions(20));
}

TEST_F(HttpHostileServerTest, ASilentServerEndsTheTaskAtItsTimeout) {
  _server.setResponse({.silent = true});
  auto get = request();
  get.timeout = 200ms;
  const auto& outcome = fetch(std::move(get));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
  EXPECT_EQ(outcome.response, nullptr);
}

TEST_F(HttpHostileServerTest, ARefusedConnectionIsAnErrorAtOnce) {
  HttpSessionConfiguration configuration;
  configuration.waitsForConnectivity = true;
  makeSession(configuration);
  auto get = request();
  {
    TlsTestServer gone;
    get.url = gone.url();
  }
  const auto& outcome = fetch(std::move(get));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 7);
}

TEST_F(HttpHostileServerTest, ALongAnswerEndsTheTask) {
  HttpSessionConfiguration configuration;
  configuration.maximumResponseBytes = 1000;
  makeSession(configuration);
  _server.setResponse({.body = std::string(1000, 'x')});
  EXPECT_FALSE(fetch(request()).error);
  _server.setResponse({.body = std::string(1001, 'x')});
  auto outcome = fetch(request());
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 63);
  // A length that is not announced is noticed as it comes.
  _server.setResponse({.raw = "HTTP/1.1 200 OK\r\n\r\n" + std::string(5000, 'x')});
  outcome = fetch(request());
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 63);
}

// The event behind the post has arrived: the rest of the answer is of no use.
TEST_F(HttpHostileServerTest, AnAnswerThatIsDiscardedEndsWithItsStatusHoweverItGoesOn) {
  HttpSessionConfiguration configuration;
  configuration.maximumResponseBytes = 1000;
  makeSession(configuration);
  auto post = request();
  post.method = "POST";
  post.discardsResponseBody = true;
  post.timeout = 2s;
  PlainListener endless([](PlainListener& self, int socket) {
    self.repeat(socket, "HTTP/1.1 503 No\r\n\r\n" + std::string(100'000, 'x'), 0s);
  });
  auto plain = post;
  plain.url = endless.url();
  plain.requiresHttps = false;
  EXPECT_FALSE(fetch(plain).error);
  EXPECT_EQ(_delegate->outcomes["task"].response->statusCode, 503);
  for (const auto& answer :
       {TlsTestServer::Response{.body = std::string(8'000'000, 'x')}, TlsTestServer::Response{.body = "short"},
        TlsTestServer::Response{.raw = "HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nonly this"}}) {
    _server.setResponse(answer);
    const auto& outcome = fetch(post);
    EXPECT_FALSE(outcome.error) << outcome.error->description;
    EXPECT_EQ(outcome.response->statusCode, 200);
    EXPECT_EQ(outcome.body, "") << "nothing of it is copied";
  }
  _server.setResponse({.raw = "HTTP/1.1"});
  EXPECT_TRUE(fetch(post).error) << "without a status nothing has arrived";
}

TEST_F(HttpHostileServerTest, SurvivesHostileServers) {
  std::string manyHeaders = "HTTP/1.1 200 OK\r\n";
  for (int i = 0; i < 20'000; ++i) manyHeaders += "X-" + std::to_string(i) + ": value\r\n";
  const std::vector<std::string> answers = {
      "\x01\x02garbage that is no HTTP\r\n\r\n",
      "HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nonly this",
      "HTTP/1.1 200 OK\r\nX: " + std::string(600'000, 'x') + "\r\n\r\n",
      manyHeaders + "\r\n",
      "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\nzz\r\nbroken",
      "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n5\r\nhe",
      "HTTP/1.1 200 OK\r\nContent-Length: -1\r\n\r\n",
      "HTTP/9.9 abc\r\n\r\n",
      "HTTP/1.1",
  };
  for (const auto& answer : answers) {
    _server.setResponse({.raw = answer});
    EXPECT_TRUE(fetch(request()).error) << answer.substr(0, 60);
  }
  _server.setResponse({.body = "fine"});
  _delegate->outcomes.clear();
  EXPECT_EQ(fetch(request()).body, "fine");
}

}  // namespace
}  // namespace velk
