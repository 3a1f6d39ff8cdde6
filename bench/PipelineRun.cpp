#include "bench/PipelineRun.h"

#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <thread>

#include "bench/BenchSink.h"
#include "bench/ChildProgram.h"
#include "bench/ClientReport.h"
#include "bench/Floor.h"
#include "bench/SampleEvents.h"
#include "foundation/Base64.h"
#include "platform/Cryptography.h"
#include "platform/Platform.h"
#include "platform/PropertyList.h"
#include "platform/UserDefaults.h"

namespace velk::bench {

namespace {

using std::chrono::milliseconds;

constexpr std::uint64_t kBatchedEvents = 50;

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "bench: %s\n", what.c_str());
  std::exit(70);
}

class Directory {
 public:
  explicit Directory(bool keep) : _keep(keep) {
    std::string pattern = "/tmp/velk-bench.XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) fail("no directory can be made under /tmp");
    _path = pattern;
  }
  ~Directory() {
    std::error_code ignored;
    if (!_keep) std::filesystem::remove_all(_path, ignored);
  }
  Directory(const Directory&) = delete;
  Directory& operator=(const Directory&) = delete;
  [[nodiscard]] std::string operator/(const char* name) const { return _path + "/" + name; }

 private:
  const bool _keep;
  std::string _path;
};

bool answersAt(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const bool answers = ::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  ::close(socket);
  return answers;
}

/// The nth of the sorted values, n as a fraction.
template <class Number>
double quantile(std::vector<Number>& values, double fraction) {
  if (values.empty()) return 0;
  const auto at = std::min(values.size() - 1, static_cast<std::size_t>(fraction * static_cast<double>(values.size())));
  std::nth_element(values.begin(), values.begin() + static_cast<std::ptrdiff_t>(at), values.end());
  return static_cast<double>(values[at]);
}

using StartSender = std::function<std::unique_ptr<ChildProgram>(std::uint32_t)>;

/// The part that is the same for the floor and for the real thing.
class Run {
 public:
  Run(const Scenario& scenario, BenchSink& sink, const ChildProgram& agent)
      : _scenario(scenario), _sink(sink), _agent(agent) {}

  Measured measure(const StartSender& startSender) {
    for (std::uint32_t number = 0; number < _scenario.clients; ++number) _senders.push_back(startSender(number));
    for (const auto& sender : _senders) {
      if (readByte(sender->output()) != kReady) fail("a sender did not get ready");
    }
    const double agentBefore = _agent.cpuSeconds();
    const double begun = steadySeconds();
    for (const auto& sender : _senders) static_cast<void>(writeByte(sender->input(), kGo));
    readReports();
    const auto counted = waitForArrivals();
    const double agentCpu = _agent.cpuSeconds() - agentBefore;
    endSenders();
    fill(counted, begun, agentCpu);
    std::this_thread::sleep_for(std::chrono::seconds(1));
    _measured.agentIdleMegabytes = _agent.residentMegabytes();
    _measured.agentIdleAnonymousMegabytes = _agent.anonymousMegabytes();
    _measured.agentPeakMegabytes = _agent.peakMegabytes();
    return _measured;
  }

 private:
  void readReports() {
    for (const auto& sender : _senders) {
      ClientReport report;
      if (!readReport(sender->output(), report)) fail("a sender ended early");
      _measured.sent += report.accepted;
      _measured.refusals += report.refusals;
      _clientCpu += report.cpuSecondsAfter - report.cpuSecondsBefore;
      _sendTimes.insert(_sendTimes.end(), report.sendNanoseconds.begin(), report.sendNanoseconds.end());
    }
  }

  /// Until all are there, or nothing has come for a while. Counting begins when posts rest: it costs time.
  BenchSink::Counted waitForArrivals() {
    constexpr int kRounds = 40;
    for (int round = 0;; ++round) {
      const auto before = _sink.postCount();
      std::this_thread::sleep_for(milliseconds(100));
      if (_sink.postCount() != before) {
        round = 0;
        continue;
      }
      auto counted = _sink.count();
      if (counted.events >= _measured.sent || round == kRounds) return counted;
      for (const auto& sender : _senders) {
        if (!writeByte(sender->input(), kAgain) || readByte(sender->output()) != kReady) fail("a sender ended early");
      }
    }
  }

  void endSenders() {
    for (const auto& sender : _senders) {
      _measured.clientPeakMegabytes = std::max(_measured.clientPeakMegabytes, sender->peakMegabytes());
      static_cast<void>(writeByte(sender->input(), kQuit));
    }
    for (const auto& sender : _senders) {
      if (sender->wait() != 0) fail("a sender failed at its end");
    }
  }

  void fill(const BenchSink::Counted& counted, double begun, double agentCpu) {
    const auto events = static_cast<double>(std::max<std::uint64_t>(counted.events, 1));
    auto latencies = counted.latencies;
    _measured.lost = _measured.sent - std::min(_measured.sent, counted.events);
    _measured.duplicates = counted.duplicates;
    _measured.posts = _sink.postCount();
    _measured.connections = _sink.connectionCount();
    _measured.eventsPerSecond = events / (counted.lastArrival - begun);
    _measured.clientMicroseconds = _clientCpu / events * 1e6;
    _measured.agentMicroseconds = agentCpu / events * 1e6;
    _measured.wireBytes = static_cast<double>(_sink.bytesReceived()) / events;
    _measured.jsonBytes = static_cast<double>(counted.jsonBytes) / events;
    _measured.sendP50 = quantile(_sendTimes, 0.5) / 1e3;
    _measured.sendP99 = quantile(_sendTimes, 0.99) / 1e3;
    _measured.sendMax = quantile(_sendTimes, 1.0) / 1e3;
    _measured.arrivalP50 = quantile(latencies, 0.5) * 1e3;
  }

  const Scenario& _scenario;
  BenchSink& _sink;
  const ChildProgram& _agent;
  std::vector<std::unique_ptr<ChildProgram>> _senders;
  std::vector<std::uint32_t> _sendTimes;
  double _clientCpu = 0;
  Measured _measured;
};

double ratePerClient(const Scenario& scenario) { return scenario.rate / scenario.clients; }

PropertyDictionary storebag(const std::string& postUrl, bool unbatched) {
  PropertyDictionary client{{"locale_whitelist", PropertyArray{"US"}},
                            {"filters", PropertyArray{}},
                            {"sampling_threshold", 1.0},
                            {"post_url", postUrl}};
  if (unbatched) client.set("expedite", 1);
  const PropertyDictionary section{{"splunk", PropertyDictionary{{"clients", PropertyArray{client}}}}};
  return {{"version", "1.0.0-bench"}, {"refresh_cycle", 600}, {"seed", section}, {"release", section}};
}

template <class Value>
Value required(Result<Value> result) {
  if (!result) fail(result.error().description);
  return std::move(*result);
}

std::string signedEnvelope(const PropertyDictionary& bag, const std::string& privateKeyPem) {
  const auto bytes = required(propertylist::serialize(bag, propertylist::Form::binary));
  const auto signature = required(signSha1Digest(privateKeyPem, sha1(bytes)));
  const auto envelope = required(propertylist::serialize(
      PropertyDictionary{{"signature", base64Encoded(signature)}, {"bag", base64Encoded(bytes)}},
      propertylist::Form::xml));
  return {envelope.begin(), envelope.end()};
}

void writeFile(const std::string& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary) << bytes;
  std::filesystem::permissions(path, std::filesystem::perms(0600));
}

std::map<std::string, std::string> prepareDaemon(const Scenario& scenario, const Directory& directory,
                                                 BenchSink& sink) {
  for (const char* name : {"run", "state", "cache", "logs", "config"}) {
    std::filesystem::create_directory(directory / name);
    std::filesystem::permissions(directory / name, std::filesystem::perms(0700));
  }
  const auto keys = required(generateRsaKeyPair(2048));
  sink.setStorebag(signedEnvelope(storebag(sink.url("/post"), scenario.unbatched), keys.privateKeyPem));
  writeFile(directory / "config/publicKey.der", {keys.publicKeyDer.begin(), keys.publicKeyDer.end()});
  writeFile(directory / "config/device.conf", deviceConfiguration());
  const auto defaults = openUserDefaults(kVelkReportingDefaultsSuite, directory / "state", "");
  const auto address = defaults->set("velkreporting_storebag_url", sink.url("/bags/vindle"));
  const auto consent = defaults->set(kDiagnosticsAndUsageSetting, true);
  if (!address || !consent) fail("the settings cannot be written");
  return {{"RUNTIME_DIRECTORY", directory / "run"},
          {"STATE_DIRECTORY", directory / "state"},
          {"CACHE_DIRECTORY", directory / "cache"},
          {"LOGS_DIRECTORY", directory / "logs"},
          {"CONFIGURATION_DIRECTORY", directory / "config"},
          {"SSL_CERT_FILE", directory / "ca.pem"},
          {"no_proxy", "127.0.0.1"},
          {"LC_ALL", "en_US.UTF-8"},
          {"JOURNAL_STREAM", ""}};
}

void waitUntilItAnswers(const std::string& socketPath) {
  constexpr int kTries = 1000;
  for (int tries = 0; !answersAt(socketPath); ++tries) {
    if (tries == kTries) fail("the daemon did not start; --daemon-log FILE shows why");
    std::this_thread::sleep_for(milliseconds(10));
  }
}

std::string ownProgram() { return std::filesystem::read_symlink("/proc/self/exe").string(); }

}  // namespace

Measured measureFloor(const Scenario& scenario, const RunOptions& options) {
  std::fprintf(stderr, "%s: floor, %u client(s), %llu events each\n", scenario.name.c_str(), scenario.clients,
               static_cast<unsigned long long>(scenario.eventsPerClient));
  const Directory directory(options.keep);
  BenchSink sink(directory / "ca.pem");
  const std::string socketPath = directory / "floor";
  const std::uint64_t batch = scenario.unbatched ? 1 : kBatchedEvents;
  ChildProgram agent({{ownProgram(), "--role", "floor-agent", "--socket", socketPath, "--url", sink.url("/post"),
                       "--ca", directory / "ca.pem", "--batch", std::to_string(batch)},
                      {},
                      {}});
  if (readByte(agent.output()) != kReady) fail("the floor's agent did not start");
  const auto measured = Run(scenario, sink, agent).measure([&](std::uint32_t number) {
    return std::make_unique<ChildProgram>(
        ChildProgram::Options{{ownProgram(), "--role", "floor-sender", "--socket", socketPath, "--number",
                               std::to_string(number), "--sender-events", std::to_string(scenario.eventsPerClient),
                               "--sender-rate", std::to_string(ratePerClient(scenario))},
                              {},
                              {}});
  });
  agent.signal(SIGTERM);
  return measured;
}

Measured measurePipeline(const Scenario& scenario, const RunOptions& options) {
  std::fprintf(stderr, "%s: daemon, %u client(s), %llu events each\n", scenario.name.c_str(), scenario.clients,
               static_cast<unsigned long long>(scenario.eventsPerClient));
  const Directory directory(options.keep);
  BenchSink sink(directory / "ca.pem");
  const auto environment = prepareDaemon(scenario, directory, sink);
  const std::string socketPath = directory / "run/com.tavrin.velkreportingd";
  std::vector<std::string> command{options.daemonProgram, "--socket", socketPath};
  if (!options.logLevel.empty()) command.insert(command.end(), {"--log-level", options.logLevel});
  ChildProgram daemon({command, environment, options.daemonLog.empty() ? "/dev/null" : options.daemonLog});
  waitUntilItAnswers(socketPath);
  const auto measured = Run(scenario, sink, daemon).measure([&](std::uint32_t number) {
    return std::make_unique<ChildProgram>(
        ChildProgram::Options{{options.clientProgram, std::to_string(number), std::to_string(scenario.eventsPerClient),
                               std::to_string(ratePerClient(scenario))},
                              {{"VELKREPORTING_SOCKET", socketPath}},
                              {}});
  });
  daemon.signal(SIGTERM);
  if (daemon.wait() != 0) fail("the daemon did not end in order");
  return measured;
}

}  // namespace velk::bench
