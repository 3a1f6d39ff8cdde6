// Files as a C program hands them over: what is refused at once, and what becomes of callback, context and file.

#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <filesystem>

#include "client/LogTexts.h"
#include "platform/Files.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/CInterfaceFixture.h"

namespace velk::test {
namespace {

void noteUpload(bool uploaded, void* context) {
  static_cast<Context*>(context)->note(uploaded ? "uploaded" : "not uploaded");
}

class CInterfaceUploadTest : public CInterfaceTest {
 protected:
  /// Refused at once, with the context ended by then and the callback never called, and one line that names the path.
  void expectRefusal(VelkReportingClient* client, const std::string& path, const std::string& inLog, int reason) {
    Context context;
    EXPECT_FALSE(VelkReportingClientUploadFile(client, path.c_str(), noteUpload, &context, Context::destroy)) << path;
    EXPECT_EQ(context.ended.load(), 1) << path;
    EXPECT_TRUE(context.texts.empty()) << path;
    const std::string line = "uploadFileWithURL: Failed to get sandbox extension for path " + asLoggedValue(inLog) +
                             ", errno " + std::to_string(reason);
    EXPECT_EQ(_log.count(line), 1) << line;
  }
  /// Handed over and answered.
  void expectAnswer(VelkReportingClient* client, const std::string& path) {
    Context context;
    ASSERT_TRUE(VelkReportingClientUploadFile(client, path.c_str(), noteUpload, &context, Context::destroy)) << path;
    ASSERT_TRUE(context.destroyed.waitFor(kPatience)) << path;
    EXPECT_EQ(context.ended.load(), 1) << path;
    EXPECT_EQ(context.texts.size(), 1U) << path;
  }

  const TemporaryDirectory _directory;
};

TEST_F(CInterfaceUploadTest, RefusesWhatItCannotOpen) {
  const Client client(create());
  expectRefusal(client, "", "", ENOENT);
  expectRefusal(client, _directory / "missing", _directory / "missing", ENOENT);
  expectRefusal(client, _directory / "no/directory", _directory / "no/directory", ENOENT);
  const std::string file = _directory.write("file", "text");
  expectRefusal(client, file + "/", file + "/", ENOTDIR);
  const std::string name(NAME_MAX + 1, 'n');
  expectRefusal(client, _directory / name, _directory / name, ENAMETOOLONG);
  std::string path = _directory.path();
  while (path.size() <= PATH_MAX) path += "/.";
  expectRefusal(client, path + "/file", path + "/file", ENAMETOOLONG);
  Context context;
  EXPECT_FALSE(VelkReportingClientUploadFile(client, nullptr, noteUpload, &context, Context::destroy));
  EXPECT_EQ(context.ended.load(), 1);
  EXPECT_EQ(_log.count(texts::kFileUrlIsNil), 1);
}

TEST_F(CInterfaceUploadTest, RefusesAPathThatIsNoTextButTakesItsAddress) {
  _daemon.start();
  const Client client(create());
  static_cast<void>(_directory.write("log\xff\x9b", "text"));
  expectRefusal(client, _directory / "log\xff\x9b", _directory / "log\\xff\\x9b", EILSEQ);
  expectAnswer(client, "file://" + _directory.path() + "/log%ff%9b");
  EXPECT_EQ(_daemon.count("uploadFileAtPath"), 1U);
}

TEST_F(CInterfaceUploadTest, RefusesAnAddressThatFitsIntoNoFrame) {
  const Client client(create());
  const std::string file = _directory.write("file", "text");
  for (const std::size_t size : {std::size_t{20'000}, std::size_t{2'000'000}}) {
    Context context;
    const std::string address = "file://" + std::string(size, 'h') + file;
    EXPECT_FALSE(VelkReportingClientUploadFile(client, address.c_str(), noteUpload, &context, Context::destroy));
    EXPECT_EQ(context.ended.load(), 1);
  }
  EXPECT_EQ(_log.count("uploadFileWithURL: Failed to get sandbox extension for path " + file + ", errno 36"), 2);
}

TEST_F(CInterfaceUploadTest, LeavesTheAnswerForWhatIsNoFileToTheDaemon) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  const Client client(create());
  const std::string fifo = _directory / "fifo";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  const std::string link = _directory / "link";
  std::filesystem::create_symlink(_directory.write("target", "text"), link);
  for (const auto& path : {_directory.path(), _directory.path() + "/", fifo, link}) expectAnswer(client, path);
  for (const auto& path : {fifo, link, _directory / "target"}) EXPECT_TRUE(files::exists(path)) << path;
}

TEST_F(CInterfaceUploadTest, TakesRelativePathsFromWhereTheProcessIsNow) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  const Client client(create());
  const auto before = std::filesystem::current_path();
  std::filesystem::current_path(_directory.path());
  static_cast<void>(_directory.write("file:log", "text"));
  static_cast<void>(_directory.write("below/log", "text"));
  expectAnswer(client, "file:log");
  Context context;
  ASSERT_TRUE(VelkReportingClientUploadFile(client, "below/log", noteUpload, &context, Context::destroy));
  std::filesystem::current_path(before);  // what was opened is removed where it was
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  EXPECT_FALSE(files::exists(_directory / "file:log"));
  EXPECT_FALSE(files::exists(_directory / "below/log"));
}

TEST_F(CInterfaceUploadTest, TheLastReleaseGivesUpAnswersThatHaveNotCome) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  _daemon.holdCalls(true);
  Context context;
  VelkReportingClient* const client = create();
  VelkReportingClientSetEndOfLifeBound(client, 0);
  const std::string path = _directory.write("log", "text");
  ASSERT_TRUE(VelkReportingClientUploadFile(client, path.c_str(), noteUpload, &context, Context::destroy));
  VelkReportingClientRelease(client);
  ASSERT_TRUE(context.destroyed.waitFor(kPatience)) << "the connection is closed";
  _daemon.holdCalls(false);  // and the answer comes too late
  flushAndWait(Client(create()));
  EXPECT_TRUE(context.texts.empty());
  EXPECT_TRUE(files::exists(path));
}

}  // namespace
}  // namespace velk::test
