#include "platform/HandedFile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/UnnamedFile.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk::test {
namespace {

class HandedFileTest : public ::testing::Test {
 protected:
  /// What the receiver of the file at that path sees.
  std::optional<std::uint64_t> sizeSeen(const std::string& path) {
    const auto file = FileToHandOver::open(path);
    EXPECT_TRUE(file.has_value()) << path;
    if (!file) return std::nullopt;
    const auto descriptor = file->descriptor();
    EXPECT_TRUE(descriptor.has_value());
    EXPECT_NE(::fcntl(descriptor->get(), F_GETFD) & FD_CLOEXEC, 0);
    return sizeOfRegularFile(*descriptor);
  }

  const TemporaryDirectory directory;
};

TEST_F(HandedFileTest, RegularFileIsSeenWithItsSize) {
  EXPECT_EQ(sizeSeen(directory.write("log", "text")), 4U);
  EXPECT_EQ(sizeSeen(directory.write("empty", "")), 0U);
}

TEST_F(HandedFileTest, EverythingElseIsHandedOverAndSeenForWhatItIs) {
  const auto fifo = directory / "fifo";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  EXPECT_EQ(sizeSeen(fifo), std::nullopt) << "and nobody waited for a writer";
  ASSERT_EQ(::chmod(fifo.c_str(), 0), 0);
  EXPECT_EQ(sizeSeen(fifo), std::nullopt);
  const auto link = directory / "link";
  std::filesystem::create_symlink(directory.write("log", "text"), link);
  EXPECT_EQ(sizeSeen(link), std::nullopt);
  EXPECT_EQ(sizeSeen(directory.path()), std::nullopt);
  EXPECT_EQ(sizeSeen(directory.path() + "/"), std::nullopt);
  EXPECT_EQ(sizeSeen("/"), std::nullopt);
  EXPECT_EQ(sizeOfRegularFile(FileDescriptor()), std::nullopt);
}

TEST_F(HandedFileTest, FileThatMayNotBeReadIsNotHandedOver) {
  if (::geteuid() == 0) GTEST_SKIP() << "root may read everything";
  const auto path = directory.write("log", "text");
  ASSERT_EQ(::chmod(path.c_str(), 0), 0);
  const auto file = FileToHandOver::open(path);
  ASSERT_FALSE(file.has_value());
  EXPECT_EQ(file.error().code, EACCES);
}

TEST_F(HandedFileTest, FileThatIsNotThereIsAnError) {
  for (const auto& path : {directory / "none", directory / "no/where", std::string()}) {
    const auto file = FileToHandOver::open(path);
    ASSERT_FALSE(file.has_value()) << path;
    EXPECT_EQ(file.error().code, ENOENT);
  }
}

TEST_F(HandedFileTest, DescriptorOfAPathAloneGivesNothingAway) {
  const auto path = directory.write("log", "text");
  const FileDescriptor pathOnly(::open(path.c_str(), O_PATH | O_CLOEXEC));
  std::uint8_t byte = 0;
  EXPECT_FALSE(readAt(pathOnly, 0, {&byte, 1}).has_value());
  const FileDescriptor writeOnly(::open(path.c_str(), O_WRONLY | O_CLOEXEC));
  EXPECT_FALSE(readAt(writeOnly, 0, {&byte, 1}).has_value());
}

TEST_F(HandedFileTest, RemovesTheFileThatWasHandedOver) {
  const auto path = directory.write("log", "text");
  const auto file = FileToHandOver::open(path);
  ASSERT_TRUE(file.has_value());
  EXPECT_TRUE(file->removeIfUnchanged().has_value());
  EXPECT_FALSE(std::filesystem::exists(path));
  EXPECT_FALSE(file->removeIfUnchanged().has_value()) << "it is gone";
}

TEST_F(HandedFileTest, FileOfTheSameNameStays) {
  const auto path = directory.write("log", "text");
  const auto file = FileToHandOver::open(path);
  ASSERT_TRUE(file.has_value());
  std::filesystem::remove(path);
  // The file system would give the number of the old one away again if nobody held it.
  static_cast<void>(directory.write("log", "another one"));
  EXPECT_FALSE(file->removeIfUnchanged().has_value());
  EXPECT_EQ(directory.read("log"), "another one");
}

TEST_F(HandedFileTest, LinkToTheFileStays) {
  const auto path = directory.write("log", "text");
  const auto file = FileToHandOver::open(path);
  ASSERT_TRUE(file.has_value());
  std::filesystem::rename(path, directory / "moved");
  std::filesystem::create_symlink(directory / "moved", path);
  EXPECT_FALSE(file->removeIfUnchanged().has_value());
  EXPECT_TRUE(std::filesystem::is_symlink(path));
  EXPECT_EQ(directory.read("moved"), "text");
}

TEST_F(HandedFileTest, DirectoryThatTookThePlaceOfItsOwnStays) {
  std::filesystem::create_directory(directory / "logs");
  const auto path = directory.write("logs/log", "text");
  const auto file = FileToHandOver::open(path);
  ASSERT_TRUE(file.has_value());
  std::filesystem::rename(directory / "logs", directory / "old");
  static_cast<void>(directory.write("logs/log", "another one"));
  EXPECT_TRUE(file->removeIfUnchanged().has_value());
  EXPECT_EQ(directory.read("logs/log"), "another one");
  EXPECT_FALSE(std::filesystem::exists(directory / "old/log")) << "it was found where it had been";
}

TEST_F(HandedFileTest, ReadsFromAnyPlaceUpToTheEnd) {
  const auto path = directory.write("log", "0123456789");
  const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  std::vector<std::uint8_t> buffer(6);
  EXPECT_EQ(readAt(file, 0, buffer).value(), 6U);
  EXPECT_EQ(readAt(file, 6, buffer).value(), 4U);
  EXPECT_EQ(buffer[0], '6');
  EXPECT_EQ(readAt(file, 10, buffer).value(), 0U);
}

TEST(UnnamedFileTest, KeepsBytesAndLeavesNothingBehind) {
  const TemporaryDirectory directory;
  auto file = UnnamedFile::make(directory / "deep/er");
  ASSERT_TRUE(file.has_value());
  const std::vector<std::uint8_t> bytes{1, 2, 3};
  ASSERT_TRUE((*file)->append(bytes).has_value());
  ASSERT_TRUE((*file)->append(bytes).has_value());
  EXPECT_EQ((*file)->size(), 6U);
  std::vector<std::uint8_t> read(8);
  EXPECT_EQ(readAt((*file)->file(), 0, read).value(), 6U);
  EXPECT_EQ(read, (std::vector<std::uint8_t>{1, 2, 3, 1, 2, 3, 0, 0}));
  EXPECT_TRUE(std::filesystem::is_empty(directory / "deep/er"));
}

TEST(UnnamedFileTest, SaysWhereItCannotBeMade) {
  const TemporaryDirectory directory;
  EXPECT_FALSE(UnnamedFile::make(directory.write("file", "") + "/below").has_value());
}

}  // namespace
}  // namespace velk::test
