#include "platform/DeviceInformation.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstdlib>

#include "platform/UserDefaults.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

class DeviceInformationTest : public testing::Test {
 protected:
  [[nodiscard]] std::optional<std::string> answer(std::string_view key) const {
    return makeDeviceInformation(directory / "etc/velkreporting", directory.path())->answer(key);
  }
  std::string configure(std::string_view text) const { return directory.write("etc/velkreporting/device.conf", text); }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
};

TEST_F(DeviceInformationTest, ReadsOsReleaseAndFirmware) {
  directory.write("etc/os-release", "NAME=\"Example Linux\"\n# comment\nVERSION_ID=\"12\"\nBUILD_ID='20240501'\n");
  directory.write("sys/class/dmi/id/product_name", "Model 7\n");
  directory.write("sys/class/dmi/id/product_family", "Family\n");
  directory.write("sys/class/dmi/id/board_name", "BOARD-1\n");
  directory.write("sys/class/dmi/id/product_serial", "SN123\n");
  EXPECT_EQ(answer("ProductVersion"), "12");
  EXPECT_EQ(answer("BuildVersion"), "20240501");
  EXPECT_EQ(answer("ProductType"), "Model 7");
  EXPECT_EQ(answer("HWModelStr"), "BOARD-1");
  EXPECT_EQ(answer("SerialNumber"), "SN123");
  EXPECT_EQ(answer("DeviceName"), "Family");
  EXPECT_EQ(answer("ReleaseType"), std::nullopt);
  EXPECT_EQ(answer("Unheard"), std::nullopt);
}

TEST_F(DeviceInformationTest, FallsBackToTheDeviceTree) {
  directory.write("proc/device-tree/model", std::string("Small Board 4\0", 14));
  EXPECT_EQ(answer("ProductType"), "Small Board 4");
  EXPECT_EQ(answer("HWModelStr"), "Small Board 4");
  EXPECT_EQ(answer("DeviceName"), "Small Board 4");
}

TEST_F(DeviceInformationTest, TakesTheKernelForABuildWhereNoneIsNamed) {
  directory.write("usr/lib/os-release", "VERSION_ID=13\n");
  directory.write("proc/sys/kernel/osrelease", "6.1.0-20\n");
  EXPECT_EQ(answer("ProductVersion"), "13");
  EXPECT_EQ(answer("BuildVersion"), "6.1.0-20");
}

TEST_F(DeviceInformationTest, PassesOverWhatFirmwareWasNotTold) {
  directory.write("sys/class/dmi/id/product_name", "To be filled by O.E.M.\n");
  directory.write("sys/class/dmi/id/product_family", "Default string\n");
  directory.write("sys/class/dmi/id/product_serial", "0000000\n");
  EXPECT_EQ(answer("ProductType"), std::nullopt);
  EXPECT_EQ(answer("SerialNumber"), std::nullopt);
}

TEST_F(DeviceInformationTest, AlwaysHasADeviceName) {
  EXPECT_FALSE(answer("DeviceName").value_or("").empty());
  directory.write("etc/os-release", "NAME=\"Example Linux\"\n");
  EXPECT_EQ(answer("DeviceName"), "Example Linux");
}

TEST_F(DeviceInformationTest, NeverNamesTheHost) {
  std::array<char, 256> host{};
  ASSERT_EQ(::gethostname(host.data(), host.size() - 1), 0);
  directory.write("sys/class/dmi/id/product_family", host.data());
  directory.write("sys/class/dmi/id/product_name", "Model 7");
  configure(std::string("DeviceName=") + host.data() + "\n");
  EXPECT_EQ(answer("DeviceName"), "Model 7");
}

TEST_F(DeviceInformationTest, PutsTheConfigurationFirst) {
  directory.write("sys/class/dmi/id/product_name", "Model 7");
  configure("# how this device is known\nReleaseType=Internal\n ProductType = \"Kiosk 3\" \nnonsense\nDeviceName=\n");
  EXPECT_EQ(answer("ReleaseType"), "Internal");
  EXPECT_EQ(answer("ProductType"), "Kiosk 3");
  EXPECT_EQ(answer("DeviceName"), "Model 7");
}

TEST_F(DeviceInformationTest, ReadsAChangedConfigurationAgain) {
  configure("ReleaseType=Internal\n");
  const auto information = makeDeviceInformation(directory / "etc/velkreporting", directory.path());
  EXPECT_EQ(information->answer("ReleaseType"), "Internal");
  configure("ReleaseType=Customer\n");
  EXPECT_EQ(information->answer("ReleaseType"), "Customer");
}

TEST_F(DeviceInformationTest, RefusesAConfigurationThatOthersCanWrite) {
  const auto path = configure("ReleaseType=Internal\n");
  ASSERT_EQ(::chmod(path.c_str(), 0664), 0);
  const auto information = makeDeviceInformation(directory / "etc/velkreporting", directory.path());
  EXPECT_EQ(information->answer("ReleaseType"), std::nullopt);
  EXPECT_EQ(information->answer("ProductType"), std::nullopt);
  EXPECT_EQ(log.count(log::Level::error, "DeviceInformation: Ignoring " + path + ": others can write it"), 1);
}

TEST_F(DeviceInformationTest, SaysThatAConfigurationCannotBeRead) {
  const auto path = configure("ReleaseType=Internal\n" + std::string(64 * 1024, '#'));
  EXPECT_EQ(answer("ReleaseType"), std::nullopt);
  EXPECT_TRUE(log.contains("DeviceInformation: Ignoring " + path + ": "));
}

TEST_F(DeviceInformationTest, DerivesTheIdentifierOneWay) {
  EXPECT_EQ(answer("UniqueDeviceID"), std::nullopt);
  const std::string machine = "0123456789abcdef0123456789abcdef";
  directory.write("etc/machine-id", machine + "\n");
  const auto identifier = answer("UniqueDeviceID");
  ASSERT_TRUE(identifier);
  EXPECT_EQ(identifier->size(), 40U);
  EXPECT_EQ(identifier->find_first_not_of("0123456789abcdef"), std::string::npos);
  EXPECT_EQ(identifier->find(machine.substr(0, 8)), std::string::npos);
  EXPECT_EQ(answer("UniqueDeviceID"), identifier);
  directory.write("etc/machine-id", "1123456789abcdef0123456789abcdef\n");
  EXPECT_NE(answer("UniqueDeviceID"), identifier);
}

TEST_F(DeviceInformationTest, HasNoIdentifierBeforeTheMachineHas) {
  for (const auto* text : {"uninitialized\n", "", "00000000000000000000000000000000\n", "abc\n"}) {
    directory.write("etc/machine-id", text);
    EXPECT_EQ(answer("UniqueDeviceID"), std::nullopt) << text;
  }
}

class LocaleTest : public testing::Test {
 protected:
  LocaleTest() { clear(); }
  ~LocaleTest() override { clear(); }
  static void clear() {
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG", "TZ"}) ::unsetenv(name);
  }
  [[nodiscard]] std::optional<std::string> country() const {
    return makeLocale(nullptr, directory.path())->countryCode();
  }
  [[nodiscard]] std::optional<std::string> countryOf(const char* locale) const {
    ::setenv("LANG", locale, 1);
    return country();
  }

  const test::TemporaryDirectory directory;
};

TEST_F(LocaleTest, TakesTheRegionOfTheLocale) {
  EXPECT_EQ(countryOf("de_AT.UTF-8@euro"), "AT");
  EXPECT_EQ(countryOf("en_us"), "US");
  EXPECT_EQ(countryOf("es_419.UTF-8"), "419");
  EXPECT_EQ(countryOf("ca_ES@valencia"), "ES");
}

TEST_F(LocaleTest, KnowsNoRegionOfOtherNames) {
  for (const char* name : {"C", "POSIX", "C.UTF-8", "de", "de_", "de_A", "de_12", "de_ABCD", "de_\xc3\xa4"}) {
    EXPECT_EQ(countryOf(name), std::nullopt) << name;
  }
}

TEST_F(LocaleTest, AsksTheVariablesInTheirOrder) {
  ::setenv("LANG", "de_DE", 1);
  EXPECT_EQ(country(), "DE");
  ::setenv("LC_MESSAGES", "fr_FR", 1);
  EXPECT_EQ(country(), "FR");
  ::setenv("LC_ALL", "it_IT", 1);
  EXPECT_EQ(country(), "IT");
  ::setenv("LC_ALL", "C", 1);
  EXPECT_EQ(country(), std::nullopt);
  ::setenv("LC_ALL", "", 1);
  EXPECT_EQ(country(), "FR");
}

TEST_F(LocaleTest, FallsBackToTheSystemsSettings) {
  EXPECT_EQ(country(), std::nullopt);
  directory.write("etc/default/locale", "LANG=\"sv_SE.UTF-8\"\n");
  EXPECT_EQ(country(), "SE");
  directory.write("etc/locale.conf", "LANG=pt_BR.UTF-8\n");
  EXPECT_EQ(country(), "BR");
}

TEST_F(LocaleTest, TellsTheOffsetOfTheZone) {
  ::setenv("TZ", "XYZ-05:30", 1);
  EXPECT_EQ(makeLocale()->timeZoneOffset(), 19800);
  ::setenv("TZ", "XYZ+3", 1);
  EXPECT_EQ(makeLocale()->timeZoneOffset(), -10800);
}

TEST_F(LocaleTest, AsksTheSuiteOfTheTimeDaemonWhetherItSetsTheZone) {
  EXPECT_EQ(makeLocale()->automaticTimeZoneEnabled(), std::nullopt);
  const auto locale = makeLocale(openUserDefaults(kTimeDefaultsSuite, directory / "state", directory / "etc"));
  EXPECT_EQ(locale->automaticTimeZoneEnabled(), std::nullopt);
  directory.write("etc/com.tavrin.timed.json", "{\"TMAutomaticTimeZoneEnabled\": false}");
  EXPECT_EQ(locale->automaticTimeZoneEnabled(), false);
  directory.write("state/com.tavrin.timed.json", "{\"TMAutomaticTimeZoneEnabled\": true}");
  EXPECT_EQ(locale->automaticTimeZoneEnabled(), true);
}

}  // namespace
}  // namespace velk
