#include "platform/Files.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>
#include <vector>

#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

unsigned modeOf(const std::string& path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0);
  return status.st_mode & 07777;
}

TEST(Files, ReadsWhatWasWritten) {
  const test::TemporaryDirectory directory;
  ASSERT_TRUE(files::writeAtomically(directory / "a", bytesOf("hello")));
  EXPECT_EQ(files::read(directory / "a", 5), ByteData({'h', 'e', 'l', 'l', 'o'}));
  EXPECT_EQ(modeOf(directory / "a"), 0600U);
  EXPECT_EQ(files::list(directory.path()), std::vector<std::string>{"a"});
}

TEST(Files, RefusesFilesThatAreTooLarge) {
  const test::TemporaryDirectory directory;
  const auto path = directory.write("a", "hello");
  const auto read = files::read(path, 4);
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error().code, static_cast<int>(files::Code::tooLarge));
  EXPECT_NE(read.error().description.find(path), std::string::npos);
}

TEST(Files, TellsAMissingFileFromOtherFailures) {
  const test::TemporaryDirectory directory;
  EXPECT_EQ(files::read(directory / "none", 10).error().code, static_cast<int>(files::Code::notFound));
  EXPECT_EQ(files::read(directory.path(), 10).error().code, static_cast<int>(files::Code::other));
  EXPECT_EQ(files::list(directory / "none").error().code, static_cast<int>(files::Code::notFound));
}

TEST(Files, DoesNotWaitForTheWriterOfAFifo) {
  const test::TemporaryDirectory directory;
  ASSERT_EQ(::mkfifo((directory / "fifo").c_str(), 0600), 0);
  EXPECT_FALSE(files::read(directory / "fifo", 10));
  EXPECT_FALSE(files::append(directory / "fifo", bytesOf("x")));
}

TEST(Files, ReadsFilesWithoutASize) { EXPECT_FALSE(files::read("/proc/self/status", 65536)->empty()); }

TEST(Files, ReplacesAFileWhole) {
  const test::TemporaryDirectory directory;
  directory.write("a", "a longer text");
  ASSERT_TRUE(files::writeAtomically(directory / "a", bytesOf("b"), 0640));
  EXPECT_EQ(directory.read("a"), "b");
  EXPECT_EQ(modeOf(directory / "a"), 0640U);
}

TEST(Files, LeavesNothingBehindWhenItCannotWrite) {
  const test::TemporaryDirectory directory;
  ASSERT_TRUE(files::createDirectories(directory / "a"));
  EXPECT_FALSE(files::writeAtomically(directory / "a", bytesOf("b")));
  EXPECT_EQ(files::list(directory.path())->size(), 1U);
}

TEST(Files, CreatesDirectoriesWithTheirParents) {
  const test::TemporaryDirectory directory;
  ASSERT_TRUE(files::createDirectories(directory / "a/b/c"));
  ASSERT_TRUE(files::createDirectories(directory / "a/b/c"));
  EXPECT_EQ(modeOf(directory / "a/b"), 0700U);
  directory.write("file", "");
  EXPECT_FALSE(files::createDirectories(directory / "file"));
  EXPECT_FALSE(files::createDirectories(directory / "file/below"));
}

TEST(Files, AppendsOnlyToWhatIsThere) {
  const test::TemporaryDirectory directory;
  EXPECT_FALSE(files::append(directory / "a", bytesOf("x")));
  ASSERT_TRUE(files::createEmpty(directory / "a"));
  EXPECT_FALSE(files::createEmpty(directory / "a"));
  ASSERT_TRUE(files::append(directory / "a", bytesOf("x")));
  ASSERT_TRUE(files::append(directory / "a", bytesOf("y")));
  EXPECT_EQ(directory.read("a"), "xy");
  ASSERT_EQ(::symlink((directory / "a").c_str(), (directory / "link").c_str()), 0);
  EXPECT_FALSE(files::append(directory / "link", bytesOf("z")));
}

TEST(Files, KeepsAFewOfTheFilesThatWereSetAside) {
  const test::TemporaryDirectory directory;
  for (int number = 0; number < 8; ++number) {
    directory.write("a", std::to_string(number));
    const auto name = files::setAside(directory / "a");
    ASSERT_TRUE(name);
    EXPECT_TRUE(files::exists(*name));
    EXPECT_FALSE(files::exists(directory / "a"));
  }
  EXPECT_EQ(files::list(directory.path())->size(), 5U);
}

TEST(Files, SweepsWhatACrashLeft) {
  const test::TemporaryDirectory directory;
  directory.write("suite.tmp-a1B2c3", "half");
  directory.write("bag.tmp-XXXXXX", "");
  const std::vector<std::string> others{"suite",         "suite.tmp-",      "suite.tmp-12345", "suite.tmp-1234567",
                                        "suite.tmp-a/b", "suite.tmp-12 45", ".tmp-a1B2c3",     "suite.corrupt-1"};
  for (const auto& name : others) directory.write(name, "stays");
  EXPECT_EQ(files::sweepTemporaries(directory.path()), 2U);
  EXPECT_FALSE(files::exists(directory / "suite.tmp-a1B2c3"));
  EXPECT_FALSE(files::exists(directory / "bag.tmp-XXXXXX"));
  for (const auto& name : others) EXPECT_EQ(directory.read(name), "stays") << name;
  EXPECT_EQ(files::sweepTemporaries(directory / "none"), 0U);
}

TEST(Files, SweepsOnlyFilesOfItsOwnUserAndNoLinks) {
  const test::TemporaryDirectory directory;
  const auto target = directory.write("target", "stays");
  ASSERT_EQ(::symlink(target.c_str(), (directory / "link.tmp-aaaaaa").c_str()), 0);
  ASSERT_EQ(::mkfifo((directory / "fifo.tmp-aaaaaa").c_str(), 0600), 0);
  ASSERT_EQ(::mkdir((directory / "directory.tmp-aaaaaa").c_str(), 0700), 0);
  std::size_t kept = 4;
  if (::geteuid() == 0) {
    ASSERT_EQ(::chown(directory.write("foreign.tmp-aaaaaa", "x").c_str(), 65534, 65534), 0);
    ++kept;
  }
  EXPECT_EQ(files::sweepTemporaries(directory.path()), 0U);
  EXPECT_EQ(files::list(directory.path())->size(), kept);
}

TEST(Files, SweepsNothingThatIsBeingWritten) {
  const test::TemporaryDirectory directory;
  std::atomic<bool> stop{false};
  std::atomic<int> failures{0};
  std::vector<std::thread> writers;
  for (const char* name : {"a", "b"}) {
    writers.emplace_back([&, name] {
      while (!stop) failures += files::writeAtomically(directory / name, bytesOf("contents")) ? 0 : 1;
    });
  }
  std::size_t swept = 0;
  for (int round = 0; round < 300; ++round) {
    directory.write("crashed.tmp-aaaaaa", "half");
    swept += files::sweepTemporaries(directory.path());
  }
  stop = true;
  for (auto& writer : writers) writer.join();
  EXPECT_GE(swept, 300U);
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(files::list(directory.path())->size(), 2U);
}

TEST(Files, ProbesADirectoryAndLeavesNothing) {
  const test::TemporaryDirectory directory;
  EXPECT_TRUE(files::probeWritable(directory.path()));
  EXPECT_TRUE(files::list(directory.path())->empty());
  const auto absent = files::probeWritable(directory / "none");
  ASSERT_FALSE(absent);
  EXPECT_NE(absent.error().description.find(directory / "none"), std::string::npos);
  EXPECT_FALSE(files::probeWritable("/proc/self"));
}

TEST(Files, TrustsOnlyWhatOthersCannotWrite) {
  const test::TemporaryDirectory directory;
  const auto path = directory.write("d/a", "x");
  EXPECT_TRUE(files::isTrustworthy(path));
  ASSERT_EQ(::chmod(path.c_str(), 0620), 0);
  EXPECT_FALSE(files::isTrustworthy(path));
  ASSERT_EQ(::chmod(path.c_str(), 0602), 0);
  EXPECT_FALSE(files::isTrustworthy(path));
  ASSERT_EQ(::chmod(path.c_str(), 0644), 0);
  EXPECT_TRUE(files::isTrustworthy(path));
  ASSERT_EQ(::chmod((directory / "d").c_str(), 0777), 0);
  EXPECT_FALSE(files::isTrustworthy(path));
  ASSERT_EQ(::symlink(path.c_str(), (directory / "link").c_str()), 0);
  EXPECT_FALSE(files::isTrustworthy(directory / "link"));
  EXPECT_FALSE(files::isTrustworthy(directory / "none"));
}

TEST(Files, TellsTimesOfFiles) {
  const test::TemporaryDirectory directory;
  const auto path = directory.write("a", "x");
  EXPECT_TRUE(files::modificationTime(path));
  EXPECT_FALSE(files::modificationTime(directory / "none"));
  EXPECT_FALSE(files::creationTime(directory / "none"));
  EXPECT_EQ(files::size(path), 1U);
}

}  // namespace
}  // namespace velk
