#include "device/ComponentTable.h"

namespace velk {

const std::array<std::string_view, 31> kComponentShortCodes{
    // 0 to 4: the system's own
    "NONE", "DAEMON", "SELFTEST", "TOOL", "LEGACY",
    // 5 to 30: what clients of the library may be
    "MEDIA", "PLAYBACK", "CALLS", "CONF", "CAPTURE", "STREAM", "MSGING", "PRESENCE", "RELAY", "SYNC", "STORAGE",
    "BACKUP", "MAIL", "NETWORK", "RADIO", "WIFI", "BLUETTH", "POWER", "THERMAL", "DISPLAY", "AUDIO", "SEARCH",
    "LOCATION", "ANALYTIC", "UPDATE", "FLEET"};

}  // namespace velk
