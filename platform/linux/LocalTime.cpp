#include "platform/LocalTime.h"

#include "platform/Lock.h"

namespace velk {

namespace {

/// Never destroyed: threads may still format times while the process ends.
Lock& zoneLock() {
  static auto* const lock = new Lock;
  return *lock;
}

}  // namespace

std::tm localTime(std::time_t time) {
  std::tm local{};
  Guard guard(zoneLock());
  ::localtime_r(&time, &local);
  return local;
}

std::tm universalTime(std::time_t time) {
  std::tm universal{};
  Guard guard(zoneLock());
  ::gmtime_r(&time, &universal);
  return universal;
}

std::time_t timeOfLocal(std::tm local) {
  local.tm_isdst = -1;
  Guard guard(zoneLock());
  return std::mktime(&local);
}

std::int32_t localOffset(std::time_t time) {
  std::tm local{};
  Guard guard(zoneLock());
  ::tzset();  // the zone's file may have been replaced meanwhile
  return ::localtime_r(&time, &local) != nullptr ? static_cast<std::int32_t>(local.tm_gmtoff) : 0;
}

}  // namespace velk
