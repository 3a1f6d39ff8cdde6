#include "daemon/StorebagMetrics.h"

#include <algorithm>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "daemon/LogTexts.h"
#include "foundation/Format.h"
#include "foundation/Text.h"
#include "platform/Log.h"

namespace velk {

namespace {

std::string metricKey(const std::string& name, std::string_view metric) {
  return formatText("CACHED_%@_%@", {name, metric});
}

std::string maxAgeKey(const std::string& name) { return metricKey(name, "max-age"); }
std::string lastModifiedKey(const std::string& name) { return metricKey(name, "Last-Modified"); }
std::string pullDueKey(const std::string& name) { return metricKey(name, "pull-due"); }

void logUnlessWritten(const Result<void>& written) {
  if (!written) log::error("saveLastLoadedStorebagMetricsWithName: could not store the metrics: %@", written.error());
}

}  // namespace

std::int32_t maxAgeOfCacheControl(const std::string* cacheControl) {
  if (cacheControl == nullptr) return kDefaultStorebagMaxAge;
  std::string separated = *cacheControl;
  std::replace(separated.begin(), separated.end(), '=', ' ');
  const auto components = split(separated, ' ');
  const auto found = std::find(components.begin(), components.end(), "max-age");
  if (found == components.end() || found + 1 == components.end()) return kDefaultStorebagMaxAge;
  const PropertyValue seconds(*(found + 1));
  return int32Value(&seconds);
}

std::int32_t StorebagMetrics::maxAge(const std::string& name) const {
  const auto stored = _defaults.value(maxAgeKey(name));
  const auto seconds = stored ? int32Value(&*stored) : 0;
  log::standard(daemontexts::kMaxAgeRead, seconds, name);
  return seconds;
}

bool StorebagMetrics::updateLastModified(const std::string& name, std::optional<std::string>& lastModified) const {
  const auto value = _defaults.value(lastModifiedKey(name));
  const auto* stored = value ? value->string() : nullptr;
  if (stored == nullptr) return false;
  if (lastModified == *stored) {
    log::standard(daemontexts::kLastModifiedSame, name, *stored);
    return true;
  }
  lastModified = *stored;
  log::standard(daemontexts::kLastModifiedChanged, *stored, name);
  return false;
}

void StorebagMetrics::save(const std::string& name, const HttpResponse& response) {
  const auto maxAge = maxAgeOfCacheControl(response.header("Cache-Control"));
  const auto* lastModified = response.header("Last-Modified");
  logUnlessWritten(_defaults.set(maxAgeKey(name), maxAge));
  logUnlessWritten(lastModified != nullptr ? _defaults.set(lastModifiedKey(name), *lastModified)
                                           : _defaults.remove(lastModifiedKey(name)));
  log::standard(daemontexts::kMetricsSaved, name, maxAge, lastModified);
}

std::optional<std::uint32_t> StorebagMetrics::secondsUntilPullDue(const std::string& name, TimeValue now) const {
  constexpr std::int64_t kLongest = ReportingSessionConnectivityHelper::kPullDelayBound;
  const auto stored = _defaults.value(pullDueKey(name));
  const auto* due = stored ? stored->integer() : nullptr;
  if (due == nullptr || *due > now.seconds + kLongest) return std::nullopt;
  return *due > now.seconds ? static_cast<std::uint32_t>(*due - now.seconds) : 0;
}

void StorebagMetrics::savePullDue(const std::string& name, TimeValue now, std::uint32_t delay) {
  logUnlessWritten(_defaults.set(pullDueKey(name), now.seconds + delay));
}

void StorebagMetrics::removePullDue(const std::string& name) { logUnlessWritten(_defaults.remove(pullDueKey(name))); }

}  // namespace velk
