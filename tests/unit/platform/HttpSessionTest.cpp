#include "platform/HttpSession.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <thread>

#include "tests/support/TlsTestServer.h"
#include "tests/unit/platform/HttpRecorder.h"

namespace velk {
namespace {

using test::TlsTestServer;
using namespace std::chrono_literals;

class HttpSessionTest : public testing::Test {
 protected:
  HttpSessionTest() { trust(_server.caFile()); }
  ~HttpSessionTest() override {
    _session.reset();
    _service.reset();
    _queue->runPending();
  }

  void trust(std::string caFile, HttpSessionConfiguration configuration = {}) {
    _session.reset();
    HttpTrust trusted;
    trusted.caFile = std::move(caFile);
    _service = makeHttpSessionService(std::move(trusted));
    makeSession(std::move(configuration));
  }
  void makeSession(HttpSessionConfiguration configuration) {
    _session = _service->makeSession(std::move(configuration), _delegate, _queue);
  }

  [[nodiscard]] HttpRequest request(std::string_view path = "/") const {
    HttpRequest request;
    request.url = _server.url(path);
    request.timeout = 20s;
    return request;
  }
  void start(HttpRequest request, const std::string& description = "task") {
    auto task = _session->makeDataTask(std::move(request));
    ASSERT_TRUE(task) << task.error().description;
    (*task)->setTaskDescription(description);
    (*task)->resume();
  }
  [[nodiscard]] bool waitForCompletions(int count) {
    return _queue->runUntil([&] { return _delegate->completed >= count; });
  }
  const Recorder::Outcome& fetch(HttpRequest request) {
    const int expected = _delegate->completed + 1;
    start(std::move(request));
    EXPECT_TRUE(waitForCompletions(expected));
    return _delegate->outcomes["task"];
  }

  TlsTestServer _server;
  std::shared_ptr<PumpedQueue> _queue = std::make_shared<PumpedQueue>();
  std::shared_ptr<Recorder> _delegate = std::make_shared<Recorder>();
  std::unique_ptr<HttpSessionService> _service;
  std::shared_ptr<HttpSession> _session;
};

TEST_F(HttpSessionTest, TellsResponseThenDataThenCompletion) {
  _server.setResponse({.status = 200, .body = "hello", .headers = {{"X-One", "1"}}});
  const auto& outcome = fetch(request("/path?query=1"));
  EXPECT_FALSE(outcome.error);
  ASSERT_NE(outcome.response, nullptr);
  EXPECT_EQ(outcome.response->statusCode, 200);
  ASSERT_NE(outcome.response->header("x-one"), nullptr);
  EXPECT_EQ(*outcome.response->header("x-one"), "1");
  EXPECT_EQ(outcome.body, "hello");
  EXPECT_EQ(_delegate->events, (std::vector<std::string>{"task response", "task data", "task completed"}));
  ASSERT_EQ(_server.requests().size(), 1u);
  EXPECT_EQ(_server.requests()[0].method, "GET");
  EXPECT_EQ(_server.requests()[0].target, "/path?query=1");
  EXPECT_EQ(_server.requests()[0].header("User-Agent"), nullptr);
}

TEST_F(HttpSessionTest, AnErrorStatusIsNoError) {
  _server.setResponse({.status = 503});
  const auto& outcome = fetch(request());
  EXPECT_FALSE(outcome.error);
  ASSERT_NE(outcome.response, nullptr);
  EXPECT_EQ(outcome.response->statusCode, 503);
}

TEST_F(HttpSessionTest, PostsTheBodyAsItIs) {
  auto post = request("/post");
  post.method = "POST";
  std::string body(300'000, 'x');
  body[5] = '\0';
  post.body = std::make_shared<const std::string>(body);
  post.setHeader("Content-Type", "application/json");
  post.setHeader("Content-Length", "1");
  EXPECT_FALSE(fetch(std::move(post)).error);
  ASSERT_EQ(_server.requests().size(), 1u);
  const auto received = _server.requests()[0];
  EXPECT_EQ(received.method, "POST");
  EXPECT_EQ(received.body, body);
  EXPECT_EQ(*received.header("Content-Type"), "application/json");
  EXPECT_EQ(received.header("Expect"), nullptr);
  EXPECT_EQ(_delegate->sent, 300'000);
  EXPECT_EQ(_delegate->toSend, 300'000);
}

TEST_F(HttpSessionTest, PostsWithoutBodyAndContentType) {
  auto post = request();
  post.method = "POST";
  EXPECT_FALSE(fetch(std::move(post)).error);
  const auto received = _server.requests().at(0);
  EXPECT_EQ(received.method, "POST");
  EXPECT_EQ(*received.header("Content-Length"), "0");
  EXPECT_EQ(received.header("Content-Type"), nullptr);
}

TEST_F(HttpSessionTest, HeaderValuesLoseControlCharactersAndMayBeEmpty) {
  auto get = request();
  get.headers = {{"X-Evil", "a\r\nX-Injected: 1\tb\x7f"}, {"X-Empty", ""}, {"X-Blank", " \n "}, {"X-Order", "last"}};
  EXPECT_FALSE(fetch(std::move(get)).error);
  const auto received = _server.requests().at(0);
  EXPECT_EQ(*received.header("X-Evil"), "aX-Injected: 1b");
  EXPECT_EQ(received.header("X-Injected"), nullptr);
  ASSERT_NE(received.header("X-Empty"), nullptr);
  EXPECT_EQ(*received.header("X-Empty"), "");
  ASSERT_NE(received.header("X-Blank"), nullptr);
  EXPECT_EQ(*received.header("X-Blank"), "");
  EXPECT_EQ(*received.header("X-Order"), "last");
}

TEST_F(HttpSessionTest, RefusesAServerOfAnUnknownAuthority) {
  trust("");
  const auto& outcome = fetch(request("/secret?token=1"));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->domain, kHttpErrorDomain);
  EXPECT_EQ(outcome.error->code, 60);
  EXPECT_NE(outcome.error->description.find("127.0.0.1"), std::string::npos);
  EXPECT_EQ(outcome.error->description.find("token"), std::string::npos);
  EXPECT_EQ(outcome.response, nullptr);
  EXPECT_TRUE(_server.requests().empty());
}

TEST_F(HttpSessionTest, RefusesACertificateOfAnotherName) {
  auto get = request();
  // A name that resolves to loopback without a name server, and that the certificate does not hold.
  get.url = "https://other.localhost:" + std::to_string(_server.port()) + "/";
  const auto& outcome = fetch(std::move(get));
  ASSERT_TRUE(outcome.error);
  EXPECT_TRUE(_server.requests().empty());
}

TEST_F(HttpSessionTest, DoesNotFollowRedirects) {
  _server.setResponse({.status = 302, .headers = {{"Location", _server.url("/elsewhere")}}});
  const auto& outcome = fetch(request("/first"));
  EXPECT_FALSE(outcome.error);
  EXPECT_EQ(outcome.response->statusCode, 302);
  EXPECT_EQ(_server.requests().size(), 1u);
}

TEST_F(HttpSessionTest, ASilentServerEndsTheTaskAtItsTimeout) {
  _server.setResponse({.silent = true});
  auto get = request();
  get.timeout = 200ms;
  const auto& outcome = fetch(std::move(get));
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
  EXPECT_EQ(outcome.response, nullptr);
}

TEST_F(HttpSessionTest, ARefusedConnectionIsAnErrorAtOnce) {
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

TEST_F(HttpSessionTest, ALongAnswerEndsTheTask) {
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

TEST_F(HttpSessionTest, RequestsOfSeveralSessionsReuseOneConnection) {
  EXPECT_FALSE(fetch(request("/1")).error);
  EXPECT_FALSE(fetch(request("/2")).error);
  makeSession({});
  EXPECT_FALSE(fetch(request("/3")).error);
  EXPECT_EQ(_server.requests().size(), 3u);
  EXPECT_EQ(_server.connectionCount(), 1);
}

TEST_F(HttpSessionTest, AConnectionThatWasClosedIsReplaced) {
  EXPECT_FALSE(fetch(request("/1")).error);
  _server.closeConnections();
  auto post = request("/2");
  post.method = "POST";
  post.body = std::make_shared<const std::string>("body");
  EXPECT_FALSE(fetch(std::move(post)).error);
  EXPECT_EQ(_server.connectionCount(), 2);
}

TEST_F(HttpSessionTest, TasksFinishBeforeTheSessionIsInvalid) {
  _server.setResponse({.body = "late", .delay = 100ms});
  start(request(), "first");
  start(request(), "second");
  _session->finishTasksAndInvalidate();
  EXPECT_FALSE(_session->makeDataTask(request()));
  ASSERT_TRUE(_queue->runUntil([&] { return _delegate->invalid; }));
  EXPECT_EQ(_delegate->completed, 2);
  EXPECT_EQ(_delegate->events.back(), "invalid");
  EXPECT_FALSE(_delegate->outcomes["first"].error);
  EXPECT_EQ(_delegate->outcomes["second"].body, "late");
}

TEST_F(HttpSessionTest, AnInvalidSessionDropsItsDelegate) {
  _session->finishTasksAndInvalidate();
  _session->finishTasksAndInvalidate();
  ASSERT_TRUE(_queue->runUntil([&] { return _delegate->invalid; }));
  _queue->runPending();
  EXPECT_EQ(_delegate.use_count(), 1);
  EXPECT_EQ(_delegate->events.size(), 1u);
}

TEST_F(HttpSessionTest, ATaskThatWasNeverStartedDoesNotHoldTheSession) {
  auto task = _session->makeDataTask(request());
  ASSERT_TRUE(task);
  _session->finishTasksAndInvalidate();
  EXPECT_EQ(_queue->pending(), 0u);
  task->reset();
  EXPECT_TRUE(_queue->runUntil([&] { return _delegate->invalid; }));
}

TEST_F(HttpSessionTest, TheEndOfTheServiceEndsRunningTasksOnce) {
  _server.setResponse({.silent = true});
  start(request(), "running");
  ASSERT_TRUE(_server.waitForRequests(1));
  auto later = _session->makeDataTask(request());
  ASSERT_TRUE(later);
  (*later)->setTaskDescription("later");
  _service.reset();
  (*later)->resume();
  ASSERT_TRUE(waitForCompletions(2));
  _queue->runPending();
  for (const auto* name : {"running", "later"}) {
    EXPECT_EQ(_delegate->outcomes[name].completions, 1);
    ASSERT_TRUE(_delegate->outcomes[name].error);
    EXPECT_NE(_delegate->outcomes[name].error->description.find("ended"), std::string::npos);
  }
}

TEST_F(HttpSessionTest, ManyTasksAtOnceAllEnd) {
  _server.setHandler(
      [](const TlsTestServer::Request& received) { return TlsTestServer::Response{.body = received.target}; });
  for (int i = 0; i < 100; ++i) start(request("/" + std::to_string(i)), std::to_string(i));
  ASSERT_TRUE(waitForCompletions(100));
  for (int i = 0; i < 100; ++i) EXPECT_EQ(_delegate->outcomes[std::to_string(i)].body, "/" + std::to_string(i));
  EXPECT_LE(_server.connectionCount(), 8);
}

TEST_F(HttpSessionTest, AServerGetsEightRequestsAtOnceAndTheRestInOrder) {
  std::atomic<int> underWay{0};
  std::atomic<int> most{0};
  _server.setHandler([&](const TlsTestServer::Request&) {
    const int now = ++underWay;
    int seen = most;
    while (now > seen && !most.compare_exchange_weak(seen, now)) {
    }
    // The first eight answer only when all of them are there.
    for (; most < 8; std::this_thread::yield()) {
    }
    --underWay;
    return TlsTestServer::Response{};
  });
  for (int number = 0; number < 100; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(waitForCompletions(100));
  for (const auto& [name, outcome] : _delegate->outcomes) EXPECT_FALSE(outcome.error) << name;
  EXPECT_EQ(most, 8);
  EXPECT_LE(_server.connectionCount(), 8);
}

TEST_F(HttpSessionTest, ATaskInLineEndsAtItsTimeout) {
  _server.setResponse({.silent = true});
  for (int number = 0; number < 8; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(_server.waitForRequests(8));
  auto late = request();
  late.timeout = 100ms;
  start(std::move(late), "late");
  ASSERT_TRUE(waitForCompletions(1));
  const auto& outcome = _delegate->outcomes["late"];
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
  EXPECT_EQ(outcome.error->description, "127.0.0.1: too many requests before it within the request's time");
  EXPECT_EQ(_server.requests().size(), 8U);
}

TEST_F(HttpSessionTest, BulkStandsInALineOfItsOwn) {
  _server.setHandler([](const TlsTestServer::Request& request) {
    return TlsTestServer::Response{.silent = request.target == "/bulk"};
  });
  auto bulk = request("/bulk");
  bulk.isBulk = true;
  for (int number = 0; number < 20; ++number) start(bulk, std::to_string(number));
  ASSERT_TRUE(_server.waitForRequests(8));
  EXPECT_FALSE(fetch(request("/small")).error);
  EXPECT_EQ(_delegate->completed, 1);
  EXPECT_EQ(_server.requests().size(), 9U) << "no more of the bulk either";
}

TEST_F(HttpSessionTest, TheEndOfTheServiceEndsTasksInLine) {
  _server.setResponse({.silent = true});
  for (int number = 0; number < 20; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(_server.waitForRequests(8));
  _session.reset();
  _service.reset();
  ASSERT_TRUE(waitForCompletions(20));
  for (const auto& [name, outcome] : _delegate->outcomes) EXPECT_TRUE(outcome.error) << name;
}

TEST_F(HttpSessionTest, ASlowDelegateHoldsTheTransferUp) {
  const std::string body(8 * 1024 * 1024, 'x');
  _server.setResponse({.body = body});
  start(request());
  ASSERT_TRUE(_queue->runUntil([&] { return !_delegate->events.empty(); }));
  ASSERT_TRUE(_server.waitForRequests(1));
  // Nobody takes the data: what is handed over stays within the bound, however long that lasts.
  EXPECT_LE(_queue->pending() * 16384, 512u * 1024);
  ASSERT_TRUE(waitForCompletions(1));
  EXPECT_FALSE(_delegate->outcomes["task"].error);
  EXPECT_EQ(_delegate->outcomes["task"].body.size(), body.size());
  EXPECT_LE(_delegate->largestData, 16384u);
}

TEST_F(HttpSessionTest, OnlyHttpsIsSpokenUnlessAllowed) {
  TlsTestServer plain(false);
  auto get = request();
  get.url = plain.url();
  const auto refused = _session->makeDataTask(get);
  ASSERT_FALSE(refused);
  EXPECT_NE(refused.error().description.find("https"), std::string::npos);
  get.requiresHttps = false;
  EXPECT_FALSE(fetch(get).error);
  EXPECT_EQ(plain.requests().size(), 1u);
}

TEST_F(HttpSessionTest, RefusesWhatIsNoHttpAddress) {
  for (const auto* url : {"", "file:///etc/passwd", "ftp://host/", "gopher://host/", "https://", "not an address",
                          "/path", "https://host:port/", "https://a b/"}) {
    auto get = request();
    get.requiresHttps = false;
    get.url = url;
    EXPECT_FALSE(_session->makeDataTask(get)) << url;
  }
}

TEST_F(HttpSessionTest, RefusesNamesOfHeadersAndMethodsThatAreNone) {
  auto get = request();
  get.headers = {{"Bad\r\nName", "1"}};
  EXPECT_FALSE(_session->makeDataTask(get));
  get.headers = {{"", "1"}};
  EXPECT_FALSE(_session->makeDataTask(get));
  get.headers.clear();
  get.method = "GET / HTTP/1.1\r\n";
  EXPECT_FALSE(_session->makeDataTask(get));
}

TEST_F(HttpSessionTest, SurvivesHostileServers) {
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

TEST_F(HttpSessionTest, UploadsAFileThatIsRemovedAtOnce) {
  std::string path = testing::TempDir() + "velk-upload-XXXXXX";
  ::close(::mkstemp(path.data()));
  const std::string contents(100'000, 'u');
  std::ofstream(path) << contents;
  auto post = request();
  post.method = "POST";
  auto task = _session->makeUploadTask(post, path);
  ::unlink(path.c_str());
  ASSERT_TRUE(task);
  (*task)->setTaskDescription("task");
  (*task)->resume();
  ASSERT_TRUE(waitForCompletions(1));
  EXPECT_FALSE(_delegate->outcomes["task"].error);
  EXPECT_EQ(_server.requests().at(0).body, contents);
  EXPECT_FALSE(_session->makeUploadTask(post, path));
  EXPECT_FALSE(_session->makeUploadTask(post, "/dev/null"));
}

TEST(HttpResponseTest, GivesTheLastHeaderOfAName) {
  HttpResponse response;
  response.headers = {{"a", "1"}, {"A", "2"}, {"b", "3"}};
  EXPECT_EQ(*response.header("a"), "2");
  EXPECT_EQ(response.header("c"), nullptr);
}

TEST(HttpRequestTest, SetsAHeaderInItsPlace) {
  HttpRequest request;
  request.setHeader("A", "1");
  request.setHeader("B", "2");
  request.setHeader("a", "3");
  ASSERT_EQ(request.headers.size(), 2u);
  EXPECT_EQ(request.headers[0], (std::pair<std::string, std::string>("A", "3")));
}

}  // namespace
}  // namespace velk
