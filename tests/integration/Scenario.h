// What several files of integration tests say about storebags, events and files.
#pragma once

#include <filesystem>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "tests/integration/Daemon.h"

namespace velk {

/// For the messages of failed expectations.
void PrintTo(const PropertyValue& value, std::ostream* stream);
void PrintTo(const PropertyDictionary& value, std::ostream* stream);
void PrintTo(const PropertyArray& value, std::ostream* stream);

}  // namespace velk

namespace velk::test {

/// Lines of device.conf that make the device known to the tests.
inline constexpr char kDeviceLines[] =
    "DeviceName=Tablebox\nProductType=Box1,2\nProductVersion=12.5\nBuildVersion=21B77\nHWModelStr=H1\n"
    "SerialNumber=S123\nUniqueDeviceID=0123456789abcdef0123456789abcdef01234567\n";
inline constexpr char kInternalDeviceLines[] =
    "DeviceName=Tablebox\nProductType=Box1,2\nProductVersion=12.5\nBuildVersion=21B77\nHWModelStr=H1\n"
    "SerialNumber=S123\nUniqueDeviceID=0123456789abcdef0123456789abcdef01234567\nReleaseType=Internal\n";

/// A client entry that takes everything, changed by `more`.
[[nodiscard]] PropertyDictionary clientEntry(const ReportingServer& server, const PropertyDictionary& more = {});
/// A post backend's settings: one client entry.
[[nodiscard]] PropertyDictionary postBackend(const ReportingServer& server, const PropertyDictionary& more = {});
/// A storebag whose sections "seed", "release" and "tavrin_internal" are all `section`.
[[nodiscard]] PropertyDictionary storebagOf(const PropertyDictionary& section);
/// One backend "splunk" whose client entry is changed by `more`.
[[nodiscard]] PropertyDictionary storebagWith(const ReportingServer& server, const PropertyDictionary& more = {});

/// The arrived events with that "_method", in order.
[[nodiscard]] std::vector<PropertyDictionary> eventsOf(const ReportingServer& server, int method);
[[nodiscard]] std::vector<std::string> keysOf(const PropertyDictionary& dictionary);
/// The numbers of a list, sorted.
[[nodiscard]] std::vector<std::int64_t> sortedNumbers(const PropertyValue& list);

/// The regular file of that name anywhere below a directory.
[[nodiscard]] std::optional<std::filesystem::path> fileNamed(const std::string& directory, const std::string& name);
[[nodiscard]] std::string contentsOf(const std::filesystem::path& file);
void writeContents(const std::filesystem::path& file, const std::string& contents);

/// Lines of the log that hold `part`.
[[nodiscard]] std::vector<std::string> linesWith(const LineCollector& log, const std::string& part);
/// What a random test is made from: VELK_TEST_SEED, or another one each time; printed.
[[nodiscard]] unsigned testSeed();
/// Three absent lists, the answer of a session without configuration.
[[nodiscard]] PropertyArray noLists();

}  // namespace velk::test
