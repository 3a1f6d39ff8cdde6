#include "daemon/StorebagService.h"

#include <algorithm>
#include <atomic>
#include <cmath>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "daemon/LogTexts.h"
#include "daemon/StorebagTable.h"
#include "ipc/Vocabulary.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"
#include "platform/UserDefaults.h"

namespace velk {

namespace {

constexpr std::string_view kUrlSetting = "velkreporting_storebag_url";
constexpr auto kRequestTimeout = std::chrono::seconds(15);
constexpr std::uint32_t kHelperReleaseTimeout = 30;
constexpr int kStatusOk = 200;
constexpr const char* kStoppingError = "the daemon is about to end";

const PropertyDictionary* sectionOf(const PropertyDictionary& storebag, std::optional<std::string_view> name) {
  return name ? storebag.dictionary(*name) : nullptr;
}

}  // namespace

/// What a waiting fetch and those who may end its wait share: the completion, which may come long after nobody waits
/// any more, and whoever stops the service. The first answer counts; the semaphore orders it before the waiter's reads.
struct StorebagService::PendingFetch {
  void answer(int status, ByteData bytes, std::optional<Error> failure) {
    if (isAnswered.exchange(true)) return;
    statusCode = status;
    data = std::move(bytes);
    error = std::move(failure);
    answered.signal();
  }

  std::atomic<bool> isAnswered{false};
  Semaphore answered;
  ByteData data;
  int statusCode = 0;
  std::optional<Error> error;
};

std::shared_ptr<StorebagService> StorebagService::make(const Platform& platform, const DeviceEnvironment& environment,
                                                       std::unique_ptr<StorebagDiskCache> diskCache,
                                                       StorebagPublicKeySource publicKey) {
  return std::shared_ptr<StorebagService>(
      new StorebagService(platform, environment, std::move(diskCache), std::move(publicKey)));
}

StorebagService::StorebagService(const Platform& platform, const DeviceEnvironment& environment,
                                 std::unique_ptr<StorebagDiskCache> diskCache, StorebagPublicKeySource publicKey)
    : _platform(platform),
      _environment(environment),
      _publicKey(std::move(publicKey)),
      _diskCache(std::move(diskCache)),
      _metrics(platform.defaults) {}

std::optional<TimeValue> StorebagService::diskModificationDate(const std::string& name) const {
  return _diskCache->modificationDate(name);
}

// ---- Selection of the environment's section

StorebagSection StorebagService::fetchStorebagForEnvironmentAndClientType(std::int32_t clientType) {
  StorebagSection result;
  const auto name = storebagNameForClientType(clientType);
  if (!name) {
    log::error(daemontexts::kNoStorebagName, clientType);
    return result;
  }
  const auto fetched = fetchStorebagWithName(std::string(*name));
  result.maxAge = fetched.maxAge;
  result.handled = fetched.handled;
  if (!fetched.storebag) {
    if (!fetched.handled) log::error(daemontexts::kCouldNotFetch, clientType);
    return result;
  }
  const auto& storebag = *fetched.storebag;
  const auto environment = _environment.userDefaultsEnvironment();
  const auto sectionName = environmentSectionName(environment);
  const auto* section = sectionOf(storebag, sectionName);
  if (section == nullptr && environment == kEnvironmentSeed) {
    log::error(daemontexts::kSeedMissing);
    section = sectionOf(storebag, environmentSectionName(kEnvironmentRelease));
  }
  if (section == nullptr) {
    log::error(daemontexts::kNoSection, clientType, sectionName ? sectionName->data() : nullptr);
    return result;
  }
  result.section = *section;
  if (const auto* releaseTimeout = storebag.find("release_timeout")) {
    result.section->set("release_timeout", *releaseTimeout);
  }
  if (const auto* version = storebag.string("version")) result.version = *version;
  if (const auto* refreshCycle = storebag.find("refresh_cycle")) {
    result.maxAge =
        static_cast<std::int32_t>(std::min<std::int64_t>(integerValue(refreshCycle), kDefaultStorebagMaxAge));
    log::standard(daemontexts::kMaxAgeOverride, result.maxAge);
  }
  return result;
}

// ---- Disk cache, else network

StorebagService::Fetched StorebagService::fetchStorebagWithName(const std::string& name) {
  Fetched fetched;
  fetched.storebag = storebagFromDisk(name);
  std::optional<ByteData> envelope;
  if (!fetched.storebag) envelope = fetchSynchronously(name);
  Guard guard(_storebagLock);
  // A refresh that has completed meanwhile may have changed it.
  fetched.maxAge = _metrics.maxAge(name);
  if (envelope && !fetched.handled) fetched.storebag = verifyAndUnpackLocked(name, *envelope, Save::no);
  return fetched;
}

std::optional<PropertyDictionary> StorebagService::storebagFromDisk(const std::string& name) {
  std::optional<PropertyDictionary> storebag;
  std::optional<std::string> lastModified;
  bool expired = false;
  {
    Guard guard(_storebagLock);
    storebag = usableDiskCopyLocked(name);
    if (!storebag) return std::nullopt;
    const auto maxAge = _metrics.maxAge(name);
    _metrics.updateLastModified(name, lastModified);
    expired = hasExpiredLocked(name, maxAge);
    log::standard(daemontexts::kLoadedFromDisk, name, expired ? daemontexts::kDiskExpired : daemontexts::kDiskValid);
  }
  if (expired) refreshInBackground(name, lastModified);
  return storebag;
}

// A copy that cannot be used counts as none: it is verified before it decides anything, so that it can never start
// the delayed refresh that would then stand in the way of the immediate fetch.
std::optional<PropertyDictionary> StorebagService::usableDiskCopyLocked(const std::string& name) {
  if (_environment.isInternalBuild()) _diskCache->setStorageClassProtectionLevel(name);
  const auto envelope = _diskCache->loadStorebagFromDisk(name);
  if (!envelope) return std::nullopt;
  const auto verified = verifyStorebagEnvelope(*envelope, _publicKey);
  // Without a key the file is not at fault and may be of use again.
  if (verified.verdict == VerifiedBag::Verdict::noPublicKey) return std::nullopt;
  std::optional<PropertyDictionary> storebag;
  if (verified.verdict == VerifiedBag::Verdict::verified) storebag = unpackStorebag(name, verified.bag);
  if (!storebag) _diskCache->setAside(name);
  return storebag;
}

bool StorebagService::hasExpiredLocked(const std::string& name, std::int32_t maxAge) const {
  const auto written = _diskCache->modificationDate(name);
  if (!written) return true;
  const auto age = std::abs(secondsFromTimeValue(_platform.clock.wallTime()) - secondsFromTimeValue(*written));
  return age > maxAge;
}

std::optional<PropertyDictionary> StorebagService::verifyAndUnpackLocked(const std::string& name,
                                                                         std::span<const std::uint8_t> envelope,
                                                                         Save save) {
  const auto verified = verifyStorebagEnvelope(envelope, _publicKey);
  if (verified.verdict != VerifiedBag::Verdict::verified) return std::nullopt;
  if (save == Save::yes && _diskCache->saveStorebagToDisk(name, envelope)) {
    log::standard(daemontexts::kStorebagSaved, name);
  }
  return unpackStorebag(name, verified.bag);
}

// ---- Network

std::string StorebagService::storebagUrl(const std::string& name) const {
  const auto setting = _platform.defaults.value(kUrlSetting);
  const auto* base = setting ? setting->string() : nullptr;
  const auto server = _environment.isInternalBuild() ? kInternalStorebagServer : kProductionStorebagServer;
  return formatText("%@/%@?version=%@",
                    {base != nullptr ? std::string_view(*base) : server, name, _environment.frameworkVersion()});
}

HttpRequest StorebagService::makeRequest(const std::string& name,
                                         const std::optional<std::string>& lastModified) const {
  HttpRequest request;
  request.url = storebagUrl(name);
  log::standard(daemontexts::kServerUrl, request.url);
  request.timeout = kRequestTimeout;
  request.ignoresLocalCache = true;
  // What the whole configuration hangs on never travels in the clear, whatever address was set.
  request.requiresHttps = true;
  if (lastModified) {
    log::standard(daemontexts::kAddingLastModified, *lastModified);
    request.setHeader("If-Modified-Since", *lastModified);
  }
  return request;
}

std::shared_ptr<ReportingSessionConnectivityHelper> StorebagService::connectivityHelper() {
  Guard guard(_storebagLock);
  // One that was made after `stop` would be invalidated by nobody.
  if (isStopped()) return nullptr;
  if (!_connectivityHelper) {
    const PropertyDictionary userInfo{{kVelkReportingUserInfoClientName, "storebag"},
                                      {kVelkReportingUserInfoServiceName, "shared"}};
    _connectivityHelper = ReportingSessionConnectivityHelper::initWithDelegate(
        _platform, {}, ReportingSessionConnectivityHelper::GETRequestMode(), userInfo);
    _connectivityHelper->activate(kHelperReleaseTimeout);
  }
  return _connectivityHelper;
}

void StorebagService::startAfresh() {
  std::shared_ptr<ReportingSessionConnectivityHelper> helper;
  {
    Guard guard(_storebagLock);
    helper.swap(_connectivityHelper);
  }
  if (helper) helper->invalidate();
}

void StorebagService::stop() {
  std::vector<std::shared_ptr<PendingFetch>> waiting;
  {
    Guard guard(_waitingLock);
    _stopped = true;
    waiting.swap(_waiting);
  }
  for (const auto& pending : waiting) pending->answer(0, {}, errorObject(kStoppingError, -1));
  startAfresh();
}

bool StorebagService::startWaiting(const std::shared_ptr<PendingFetch>& pending) {
  {
    Guard guard(_waitingLock);
    if (!_stopped) {
      _waiting.push_back(pending);
      return true;
    }
  }
  pending->error = errorObject(kStoppingError, -1);
  return false;
}

bool StorebagService::isStopped() const {
  Guard guard(_waitingLock);
  return _stopped;
}

void StorebagService::endWaiting(const std::shared_ptr<PendingFetch>& pending) {
  Guard guard(_waitingLock);
  std::erase(_waiting, pending);
}

void StorebagService::refreshInBackground(const std::string& name, const std::optional<std::string>& lastModified) {
  HttpCompletion completion([weak = weak_from_this(), name](ByteData data, std::shared_ptr<const HttpResponse> response,
                                                            std::optional<Error> error) {
    if (const auto service = weak.lock()) service->networkAnswered(name, data, response.get(), error);
  });
  auto request = makeRequest(name, lastModified);
  if (const auto helper = connectivityHelper()) {
    helper->getURLRequestWithCompletionHandler(std::move(request), false, std::move(completion));
  }
}

std::optional<ByteData> StorebagService::fetchSynchronously(const std::string& name) {
  const auto pending = std::make_shared<PendingFetch>();
  HttpCompletion completion(
      [weak = weak_from_this(), pending, name](ByteData data, std::shared_ptr<const HttpResponse> response,
                                               std::optional<Error> error) {
        if (const auto service = weak.lock()) service->networkAnswered(name, data, response.get(), error);
        pending->answer(response ? response->statusCode : 0, std::move(data), std::move(error));
      },
      // The transport ignored or dropped the request: no answer can come, so the wait ends here.
      [pending, name] {
        log::standard(daemontexts::kNotChanged, name);
        pending->answer(0, {}, errorObject("the request was ignored by the transport", -1));
      });
  auto request = makeRequest(name, std::nullopt);
  const auto url = request.url;
  if (startWaiting(pending)) {
    if (const auto helper = connectivityHelper()) {
      helper->getURLRequestWithCompletionHandler(std::move(request), true, std::move(completion));
    } else {
      pending->answer(0, {}, errorObject(kStoppingError, -1));
    }
    pending->answered.wait();
    endWaiting(pending);
  }
  if (!pending->error && pending->statusCode == kStatusOk) return std::move(pending->data);
  log::standard(daemontexts::kErrorResolving, url,
                pending->error ? pending->error->description : formatText("status %d", {pending->statusCode}));
  if (name != kConferencingStorebagName) return std::nullopt;
  log::standard(daemontexts::kLoadingDefault, name);
  return fallbackStorebag();
}

// On the transport's queue.
void StorebagService::networkAnswered(const std::string& name, const ByteData& data, const HttpResponse* response,
                                      const std::optional<Error>& error) {
  if (error || response == nullptr || response->statusCode != kStatusOk) {
    log::standard(daemontexts::kNotChanged, name);
    return;
  }
  Guard guard(_storebagLock);
  // Before the verification: an answer that fails it has still told the server's wishes.
  _metrics.save(name, *response);
  if (data.empty()) {
    log::standard(daemontexts::kZeroLength, name);
  } else {
    static_cast<void>(verifyAndUnpackLocked(name, data, Save::yes));
  }
}

}  // namespace velk
