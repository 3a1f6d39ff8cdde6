// The tools where nothing more can be written: each test has a disk of its own, a small one.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>

#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <thread>

#include "tests/support/FakeClock.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/tools/Packing.h"
#include "tools/collector/PostStore.h"
#include "tools/collector/Uploads.h"
#include "tools/ctl/Program.h"

namespace velk::collector {
namespace {

/// Runs the body on a thread with a disk at `path` that nobody else sees. False where that is not allowed.
bool withSmallDisk(const std::string& path, const std::string& size, const std::function<void()>& body) {
  bool isAllowed = false;
  std::thread([&] {
    isAllowed = ::unshare(CLONE_NEWNS) == 0 && ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                ::mount("tmpfs", path.c_str(), "tmpfs", 0, ("size=" + size).c_str()) == 0;
    if (isAllowed) body();
  }).join();
  return isAllowed;
}

bool names(const std::string& sentence, const std::string& part) { return sentence.find(part) != std::string::npos; }

constexpr const char* kNoDisks = "no disks of one's own here";

TEST(FullDisk, APostThatDoesNotFitIsRefusedWithTheFilesName) {
  const test::TemporaryDirectory directory;
  const auto path = directory / "posts.sqlite";
  if (!withSmallDisk(directory.path(), "256k", [&] {
        auto store = PostStore::open(path);
        ASSERT_TRUE(store) << store.error().description;
        ReceivedPost post;
        post.events.push_back(PropertyDictionary{{"text", std::string(10'000, 'x')}});
        Result<std::int64_t> added = 0;
        int kept = 0;
        while (kept < 1000 && (added = (*store)->add(post, "/post", {}, TimeValue{}))) ++kept;
        ASSERT_FALSE(added);
        EXPECT_GT(kept, 0);
        EXPECT_TRUE(names(added.error().description, path)) << added.error().description;
        EXPECT_TRUE(names(added.error().description, "full")) << added.error().description;
      })) {
    GTEST_SKIP() << kNoDisks;
  }
}

TEST(FullDisk, AnUploadThatDoesNotFitIsTheCollectorsFailureAndLeavesNothing) {
  const test::TemporaryDirectory directory;
  if (!withSmallDisk(directory.path(), "256k", [&] {
        std::ostringstream printed;
        tools::JsonLines lines(printed);
        test::FakeClock clock;
        Announcer announcer(lines, true, false);
        auto store = UploadStore::open(directory.path());
        ASSERT_TRUE(store) << store.error().description;
        CollectorOptions options;
        Uploads uploads(options, store->get(), announcer, clock);
        std::string noise;
        std::uint32_t state = 1;
        while (noise.size() < 400'000) noise += static_cast<char>((state = state * 1664525 + 1013904223) >> 24);
        const auto body = test::packed(noise);
        {
          const auto incoming = uploads.begin();
          const bool whole = incoming->take(body);
          const auto answer = uploads.end(*incoming, whole, "/upload?filename=log.gz&raw=true");
          EXPECT_EQ(answer.status, 507) << "it is no fault of the sender's";
          EXPECT_EQ(answer.body, "the upload cannot be kept\n");
          EXPECT_TRUE(names(printed.str(), "No space left on device")) << printed.str();
          EXPECT_TRUE(names(printed.str(), directory / "uploads")) << printed.str();
        }
        const auto incoming = uploads.begin();
        const bool whole = incoming->take(test::packed("small"));
        EXPECT_EQ(uploads.end(*incoming, whole, "/upload?filename=log.gz&raw=true").status, 200)
            << "there is room again";
      })) {
    GTEST_SKIP() << kNoDisks;
  }
}

TEST(FullDisk, OutputThatCannotBeWrittenIsNoSuccess) {
  const test::TemporaryDirectory directory;
  std::ostringstream out;
  std::ostringstream error;
  ASSERT_EQ(ctl::run({"storebag", "keygen", "--out", directory.path()}, out, error), tools::ExitCode::ok);
  const auto bag = directory.write("bag.json", "{}");
  for (const std::vector<std::string>& arguments :
       {std::vector<std::string>{"storebag", "sign", "--key", directory / "privateKey.pem", bag}, {"--help"}}) {
    std::ofstream full("/dev/full");
    error.str("");
    EXPECT_EQ(ctl::run(arguments, full, error), tools::ExitCode::ioError);
    EXPECT_TRUE(names(error.str(), "standard output")) << error.str();
  }
}

}  // namespace
}  // namespace velk::collector
