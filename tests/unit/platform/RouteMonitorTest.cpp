#include "platform/linux/RouteMonitor.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <fstream>

#include "platform/linux/CurlSession.h"

namespace velk {
namespace {

TEST(RouteMonitorTest, ListensWithoutBlocking) {
  RouteMonitor monitor;
  ASSERT_GE(monitor.descriptor(), 0);
  (void)monitor.drain();
  EXPECT_FALSE(monitor.drain());
}

TEST(RouteMonitorTest, AsksTheKernelForDefaultRoutes) {
  const auto routes = defaultRoutes();
  EXPECT_EQ(routes.any(), routes.ipv4.has_value() || routes.ipv6.has_value());
}

TEST(RouteMonitorTest, KnowsMobileInterfacesByTheirDeviceType) {
  std::string sysfs = testing::TempDir() + "velk-net-XXXXXX";
  ASSERT_NE(::mkdtemp(sysfs.data()), nullptr);
  for (const auto* name : {"wwan0", "eth0"}) ::mkdir((sysfs + "/" + name).c_str(), 0700);
  std::ofstream(sysfs + "/wwan0/uevent") << "DEVTYPE=wwan\nINTERFACE=wwan0\n";
  std::ofstream(sysfs + "/eth0/uevent") << "INTERFACE=eth0\n";
  EXPECT_TRUE(isMobileInterface("wwan0", sysfs));
  EXPECT_FALSE(isMobileInterface("eth0", sysfs));
  EXPECT_FALSE(isMobileInterface("none", sysfs));
  EXPECT_FALSE(isMobileInterface("", sysfs));
}

TEST(HttpAddressTest, KnowsLoopback) {
  for (const auto* url : {"https://localhost/", "https://LOCALHOST:1/", "https://a.localhost/", "https://127.3.2.1/",
                          "http://[::1]:80/"}) {
    const auto address = parseHttpAddress(url);
    ASSERT_TRUE(address) << url;
    EXPECT_TRUE(address->isLoopback()) << url;
  }
  for (const auto* url :
       {"https://example.net/", "https://128.0.0.1/", "http://[2001:db8::1]/", "https://localhost.example/"}) {
    const auto address = parseHttpAddress(url);
    ASSERT_TRUE(address) << url;
    EXPECT_FALSE(address->isLoopback()) << url;
  }
}

}  // namespace
}  // namespace velk
