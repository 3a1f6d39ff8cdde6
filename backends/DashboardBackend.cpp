// How a dashboard backend is made, how an event becomes a datagram, and the upload of log data.
#include "backends/DashboardBackend.h"

#include <algorithm>
#include <new>
#include <utility>

#include "backends/DashboardText.h"
#include "backends/LogTexts.h"
#include "foundation/DashboardDatagram.h"
#include "foundation/Text.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "platform/Semaphore.h"

namespace velk {

namespace {

constexpr Duration kDefaultPeriod = std::chrono::milliseconds(500);
/// Datagrams that may be on their way to the network queue; who sends more waits for them.
constexpr std::uint32_t kMostHandedOver = 256;

// The notice of an upload among the events of the dashboard.
constexpr const char* kLocationKey = "LogDataUploadLocation";
constexpr std::uint16_t kNoticeMethod = 0;
constexpr std::uint16_t kNoticeRespCode = 2;
/// Longer than any address: the rest of an answer is none of ours to log.
constexpr std::size_t kMostLocationBytes = 2048;
/// What is taken of an answer at all.
constexpr std::size_t kMostAnswerBytes = 1024 * 1024;

const PropertyValue* present(const PropertyDictionary& section, std::string_view key) {
  const auto* value = section.find(key);
  return value != nullptr && !value->isNull() ? value : nullptr;
}

std::optional<std::string> textIn(const PropertyDictionary& section, std::string_view key) {
  const auto* text = section.string(key);
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

/// A section may ask for any period; one that is none gets the usual one.
Duration periodFrom(const PropertyValue& reliable) {
  const auto milliseconds = int32Value(&reliable);
  return milliseconds > 0 ? std::chrono::milliseconds(milliseconds) : kDefaultPeriod;
}

/// The answer to a post, for the one who waits for it.
struct UploadAnswer {
  Semaphore arrived;
  bool received = false;
  ByteData data;
  std::optional<Error> error;
};

}  // namespace

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(const BackendContext& context, const std::string& name,
                                                                 const PropertyValue& profile,
                                                                 const std::optional<std::string>& productFamily) {
  const auto* section = profile.dictionary();
  const auto address = section != nullptr ? textIn(*section, "ip") : std::nullopt;
  const auto port = section != nullptr ? uint16Value(section->find("port")) : std::uint16_t{0};
  return initWithProfile(context, name, section, address, port, productFamily);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithServerIP(const BackendContext& context,
                                                                     const std::string& name,
                                                                     const std::optional<std::string>& serverIP,
                                                                     std::uint16_t serverPort,
                                                                     const std::optional<std::string>& productFamily) {
  if (!serverIP) return nullptr;
  return initWithProfile(context, name, nullptr, serverIP, serverPort, productFamily);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithProfile(const BackendContext& context,
                                                                    const std::string& name,
                                                                    const PropertyDictionary* profile,
                                                                    const std::optional<std::string>& serverIP,
                                                                    std::uint16_t serverPort,
                                                                    const std::optional<std::string>& productFamily) {
  if (profile != nullptr) {
    if (profile->string("ip") == nullptr) {
      log::error(backend_texts::kNoServerIP);
      return nullptr;
    }
    if (present(*profile, "port") == nullptr) {
      log::error(backend_texts::kNoServerPort);
      return nullptr;
    }
  }
  auto* const sockets = context.platform.udpSockets;
  auto socket = sockets != nullptr ? sockets->makeSocket() : failure(kUdpSocketErrorDomain, 0, "no such service");
  if (!socket) {
    log::error(backend_texts::kSocketFailed, socket.error().code);
    return nullptr;
  }
  auto section = profile != nullptr ? PropertyValue(*profile) : PropertyValue();
  auto backend = std::make_shared<DashboardBackend>(Private(), context, name, std::move(section), productFamily,
                                                    std::move(*socket));
  // On the queue, so that nothing is read before everything is there.
  const bool usable = backend->_networkProcQueue->sync([&] {
    if (backend->chooseAddress(profile, serverIP, serverPort) && backend->connectSocket() && backend->makeTimer()) {
      return true;
    }
    backend->cleanupSources();
    return false;
  });
  return usable ? backend : nullptr;
}

DashboardBackend::DashboardBackend(Private, const BackendContext& context, const std::string& name,
                                   PropertyValue profile, const std::optional<std::string>& productFamily,
                                   std::unique_ptr<UdpSocket> socket)
    : VelkReportingBackend(context, name, std::move(profile), productFamily),
      _networkProcQueue(context.platform.scheduler.makeSerialQueue("com.tavrin.VelkReporting.networkProc")),
      _period(kDefaultPeriod),
      _socket(std::move(socket)) {}

DashboardBackend::~DashboardBackend() = default;

bool DashboardBackend::chooseAddress(const PropertyDictionary* profile, const std::optional<std::string>& serverIP,
                                     std::uint16_t serverPort) {
  if (profile != nullptr) {
    _usingProfile = true;
    _displayURL = textIn(*profile, "display_url");
    _postURL = textIn(*profile, "post_url");
    _serverIP = *profile->string("ip");
    _serverPort = uint16Value(profile->find("port"));
    const auto* reliable = present(*profile, "reliable");
    if (reliable == nullptr) return true;
    _period = periodFrom(*reliable);
  } else if (serverIP) {
    _serverIP = *serverIP;
    _serverPort = serverPort;
  } else {
    log::error(backend_texts::kAllNullParameters);
    return false;
  }
  useReliableUDP();
  return true;
}

void DashboardBackend::useReliableUDP() {
  if (const int error = _socket->bindToAnyPort(); error != 0) {
    log::error(backend_texts::kCannotBind, error);
    return;
  }
  _reliableUDP = true;
  const auto self = std::static_pointer_cast<DashboardBackend>(shared_from_this());
  _readSource = _socket->makeReadSource(
      _networkProcQueue, [self] { self->readAcknowledgements(); }, [] { log::error(backend_texts::kNoReadSource); });
  if (!_readSource) log::error(backend_texts::kNoReadSource);
}

bool DashboardBackend::connectSocket() {
  if (!isIPv4Address(_serverIP)) {
    // Display URL and log data need none. A closed socket neither sends nor reads.
    log::error(backend_texts::kNoServerAddress, _serverIP);
    _readSource.reset();
    _socket->close();
    return true;
  }
  if (_socket->connectTo(_serverIP, _serverPort) == 0) return true;
  log::error(backend_texts::kConnectFailed);
  return false;
}

bool DashboardBackend::makeTimer() {
  auto& scheduler = _context.platform.scheduler;
  const auto self = std::static_pointer_cast<DashboardBackend>(shared_from_this());
  _timer = scheduler.makeTimer(_networkProcQueue, [self] { self->myPeriodicTask(); });
  _timerStart = scheduler.clock().steadyTime();
  if (!_timer) log::error(backend_texts::kNoTimerSource);
  return _timer != nullptr;
}

std::optional<std::string> DashboardBackend::sendMessageWithoutFlag(const std::optional<PropertyDictionary>& payload,
                                                                    const TimeValue& timestamp, std::uint16_t method,
                                                                    std::uint16_t respCode, std::uint16_t eventID) {
  std::unique_ptr<DatagramBuffer> buffer(new (std::nothrow) DatagramBuffer);
  if (!buffer) {
    log::error(backend_texts::kNoMemory);
    return std::nullopt;
  }
  const auto length = fillDatagram(*buffer, payload, timestamp, method, respCode, eventID);
  auto line = writeLocalLog(std::span(*buffer).first(length));
  if (++_handedOver > kMostHandedOver) _networkProcQueue->sync([] {});
  auto self = std::static_pointer_cast<DashboardBackend>(shared_from_this());
  _networkProcQueue->async([self = std::move(self), buffer = std::move(buffer), length, eventID] {
    --self->_handedOver;
    self->tryToSendMsg(std::span(*buffer).first(length), eventID);
  });
  return line;
}

std::size_t DashboardBackend::fillDatagram(DatagramBuffer& buffer, const std::optional<PropertyDictionary>& payload,
                                           const TimeValue& timestamp, std::uint16_t method, std::uint16_t respCode,
                                           std::uint16_t eventID) const {
  static_assert(sizeof(DatagramBuffer) > dashboard::kMostDatagramBytes);
  const auto text = payload ? keyValueText(*payload) : std::string();
  const std::size_t length = dashboard::kHeaderBytes + text.size();
  dashboard::Header header;
  header.majorVersion = _selfVersion.major;
  header.component = static_cast<std::uint8_t>(_compType);
  header.fourMilliseconds = static_cast<std::uint8_t>(timestamp.microseconds / 4000);
  header.seconds = static_cast<std::uint32_t>(timestamp.seconds);
  header.sessionID = _sessionID;
  header.clientVersion = _clientVersion;
  header.length = static_cast<std::uint16_t>(length);
  header.method = method;
  header.respCode = respCode;
  std::copy_n(_udid.begin(), std::min(_udid.size(), header.deviceIdentifier.size()), header.deviceIdentifier.begin());
  header.eventNumber = eventID;
  if (_reliableUDP) header.flags |= dashboard::kFlagReliable;
  if (!_usingProfile) header.flags |= dashboard::kFlagWithoutProfile;
  dashboard::writeHeader(header, std::span(buffer).first<dashboard::kHeaderBytes>());
  std::copy(text.begin(), text.end(), buffer.begin() + dashboard::kHeaderBytes);
  return length;
}

bool DashboardBackend::uploadLogData(const PropertyArray& logData) {
  if (!_postURL) {
    log::error(backend_texts::kNoLogDataURL);
    return false;
  }
  const auto archive = propertylist::serialize(logData, propertylist::Form::binary);
  if (!archive) {
    log::error(backend_texts::kLogDataNotSerialized);
    return false;
  }
  HttpRequest request;
  request.url = *_postURL;
  request.method = "POST";
  request.body = std::make_shared<const std::string>(archive->begin(), archive->end());
  // The address as the signed storebag has it.
  request.requiresHttps = false;
  request.isBulk = true;
  request.maximumResponseBytes = kMostAnswerBytes;
  request.setHeader("Content-Type", "application/octet-stream");
  const auto sender = transport();
  if (!sender) return true;
  const auto answer = std::make_shared<UploadAnswer>();
  sender->postURLRequestWithCompletionHandler(
      std::move(request),
      HttpCompletion(
          [answer](ByteData data, const std::shared_ptr<const HttpResponse>&, std::optional<Error> error) {
            answer->received = true;
            answer->data = std::move(data);
            answer->error = std::move(error);
            answer->arrived.signal();
          },
          [answer] { answer->arrived.signal(); }));
  answer->arrived.wait();
  if (!answer->received || answer->error) {
    log::error(backend_texts::kLogDataNotUploaded, answer->error ? &answer->error->description : nullptr);
    return false;
  }
  noticeLocation(answer->data);
  return true;
}

/// Numbered like an event; what the base class then does with it is nothing, so that the number is all it takes.
void DashboardBackend::noticeLocation(const ByteData& answer) {
  std::string location(answer.begin(), answer.end());
  if (!isUtf8(location)) location.clear();
  location.resize(utf8Prefix(location, kMostLocationBytes).size());
  log::standard(backend_texts::kLogDataUploaded, location);
  sendMessage(PropertyDictionary{{kLocationKey, std::move(location)}}, _context.platform.clock.wallTime(),
              kNoticeMethod, kNoticeRespCode, 0);
}

}  // namespace velk
