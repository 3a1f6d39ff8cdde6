// An HTTP session between a real server and a delegate that remembers.
#pragma once

#include <memory>
#include <string>

#include "platform/HttpSession.h"
#include "tests/support/TlsTestServer.h"
#include "tests/unit/platform/HttpRecorder.h"

namespace velk {

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
    request.timeout = std::chrono::seconds(20);
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

  test::TlsTestServer _server;
  std::shared_ptr<PumpedQueue> _queue = std::make_shared<PumpedQueue>();
  std::shared_ptr<Recorder> _delegate = std::make_shared<Recorder>();
  std::unique_ptr<HttpSessionService> _service;
  std::shared_ptr<HttpSession> _session;
};

}  // namespace velk
