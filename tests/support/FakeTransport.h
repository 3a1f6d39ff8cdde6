// A transport that remembers what it is asked to post, and answers when the test says so.
#pragma once

#include <atomic>
#include <cstddef>
#include <vector>

#include "connectivity/ConnectivityInterface.h"
#include "platform/Lock.h"

namespace velk::test {

/// Any thread. Answers run on the thread that gives them.
class FakeTransport : public ReportingSessionConnectivityInterface {
 public:
  FakeTransport();
  ~FakeTransport() override;

  void postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) override;
  void activate() override { ++activations; }
  void waitForRoom(std::uint64_t) override { ++waits; }
  [[nodiscard]] bool takesPosts() const override { return isActive; }

  /// How many requests came so far.
  [[nodiscard]] std::size_t count() const;
  /// A copy of the request; `number` counts from 0 and must be below `count()`.
  [[nodiscard]] HttpRequest request(std::size_t number) const;

  /// Answers a request, once.
  void answer(std::size_t number, int statusCode);
  void fail(std::size_t number, Error error);
  /// Drops a request as a transport without session does: its completion is destroyed uncalled.
  void drop(std::size_t number);

  std::atomic<int> activations{0};
  std::atomic<int> waits{0};
  std::atomic<bool> isActive{true};

 private:
  struct Post {
    HttpRequest request;
    HttpCompletion completion;
  };
  [[nodiscard]] HttpCompletion takeCompletion(std::size_t number);

  mutable Lock _lock;
  std::vector<Post> _posts VELK_GUARDED_BY(_lock);
};

}  // namespace velk::test
