// The facilities of the operating system that one process uses, real or faked: made once at the top, handed down by
// reference, so that no class below asks the system behind its owner's back.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"

namespace velk {

class Clock;
class Scheduler;
class UserDefaults;
class DeviceInformation;
class Locale;
class HttpSessionService;
class AdaptorBundle;
class PowerLog;
class UdpSocketService;

/// Uniform random numbers.
class RandomSource {
 public:
  virtual ~RandomSource() = default;
  /// An unbiased number in [0, bound); `bound` is above 0. Any thread.
  [[nodiscard]] virtual std::uint32_t below(std::uint32_t bound) = 0;
};
[[nodiscard]] std::unique_ptr<RandomSource> makeRandomSource();

/// The process's hold on its own life: while a transaction is open it is not ended for being idle.
class KeepAlive {
 public:
  virtual ~KeepAlive() = default;
  virtual void beginTransaction() = 0;
  virtual void endTransaction() = 0;
};

/// What the user agreed to: diagnostics and usage data may be reported. Any thread.
class Consent {
 public:
  virtual ~Consent() = default;
  [[nodiscard]] virtual bool diagnosticsAndUsageEnabled() const = 0;
};
/// The setting "diagnosticsAndUsage" of the suite: off unless somebody turned it on.
[[nodiscard]] std::unique_ptr<Consent> makeConsent(const UserDefaults& defaults);
inline constexpr const char* kDiagnosticsAndUsageSetting = "diagnosticsAndUsage";

class ProcessStatistics {
 public:
  virtual ~ProcessStatistics() = default;
  /// Anonymous memory of this process in bytes; 0 when the system does not say.
  [[nodiscard]] virtual std::uint64_t anonymousMemory() const = 0;
};
[[nodiscard]] std::unique_ptr<ProcessStatistics> makeProcessStatistics();

/// The diagnostic-log submission service, which collects retired logs for support.
class LogSubmission {
 public:
  virtual ~LogSubmission() = default;
  /// Creates an empty log file that may be submitted later.
  [[nodiscard]] virtual Result<void> createSubmittableLog(const std::string& path, const std::string& logType) = 0;
  /// Takes the file away. False where there is no such service: the caller then deletes the file.
  [[nodiscard]] virtual bool moveForSubmission(const std::string& path, const std::string& logType) = 0;
};
/// Moves into `spoolDirectory`; an empty path: nothing is ever taken.
[[nodiscard]] std::unique_ptr<LogSubmission> makeLogSubmission(std::string spoolDirectory);

struct Platform {
  Clock& clock;
  Scheduler& scheduler;
  UserDefaults& defaults;
  const DeviceInformation& device;
  const Locale& locale;
  HttpSessionService& http;
  RandomSource& random;
  KeepAlive& keepAlive;
  const Consent& consent;
  const ProcessStatistics& process;
  LogSubmission& logSubmission;
  // Null where there is no such service.
  AdaptorBundle* adaptorBundle = nullptr;
  PowerLog* powerLog = nullptr;
  UdpSocketService* udpSockets = nullptr;
};

}  // namespace velk
