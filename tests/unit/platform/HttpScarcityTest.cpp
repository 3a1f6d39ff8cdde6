// Requests in a process that has no descriptors left.
#include <fcntl.h>
#include <sys/resource.h>

#include <vector>

#include "platform/FileDescriptor.h"
#include "tests/unit/platform/HttpFixture.h"

namespace velk {
namespace {

/// Takes every descriptor that the process may have, which are few while it lives.
class NoDescriptors {
 public:
  NoDescriptors() {
    ::getrlimit(RLIMIT_NOFILE, &_before);
    const rlimit few{256, _before.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &few);
    for (;;) {
      FileDescriptor taken(::open("/dev/null", O_RDONLY | O_CLOEXEC));
      if (!taken) return;
      _taken.push_back(std::move(taken));
    }
  }
  ~NoDescriptors() { ::setrlimit(RLIMIT_NOFILE, &_before); }
  NoDescriptors(const NoDescriptors&) = delete;
  NoDescriptors& operator=(const NoDescriptors&) = delete;

 private:
  rlimit _before{};
  std::vector<FileDescriptor> _taken;
};

class HttpScarcityTest : public HttpSessionTest {
 protected:
  void SetUp() override {
#ifdef __SANITIZE_ADDRESS__
    GTEST_SKIP() << "the sanitizer looks at an object through a pipe, for which there is no descriptor either";
#endif
  }
  HttpScarcityTest() {
    HttpSessionConfiguration configuration;
    configuration.waitsForConnectivity = true;
    makeSession(configuration);
  }
};

TEST_F(HttpScarcityTest, ARequestWithoutADescriptorFailsWithTheCauseAndTheNextOneWorks) {
  EXPECT_FALSE(fetch(request()).error);
  auto other = request();
  other.url = "http://127.0.0.1:9/";
  other.requiresHttps = false;
  {
    const NoDescriptors none;
    const auto& outcome = fetch(other);
    ASSERT_TRUE(outcome.error);
    EXPECT_NE(outcome.error->description.find("Too many open files"), std::string::npos) << outcome.error->description;
  }
  const test::TlsTestServer another(false);
  other.url = another.url();
  EXPECT_FALSE(fetch(other).error);
}

TEST_F(HttpScarcityTest, ANameThatCannotBeResolvedForWantOfDescriptorsIsAFailureThatSaysSo) {
  EXPECT_FALSE(fetch(request()).error);
  auto other = request();
  other.url = "https://velk.invalid/";
  const NoDescriptors none;
  const auto& outcome = fetch(other);
  ASSERT_TRUE(outcome.error);
  EXPECT_NE(outcome.error->description.find("Too many open files"), std::string::npos) << outcome.error->description;
}

TEST_F(HttpScarcityTest, AServiceThatCannotStartTriesAgainWithTheNextRequest) {
  {
    const NoDescriptors none;
    const auto& outcome = fetch(request());
    ASSERT_TRUE(outcome.error);
    EXPECT_NE(outcome.error->description.find("127.0.0.1: no descriptors"), std::string::npos)
        << outcome.error->description;
  }
  EXPECT_FALSE(fetch(request()).error);
}

}  // namespace
}  // namespace velk
