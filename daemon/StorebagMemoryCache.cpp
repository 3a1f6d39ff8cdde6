#include "daemon/StorebagMemoryCache.h"

#include <cmath>

#include "daemon/LogTexts.h"
#include "daemon/StorebagService.h"
#include "daemon/StorebagTable.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ReportingdSession.h"

namespace velk {

namespace {

std::int32_t clientTypeOf(const ReportingdSession& session) {
  const auto sessionInfo = session.sessionInfo();
  return sessionInfo ? int32Value(sessionInfo->find(kVelkReportingSessionInfoClientType)) : 0;
}

bool isLater(const TimeValue& time, const TimeValue& other) {
  return secondsFromTimeValue(time) > secondsFromTimeValue(other);
}

PropertyValue dateValue(const TimeValue& time) { return Date{secondsFromTimeValue(time)}; }

std::string_view stateText(bool succeeded) { return succeeded ? "Fetch Successful" : "Fetch Failure"; }

}  // namespace

std::optional<PropertyDictionary> StorebagMemoryCache::storebagForSession(const ReportingdSession& session) {
  const auto clientType = clientTypeOf(session);
  const auto name = storebagNameForClientType(clientType);
  if (!name) return std::nullopt;
  log::standard(daemontexts::kRetrievingStorebag, session.sessionID(), clientType);
  const auto entry = _entries.find(*name);
  if (entry == _entries.end() || mustFetch(entry->first, entry->second, clientType)) fetchAndCacheStorebag(clientType);
  const auto fetched = _entries.find(*name);
  return fetched != _entries.end() ? fetched->second.data : std::nullopt;
}

bool StorebagMemoryCache::mustFetch(const std::string& name, const Entry& entry, std::int32_t clientType) const {
  if (entry.expired) return true;
  const auto onDisk = _service.diskModificationDate(name);
  // A refresh may be quicker than the fetch that started it, and its file older than that fetch's end.
  if (onDisk && (isLater(*onDisk, entry.fetchTime) || !entry.copyDate || isLater(*onDisk, *entry.copyDate))) {
    log::standard(daemontexts::kDiskCacheOverrides, name, dateValue(*onDisk), dateValue(entry.fetchTime));
    return true;
  }
  const auto age = ageInSeconds(entry);
  if (entry.fetchSucceeded && age < entry.maxAge) {
    log::standard(daemontexts::kCachedStorebagFound, clientType);
    return false;
  }
  if (!entry.fetchSucceeded && age < kStorebagRetrySeconds) {
    log::standard(daemontexts::kStorebagMustWait, clientType, kStorebagRetrySeconds);
    return false;
  }
  return true;
}

// The clock may have been set back or forth since; either way that much time counts as passed.
double StorebagMemoryCache::ageInSeconds(const Entry& entry) const {
  return std::abs(secondsFromTimeValue(_clock.wallTime()) - secondsFromTimeValue(entry.fetchTime));
}

void StorebagMemoryCache::fetchAndCacheStorebag(std::int32_t clientType) {
  log::standard(daemontexts::kFetchingStorebag, clientType);
  const auto name = storebagNameForClientType(clientType);
  if (!name) {
    log::error(daemontexts::kClientTypeInvalid, clientType);
    return;
  }
  auto& entry = _entries[std::string(*name)];
  auto fetched = _service.fetchStorebagForEnvironmentAndClientType(clientType);
  log::standard(daemontexts::kStorebagMaxAge, fetched.maxAge);
  const bool found = fetched.section.has_value();
  if (found) {
    entry.data = std::move(fetched.section);
    entry.version = std::move(fetched.version);
  } else if (!fetched.handled) {
    log::error(daemontexts::kUnableToFetch, clientType);
  }
  entry.fetchTime = _clock.wallTime();
  entry.copyDate = fetched.copyDate;
  entry.fetchSucceeded = found || fetched.handled;
  entry.maxAge = fetched.maxAge;
  entry.expired = false;
}

std::optional<std::string> StorebagMemoryCache::storebagVersionForSession(const ReportingdSession& session) const {
  const auto name = storebagNameForClientType(clientTypeOf(session));
  if (!name) return std::nullopt;
  const auto entry = _entries.find(*name);
  return entry != _entries.end() ? entry->second.version : std::nullopt;
}

void StorebagMemoryCache::expireAll() {
  for (auto& [name, entry] : _entries) entry.expired = true;
}

PropertyDictionary StorebagMemoryCache::snapshot() const {
  PropertyDictionary storebags;
  storebags.reserve(_entries.size());
  for (const auto& [name, entry] : _entries) {
    PropertyDictionary values{{"StorebagFetchTime", dateValue(entry.fetchTime)},
                              {"StorebagFetchState", stateText(entry.fetchSucceeded)},
                              {"StorebagMaxAge", entry.maxAge}};
    if (entry.data) values.set("StorebagData", *entry.data);
    if (entry.version) values.set("StorebagVersion", *entry.version);
    storebags.set(name, std::move(values));
  }
  return storebags;
}

PropertyArray StorebagMemoryCache::status() const {
  PropertyArray rows;
  for (const auto& [name, entry] : _entries) {
    PropertyDictionary row{{"name", name},
                           {"state", stateText(entry.fetchSucceeded)},
                           {"ageSeconds", ageInSeconds(entry)},
                           {"maxAgeSeconds", entry.maxAge},
                           {"available", entry.data.has_value()}};
    if (entry.version) row.set("version", *entry.version);
    rows.append(std::move(row));
  }
  return rows;
}

}  // namespace velk
