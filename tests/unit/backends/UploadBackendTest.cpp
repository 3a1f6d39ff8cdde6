#include "backends/UploadBackend.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <random>
#include <thread>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "platform/HandedFile.h"
#include "tests/support/FakeHttpSession.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

using namespace backend_texts;

constexpr char kUdid[] = "0123456789abcdef0123456789abcdef01234567";

FileUpload openFile(const std::string& path, ProcessUploads::User user = 0) {
  FileUpload upload{path, "token", FileDescriptor(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC))};
  upload.user = user;
  return upload;
}

/// Answers every post at once.
class AnsweringTransport : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) override {
    requests.push_back(std::move(request));
    if (drops) return;
    auto response = std::make_shared<HttpResponse>();
    response->statusCode = status;
    completion(ByteData(answer.begin(), answer.end()), std::move(response), error);
  }

  std::vector<HttpRequest> requests;
  std::string answer;
  int status = 200;
  std::optional<Error> error;
  bool drops = false;
};

class UploadBackendTest : public BackendTest {
 protected:
  UploadBackendTest() {
    context.largeFilesDirectory = directory / "large";
    backend = makeUpload(section);
  }

  std::shared_ptr<UploadBackend> makeUpload(const PropertyValue& profile) {
    auto made = UploadBackend::initWithName(context, "upload_server", profile, "Lamp");
    if (!made) return made;
    made->setUdid(kUdid);
    made->setSessionID(4'000'000'000);
    made->setReportingSessionConnectivityDelegate(server);
    return made;
  }
  bool upload(const std::string& path, UploadBackend& to) {
    FileUpload each = openFile(path);
    const bool taken = to.uploadFileAtPath(each);
    delivered = each.isDelivered;
    return taken;
  }
  bool upload(const std::string& path) { return upload(path, *backend); }
  /// The decompressed body of the last request.
  std::string lastBody() {
    if (server->requests.empty()) return "(none)";
    const HttpRequest& request = server->requests.back();
    if (request.body) return inflated(*request.body).value_or("(damaged)");
    if (!request.bodyFile) return "(no body)";
    std::vector<std::uint8_t> bytes(request.bodyFile->size());
    EXPECT_EQ(readAt(request.bodyFile->file(), 0, bytes).value_or(0), bytes.size());
    return inflated({reinterpret_cast<const char*>(bytes.data()), bytes.size()}).value_or("(damaged)");
  }

  const TemporaryDirectory directory;
  const std::shared_ptr<AnsweringTransport> server = std::make_shared<AnsweringTransport>();
  const PropertyDictionary section{{"post_url", "https://logs.example/up"}, {"display_url", "https://see.example"}};
  std::shared_ptr<UploadBackend> backend;
  bool delivered = false;
};

TEST_F(UploadBackendTest, NeedsAnAddressToPostTo) {
  EXPECT_EQ(makeUpload(PropertyDictionary{{"display_url", "https://see.example"}}), nullptr);
  EXPECT_EQ(makeUpload(PropertyDictionary{{"post_url", 5}}), nullptr);
  EXPECT_EQ(makeUpload("text"), nullptr);
  EXPECT_EQ(log.count(log::Level::error, "UploadBackend(initWithName): can't resolve upload post URL."), 3);
}

TEST_F(UploadBackendTest, ReadsItsAddresses) {
  EXPECT_EQ(backend->uploadURL(), "https://logs.example/up");
  EXPECT_EQ(backend->displayURL(), "https://see.example");
  EXPECT_FALSE(makeUpload(PropertyDictionary{{"post_url", "https://a"}})->displayURL());
}

TEST_F(UploadBackendTest, PostsTheCompressedFile) {
  const auto path = directory.write("trace.log", "what happened");
  EXPECT_TRUE(upload(path));
  ASSERT_EQ(server->requests.size(), 1U);
  const HttpRequest& request = server->requests[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url, std::string("https://logs.example/up?uuid=") + kUdid +
                             "&sequence=4000000000&description=Vistra%20AFRC%20log%20(Uploaded%20by%20Fenn)"
                             "&filename=trace.log.gz&raw=true");
  EXPECT_EQ(headerOf(request, "Content-Type"), "application/octet-stream");
  EXPECT_EQ(headerOf(request, "Content-Encoding"), "gzip");
  EXPECT_EQ(request.headers.size(), 2U);
  EXPECT_EQ(lastBody(), "what happened");
  EXPECT_EQ(request.timeout, std::chrono::seconds(60));
  EXPECT_EQ(log.count(log::Level::standard, "UploadBackend(uploadFileAtPath): Uploading file " + path), 1);
}

TEST_F(UploadBackendTest, OneByteIsAWholeFile) {
  EXPECT_TRUE(upload(directory.write("log", "x")));
  EXPECT_EQ(lastBody(), "x");
}

// The ampersand ends the name for a server that splits the query at it; so it has always been sent.
TEST_F(UploadBackendTest, AmpersandStaysInTheFileName) {
  EXPECT_TRUE(upload(directory.write("a b&c.log", "x")));
  EXPECT_NE(server->requests[0].url.find("&filename=a%20b&c.log.gz&raw=true"), std::string::npos)
      << server->requests[0].url;
}

TEST_F(UploadBackendTest, EverythingThatAQueryCannotHoldIsEscapedInTheFileName) {
  EXPECT_TRUE(upload(directory.write("\xC3\xA9#%\"<>[]\\^`{|}\n", "x")));
  EXPECT_NE(server->requests[0].url.find("&filename=%C3%A9%23%25%22%3C%3E%5B%5D%5C%5E%60%7B%7C%7D%0A.gz&raw=true"),
            std::string::npos)
      << server->requests[0].url;
}

TEST_F(UploadBackendTest, OnlyRegularFilesAreUploaded) {
  const auto fifo = directory / "fifo";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  EXPECT_FALSE(upload(directory.path()));
  EXPECT_FALSE(upload(fifo));
  EXPECT_FALSE(upload(directory / "none")) << "no descriptor came along";
  FileUpload link{directory / "link", "token", {}};
  std::filesystem::create_symlink(directory.write("log", "text"), link.path);
  link.file = FileDescriptor(::open(link.path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  EXPECT_FALSE(backend->uploadFileAtPath(link));
  EXPECT_EQ(log.count("UploadBackend(uploadFileAtPath): Only upload a regular file."), 4);
  EXPECT_TRUE(server->requests.empty());
}

TEST_F(UploadBackendTest, EmptyFilesAndThoseThatCannotBeReadAreNotUploaded) {
  EXPECT_FALSE(upload(directory.write("log", "")));
  FileUpload unreadable{directory.write("log", "text"), "token", {}};
  unreadable.file = FileDescriptor(::open(unreadable.path.c_str(), O_PATH | O_CLOEXEC));
  EXPECT_FALSE(backend->uploadFileAtPath(unreadable));
  EXPECT_EQ(log.count("UploadBackend(uploadFileAtPath): Input file is empty"), 2);
  EXPECT_TRUE(server->requests.empty());
  EXPECT_TRUE(std::filesystem::exists(directory / "log"));
}

TEST_F(UploadBackendTest, WithoutAnAddressNothingIsSaidOfTheFile) {
  backend->setUploadURL(std::nullopt);
  log.clear();
  EXPECT_FALSE(upload(directory.path()));
  EXPECT_EQ(log.lines().size(), 1U);
}

TEST_F(UploadBackendTest, AddressThatIsNoneMakesNoRequest) {
  for (const char* address : {"https://two words", "", "https://host:port", "nowhere"}) {
    backend->setUploadURL(address);
    EXPECT_FALSE(upload(directory.write("log", "text"))) << address;
  }
  EXPECT_EQ(log.count("UploadBackend(uploadFileAtPath): Unable to create URL request"), 4);
  EXPECT_TRUE(server->requests.empty());
}

// Nobody can tell it from a delivered file, but for the file's staying.
TEST_F(UploadBackendTest, TrueWithoutATransport) {
  backend->setReportingSessionConnectivityDelegate({});
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_FALSE(delivered);
}

TEST_F(UploadBackendTest, TrueWhateverTheServerSays) {
  for (const int status : {200, 404, 500}) {
    server->status = status;
    server->answer = "no";
    EXPECT_TRUE(upload(directory.write("log", "text")));
    EXPECT_FALSE(delivered);
  }
  server->error = Error{"HttpErrorDomain", 7, "logs.example: refused"};
  server->answer = "";
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_FALSE(delivered);
  EXPECT_EQ(log.count(log::Level::error, "UploadBackend(uploadFileAtPath): post logs.example: refused"), 1);
}

TEST_F(UploadBackendTest, TheAnswersTextAloneDecidesOverTheFile) {
  const auto isDelivered = [this](const std::string& answer) {
    server->answer = answer;
    EXPECT_TRUE(upload(directory.write("log", "text")));
    return delivered;
  };
  EXPECT_TRUE(isDelivered("success"));
  EXPECT_TRUE(isDelivered("{\"result\": \"unsuccessful\"}")) << "anywhere";
  EXPECT_FALSE(isDelivered("SUCCESS"));
  EXPECT_FALSE(isDelivered(""));
  EXPECT_FALSE(isDelivered("succes"));
  EXPECT_FALSE(isDelivered("success \xFF")) << "no text";
  server->status = 500;
  EXPECT_TRUE(isDelivered("success"));
  EXPECT_EQ(log.count(log::Level::standard,
                      "UploadBackend(uploadFileAtPath): sending to |https://logs.example/up|, Json "
                      "output: success"),
            2);
}

TEST_F(UploadBackendTest, BytesThatCameBeforeAnErrorAreAnAnswer) {
  server->answer = "success";
  server->error = Error{"HttpErrorDomain", 18, "cut off"};
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_TRUE(delivered);
  EXPECT_FALSE(log.contains("cut off"));
}

TEST_F(UploadBackendTest, LongAnswersAreCutInTheLogAlone) {
  server->answer = std::string(100'000, 'a') + "success";
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_TRUE(delivered);
  for (const auto& line : log.lines()) EXPECT_LT(line.text.size(), 5000U);
}

TEST_F(UploadBackendTest, RequestThatTheTransportDropsHoldsNobodyUp) {
  server->drops = true;
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_FALSE(delivered);
  EXPECT_TRUE(log.contains("UploadBackend(uploadFileAtPath): post "));
}

TEST_F(UploadBackendTest, PostsToTheAddressAsItIsConfigured) {
  backend->setUploadURL("http://logs.example/up");
  for (const bool isInternal : {false, true}) {
    backend->setIsInternal(isInternal);
    EXPECT_TRUE(upload(directory.write("log", "text")));
    EXPECT_EQ(server->requests.back().url.find("http://logs.example/up?"), 0U);
    EXPECT_FALSE(server->requests.back().requiresHttps);
  }
}

TEST_F(UploadBackendTest, LargeBodiesGetMoreTimeUpToAnHour) {
  EXPECT_EQ(UploadBackend::timeoutFor(0), std::chrono::seconds(60));
  EXPECT_EQ(UploadBackend::timeoutFor(100 * 128 * 1024), std::chrono::seconds(160));
  EXPECT_EQ(UploadBackend::timeoutFor(UINT64_MAX), std::chrono::hours(1));
}

TEST_F(UploadBackendTest, LargeFilesAreSentFromTheDisk) {
  std::string contents;
  while (contents.size() <= kMaximumSizeInMemory) contents += std::to_string(contents.size()) + " bytes so far\n";
  EXPECT_TRUE(upload(directory.write("log", contents)));
  ASSERT_EQ(server->requests.size(), 1U);
  EXPECT_EQ(server->requests[0].body, nullptr);
  ASSERT_NE(server->requests[0].bodyFile, nullptr);
  EXPECT_TRUE(lastBody() == contents);
  EXPECT_EQ(log.count("compressDataWithZlibOrGzip: Compressed file from " + std::to_string(contents.size()) + " to " +
                      std::to_string(server->requests[0].bodyFile->size())),
            1);
  EXPECT_TRUE(std::filesystem::is_empty(directory / "large"));
}

TEST_F(UploadBackendTest, LargeFileWithoutRoomForItStays) {
  context.largeFilesDirectory = directory.write("file", "") + "/below";
  const auto cramped = makeUpload(section);
  EXPECT_FALSE(upload(directory.write("log", std::string(kMaximumSizeInMemory + 1, 'a')), *cramped));
  EXPECT_TRUE(log.contains("UploadBackend(uploadFileAtPath): there is no room for " + (directory / "log") + ", "));
  EXPECT_TRUE(server->requests.empty());
}

/// Bytes that do not become fewer.
std::string noise(std::size_t size) {
  std::minstd_rand random(1);
  std::string bytes(size, '\0');
  for (auto& byte : bytes) byte = static_cast<char>(random() >> 8U);
  return bytes;
}

TEST_F(UploadBackendTest, LargeFileBeyondItsUsersShareOfTheDiskStays) {
  constexpr std::uint64_t kSize = kMaximumSizeInMemory + 1'000'000;
  const auto path = directory.write("log", noise(kSize));
  ProcessUploads::DiskRoom others(context.uploads, 2);
  ASSERT_TRUE(others.grow(ProcessUploads::kMaximumDiskBytes / 2 - 1'000'000, UINT64_MAX));
  {
    ProcessUploads::DiskRoom own(context.uploads, 1);
    ASSERT_TRUE(own.grow(ProcessUploads::kMaximumDiskBytes / 4 - 1'000'000, UINT64_MAX));
    log.clear();
    EXPECT_EQ(gzipFile(openFile(path, 1), kSize, directory.path(), context.uploads).outcome,
              CompressedFile::Outcome::failed);
    ASSERT_EQ(log.lines().size(), 1U);
    EXPECT_EQ(log.lines()[0].level, log::Level::error);
    EXPECT_TRUE(log.contains("UploadBackend(uploadFileAtPath): there is no room for " + path +
                             ", compressed: its user has its share of the "));
  }
  EXPECT_EQ(gzipFile(openFile(path, 1), kSize, directory.path(), context.uploads).outcome,
            CompressedFile::Outcome::compressed);
}

TEST_F(UploadBackendTest, RoomOnTheDiskIsTakenAsLongAsTheFileIsThere) {
  constexpr std::uint64_t kSize = kMaximumSizeInMemory + 1'000'000;
  const auto path = directory.write("log", noise(kSize));
  const auto takeAll = [this] {
    ProcessUploads::DiskRoom room(context.uploads, 1);
    return room.grow(ProcessUploads::kMaximumDiskBytes / 2, UINT64_MAX).has_value();
  };
  EXPECT_TRUE(takeAll());
  {
    const auto compressed = gzipFile(openFile(path, 1), kSize, directory.path(), context.uploads);
    ASSERT_NE(compressed.onDisk, nullptr);
    EXPECT_FALSE(takeAll());
  }
  EXPECT_TRUE(takeAll());
}

TEST_F(UploadBackendTest, FilesOfAnySizeButTheLargestAreTaken) {
  const auto path = directory.write("log", "text");
  std::filesystem::resize_file(path, UploadBackend::kMaximumFileBytes + 1);
  EXPECT_FALSE(upload(path));
  EXPECT_TRUE(server->requests.empty());
}

TEST_F(UploadBackendTest, LargeFilesAreGivenUpWhenTheProcessEnds) {
  const auto path = directory.write("log", "text");
  std::filesystem::resize_file(path, kMaximumSizeInMemory + 1);
  context.uploads->stop();
  EXPECT_FALSE(upload(path));
  EXPECT_TRUE(server->requests.empty());
  EXPECT_EQ(gzipFile(openFile(path), kMaximumSizeInMemory + 1, directory.path(), context.uploads).outcome,
            CompressedFile::Outcome::abandoned);
}

/// A file that is being compressed on a thread of its own.
class Compressing {
 public:
  Compressing(std::string path, std::uint64_t size, const std::string& directory,
              const std::shared_ptr<ProcessUploads>& uploads, ProcessUploads::User user)
      : _thread([this, path = std::move(path), size, directory, uploads, user] {
          _compressed = gzipFile(openFile(path, user), size, directory, uploads);
          _isDone = true;
        }) {}
  ~Compressing() { join(); }

  [[nodiscard]] bool isDone() const { return _isDone; }
  const CompressedFile& join() {
    if (_thread.joinable()) _thread.join();
    return _compressed;
  }

 private:
  std::atomic<bool> _isDone{false};
  CompressedFile _compressed;
  std::thread _thread;
};

TEST_F(UploadBackendTest, FilesOfAnySizeTakeTurns) {
  const auto large = directory.write("large", "text");
  std::filesystem::resize_file(large, kMaximumSizeInMemory + 1);
  auto& uploads = *context.uploads;
  std::optional<ProcessUploads::CompressionTurn> first(std::in_place, uploads, 1);
  const ProcessUploads::CompressionTurn second(uploads, 1);
  Compressing ofLarge(large, kMaximumSizeInMemory + 1, directory.path(), context.uploads, 1);
  Compressing ofSmall(directory.write("small", "text"), 4, directory.path(), context.uploads, 1);
  while (uploads.waitingForTurns() < 2 && !ofLarge.isDone() && !ofSmall.isDone()) std::this_thread::yield();
  EXPECT_EQ(uploads.waitingForTurns(), 2U) << "both wait";
  first.reset();
  EXPECT_EQ(ofLarge.join().outcome, CompressedFile::Outcome::compressed);
  EXPECT_EQ(ofSmall.join().outcome, CompressedFile::Outcome::compressed);
  EXPECT_EQ(inflated(*ofSmall.join().inMemory), "text");
}

// A turn is for a piece, so that whoever comes later does not wait for the end of a file.
TEST_F(UploadBackendTest, SmallFilesGetTheirTurnsWhileAHugeOneIsCompressed) {
  constexpr std::uint64_t kHuge = std::uint64_t{8} << 30U;
  constexpr std::size_t kFitsIntoMemory = 1'000'000;
  const auto huge = directory.write("huge", "text");
  std::filesystem::resize_file(huge, kHuge);
  const auto small = directory.write("small", std::string(kFitsIntoMemory, 'x'));
  auto& uploads = *context.uploads;
  const ProcessUploads::CompressionTurn second(uploads, 1);
  Compressing ofHuge(huge, kHuge, directory.path(), context.uploads, 1);
  for (const ProcessUploads::User user : {1, 2}) {
    Compressing ofSmall(small, kFitsIntoMemory, directory.path(), context.uploads, user);
    EXPECT_EQ(inflated(*ofSmall.join().inMemory), std::string(kFitsIntoMemory, 'x'));
  }
  EXPECT_FALSE(ofHuge.isDone());
  uploads.stop();
  EXPECT_EQ(ofHuge.join().outcome, CompressedFile::Outcome::abandoned);
}

TEST_F(UploadBackendTest, LogsTheBeginningOfALongAnswer) {
  server->answer = std::string(4095, 'x') + " success";
  EXPECT_TRUE(upload(directory.write("log", "text")));
  EXPECT_TRUE(delivered) << "the whole of it is read";
  EXPECT_EQ(log.count("UploadBackend(uploadFileAtPath): sending to |https://logs.example/up|, Json output: " +
                      asLoggedValue(server->answer)),
            1);
}

// The whole way: what the backend allows is what the HTTP session is told, and its end is the upload's end.
TEST_F(UploadBackendTest, AServerThatNeverAnswersHoldsAnUploadForAMinute) {
  FakeHttpSessionService http;
  fakes.setHttpSessionService(&http);
  const auto helper = ReportingSessionConnectivityHelper::initWithDelegate(
      platform, {}, ReportingSessionConnectivityHelper::POSTRequestMode(), {});
  helper->activate(30);
  fakes.scheduler.runUntilIdle();
  backend->setReportingSessionConnectivityDelegate(helper);
  bool taken = false;
  std::thread uploading([&] { taken = upload(directory.write("log", "text")); });
  std::shared_ptr<FakeHttpTask> task;
  for (int waits = 0; !task && waits < 60'000; ++waits) {
    fakes.scheduler.runUntilIdle();
    task = http.waitForTask(0, std::chrono::milliseconds(1));
  }
  if (!task) std::abort();  // the thread above would wait for ever
  EXPECT_EQ(task->request().timeout, std::chrono::seconds(60));
  EXPECT_TRUE(task->request().isBulk);
  task->fail(28, "logs.example: Operation timed out");
  fakes.scheduler.runUntilIdle();
  uploading.join();
  EXPECT_TRUE(taken);
  EXPECT_FALSE(delivered);
  EXPECT_EQ(log.count(log::Level::error, "UploadBackend(uploadFileAtPath): post logs.example: Operation timed out"), 1);
  helper->invalidate();
  fakes.scheduler.runUntilIdle();
  fakes.setHttpSessionService(nullptr);
}

TEST_F(UploadBackendTest, ReadsNoMoreThanTheSizeItSaw) {
  const auto path = directory.write("log", "0123456789");
  const auto file = openFile(path);
  const auto uploads = std::make_shared<ProcessUploads>();
  EXPECT_EQ(inflated(*gzipFile(file, 4, directory.path(), uploads).inMemory), "0123");
  EXPECT_EQ(inflated(*gzipFile(file, 100, directory.path(), uploads).inMemory), "0123456789")
      << "it has become shorter";
  const auto large = gzipFile(file, kMaximumSizeInMemory + 1, directory.path(), uploads);
  EXPECT_EQ(large.outcome, CompressedFile::Outcome::compressed);
  ASSERT_EQ(::truncate(path.c_str(), 0), 0);
  EXPECT_EQ(gzipFile(file, 4, directory.path(), uploads).outcome, CompressedFile::Outcome::nothingToRead);
  EXPECT_EQ(gzipFile(file, kMaximumSizeInMemory + 1, directory.path(), uploads).outcome,
            CompressedFile::Outcome::nothingToRead);
}

}  // namespace
}  // namespace velk::test
