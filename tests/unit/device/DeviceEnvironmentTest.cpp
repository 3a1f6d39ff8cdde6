#include "device/DeviceEnvironment.h"

#include <gtest/gtest.h>

#include <limits>
#include <set>
#include <thread>
#include <vector>

#include "device/ComponentTable.h"
#include "tests/support/FakeDeviceInformation.h"
#include "tests/support/FakeUserDefaults.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

class DeviceEnvironmentTest : public testing::Test {
 protected:
  [[nodiscard]] std::uint32_t environment() const {
    return DeviceEnvironment(defaults, device).userDefaultsEnvironment();
  }
  [[nodiscard]] std::uint32_t environmentFor(PropertyValue setting) {
    defaults.put("environmentType", std::move(setting));
    return environment();
  }

  test::RecordingLog log;
  test::FakeUserDefaults defaults;
  test::FakeDeviceInformation device;
};

TEST_F(DeviceEnvironmentTest, FollowsTheSeedSectionByDefault) {
  EXPECT_EQ(environment(), 3U);
  EXPECT_EQ(log.count(log::Level::standard, "userDefaultsEnvironment: Environment type 3"), 1);
  device.set("ReleaseType", "Customer");
  EXPECT_EQ(environment(), 3U);
}

TEST_F(DeviceEnvironmentTest, FollowsTheInternalSectionOnInternalBuilds) {
  device.set("ReleaseType", "Internal");
  EXPECT_EQ(environment(), 2U);
  EXPECT_EQ(log.count(log::Level::standard, "userDefaultsEnvironment: Environment type 2"), 1);
}

TEST_F(DeviceEnvironmentTest, KeepsValidSettings) {
  device.set("ReleaseType", "Internal");
  for (std::uint32_t type = 0; type <= 4; ++type) EXPECT_EQ(environmentFor(type), type);
  EXPECT_EQ(environmentFor("1"), 1U);
  EXPECT_EQ(environmentFor(true), 1U);
  EXPECT_EQ(environmentFor("nonsense"), 0U);
  EXPECT_FALSE(log.contains("Invalid"));
}

TEST_F(DeviceEnvironmentTest, ReplacesInvalidSettings) {
  EXPECT_EQ(environmentFor(7), 2U);
  EXPECT_EQ(log.count(log::Level::error, "userDefaultsEnvironment: Invalid environment type 7"), 1);
  EXPECT_EQ(log.count(log::Level::standard, "userDefaultsEnvironment: Environment type 2"), 1);
  EXPECT_EQ(environmentFor(5), 2U);
  EXPECT_EQ(environmentFor(-1), 2U);
  EXPECT_EQ(log.count(log::Level::error, "userDefaultsEnvironment: Invalid environment type 4294967295"), 1);
}

TEST_F(DeviceEnvironmentTest, ReadsTheSettingAfreshEachTime) {
  const DeviceEnvironment subject(defaults, device);
  EXPECT_EQ(subject.userDefaultsEnvironment(), 3U);
  defaults.put("environmentType", 4);
  EXPECT_EQ(subject.userDefaultsEnvironment(), 4U);
  ASSERT_TRUE(defaults.remove("environmentType"));
  EXPECT_EQ(subject.userDefaultsEnvironment(), 3U);
}

TEST_F(DeviceEnvironmentTest, NamesSections) {
  EXPECT_EQ(environmentSectionName(0), std::nullopt);
  EXPECT_EQ(environmentSectionName(1), "development");
  EXPECT_EQ(environmentSectionName(2), "tavrin_internal");
  EXPECT_EQ(environmentSectionName(3), "seed");
  EXPECT_EQ(environmentSectionName(4), "release");
  EXPECT_EQ(environmentSectionName(5), std::nullopt);
}

TEST_F(DeviceEnvironmentTest, ComparesTheReleaseTypeExactly) {
  for (const auto* type : {"internal", "INTERNAL", " Internal", "Internal ", ""}) {
    device.set("ReleaseType", type);
    EXPECT_FALSE(DeviceEnvironment(defaults, device).isInternalBuild()) << type;
  }
  device.set("ReleaseType", "Internal");
  EXPECT_TRUE(DeviceEnvironment(defaults, device).isInternalBuild());
}

TEST_F(DeviceEnvironmentTest, AsksForTheReleaseTypeOnce) {
  device.set("ReleaseType", "Internal");
  const DeviceEnvironment subject(defaults, device);
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&subject] { EXPECT_TRUE(subject.isInternalBuild()); });
  }
  for (auto& thread : threads) thread.join();
  device.set("ReleaseType", "Customer");
  EXPECT_TRUE(subject.isInternalBuild());
  EXPECT_EQ(device.askedCount("ReleaseType"), 1);
}

TEST_F(DeviceEnvironmentTest, AsksForFactsAfreshEachTime) {
  const DeviceEnvironment subject(defaults, device);
  EXPECT_EQ(subject.productVersion(), std::nullopt);
  device.set("ProductVersion", "12");
  device.set("BuildVersion", "B7");
  device.set("ProductType", "Kiosk");
  device.set("DeviceName", "Kiosk 3");
  device.set("HWModelStr", "K3");
  device.set("SerialNumber", "SN");
  EXPECT_EQ(subject.productVersion(), "12");
  EXPECT_EQ(subject.buildVersion(), "B7");
  EXPECT_EQ(subject.productType(), "Kiosk");
  EXPECT_EQ(subject.deviceName(), "Kiosk 3");
  EXPECT_EQ(subject.hardwareModel(), "K3");
  EXPECT_EQ(subject.serialNumber(), "SN");
}

TEST_F(DeviceEnvironmentTest, FillsABufferWithTheIdentifier) {
  const std::string identifier(40, 'a');
  device.set("UniqueDeviceID", identifier);
  std::vector<char> buffer(41, 'x');
  const DeviceEnvironment subject(defaults, device);
  subject.uniqueDeviceIdentifier(buffer);
  EXPECT_EQ(std::string(buffer.data()), identifier);
  EXPECT_EQ(buffer[40], '\0');
  std::vector<char> larger(50, 'x');
  subject.uniqueDeviceIdentifier(larger);
  EXPECT_EQ(std::string(larger.data()), identifier);
  EXPECT_EQ(larger[49], '\0');
}

TEST_F(DeviceEnvironmentTest, LeavesTheBufferWithoutAnIdentifier) {
  std::vector<char> buffer(41, 'x');
  const DeviceEnvironment subject(defaults, device);
  subject.uniqueDeviceIdentifier(buffer);
  EXPECT_EQ(buffer, std::vector<char>(41, 'x'));
}

TEST_F(DeviceEnvironmentTest, NeverWritesBeyondASmallBuffer) {
  device.set("UniqueDeviceID", std::string(41, 'a'));
  std::vector<char> buffer(41, 'x');
  const DeviceEnvironment subject(defaults, device);
  subject.uniqueDeviceIdentifier(buffer);
  subject.uniqueDeviceIdentifier({});
  EXPECT_EQ(buffer, std::vector<char>(41, 'x'));
}

TEST_F(DeviceEnvironmentTest, AssumesAVersionOfTheFramework) {
  EXPECT_EQ(DeviceEnvironment(defaults, device).frameworkVersion(), "8.0");
  EXPECT_EQ(DeviceEnvironment(defaults, device, "9.1").frameworkVersion(), "9.1");
  EXPECT_EQ(DeviceEnvironment(defaults, device, "").frameworkVersion(), "8.0");
}

TEST(UserInfoIdentifier, JoinsLowerCasedNames) {
  EXPECT_EQ(userInfoIdentifierString({{"_clientName", "Media"}, {"_serviceName", "Calls"}}), "media:calls");
  EXPECT_EQ(userInfoIdentifierString({{"_clientName", "MÉDIA"}, {"_serviceName", "ПОЧТА"}}), "média:почта");
  EXPECT_EQ(userInfoIdentifierString({{"_clientName", "Media"}}), "media:");
  EXPECT_EQ(userInfoIdentifierString({{"_serviceName", "Calls"}}), ":calls");
  EXPECT_EQ(userInfoIdentifierString({}), ":");
  EXPECT_EQ(userInfoIdentifierString({{"_clientName", 5}, {"_serviceName", PropertyArray{}}}), ":");
}

TEST(ErrorObject, StandsInTheDomainOfClients) {
  const auto error = errorObject("it failed", -1);
  EXPECT_EQ(error.domain, "VelkReportingErrorDomain");
  EXPECT_EQ(error.code, -1);
  EXPECT_EQ(error.description, "it failed");
}

TEST(FiniteOrMinusOne, KeepsFiniteNumbersOnly) {
  EXPECT_EQ(finiteOrMinusOne(-2.5), -2.5);
  EXPECT_EQ(finiteOrMinusOne(0.0), 0.0);
  EXPECT_EQ(finiteOrMinusOne(std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(finiteOrMinusOne(-std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(finiteOrMinusOne(std::numeric_limits<double>::quiet_NaN()), -1.0);
}

TEST(ComponentTable, HoldsDifferentShortCodes) {
  std::set<std::string_view> codes;
  for (const auto code : kComponentShortCodes) {
    EXPECT_GE(code.size(), 2U);
    EXPECT_LE(code.size(), 8U) << code;
    EXPECT_EQ(code.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789"), std::string_view::npos) << code;
    codes.insert(code);
  }
  EXPECT_EQ(codes.size(), 31U);
}

TEST(ComponentTable, IsNeverReadBeyondItsEnds) {
  EXPECT_EQ(componentShortCode(0), kComponentShortCodes.front());
  EXPECT_EQ(componentShortCode(30), kComponentShortCodes.back());
  for (const std::int32_t type :
       {-1, 31, std::numeric_limits<std::int32_t>::min(), std::numeric_limits<std::int32_t>::max()}) {
    EXPECT_EQ(componentShortCode(type), "Unknown");
    EXPECT_EQ(healthShortCode(type), "Unknown");
  }
}

TEST(ComponentTable, CountsOnlyClientsOfTheLibraryByName) {
  EXPECT_EQ(healthShortCode(4), "Unknown");
  EXPECT_EQ(healthShortCode(5), componentShortCode(5));
  EXPECT_EQ(healthShortCode(30), componentShortCode(30));
}

}  // namespace
}  // namespace velk
