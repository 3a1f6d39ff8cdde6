// The real daemon, in directories of its own, with a real storebag server and collector: what the integration tests
// drive from outside.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/PropertyValue.h"
#include "tests/integration/ChildProcess.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/support/TlsTestServer.h"

namespace velk::test {

/// Serves signed storebags under /bags/vindle/NAME and takes posts everywhere else, over TLS. Any thread.
class ReportingServer {
 public:
  struct Post {
    TlsTestServer::Request request;
    /// The JSON body, gunzipped.
    PropertyDictionary body;
  };

  /// `listens` false: connections are refused until its `tls().startListening()`.
  explicit ReportingServer(bool listens = true);

  [[nodiscard]] TlsTestServer& tls() { return _server; }
  [[nodiscard]] std::string url(std::string_view path) const { return _server.url(path); }
  [[nodiscard]] int port() const { return _server.port(); }
  /// The DER public key that verifies the storebags.
  [[nodiscard]] const ByteData& publicKey() const { return _publicKey; }

  /// The storebag served under `name` from now on: signed; `headers` go with it.
  void setStorebag(const std::string& name, const PropertyDictionary& bag,
                   std::vector<std::pair<std::string, std::string>> headers = {{"Cache-Control", "max-age=600"}});
  /// Bytes served as they are.
  void setRawStorebag(const std::string& name, std::string bytes);
  /// Any answer, misbehaviour included.
  void setStorebagAnswer(const std::string& name, TlsTestServer::Response answer);
  /// The envelope of a bag, as it travels.
  [[nodiscard]] std::string signedEnvelope(const PropertyDictionary& bag) const;
  /// What is served under that name now.
  [[nodiscard]] std::string servedStorebag(const std::string& name) const;
  void setStorebagDelay(Duration delay);
  /// Instead of 200; 200 serves the storebags again.
  void setStorebagStatus(int status);
  /// The answer to posts; 200 until set.
  void setPostResponse(TlsTestServer::Response response);

  [[nodiscard]] std::vector<Post> posts() const;
  /// The events of all posts so far, in order.
  [[nodiscard]] std::vector<PropertyDictionary> events() const;
  /// Waits until `count` events for which `_method` is one of `methods` (empty: any) have arrived.
  [[nodiscard]] bool waitForEvents(std::size_t count, const std::vector<int>& methods = {},
                                   std::chrono::milliseconds patience = kPatience) const;
  /// Waits for that many posts.
  [[nodiscard]] bool waitForPosts(std::size_t count, std::chrono::milliseconds patience = kPatience) const;
  /// How often a storebag of that name was asked for.
  [[nodiscard]] std::size_t storebagRequests(const std::string& name) const;

 private:
  TlsTestServer::Response answer(const TlsTestServer::Request& request);
  TlsTestServer::Response answerStorebag(const std::string& name);
  void take(const TlsTestServer::Request& request);

  std::string _privateKey;
  ByteData _publicKey;
  mutable Lock _lock;
  mutable Condition _changed;
  std::map<std::string, TlsTestServer::Response> _storebags VELK_GUARDED_BY(_lock);
  std::map<std::string, std::size_t> _storebagRequests VELK_GUARDED_BY(_lock);
  Duration _storebagDelay VELK_GUARDED_BY(_lock){};
  std::optional<int> _storebagStatus VELK_GUARDED_BY(_lock);
  TlsTestServer::Response _postResponse VELK_GUARDED_BY(_lock);
  std::vector<Post> _posts VELK_GUARDED_BY(_lock);
  TlsTestServer _server;  // last: its threads use everything above
};

/// A storebag whose "release" and "seed" sections hold one post backend, "splunk", that takes everything of every
/// client and posts to `postUrl`. Tests change what they need.
[[nodiscard]] PropertyDictionary simpleStorebag(const std::string& postUrl);
/// The client entry inside the section of such a storebag, for writing.
void setInClientEntry(PropertyDictionary& bag, std::string_view key, const PropertyValue& value,
                      std::string_view backend = "splunk");

class Daemon {
 public:
  struct Options {
    std::vector<std::string> arguments;
    std::map<std::string, std::string> environment;
    /// Settings of the suite, written before the start.
    PropertyDictionary defaults;
    /// Lines of device.conf.
    std::string deviceConfiguration;
    bool consent = true;
    /// Whom it runs as; only root may choose.
    std::optional<uid_t> user;
    /// The most threads that its user may have.
    std::optional<int> threads;
    /// False: the socket and directories are prepared, and `start` is called by the test.
    bool starts = true;
  };

  /// Waits until it listens.
  explicit Daemon(ReportingServer& server) : Daemon(server, Options()) {}
  Daemon(ReportingServer& server, const Options& options);
  ~Daemon();

  void start();
  /// Orderly; the exit status.
  int stop();
  /// Ends it at once.
  void kill();

  [[nodiscard]] ChildProcess& process() { return *_process; }
  /// The lines of its log, "<N>" prefixes included.
  [[nodiscard]] LineCollector& log() { return _process->errors(); }
  [[nodiscard]] std::string socketPath() const { return _directory.path() + "/run/com.tavrin.velkreportingd"; }
  [[nodiscard]] const std::string& directory() const { return _directory.path(); }
  /// The environment under which clients and tools find this daemon.
  [[nodiscard]] std::map<std::string, std::string> environment() const;
  /// The text of all message logs.
  [[nodiscard]] std::string messageLog() const;

 private:
  ReportingServer& _server;
  const Options _options;
  TemporaryDirectory _directory;
  std::unique_ptr<ChildProcess> _process;
};

/// `velkreportingctl session` against a daemon: one JSON object a line, both ways.
class ControlledSession {
 public:
  /// `user`: whom it runs as; this process's user if none.
  explicit ControlledSession(const Daemon& daemon, std::optional<uid_t> user = std::nullopt);

  /// Calls a method, {"method": ..., ...}, and does not wait. Returns the line's number.
  std::size_t send(const PropertyDictionary& call);
  /// The reply to that line (the whole output object), or an empty dictionary when none came in time.
  [[nodiscard]] PropertyDictionary reply(std::size_t line, std::chrono::milliseconds patience = kPatience);
  /// Both: the values of the reply, none when there was no reply.
  [[nodiscard]] PropertyArray call(const PropertyDictionary& call);
  /// The nth (from 0) object with that "event".
  [[nodiscard]] PropertyDictionary event(const std::string& name, std::size_t number = 0,
                                         std::chrono::milliseconds patience = kPatience);
  [[nodiscard]] ChildProcess& process() { return _process; }
  /// Ends the input and waits: the exit status.
  int finish();
  /// Ends the process as a crash would.
  void kill();

  /// The usual opening: session info (with "ComponentType", "SessionID" and what `more` holds), user info Test/unit.
  [[nodiscard]] PropertyArray open(int clientType, int sessionID, const PropertyDictionary& more = {},
                                   const PropertyValue& userInfo = PropertyDictionary{{"_clientName", "Test"},
                                                                                      {"_serviceName", "unit"}});
  /// The same without waiting: the line whose reply holds the lists.
  std::size_t sendOpening(int clientType, int sessionID, const PropertyDictionary& more = {},
                          const PropertyValue& userInfo = PropertyDictionary{{"_clientName", "Test"},
                                                                             {"_serviceName", "unit"}});
  std::size_t sendEvent(int category, int type, const PropertyValue& payload = {}, int flag = 0);

 private:
  std::size_t _lines = 0;
  ChildProcess _process;
};

/// Runs a program to its end.
struct Finished {
  int status;
  std::string output;
  std::string errors;
};
[[nodiscard]] Finished runProgram(const ChildProcess::Options& options, const std::string& input = {});
/// `velkreportingctl` with these arguments against the daemon.
[[nodiscard]] Finished runControl(const Daemon& daemon, std::vector<std::string> arguments,
                                  std::optional<uid_t> user = std::nullopt);

/// Paths of the programs under test.
[[nodiscard]] std::string daemonProgram();
[[nodiscard]] std::string controlProgram();
[[nodiscard]] std::string collectorProgram();

}  // namespace velk::test
