// The fixed log texts of device/.
#pragma once

namespace velk::logtexts {

inline constexpr const char* kInvalidEnvironmentType = "userDefaultsEnvironment: Invalid environment type %u";  // error
inline constexpr const char* kEnvironmentType = "userDefaultsEnvironment: Environment type %u";

}  // namespace velk::logtexts
