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
constexpr const char* kLateError = "no answer came in time";

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
                                                       StorebagPublicKeySource publicKey, Duration answerLimit) {
  return std::shared_ptr<StorebagService>(
      new StorebagService(platform, environment, std::move(diskCache), std::move(publicKey), answerLimit));
}

StorebagService::StorebagService(const Platform& platform, const DeviceEnvironment& environment,
                                 std::unique_ptr<StorebagDiskCache> diskCache, StorebagPublicKeySource publicKey,
                                 Duration answerLimit)
    : _platform(platform),
      _environment(environment),
      _publicKey(std::move(publicKey)),
      _answerLimit(answerLimit),
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
  result.copyDate = fetched.copyDate;
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
  auto copy = copyFromDisk(name);
  fetched.storebag = std::move(copy.storebag);
  fetched.copyDate = copy.date;
  std::optional<ByteData> envelope;
  if (!fetched.storebag && !copy.lacksKey) envelope = fetchSynchronously(name);
  Guard guard(_storebagLock);
  // A refresh that has completed meanwhile may have changed it.
  fetched.maxAge = _metrics.maxAge(name);
  if (!envelope) return fetched;
  if (!fetched.handled) fetched.storebag = verifyAndUnpackLocked(name, *envelope, Save::no);
  fetched.copyDate = _diskCache->modificationDate(name);
  return fetched;
}

StorebagService::DiskCopy StorebagService::copyFromDisk(const std::string& name) {
  DiskCopy copy;
  std::optional<std::string> lastModified;
  bool expired = false;
  {
    Guard guard(_storebagLock);
    copy = diskCopyLocked(name);
    if (!copy.storebag) return copy;
    const auto maxAge = _metrics.maxAge(name);
    _metrics.updateLastModified(name, lastModified);
    expired = hasExpired(copy, maxAge);
    log::standard(daemontexts::kLoadedFromDisk, name, expired ? daemontexts::kDiskExpired : daemontexts::kDiskValid);
  }
  // No session waits for it: the copy is served.
  if (expired) pull(name, makeRequest(name, lastModified), false, nullptr);
  return copy;
}

// A copy that cannot be used counts as none: it is verified before it decides anything, so that it never starts a
// delayed refresh in place of the immediate fetch.
StorebagService::DiskCopy StorebagService::diskCopyLocked(const std::string& name) {
  DiskCopy copy;
  if (_environment.isInternalBuild()) _diskCache->setStorageClassProtectionLevel(name);
  copy.date = _diskCache->modificationDate(name);
  const auto envelope = _diskCache->loadStorebagFromDisk(name);
  if (!envelope) return copy;
  const auto verified = verifyStorebagEnvelope(*envelope, _publicKey);
  // Without a key the file is not at fault and may be of use again.
  copy.lacksKey = verified.verdict == VerifiedBag::Verdict::noPublicKey;
  if (copy.lacksKey) return copy;
  if (verified.verdict == VerifiedBag::Verdict::verified) copy.storebag = unpackStorebag(name, verified.bag);
  if (!copy.storebag) _diskCache->setAside(name);
  return copy;
}

bool StorebagService::hasExpired(const DiskCopy& copy, std::int32_t maxAge) const {
  if (!copy.date) return true;
  const auto age = std::abs(secondsFromTimeValue(_platform.clock.wallTime()) - secondsFromTimeValue(*copy.date));
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

std::shared_ptr<ReportingSessionConnectivityHelper> StorebagService::makeTransport() const {
  const PropertyDictionary userInfo{{kVelkReportingUserInfoClientName, "storebag"},
                                    {kVelkReportingUserInfoServiceName, "shared"}};
  auto transport = ReportingSessionConnectivityHelper::initWithDelegate(
      _platform, {}, ReportingSessionConnectivityHelper::GETRequestMode(), userInfo);
  transport->activate(kHelperReleaseTimeout);
  return transport;
}

void StorebagService::pull(const std::string& name, HttpRequest request, bool isUrgent, HttpCompletion answer) {
  const auto url = request.url;
  // Held until the due time has been stored, so that the pull cannot end first.
  Guard guard(_storebagLock);
  // A transport that was made after `stop` would never be invalidated.
  if (isStopped()) return;
  if (const auto pending = _pulls.find(url); pending != _pulls.end()) {
    const auto& transport = pending->second.transport;
    if (pending->second.isUrgent || !isUrgent) {
      // It has been asked for this address: it logs the duplicate and drops it.
      transport->getURLRequestWithCompletionHandler(std::move(request), isUrgent, std::move(answer));
      return;
    }
    transport->invalidate();
  }
  const auto number = ++_lastPull;
  const auto transport = makeTransport();
  _pulls[url] = {number, isUrgent, transport};
  HttpCompletion completion(
      [weak = weak_from_this(), name, url, number, answer = std::move(answer)](
          ByteData data, std::shared_ptr<const HttpResponse> response, std::optional<Error> error) mutable {
        if (const auto service = weak.lock()) service->pullEnded(name, url, number, data, response.get(), error);
        answer(std::move(data), std::move(response), std::move(error));
      },
      [weak = weak_from_this(), url, number] {
        if (const auto service = weak.lock()) service->pullDropped(url, number);
      });
  const auto now = _platform.clock.wallTime();
  const auto left = isUrgent ? std::nullopt : _metrics.secondsUntilPullDue(name, now);
  const auto delay =
      transport->getURLRequestWithCompletionHandler(std::move(request), isUrgent, std::move(completion), left);
  if (!isUrgent && !left && delay) _metrics.savePullDue(name, now, *delay);
}

// On the transport's queue.
void StorebagService::pullEnded(const std::string& name, const std::string& url, std::uint64_t number,
                                const ByteData& data, const HttpResponse* response, const std::optional<Error>& error) {
  Guard guard(_storebagLock);
  networkAnsweredLocked(name, data, response, error);
  const bool wasLetGo = !forgetPullLocked(url, number);
  // One whose transport was let go before its time has not been made, and stays due.
  if (!wasLetGo || response != nullptr) _metrics.removePullDue(name);
}

void StorebagService::pullDropped(const std::string& url, std::uint64_t number) {
  Guard guard(_storebagLock);
  forgetPullLocked(url, number);
}

bool StorebagService::forgetPullLocked(const std::string& url, std::uint64_t number) {
  const auto found = _pulls.find(url);
  if (found == _pulls.end() || found->second.number != number) return false;
  found->second.transport->invalidate();
  _pulls.erase(found);
  return true;
}

void StorebagService::startAfresh() {
  Pulls pulls;
  {
    Guard guard(_storebagLock);
    pulls.swap(_pulls);
  }
  for (const auto& [url, pull] : pulls) pull.transport->invalidate();
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

std::optional<ByteData> StorebagService::fetchSynchronously(const std::string& name) {
  const auto pending = std::make_shared<PendingFetch>();
  HttpCompletion answer(
      [pending](ByteData data, std::shared_ptr<const HttpResponse> response, std::optional<Error> error) {
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
    pull(name, std::move(request), true, std::move(answer));
    if (!pending->answered.waitFor(_answerLimit)) {
      pending->answer(0, {}, errorObject(kLateError, -1));
      // An answer of the same moment may have been the first one.
      pending->answered.wait();
    }
    endWaiting(pending);
  }
  if (!pending->error && pending->statusCode == kStatusOk) return std::move(pending->data);
  log::standard(daemontexts::kErrorResolving, url,
                pending->error ? pending->error->description : formatText("status %d", {pending->statusCode}));
  if (name != kConferencingStorebagName) return std::nullopt;
  log::standard(daemontexts::kLoadingDefault, name);
  return fallbackStorebag();
}

void StorebagService::networkAnsweredLocked(const std::string& name, const ByteData& data, const HttpResponse* response,
                                            const std::optional<Error>& error) {
  if (error || response == nullptr || response->statusCode != kStatusOk) {
    log::standard(daemontexts::kNotChanged, name);
    return;
  }
  // Before the verification: an answer that fails it has still told the server's wishes.
  _metrics.save(name, *response);
  if (data.empty()) {
    log::standard(daemontexts::kZeroLength, name);
  } else {
    static_cast<void>(verifyAndUnpackLocked(name, data, Save::yes));
  }
}

}  // namespace velk
