// Users who want more uploads, or more of the disk, than there is for all: what they leave to others.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <filesystem>
#include <random>

#include "tests/integration/Scenario.h"
#include "tests/integration/WireSession.h"

namespace velk::test {
namespace {

const PropertyArray kTaken{true};
const PropertyArray kNotTaken{false};
constexpr uid_t kNobody = 65534;

PropertyDictionary uploadCall(const std::string& path) { return {{"method", "uploadFileAtPath"}, {"path", path}}; }

/// Bytes that do not become fewer.
std::string noise(std::size_t size) {
  std::minstd_rand random(1);
  std::string bytes(size, '\0');
  for (auto& byte : bytes) byte = static_cast<char>(random() >> 8U);
  return bytes;
}

class UploadShare : public ::testing::Test {
 protected:
  UploadShare() {
    options.deviceConfiguration = kDeviceLines;
    options.starts = false;
    TlsTestServer::Response success;
    success.body = "success";
    server.setPostResponse(success);
  }
  /// Takes events and files.
  void serve(const std::string& name) {
    server.setStorebag(name, storebagOf({{"release_timeout", 1},
                                         {"splunk", postBackend(server)},
                                         {"upload_server", PropertyDictionary{{"post_url", server.url("/up")}}}}));
  }

  ReportingServer server;
  Daemon::Options options;
  const TemporaryDirectory directory;
};

/// Ninety-five sessions of this process's user, each with a file that takes minutes to compress.
class Hog {
 public:
  static inline const std::vector<std::pair<int, const char*>> kTypes{
      {5, "bramble"},  {6, "clover"},  {8, "fennel"},   {10, "juniper"},  {12, "lavender"},
      {14, "mallow"},  {15, "nettle"}, {16, "orchid"},  {17, "primrose"}, {19, "rosemary"},
      {21, "saffron"}, {22, "tansy"},  {23, "thistle"}, {25, "valerian"}, {26, "verbena"},
      {27, "willow"},  {28, "yarrow"}, {29, "comfrey"}, {30, "burdock"}};

  Hog(const Daemon& daemon, EventLoop& loop) {
    for (const auto& type : kTypes) {
      for (int each = 0; each < 5; ++each) {
        auto session = std::make_unique<WireSession>(daemon, loop);
        session->describe({{"ComponentType", type.first}, {"SessionID", static_cast<int>(_sessions.size())}},
                          PropertyDictionary{{"_clientName", "Hog"}, {"_serviceName", "uploads"}});
        EXPECT_TRUE(session->configure().has_value());
        _sessions.push_back(std::move(session));
      }
    }
  }
  [[nodiscard]] std::size_t size() const { return _sessions.size(); }
  void upload(const std::string& path) {
    for (const auto& session : _sessions) {
      session->proxy().uploadFileAtPath("file://" + path, "token",
                                        FileDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC)),
                                        UploadReply([](bool, bool) {}));
    }
  }
  void sendEvents() {
    for (const auto& session : _sessions) session->send(7, 1, {});
  }

 private:
  std::vector<std::unique_ptr<WireSession>> _sessions;
};

TEST_F(UploadShare, AUserWithManySessionsLeavesPlacesAndTurnsToAnother) {
  for (const auto& type : Hog::kTypes) serve(type.second);
  serve("heather");
  Daemon daemon(server, options);
  std::filesystem::create_directories(daemon.directory() + "/config/entitlements.d");
  writeContents(daemon.directory() + "/config/entitlements.d/tests.conf",
                "[com.tavrin.private.velkreportingd]\nusers = 65534\n");
  daemon.start();
  std::filesystem::permissions(directory.path(), std::filesystem::perms(0755));
  const auto huge = directory.write("huge", "begin");
  std::filesystem::resize_file(huge, std::uintmax_t{15} << 30U);
  EventLoop loop("test-hog");
  {
    Hog hog(daemon, loop);
    hog.upload(huge);
    // Half of the places; the other files are refused at once.
    constexpr std::size_t kUnderWay = 32;
    const auto refused = hog.size() - kUnderWay;
    EXPECT_EQ(daemon.log().countOnceThereAre(kUnderWay, "UploadBackend(uploadFileAtPath): Uploading file "), kUnderWay);
    EXPECT_EQ(daemon.log().countOnceThereAre(refused, "its user's share of the 64 places"), refused);

    hog.sendEvents();
    EXPECT_TRUE(server.waitForEvents(hog.size(), {7})) << "its own events go on";
    if (::geteuid() == 0) {
      const auto small = directory.write("small", std::string(2'000'000, 'x'));
      std::filesystem::permissions(small, std::filesystem::perms(0644));
      ControlledSession other(daemon, kNobody);
      ASSERT_EQ(other.open(9, 1000).size(), 3U);
      EXPECT_EQ(other.call(uploadCall(small)), kTaken);
      other.sendEvent(7, 1);
      EXPECT_TRUE(server.waitForEvents(hog.size() + 1, {7}));
      EXPECT_EQ(other.finish(), 0);
    }
    for (const auto& post : server.posts()) {
      EXPECT_EQ(post.request.target.find("filename=huge"), std::string::npos) << "they are still being compressed";
    }
    EXPECT_EQ(daemon.stop(), 0);
  }
  loop.stop();
  EXPECT_EQ(daemon.log().count("stop: uploads left behind: 32;"), 1U);
  if (::geteuid() != 0) GTEST_SKIP() << "only root may be another user";
}

/// A file system of its own for a directory, seen by this process and its children alone.
class SmallDisk {
 public:
  SmallDisk(std::string directory, const char* size) : _directory(std::move(directory)) {
    _isThere = ::unshare(CLONE_NEWNS) == 0 && ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
               ::mount("none", _directory.c_str(), "tmpfs", 0, (std::string("mode=0700,size=") + size).c_str()) == 0;
  }
  ~SmallDisk() {
    if (_isThere) ::umount2(_directory.c_str(), MNT_DETACH);
  }
  SmallDisk(const SmallDisk&) = delete;
  SmallDisk& operator=(const SmallDisk&) = delete;

  [[nodiscard]] bool isThere() const { return _isThere; }

 private:
  const std::string _directory;
  bool _isThere = false;
};

TEST_F(UploadShare, OfTheDiskLeavesRoomForStorebags) {
  constexpr std::size_t kSize = 10U << 20U;
  serve("heather");
  serve("clover");
  Daemon daemon(server, options);
  const SmallDisk disk(daemon.directory() + "/cache", "80m");
  if (!disk.isThere()) GTEST_SKIP() << "only root may mount a small disk";
  daemon.start();
  const auto first = directory.write("first", noise(kSize));
  const auto second = directory.write("second", noise(kSize));
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  ControlledSession another(daemon);
  ASSERT_EQ(another.open(9, 2).size(), 3U);
  // Both sessions' start messages: what arrives after them is the file.
  ASSERT_TRUE(server.waitForPosts(2));
  const auto posts = server.posts().size();
  TlsTestServer::Response silence;
  silence.silent = true;
  server.setPostResponse(silence);
  session.send(uploadCall(first));
  ASSERT_TRUE(server.waitForPosts(posts + 1)) << "it is kept until the server answers";

  EXPECT_EQ(another.call(uploadCall(second)), kNotTaken);
  EXPECT_TRUE(daemon.log().waitForPart("<3>UploadBackend(uploadFileAtPath): there is no room for " + second +
                                       ", compressed: only "));
  EXPECT_TRUE(std::filesystem::exists(second));

  ControlledSession third(daemon);
  ASSERT_EQ(third.open(6, 3).size(), 3U);
  EXPECT_TRUE(fileNamed(daemon.directory() + "/cache", "clover"));
  EXPECT_GT(std::filesystem::space(daemon.directory() + "/cache").available, std::uintmax_t{60} << 20U);
  server.setPostResponse({});
  server.tls().closeConnections();
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
