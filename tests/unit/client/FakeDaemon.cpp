#include "tests/unit/client/FakeDaemon.h"

#include <stdlib.h>

#include <chrono>
#include <deque>
#include <stdexcept>

namespace velk::test {

struct FakeDaemon::State {
  mutable Lock lock;
  mutable Condition changed;
  std::vector<Call> calls VELK_GUARDED_BY(lock);
  std::vector<std::shared_ptr<Connection>> connections VELK_GUARDED_BY(lock);
  std::size_t accepted VELK_GUARDED_BY(lock) = 0;
  std::size_t forgotten VELK_GUARDED_BY(lock) = 0;  ///< of those that were accepted
  std::size_t ends VELK_GUARDED_BY(lock) = 0;
  bool holds VELK_GUARDED_BY(lock) = false;
  bool refuses VELK_GUARDED_BY(lock) = false;
  bool deliversUploads VELK_GUARDED_BY(lock) = false;
  std::optional<PropertyArray> enabled VELK_GUARDED_BY(lock) = PropertyArray{"splunk"};
  std::optional<PropertyArray> whitelist VELK_GUARDED_BY(lock);
  std::optional<PropertyArray> blacklist VELK_GUARDED_BY(lock);
  std::optional<std::string> messageReply VELK_GUARDED_BY(lock);
  std::optional<std::string> displayUrl VELK_GUARDED_BY(lock) = "https://reports.example/";
  SingleMessages singleMessages VELK_GUARDED_BY(lock) = SingleMessages::answered;
  std::deque<TextReply> kept VELK_GUARDED_BY(lock);
  std::optional<Error> flushError VELK_GUARDED_BY(lock);

  template <class Holds>
  bool waitUntil(Holds holds) const {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    Guard guard(lock);
    while (!holds()) {
      if (!changed.waitUntil(lock, deadline)) return holds();
    }
    return true;
  }
};

class FakeDaemon::Session : public ClientSessionInterface {
 public:
  Session(std::shared_ptr<State> state, std::size_t connection) : _state(std::move(state)), _connection(connection) {}

  void setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                      PropertyArray frameworksToCheck, bool hasAggregationBlock) override {
    record("setSessionInfo", {sessionInfo, orNull(userInfo), frameworksToCheck, hasAggregationBlock});
    std::shared_ptr<Connection> refused;
    {
      Guard guard(_state->lock);
      if (_state->refuses) refused = _state->connections[_connection - 1 - _state->forgotten];
    }
    if (refused) refused->invalidate();
  }
  void startConfigWithCompletionHandler(ConfigurationReply reply) override {
    record("startConfigWithCompletionHandler", {});
    configure(std::move(reply));
  }
  void fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) override {
    record("fetchStatesWithUserInfo", {orNull(userInfo)});
    configure(std::move(reply));
  }
  void fetchDisplayURL(TextReply reply) override {
    record("fetchDisplayURL", {});
    std::optional<std::string> url;
    {
      Guard guard(_state->lock);
      url = _state->displayUrl;
    }
    reply(url);
  }
  void sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) override {
    record("sendMessageWithDictionary", {dictionary});
    std::optional<std::string> text;
    {
      Guard guard(_state->lock);
      text = _state->messageReply;
    }
    reply(text);
  }
  void flushMessagesWithCompletion(FlushReply reply) override {
    record("flushMessagesWithCompletion", {});
    std::optional<Error> error;
    {
      Guard guard(_state->lock);
      error = _state->flushError;
    }
    reply(error ? std::nullopt : std::optional<std::string>("flushed"), error);
  }
  void finishSessionGracefully() override { record("finishSessionGracefully", {}); }
  void uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file, UploadReply reply) override {
    record("uploadFileAtPath", {url, extensionToken, static_cast<bool>(file)});
    bool isDelivered = false;
    {
      Guard guard(_state->lock);
      isDelivered = _state->deliversUploads;
    }
    reply(true, isDelivered);
  }
  void uploadLogData(PropertyArray logData, LogDataReply reply) override {
    record("uploadLogData", {logData});
    reply(true, std::nullopt);
  }
  void sendMessageWithSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                  std::uint16_t category, std::uint16_t type, std::optional<PropertyDictionary> payload,
                                  TextReply reply) override {
    // Kept before it is told of: whoever has waited for it may answer it.
    const bool answers = receive(reply);
    record("sendMessageWithSessionInfo", {sessionInfo, orNull(userInfo), category, type, orNull(payload)});
    if (answers) reply("finished");
  }
  void updateSharedDataWithDictionary(PropertyDictionary dictionary) override {
    record("updateSharedDataWithDictionary", {dictionary});
  }
  void updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) override {
    record("updateSharedDataForKey", {key, value ? *value : PropertyValue()});
  }
  void setDigestKey(ByteData key, std::int32_t algorithm) override { record("setDigestKey", {key, algorithm}); }

 private:
  static PropertyValue orNull(const std::optional<PropertyDictionary>& value) {
    return value ? PropertyValue(*value) : PropertyValue();
  }

  /// Whether a single message is to be answered at once.
  bool receive(TextReply& reply) {
    Guard guard(_state->lock);
    if (_state->singleMessages == SingleMessages::kept) _state->kept.push_back(std::move(reply));
    return _state->singleMessages == SingleMessages::answered;
  }

  void record(const char* method, PropertyArray arguments) {
    Guard guard(_state->lock);
    while (_state->holds) _state->changed.wait(_state->lock);
    _state->calls.push_back({method, std::move(arguments), _connection});
    _state->changed.notifyAll();
  }

  void configure(ConfigurationReply reply) {
    std::optional<PropertyArray> enabled;
    std::optional<PropertyArray> whitelist;
    std::optional<PropertyArray> blacklist;
    {
      Guard guard(_state->lock);
      enabled = _state->enabled;
      whitelist = _state->whitelist;
      blacklist = _state->blacklist;
    }
    reply(enabled, whitelist, blacklist);
  }

  const std::shared_ptr<State> _state;
  const std::size_t _connection;
};

FakeDaemon::FakeDaemon() : _state(std::make_shared<State>()) {
  setenv("VELKREPORTING_SOCKET", (_directory.path() + "/socket").c_str(), 1);
}

FakeDaemon::~FakeDaemon() {
  holdCalls(false);
  stop();
}

void FakeDaemon::start() {
  _loop = std::make_unique<EventLoop>("fakedaemon");
  Listener::Options options;
  options.loop = _loop.get();
  options.acceptQueue = _loop->makeLoopQueue("fakedaemon.accept");
  options.makeDeliveryQueue = [this] { return _loop->makeLoopQueue("fakedaemon.session"); };
  options.shouldAcceptNewConnection = [state = _state](const std::shared_ptr<Connection>& connection) {
    std::size_t number = 0;
    {
      Guard guard(state->lock);
      state->connections.push_back(connection);
      number = ++state->accepted;
    }
    connection->setExportedDispatcher(
        std::make_shared<SessionInterfaceDispatcher>(std::make_shared<Session>(state, number)));
    connection->setInvalidationHandler([state] {
      Guard guard(state->lock);
      ++state->ends;
      state->changed.notifyAll();
    });
    connection->resume();
    return true;
  };
  auto listener = Listener::bind(_directory.path() + "/socket", std::move(options));
  if (!listener) throw std::runtime_error(listener.error().description);
  _listener = std::move(*listener);
  if (const auto resumed = _listener->resume(); !resumed) throw std::runtime_error(resumed.error().description);
}

void FakeDaemon::stop() {
  if (!_listener) return;
  _listener->stop();
  _listener.reset();
  // Without a goodbye: the loop and with it every socket goes as in a process that dies.
  _loop->stop();
  std::deque<TextReply> kept;  // too late for them to be told of
  {
    Guard guard(_state->lock);
    kept.swap(_state->kept);
    _state->connections.clear();
    _state->forgotten = _state->accepted;
  }
  kept.clear();
  _loop.reset();
}

void FakeDaemon::endConnections() {
  std::vector<std::shared_ptr<Connection>> connections;
  {
    Guard guard(_state->lock);
    connections = _state->connections;
  }
  for (const auto& connection : connections) connection->invalidate();
}

void FakeDaemon::refuseSessions() {
  Guard guard(_state->lock);
  _state->refuses = true;
}

void FakeDaemon::setConfiguration(std::optional<PropertyArray> enabled, std::optional<PropertyArray> whitelist,
                                  std::optional<PropertyArray> blacklist) {
  Guard guard(_state->lock);
  _state->enabled = std::move(enabled);
  _state->whitelist = std::move(whitelist);
  _state->blacklist = std::move(blacklist);
}

void FakeDaemon::setDeliversUploads(bool delivers) {
  Guard guard(_state->lock);
  _state->deliversUploads = delivers;
}

void FakeDaemon::setMessageReply(std::optional<std::string> text) {
  Guard guard(_state->lock);
  _state->messageReply = std::move(text);
}

void FakeDaemon::setDisplayUrl(std::optional<std::string> url) {
  Guard guard(_state->lock);
  _state->displayUrl = std::move(url);
}

void FakeDaemon::setSingleMessages(SingleMessages fate) {
  Guard guard(_state->lock);
  _state->singleMessages = fate;
}

void FakeDaemon::answerKeptMessage() {
  TextReply reply;
  {
    Guard guard(_state->lock);
    if (_state->kept.empty()) throw std::runtime_error("no single message is kept");
    reply = std::move(_state->kept.front());
    _state->kept.pop_front();
  }
  reply("finished");
}

void FakeDaemon::setFlushError(std::optional<Error> error) {
  Guard guard(_state->lock);
  _state->flushError = std::move(error);
}

void FakeDaemon::holdCalls(bool hold) {
  Guard guard(_state->lock);
  _state->holds = hold;
  _state->changed.notifyAll();
}

std::vector<FakeDaemon::Call> FakeDaemon::calls() const {
  Guard guard(_state->lock);
  return _state->calls;
}

std::size_t FakeDaemon::count(const std::string& method) const {
  std::size_t found = 0;
  for (const auto& call : calls()) found += call.method == method ? 1 : 0;
  return found;
}

bool FakeDaemon::waitForCalls(const std::string& method, std::size_t count) const {
  // Looks at each call once: whoever records one waits meanwhile, and there may be tens of thousands.
  std::size_t at = 0;
  std::size_t found = 0;
  return _state->waitUntil([&]() VELK_NO_THREAD_SAFETY_ANALYSIS {
    for (; at < _state->calls.size(); ++at) found += _state->calls[at].method == method ? 1 : 0;
    return found >= count;
  });
}

bool FakeDaemon::waitForEnds(std::size_t count) const {
  return _state->waitUntil([&]() VELK_NO_THREAD_SAFETY_ANALYSIS { return _state->ends >= count; });
}

void FakeDaemon::sendToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                              std::uint16_t category, std::uint16_t type,
                              const std::optional<PropertyDictionary>& payload) {
  std::shared_ptr<Connection> connection;
  {
    Guard guard(_state->lock);
    connection = _state->connections.back();
  }
  const auto sent =
      ReplyInterfaceProxy(connection).sendMessageToClient(sessionInfo, timestamp, category, type, payload);
  if (!sent) throw std::runtime_error(sent.error().description);
}

}  // namespace velk::test
