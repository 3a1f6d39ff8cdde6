// Log data on its way from a session to the address of a dashboard's section.
#include "platform/PropertyList.h"
#include "tests/unit/backends/DashboardFixture.h"

namespace velk::test {
namespace {

namespace texts = backend_texts;

/// Answers posts before they return, as it is told.
class AnsweringTransport : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) override {
    requests.push_back(std::move(request));
    if (drops) return;
    auto response = std::make_shared<HttpResponse>();
    response->statusCode = status;
    completion(ByteData(body.begin(), body.end()), error ? nullptr : std::move(response), error);
  }

  std::vector<HttpRequest> requests;
  std::string body = "https://logs.example/17";
  int status = 200;
  bool drops = false;
  std::optional<Error> error;
};

class DashboardLogDataTest : public DashboardTest {
 protected:
  ~DashboardLogDataTest() override {
    if (backend) backend->cleanup();
    fakes.scheduler.runUntilIdle();
  }

  void start(const PropertyDictionary& more = {{"post_url", "https://logs.example/post"}}) {
    backend = makeWith(section(more));
    backend->setReportingSessionConnectivityDelegate(server);
  }
  [[nodiscard]] bool upload() { return backend->uploadLogData(logData); }

  std::shared_ptr<AnsweringTransport> server = std::make_shared<AnsweringTransport>();
  std::shared_ptr<DashboardBackend> backend;
  const PropertyArray logData{PropertyDictionary{{"LogData", ByteData{1, 2, 3}}, {"StartTime", Date{1.5e9}}},
                              PropertyDictionary{{"LogData", "words"}, {"EndTime", 5}}};
};

TEST_F(DashboardLogDataTest, IsPostedAsABinaryPropertyList) {
  start();
  EXPECT_TRUE(upload());
  ASSERT_EQ(server->requests.size(), 1U);
  const HttpRequest& request = server->requests[0];
  EXPECT_EQ(request.url, "https://logs.example/post");
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(headerOf(request, "Content-Type"), "application/octet-stream");
  EXPECT_EQ(request.headers.size(), 1U);
  EXPECT_EQ(request.body->substr(0, 8), "bplist00");
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(request.body->data());
  const auto archived = propertylist::parse({bytes, request.body->size()});
  ASSERT_TRUE(archived);
  EXPECT_EQ(*archived, PropertyValue(logData));
}

TEST_F(DashboardLogDataTest, GoesToTheAddressAsItIsConfigured) {
  start({{"post_url", "http://logs.example/post"}});
  for (const bool isInternal : {false, true}) {
    backend->setIsInternal(isInternal);
    EXPECT_TRUE(upload());
    EXPECT_EQ(server->requests.back().url, "http://logs.example/post");
    EXPECT_FALSE(server->requests.back().requiresHttps);
  }
}

TEST_F(DashboardLogDataTest, TellsWhereItWent) {
  start();
  EXPECT_TRUE(upload());
  EXPECT_EQ(
      log.lines(),
      (std::vector<RecordingLog::Line>{
          {log::Level::standard, "DashboardBackend(uploadLogData): Log data uploaded to https://logs.example/17"}}));
}

/// The number of a backend's last event.
class LastNumber : public VelkReportingBackend {
 public:
  [[nodiscard]] static std::uint16_t of(const VelkReportingBackend& backend) {
    return backend.*(&LastNumber::_eventID);
  }
};

TEST_F(DashboardLogDataTest, NoticeTakesAnEventNumberAndSendsNothing) {
  start({{"post_url", "https://logs.example/post"}, {"reliable", 500}});
  EXPECT_TRUE(upload());
  EXPECT_EQ(LastNumber::of(*backend), 1);
  EXPECT_TRUE(upload());
  EXPECT_EQ(LastNumber::of(*backend), 2);
  server->error = Error{"HttpErrorDomain", 7, "no route"};
  EXPECT_FALSE(upload());
  EXPECT_EQ(LastNumber::of(*backend), 2) << "a failure is no news";
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(socket().sent.empty());
  EXPECT_FALSE(isTimerArmed());
}

TEST_F(DashboardLogDataTest, NeedsAnAddress) {
  start({});
  EXPECT_FALSE(upload());
  EXPECT_EQ(log.count(log::Level::error, texts::kNoLogDataURL), 1);
  EXPECT_TRUE(server->requests.empty());
}

TEST_F(DashboardLogDataTest, ThatHasNoArchiveIsNotPosted) {
  start();
  EXPECT_FALSE(backend->uploadLogData(PropertyArray{PropertyValue()}));
  EXPECT_EQ(log.count(log::Level::error, texts::kLogDataNotSerialized), 1);
  EXPECT_TRUE(server->requests.empty());
}

TEST_F(DashboardLogDataTest, WithoutTransportIsReportedAsUploaded) {
  start();
  server.reset();
  EXPECT_TRUE(upload());
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(DashboardLogDataTest, IsUploadedWhateverStatusTheServerGives) {
  start();
  for (const int status : {204, 404, 500, 503}) {
    server->status = status;
    EXPECT_TRUE(upload()) << status;
  }
}

TEST_F(DashboardLogDataTest, AnEmptyAnswerIsAnAnswer) {
  start();
  server->body.clear();
  EXPECT_TRUE(upload());
  EXPECT_EQ(log.count(log::Level::standard, "DashboardBackend(uploadLogData): Log data uploaded to "), 1);
}

TEST_F(DashboardLogDataTest, AFailedPostSaysWhy) {
  start();
  server->error = Error{"HttpErrorDomain", 7, "no route to logs.example"};
  for (const char* body : {"", "half an answer"}) {
    log.clear();
    server->body = body;
    EXPECT_FALSE(upload());
    EXPECT_EQ(log.lines(),
              (std::vector<RecordingLog::Line>{
                  {log::Level::error,
                   "DashboardBackend(uploadLogData): Error uploading log data array (no route to logs.example)"}}));
  }
}

TEST_F(DashboardLogDataTest, ADroppedPostWakesTheOneWhoWaits) {
  start();
  server->drops = true;
  EXPECT_FALSE(upload());
  EXPECT_EQ(log.count(log::Level::error, "DashboardBackend(uploadLogData): Error uploading log data array ((null))"),
            1);
}

TEST_F(DashboardLogDataTest, LogsNoAnswerThatIsNoAddress) {
  start();
  server->body = "\xFF\xFE";
  EXPECT_TRUE(upload());
  EXPECT_EQ(log.lines().back().text, "DashboardBackend(uploadLogData): Log data uploaded to ");
  server->body = std::string(100'000, 'x');
  EXPECT_TRUE(upload());
  EXPECT_LT(log.lines().back().text.size(), 2200U);
  server->body.assign(3000, 'x').append("\xFF");
  EXPECT_TRUE(upload());
  EXPECT_EQ(log.lines().back().text, "DashboardBackend(uploadLogData): Log data uploaded to ");
}

TEST_F(DashboardLogDataTest, CutsALongAnswerBehindAWholeCharacter) {
  start();
  server->body.assign(2047, 'x').append("\xC3\xA9 and more");
  EXPECT_TRUE(upload());
  EXPECT_EQ(log.lines().back().text,
            "DashboardBackend(uploadLogData): Log data uploaded to " + asLoggedValue(std::string(2047, 'x')));
}

TEST_F(DashboardLogDataTest, TakesNoMoreOfAnAnswerThanAnyAddressNeeds) {
  start();
  EXPECT_TRUE(upload());
  EXPECT_EQ(server->requests[0].maximumResponseBytes, std::size_t{1024 * 1024});
}

}  // namespace
}  // namespace velk::test
