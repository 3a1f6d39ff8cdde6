#include "platform/TrustedPath.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

using testing::HasSubstr;

/// A file in a directory in a directory, all of them this user's alone.
class TrustedPath : public testing::Test {
 protected:
  void change(const std::string& path, unsigned mode) { ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path; }
  static std::string refusalOf(const std::string& path) {
    const auto trusted = trustedPath(path);
    return trusted ? "(none)" : trusted.error().description;
  }

  const test::TemporaryDirectory directory;
  const std::string file = directory.write("outer/inner/adaptor.so", "contents");
  const std::string inner = directory / "outer/inner";
  const std::string outer = directory / "outer";
};

TEST_F(TrustedPath, TakesAFileOfThisUserInADirectoryOfThisUser) {
  // The temporary directory itself is sticky and writable by everybody.
  EXPECT_EQ(trustedPath(file).value_or("(refused)"), std::filesystem::canonical(file));
}

TEST_F(TrustedPath, RefusesAPathThatIsNotAbsolute) {
  EXPECT_THAT(refusalOf("adaptor.so"), HasSubstr("\"adaptor.so\" is not an absolute path"));
  EXPECT_THAT(refusalOf("./x/adaptor.so"), HasSubstr("is not an absolute path"));
  EXPECT_THAT(refusalOf(""), HasSubstr("is not an absolute path"));
}

TEST_F(TrustedPath, RefusesWhatIsNotThere) {
  EXPECT_THAT(refusalOf(directory / "none.so"), HasSubstr("none.so: No such file or directory"));
  EXPECT_THAT(refusalOf(file + "/below"), HasSubstr("Not a directory"));
  EXPECT_THAT(refusalOf("/" + std::string(5000, 'x')), HasSubstr("File name too long"));
}

TEST_F(TrustedPath, RefusesWhatIsNoRegularFile) {
  EXPECT_THAT(refusalOf(inner), HasSubstr("is not a regular file"));
  ASSERT_EQ(::mkfifo((directory / "fifo").c_str(), 0600), 0);
  EXPECT_THAT(refusalOf(directory / "fifo"), HasSubstr("is not a regular file"));
  EXPECT_THAT(refusalOf("/dev/null"), HasSubstr("is not a regular file"));
}

TEST_F(TrustedPath, RefusesAFileThatOthersCanWrite) {
  for (const unsigned mode : {0620U, 0602U, 0666U}) {
    change(file, mode);
    EXPECT_THAT(refusalOf(file), HasSubstr("adaptor.so can be written by others than its owner")) << mode;
  }
  // Sticky means nothing on a file.
  change(file, 01622);
  EXPECT_THAT(refusalOf(file), HasSubstr("can be written by others"));
}

TEST_F(TrustedPath, RefusesAnyDirectoryOnTheWayThatOthersCanWrite) {
  change(inner, 0770);
  EXPECT_THAT(refusalOf(file), HasSubstr("outer/inner can be written by others"));
  change(inner, 0700);
  change(outer, 0707);
  EXPECT_THAT(refusalOf(file), HasSubstr("outer can be written by others"));
  change(outer, 01777);
  EXPECT_EQ(refusalOf(file), "(none)") << "in a sticky directory nobody moves what is not his own";
}

TEST_F(TrustedPath, JudgesWhatALinkLeadsTo) {
  const auto link = directory / "link.so";
  ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
  EXPECT_EQ(trustedPath(link).value_or("(refused)"), std::filesystem::canonical(file)) << "not the link itself";
  change(inner, 0777);
  EXPECT_THAT(refusalOf(link), HasSubstr("outer/inner can be written by others"));
  ASSERT_EQ(::symlink("loop", (directory / "loop").c_str()), 0);
  EXPECT_THAT(refusalOf(directory / "loop"), HasSubstr("Too many levels of symbolic links"));
}

TEST_F(TrustedPath, RefusesWhatBelongsToSomebodyElse) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give files away";
  ASSERT_EQ(::chown(file.c_str(), 65534, 65534), 0);
  EXPECT_THAT(refusalOf(file), HasSubstr("adaptor.so belongs to user 65534, who is neither root nor the user"));
  ASSERT_EQ(::chown(file.c_str(), 0, 0), 0);
  ASSERT_EQ(::chown(outer.c_str(), 65534, 65534), 0);
  EXPECT_THAT(refusalOf(file), HasSubstr("outer belongs to user 65534"));
}

}  // namespace
}  // namespace velk
