#include "tests/integration/Daemon.h"

#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "foundation/Json.h"
#include "platform/Files.h"
#include "platform/Platform.h"
#include "platform/UserDefaults.h"

namespace velk::test {

namespace {

void require(const Result<void>& result) {
  if (!result) throw std::runtime_error(result.error().description);
}

void giveAllTo(const std::string& directory, uid_t user) {
  std::vector<std::string> paths{directory};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(directory)) paths.push_back(entry.path());
  for (const auto& path : paths) {
    if (::chown(path.c_str(), user, user) != 0) throw std::runtime_error("cannot give " + path + " away");
  }
}

}  // namespace

Daemon::Daemon(ReportingServer& server, const Options& options) : _server(server), _options(options) {
  for (const char* name : {"run", "state", "cache", "logs", "config"}) {
    require(files::createDirectories(directory() + "/" + name, std::string(name) == "run" ? 0755 : 0700));
  }
  std::filesystem::permissions(directory(), std::filesystem::perms(0755));  // the socket is for everybody
  require(files::writeAtomically(directory() + "/config/publicKey.der", server.publicKey(), 0600));
  const std::string device = options.deviceConfiguration;
  if (!device.empty()) {
    require(files::writeAtomically(directory() + "/config/device.conf", ByteData(device.begin(), device.end()), 0600));
  }
  const auto defaults = openUserDefaults(kVelkReportingDefaultsSuite, directory() + "/state", "");
  require(defaults->set("velkreporting_storebag_url", server.url("/bags/vindle")));
  if (options.consent) require(defaults->set(kDiagnosticsAndUsageSetting, true));
  for (const auto& entry : options.defaults) require(defaults->set(entry.key, entry.value));
  if (options.user) {
    giveAllTo(directory(), *options.user);
    std::filesystem::permissions(server.tls().caFile(), std::filesystem::perms(0644));
  }
  if (options.starts) start();
}

Daemon::~Daemon() {
  if (_process) static_cast<void>(stop());
}

std::map<std::string, std::string> Daemon::environment() const {
  return {{"RUNTIME_DIRECTORY", directory() + "/run"},
          {"STATE_DIRECTORY", directory() + "/state"},
          {"CACHE_DIRECTORY", directory() + "/cache"},
          {"LOGS_DIRECTORY", directory() + "/logs"},
          {"CONFIGURATION_DIRECTORY", directory() + "/config"},
          {"VELKREPORTING_SOCKET", socketPath()},
          {"no_proxy", "127.0.0.1,localhost"},
          {"JOURNAL_STREAM", ""}};
}

void Daemon::start() {
  ChildProcess::Options child;
  if (_options.threads) child.command = {"/usr/bin/prlimit", "--nproc=" + std::to_string(*_options.threads)};
  child.command.insert(child.command.end(), {daemonProgram(), "--socket", socketPath()});
  child.command.insert(child.command.end(), _options.arguments.begin(), _options.arguments.end());
  child.user = _options.user;
  child.environment = environment();
  child.environment["SSL_CERT_FILE"] = _server.tls().caFile();
  child.environment["LC_ALL"] = "en_US.UTF-8";
  for (const auto& [name, value] : _options.environment) child.environment[name] = value;
  _process = std::make_unique<ChildProcess>(child);
  if (!log().waitForPart("main: Listener resumes with sandbox, start loop.")) {
    std::string words;
    for (const auto& line : log().lines()) words += line + "\n";
    throw std::runtime_error("the daemon did not start:\n" + words);
  }
}

int Daemon::stop() {
  _process->signal(SIGTERM);
  const auto status = _process->wait();
  if (!status) return -1;
  log().waitForEnd();
  return *status;
}

void Daemon::kill() {
  _process->signal(SIGKILL);
  static_cast<void>(_process->wait());
}

std::string Daemon::messageLog() const {
  std::string text;
  for (const auto& entry : std::filesystem::directory_iterator(directory() + "/logs")) {
    std::ostringstream contents;
    contents << std::ifstream(entry.path()).rdbuf();
    text += contents.str();
  }
  return text;
}

namespace {

ChildProcess::Options controlOptions(const Daemon& daemon, std::vector<std::string> arguments,
                                     std::optional<uid_t> user) {
  ChildProcess::Options options;
  options.command = {controlProgram()};
  options.command.insert(options.command.end(), arguments.begin(), arguments.end());
  options.environment = daemon.environment();
  options.user = user;
  return options;
}

PropertyDictionary parsedLine(const std::string& line) {
  const auto value = json::parse(line, json::Extensions::tagged);
  return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
}

}  // namespace

ControlledSession::ControlledSession(const Daemon& daemon, std::optional<uid_t> user)
    : _process(controlOptions(daemon, {"session"}, user)) {}

std::size_t ControlledSession::send(const PropertyDictionary& call) {
  std::string line;
  if (!json::write(call, line, json::Extensions::tagged)) throw std::runtime_error("the call is no JSON");
  _process.write(line + "\n");
  return ++_lines;
}

PropertyDictionary ControlledSession::reply(std::size_t line, std::chrono::milliseconds patience) {
  const auto found = _process.output().waitFor(
      [line](const std::string& text) {
        return integerValue(parsedLine(text).find("line")) == static_cast<std::int64_t>(line);
      },
      0, patience);
  return found ? parsedLine(*found) : PropertyDictionary();
}

PropertyArray ControlledSession::call(const PropertyDictionary& call) {
  const PropertyDictionary answer = reply(send(call));
  const PropertyArray* values = answer.array("reply");
  return values != nullptr ? *values : PropertyArray();
}

PropertyDictionary ControlledSession::event(const std::string& name, std::size_t number,
                                            std::chrono::milliseconds patience) {
  std::size_t seen = 0;
  const auto found = _process.output().waitFor(
      [&](const std::string& text) {
        const auto object = parsedLine(text);
        const std::string* event = object.string("event");
        return event != nullptr && *event == name && seen++ == number;
      },
      0, patience);
  return found ? parsedLine(*found) : PropertyDictionary();
}

int ControlledSession::finish() {
  _process.closeInput();
  const auto status = _process.wait();
  return status ? *status : -1;
}

void ControlledSession::kill() {
  _process.signal(SIGKILL);
  static_cast<void>(_process.wait());
}

PropertyArray ControlledSession::open(int clientType, int sessionID, const PropertyDictionary& more,
                                      const PropertyValue& userInfo) {
  const PropertyDictionary answer = reply(sendOpening(clientType, sessionID, more, userInfo));
  const PropertyArray* lists = answer.array("reply");
  return lists != nullptr ? *lists : PropertyArray();
}

std::size_t ControlledSession::sendOpening(int clientType, int sessionID, const PropertyDictionary& more,
                                           const PropertyValue& userInfo) {
  PropertyDictionary sessionInfo{{"ComponentType", clientType}, {"ClientVersion", 3}, {"SessionID", sessionID}};
  sessionInfo.merge(more);
  send({{"method", "setSessionInfo"},
        {"sessionInfo", sessionInfo},
        {"userInfo", userInfo},
        {"frameworksToCheck", PropertyArray{}},
        {"hasAggregationBlock", false}});
  return send({{"method", "startConfigWithCompletionHandler"}});
}

std::size_t ControlledSession::sendEvent(int category, int type, const PropertyValue& payload, int flag) {
  PropertyDictionary message{{"ParametersCategory", category}, {"ParametersType", type}, {"ParametersFlag", flag}};
  if (!payload.isNull()) message.set("ParametersPayload", payload);
  return send({{"method", "sendMessageWithDictionary"}, {"dictionary", message}});
}

Finished runProgram(const ChildProcess::Options& options, const std::string& input) {
  ChildProcess process(options);
  process.write(input);
  process.closeInput();
  const auto status = process.wait();
  const auto joined = [](const LineCollector& lines) {
    std::string text;
    for (const auto& line : lines.lines()) text += line + "\n";
    return text;
  };
  static_cast<void>(process.output().waitFor([](const std::string&) { return false; }));  // to the end of its output
  static_cast<void>(process.errors().waitFor([](const std::string&) { return false; }));
  return {status ? *status : -1, joined(process.output()), joined(process.errors())};
}

Finished runControl(const Daemon& daemon, std::vector<std::string> arguments, std::optional<uid_t> user) {
  return runProgram(controlOptions(daemon, std::move(arguments), user));
}

std::string daemonProgram() { return VELK_DAEMON_PROGRAM; }
std::string controlProgram() { return VELK_CONTROL_PROGRAM; }
std::string collectorProgram() { return VELK_COLLECTOR_PROGRAM; }

}  // namespace velk::test
