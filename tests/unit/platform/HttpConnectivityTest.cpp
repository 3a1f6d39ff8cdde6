// Requests on a machine without a network: each test runs on a thread with a network namespace of its own, which the
// HTTP thread inherits.
#include <arpa/inet.h>
#include <net/if.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

#include "platform/FileDescriptor.h"
#include "platform/linux/RouteMonitor.h"
#include "tests/unit/platform/HttpRecorder.h"

namespace velk {
namespace {

using namespace std::chrono_literals;

/// False where the system does not allow such namespaces.
bool runWithoutNetwork(const std::function<void()>& body) {
  bool allowed = false;
  std::thread([&] {
    allowed = ::unshare(CLONE_NEWNET) == 0;
    if (allowed) body();
  }).join();
  return allowed;
}

/// Gives the namespace its first address.
void connectNetwork() {
  const FileDescriptor socket(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  ifreq request{};
  std::strcpy(request.ifr_name, "lo");
  request.ifr_flags = IFF_UP;
  ASSERT_EQ(::ioctl(socket.get(), SIOCSIFFLAGS, &request), 0);
  auto* address = reinterpret_cast<sockaddr_in*>(&request.ifr_addr);
  *address = {};
  address->sin_family = AF_INET;
  ::inet_pton(AF_INET, "192.0.2.1", &address->sin_addr);
  ASSERT_EQ(::ioctl(socket.get(), SIOCSIFADDR, &request), 0);
}

struct Request {
  explicit Request(bool waits, Duration timeout) {
    HttpSessionConfiguration configuration;
    configuration.waitsForConnectivity = waits;
    session = service->makeSession(configuration, delegate, queue);
    HttpRequest request;
    request.url = "https://192.0.2.1:9/";
    request.timeout = timeout;
    auto task = session->makeDataTask(std::move(request));
    (*task)->setTaskDescription("task");
    (*task)->resume();
  }
  [[nodiscard]] bool isOver(Duration limit = 20s) {
    return queue->runUntil([this] { return delegate->completed > 0; }, limit);
  }
  [[nodiscard]] Error error() { return delegate->outcomes["task"].error.value(); }

  std::shared_ptr<PumpedQueue> queue = std::make_shared<PumpedQueue>();
  std::shared_ptr<Recorder> delegate = std::make_shared<Recorder>();
  std::unique_ptr<HttpSessionService> service = makeHttpSessionService(HttpTrust{});
  std::shared_ptr<HttpSession> session;
};

TEST(HttpConnectivityTest, FailsAtOnceUnlessItMayWait) {
  const bool allowed = runWithoutNetwork([] {
    Request request(false, 20s);
    ASSERT_TRUE(request.isOver());
    EXPECT_EQ(request.error().code, 7);
  });
  if (!allowed) GTEST_SKIP() << "no network namespaces here";
}

TEST(HttpConnectivityTest, WaitsNoLongerThanTheRequestAllows) {
  const bool allowed = runWithoutNetwork([] {
    EXPECT_FALSE(defaultRoutes().any());
    Request request(true, 200ms);
    ASSERT_TRUE(request.isOver());
    EXPECT_EQ(request.error().code, 28);
    EXPECT_NE(request.error().description.find("no network"), std::string::npos);
  });
  if (!allowed) GTEST_SKIP() << "no network namespaces here";
}

TEST(HttpConnectivityTest, TriesAgainWhenTheNetworkComes) {
  const bool allowed = runWithoutNetwork([] {
    Request request(true, 20s);
    EXPECT_FALSE(request.isOver(50ms));
    connectNetwork();
    ASSERT_TRUE(request.isOver());
    // The address is there now, and nobody listens at it.
    EXPECT_EQ(request.error().code, 7);
  });
  if (!allowed) GTEST_SKIP() << "no network namespaces here";
}

}  // namespace
}  // namespace velk
