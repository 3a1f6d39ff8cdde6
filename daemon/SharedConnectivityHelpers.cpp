#include "daemon/SharedConnectivityHelpers.h"

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "daemon/LogTexts.h"
#include "device/DeviceEnvironment.h"
#include "platform/Log.h"

namespace velk {

SharedConnectivityHelpers::SharedConnectivityHelpers(const Platform& platform)
    : _platform(platform), _stateQueue(platform.scheduler.makeSerialQueue("com.tavrin.VelkReportingAgentStateQueue")) {}

std::shared_ptr<ReportingSessionConnectivityHelper> SharedConnectivityHelpers::request(
    const PropertyDictionary& userInfo, std::int32_t mode, const std::weak_ptr<ConnectivityHelperDelegate>& delegate) {
  const auto key = userInfoIdentifierString(userInfo);
  return _stateQueue->sync([&] { return requestOnQueue(key, userInfo, mode, delegate); });
}

std::shared_ptr<ReportingSessionConnectivityHelper> SharedConnectivityHelpers::requestOnQueue(
    const std::string& key, const PropertyDictionary& userInfo, std::int32_t mode,
    const std::weak_ptr<ConnectivityHelperDelegate>& delegate) {
  assertOnQueue(*_stateQueue);
  log::standard(daemontexts::kRequestingHelper, key);
  auto& entry = _helpers[key];
  if (entry.helper) {
    log::standard(daemontexts::kFoundHelper, key);
  } else {
    log::standard(daemontexts::kCreatingHelper, key);
    entry.helper = ReportingSessionConnectivityHelper::initWithDelegate(_platform, delegate, mode, userInfo);
  }
  log::standard(daemontexts::kIncrementingHelper, key);
  ++entry.uses;
  entry.helper->ownerIncrementUsageCount();
  return entry.helper;
}

void SharedConnectivityHelpers::release(const PropertyDictionary& userInfo) {
  _stateQueue->async(
      [self = shared_from_this(), key = userInfoIdentifierString(userInfo)] { self->releaseOnQueue(key); });
}

void SharedConnectivityHelpers::releaseOnQueue(const std::string& key) {
  assertOnQueue(*_stateQueue);
  log::standard(daemontexts::kReleasingHelper, key);
  const auto found = _helpers.find(key);
  if (found == _helpers.end()) return;
  log::standard(daemontexts::kDecrementingHelper, key);
  auto& entry = found->second;
  if (entry.uses > 0) --entry.uses;
  // Weakly: a transport must not hold itself through its own timer.
  const std::weak_ptr<ReportingSessionConnectivityHelper> helper = entry.helper;
  entry.helper->ownerDecrementUsageCountWithBlock(
      [weak = weak_from_this(), key, helper](std::uint32_t usage) {
        if (const auto self = weak.lock()) self->usageReported(key, helper, usage);
      },
      _stateQueue);
  entry.unusedSince = ++_releases;
  if (entry.uses == 0) boundUnused();
}

void SharedConnectivityHelpers::usageReported(const std::string& key,
                                              const std::weak_ptr<ReportingSessionConnectivityHelper>& helper,
                                              std::uint32_t usage) {
  assertOnQueue(*_stateQueue);
  if (usage != 0) return;
  const auto found = _helpers.find(key);
  if (found == _helpers.end() || found->second.helper != helper.lock() || found->second.uses != 0) return;
  letGo(found);
}

void SharedConnectivityHelpers::letGo(Helpers::iterator entry) {
  log::standard(daemontexts::kHelperReachedZero, entry->first);
  const auto unused = std::move(entry->second.helper);
  _helpers.erase(entry);
  unused->invalidate();
}

void SharedConnectivityHelpers::boundUnused() {
  std::size_t unused = 0;
  auto oldest = _helpers.end();
  for (auto entry = _helpers.begin(); entry != _helpers.end(); ++entry) {
    if (entry->second.uses != 0) continue;
    ++unused;
    if (oldest == _helpers.end() || entry->second.unusedSince < oldest->second.unusedSince) oldest = entry;
  }
  if (unused > kMaximumUnused) letGo(oldest);
}

void SharedConnectivityHelpers::invalidateAll() {
  _stateQueue->async([self = shared_from_this()] {
    for (const auto& [key, entry] : std::exchange(self->_helpers, {})) entry.helper->invalidate();
  });
}

std::size_t SharedConnectivityHelpers::count() {
  return _stateQueue->sync([&] { return _helpers.size(); });
}

PropertyArray SharedConnectivityHelpers::status(std::size_t limit) {
  return _stateQueue->sync([&] {
    PropertyArray rows;
    for (const auto& [key, entry] : _helpers) {
      if (rows.size() == limit) break;
      PropertyDictionary row{{"key", key}, {"usage", entry.uses}};
      row.merge(entry.helper->status());
      rows.append(std::move(row));
    }
    return rows;
  });
}

}  // namespace velk
