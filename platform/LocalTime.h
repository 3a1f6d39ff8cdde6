// Calendar times in the local zone and in GMT, one caller at a time: the C library keeps the zone in one place for
// the whole process, behind a lock of its own that neither we nor our tools can see. Any thread.
#pragma once

#include <cstdint>
#include <ctime>

namespace velk {

[[nodiscard]] std::tm localTime(std::time_t time);
[[nodiscard]] std::tm universalTime(std::time_t time);
/// The time that reads so in the local zone; -1 when none does. Whether summer time was in force is found out.
[[nodiscard]] std::time_t timeOfLocal(std::tm local);
/// The zone's offset from GMT in seconds at that time. Looks for a change of the zone first, which costs a system call.
[[nodiscard]] std::int32_t localOffset(std::time_t time);

}  // namespace velk
