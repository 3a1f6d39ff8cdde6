// All facilities of the operating system that a daemon's class asks for, faked, in one bundle.
#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "platform/HttpSession.h"
#include "platform/Lock.h"
#include "platform/Platform.h"
#include "tests/support/FakeDeviceInformation.h"
#include "tests/support/FakeLocale.h"
#include "tests/support/FakeRandom.h"
#include "tests/support/FakeUdpSockets.h"
#include "tests/support/FakeUserDefaults.h"
#include "tests/support/ManualScheduler.h"

namespace velk::test {

class FakeConsent : public Consent {
 public:
  [[nodiscard]] bool diagnosticsAndUsageEnabled() const override { return enabled; }
  std::atomic<bool> enabled{true};
};

/// Counts what is held.
class FakeKeepAlive : public KeepAlive {
 public:
  void beginTransaction() override { ++begun; }
  void endTransaction() override { ++ended; }
  [[nodiscard]] int open() const { return begun - ended; }
  std::atomic<int> begun{0};
  std::atomic<int> ended{0};
};

class FakeProcessStatistics : public ProcessStatistics {
 public:
  [[nodiscard]] std::uint64_t anonymousMemory() const override { return memory; }
  std::atomic<std::uint64_t> memory{0};
};

/// Really creates the logs; takes what it is given (removing the file) while `accepts` is true.
class FakeLogSubmission : public LogSubmission {
 public:
  struct Entry {
    std::string path;
    std::string logType;
    bool operator==(const Entry&) const = default;
  };

  [[nodiscard]] Result<void> createSubmittableLog(const std::string& path, const std::string& logType) override;
  [[nodiscard]] bool moveForSubmission(const std::string& path, const std::string& logType) override;

  [[nodiscard]] std::vector<Entry> created() const;
  [[nodiscard]] std::vector<Entry> moved() const;

  std::atomic<bool> accepts{true};
  /// False: the service does not make the file, whatever it answers.
  std::atomic<bool> creates{true};

 private:
  mutable Lock _lock;
  std::vector<Entry> _created VELK_GUARDED_BY(_lock);
  std::vector<Entry> _moved VELK_GUARDED_BY(_lock);
};

/// Owns the fakes; what is handed a `Platform` must not outlive it. Without a service set, `platform().http` makes
/// null sessions.
class FakePlatform {
 public:
  FakePlatform();
  ~FakePlatform();
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;

  /// Replaces the HTTP service that sessions are made by (not owned; null: none). Before or after `platform()`.
  void setHttpSessionService(HttpSessionService* service) { _http.service = service; }

  [[nodiscard]] Platform platform();
  [[nodiscard]] FakeClock& clock() { return scheduler.fakeClock(); }

  ManualScheduler scheduler;
  FakeUserDefaults defaults;
  FakeDeviceInformation device;
  FakeLocale locale;
  FakeRandom random;
  FakeConsent consent;
  FakeKeepAlive keepAlive;
  FakeProcessStatistics process;
  FakeLogSubmission logSubmission;
  FakeUdpSockets udpSockets;

 private:
  /// Hands on to whatever service the test has set.
  class ForwardingHttpService : public HttpSessionService {
   public:
    [[nodiscard]] std::shared_ptr<HttpSession> makeSession(HttpSessionConfiguration configuration,
                                                           std::shared_ptr<HttpSessionDelegate> delegate,
                                                           std::shared_ptr<Queue> delegateQueue) override;
    std::atomic<HttpSessionService*> service{nullptr};
  };

  ForwardingHttpService _http;
};

}  // namespace velk::test
