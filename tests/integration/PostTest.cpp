// How events leave the machine: requests, headers, compression, batches, and what a server's answers do.

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

#include <algorithm>
#include <set>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

std::string hmacSha1(const std::string& key, const std::string& text) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int size = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()), reinterpret_cast<const unsigned char*>(text.data()),
       text.size(), digest, &size);
  std::string hex;
  for (unsigned int i = 0; i < size; ++i) {
    char pair[3];
    std::snprintf(pair, sizeof pair, "%02x", digest[i]);
    hex += pair;
  }
  return hex;
}

using Headers = std::vector<std::pair<std::string, std::string>>;

/// Without those that the transport writes itself, wherever it likes.
Headers ownHeaders(const TlsTestServer::Request& request) {
  Headers headers;
  for (const auto& header : request.headers) {
    if (header.first != "Host" && header.first != "Content-Length") headers.push_back(header);
  }
  return headers;
}

struct Poster {
  explicit Poster(const PropertyDictionary& more = {}, const PropertyDictionary& sessionInfo = {},
                  const char* device = kDeviceLines)
      : Poster(
            device, [&](const ReportingServer& server) { return storebagWith(server, more); }, sessionInfo) {}
  template <class MakeBag>
  Poster(const char* device, const MakeBag& makeBag, const PropertyDictionary& sessionInfo = {})
      : daemon(prepared(server, makeBag(server)), optionsFor(device)), session(daemon) {
    EXPECT_EQ(session.open(9, 42, sessionInfo).size(), 3U);
  }
  static ReportingServer& prepared(ReportingServer& server, const PropertyDictionary& bag) {
    server.setStorebag("heather", bag);
    return server;
  }
  static Daemon::Options optionsFor(const char* device) {
    Daemon::Options options;
    options.deviceConfiguration = device;
    return options;
  }
  PropertyArray flush() { return session.call({{"method", "flushMessagesWithCompletion"}}); }

  ReportingServer server;
  Daemon daemon;
  ControlledSession session;
};

std::string errorOf(const PropertyArray& flushed) {
  if (flushed.size() != 2 || flushed[1].dictionary() == nullptr) return "no error";
  const auto* text = flushed[1].dictionary()->string("description");
  return text != nullptr ? *text : "no description";
}

TEST(Post, HasExactlyTheseHeadersInThisOrder) {
  Poster poster({{"include_session_id", 1}});
  poster.session.sendEvent(7, 3, PropertyDictionary{{"text", std::string(600, 'a')}});
  ASSERT_TRUE(poster.server.waitForEvents(1, {7}));

  const auto posts = poster.server.posts();
  const auto post = std::find_if(posts.begin(), posts.end(), [](const auto& each) {
    const auto* map = each.request.header("X-Velk-Event-Map");
    return map != nullptr && *map == "7 3";
  });
  ASSERT_NE(post, posts.end());
  const auto& request = post->request;
  const auto event = *(*post->body.array("events"))[0].dictionary();
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.target, "/post");
  const Headers expected{{"X-Velk-Client-Name", "Test"},
                         {"X-Velk-Service-Name", "unit"},
                         {"User-Agent", "VelkReporting/8.0 (Box1,2; 12.5)"},
                         {"X-Velk-Client-Version", "3"},
                         {"X-Velk-Sender", *event.string("_sender")},
                         {"X-Velk-Event-Map", "7 3"},
                         {"Accept", "application/json"},
                         {"Content-Type", "application/json"},
                         {"Content-Encoding", "gzip"},
                         {"X-Velk-Session-ID", *event.string("_sessionID")}};
  EXPECT_EQ(ownHeaders(request), expected);
  ASSERT_NE(request.header("Content-Length"), nullptr);
  EXPECT_EQ(*request.header("Content-Length"), std::to_string(request.body.size()));
}

TEST(Post, OfAnInternalBuildSaysSo) {
  Poster poster({}, {}, kInternalDeviceLines);
  ASSERT_TRUE(poster.server.waitForPosts(1));
  const auto headers = ownHeaders(poster.server.posts()[0].request);
  ASSERT_GT(headers.size(), 3U);
  EXPECT_EQ(headers[2], (std::pair<std::string, std::string>{"X-Velk-Internal-Build", "1"}));
}

TEST(Post, HeaderValuesLoseControlCharacters) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(
      session.open(9, 1, {}, PropertyDictionary{{"_clientName", "Te\r\nX-Evil: 1\r\n\r\nst"}, {"_serviceName", ""}})
          .size(),
      3U);
  ASSERT_TRUE(server.waitForPosts(1));
  const auto request = server.posts()[0].request;
  EXPECT_EQ(request.header("X-Evil"), nullptr);
  ASSERT_NE(request.header("X-Velk-Client-Name"), nullptr);
  EXPECT_EQ(request.header("X-Velk-Client-Name")->find('\r'), std::string::npos);
  ASSERT_NE(request.header("X-Velk-Service-Name"), nullptr) << "empty values are sent as empty";
  EXPECT_EQ(*request.header("X-Velk-Service-Name"), "");
}

TEST(Post, CompressesOnlyWhatGetsShorter) {
  Poster poster({}, {{"BatchEvents", true}});
  for (int i = 0; i < 20; ++i) poster.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  ASSERT_EQ(poster.flush().size(), 2U);
  ASSERT_TRUE(poster.server.waitForEvents(20, {7}));
  const auto request = poster.server.posts()[0].request;
  ASSERT_NE(request.header("Content-Encoding"), nullptr);
  EXPECT_LT(request.body.size(), TlsTestServer::gunzip(request.body).size());
  EXPECT_EQ(request.header("X-Velk-Event-Map"), nullptr) << "only for single events";
}

TEST(Post, BodyIsCompact) {
  Poster poster;
  poster.session.sendEvent(7, 1, PropertyDictionary{{"path", "a/b"}, {"two", 2.0}});
  ASSERT_TRUE(poster.server.waitForEvents(1, {7}));
  for (const auto& post : poster.server.posts()) {
    const bool isGzip = post.request.header("Content-Encoding") != nullptr;
    const std::string text = isGzip ? TlsTestServer::gunzip(post.request.body) : post.request.body;
    EXPECT_EQ(text.rfind("{\"postTime\":", 0), 0U);
    EXPECT_EQ(text.find('\n'), std::string::npos);
    if (text.find("\"path\"") != std::string::npos) {
      EXPECT_NE(text.find("\"path\":\"a/b\",\"two\":2.0,"), std::string::npos) << text;
    }
  }
}

TEST(Post, OfTheDigestBackendIsSigned) {
  Poster poster(kDeviceLines, [](const ReportingServer& server) {
    return storebagOf(
        {{"qrs", postBackend(server)}, {"splunk", postBackend(server, {{"post_url", server.url("/plain")}})}});
  });
  const std::string key = "secret key";
  poster.session.send({{"method", "setDigestKey"}, {"key", ByteData(key.begin(), key.end())}, {"algorithm", 0}});
  poster.session.sendEvent(7, 3, PropertyDictionary{{"answer", 42}});
  ASSERT_TRUE(poster.server.waitForEvents(2, {7}));

  std::size_t digests = 0;
  for (const auto& post : poster.server.posts()) {
    const auto* digest = post.request.header("X-Velk-DIGEST");
    if (digest == nullptr) continue;
    ++digests;
    EXPECT_EQ(post.request.target, "/post");
    const bool isGzip = post.request.header("Content-Encoding") != nullptr;
    EXPECT_EQ(*digest, hmacSha1(key, isGzip ? TlsTestServer::gunzip(post.request.body) : post.request.body));
    EXPECT_EQ(ownHeaders(post.request).back().first, "X-Velk-DIGEST");
  }
  EXPECT_EQ(digests, 1U);
}

TEST(Post, DigestOfAnotherAlgorithmIsNoneUntilUserInfoIsRefreshed) {
  Poster poster(kDeviceLines, [](const ReportingServer& server) { return storebagOf({{"qrs", postBackend(server)}}); });
  poster.session.send({{"method", "setDigestKey"}, {"key", ByteData{1, 2, 3}}, {"algorithm", 2}});
  poster.session.sendEvent(7, 3, PropertyDictionary{{"a", 1}});
  ASSERT_TRUE(poster.server.waitForEvents(1, {7}));
  poster.session.send(
      {{"method", "fetchStatesWithUserInfo"}, {"userInfo", PropertyDictionary{{"_clientName", "New"}}}});
  poster.session.sendEvent(8, 3, PropertyDictionary{{"a", 1}});
  ASSERT_TRUE(poster.server.waitForEvents(1, {8}));

  std::size_t digests = 0;
  for (const auto& post : poster.server.posts()) digests += post.request.header("X-Velk-DIGEST") != nullptr ? 1 : 0;
  EXPECT_EQ(digests, 1U) << "the refresh hands on algorithm 0";
}

TEST(Post, TheFiftyFirstEventOfAMethodFlushes) {
  Poster poster({}, {{"BatchEvents", true}});
  for (int i = 1; i <= 51; ++i) poster.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  poster.session.sendEvent(8, 1, PropertyDictionary{{"last", true}});

  ASSERT_TRUE(poster.server.waitForPosts(1));
  const auto& events = *poster.server.posts()[0].body.array("events");
  ASSERT_EQ(events.size(), 51U) << "the start message and the first fifty";
  EXPECT_EQ(integerValue(events[50].dictionary()->find("number")), 50);
  EXPECT_TRUE(poster.daemon.log().waitForPart(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 7"));
  const auto flushed = poster.flush();
  ASSERT_EQ(flushed.size(), 2U);
  EXPECT_TRUE(flushed[1].isNull());
  ASSERT_TRUE(poster.server.waitForPosts(2));
  EXPECT_EQ(poster.server.posts()[1].body.array("events")->size(), 2U);
}

TEST(Post, ThresholdComesFromTheEntry) {
  Poster poster({{"event_threshold", 1}, {"expedite", 0}});
  for (int i = 1; i <= 3; ++i) poster.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  ASSERT_TRUE(poster.server.waitForPosts(1));
  EXPECT_EQ(poster.server.posts()[0].body.array("events")->size(), 3U);
}

TEST(Post, RealtimeEventsFlushTheBatchBeforeThem) {
  Poster poster({{"realtime_post_url", nullptr}}, {{"BatchEvents", true}});
  for (int i = 1; i <= 2; ++i) poster.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  const auto reply = poster.session.reply(poster.session.sendEvent(7, 1, PropertyDictionary{{"number", 3}}, 1));

  ASSERT_TRUE(poster.server.waitForEvents(3, {7}));
  const auto posts = poster.server.posts();
  ASSERT_EQ(posts.size(), 2U);
  std::set<std::size_t> sizes{posts[0].body.array("events")->size(), posts[1].body.array("events")->size()};
  EXPECT_EQ(sizes, (std::set<std::size_t>{1, 3}));
  ASSERT_NE(reply.array("reply"), nullptr);
  const auto* text = (*reply.array("reply"))[0].string();
  ASSERT_NE(text, nullptr);
  EXPECT_EQ(text->rfind("Flushed events:\n", 0), 0U);
  EXPECT_NE(text->find("\nStandalone event:\n"), std::string::npos);
}

TEST(Post, RealtimeEventsHaveAnAddressOfTheirOwn) {
  Poster poster(kDeviceLines, [](const ReportingServer& server) {
    return storebagWith(server, {{"realtime_post_url", server.url("/now")}});
  });
  poster.session.sendEvent(7, 1, PropertyDictionary{{"a", 1}}, 1);
  ASSERT_TRUE(poster.server.waitForEvents(1, {7}));
  const auto posts = poster.server.posts();
  EXPECT_EQ(std::count_if(posts.begin(), posts.end(), [](const auto& post) { return post.request.target == "/now"; }),
            1);
}

TEST(Post, WaitingBackendWakesAndKeepsTheWakingEvent) {
  // The other backend is enabled from the start: only that makes the session's transport active.
  Poster poster(kDeviceLines, [](const ReportingServer& server) {
    return storebagOf({{"splunk", postBackend(server, {{"sampling_threshold", 0.0}})},
                       {"korrin", postBackend(server, {{"event_whitelist", PropertyArray{1000}}})}});
  });
  poster.session.sendEvent(7, 1, PropertyDictionary{{"number", 1}});
  poster.session.sendEvent(7, 1, PropertyDictionary{{"number", 2}}, 3);  // wakes it, and is batched although realtime
  poster.session.sendEvent(7, 1, PropertyDictionary{{"number", 3}});
  ASSERT_TRUE(poster.server.waitForEvents(1, {7}));
  EXPECT_EQ(integerValue(eventsOf(poster.server, 7)[0].find("number")), 3);
  ASSERT_EQ(poster.flush().size(), 2U);
  ASSERT_TRUE(poster.server.waitForEvents(3, {7}));
  EXPECT_EQ(integerValue(eventsOf(poster.server, 7)[1].find("number")), 1);
  EXPECT_EQ(integerValue(eventsOf(poster.server, 7)[2].find("number")), 2);
}

TEST(Post, WaitingBackendThatNeverWakesLosesItsBatch) {
  Poster poster({{"sampling_threshold", 0.0}});
  poster.session.sendEvent(7, 1, PropertyDictionary{{"number", 1}}, 1);
  EXPECT_EQ(errorOf(poster.flush()), "Nothing to flush");
  EXPECT_EQ(poster.session.finish(), 0);
  EXPECT_EQ(poster.daemon.stop(), 0);
  EXPECT_TRUE(poster.server.posts().empty());
}

TEST(Post, ClearAddressesAreForcedToHttps) {
  Poster poster(kDeviceLines, [](const ReportingServer& server) {
    return storebagWith(server, {{"post_url", "http://127.0.0.1:" + std::to_string(server.port()) + "/post"}});
  });
  poster.session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
  EXPECT_TRUE(poster.server.waitForEvents(1, {7}));
}

TEST(Post, InternalBuildsPostInTheClearWhereTold) {
  TlsTestServer plain(false);
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"post_url", plain.url("/post")}}));
  Daemon::Options options;
  options.deviceConfiguration = kInternalDeviceLines;
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  EXPECT_TRUE(plain.waitForRequests(1, kPatience));
}

TEST(Post, OtherBuildsNeverPostInTheClear) {
  TlsTestServer plain(false);
  const std::string address = "127.0.0.1:" + std::to_string(plain.port()) + "/post";
  const std::vector<std::pair<int, const char*>> types{
      {5, "bramble"},   {6, "clover"},  {8, "fennel"},  {9, "heather"}, {10, "juniper"},
      {12, "lavender"}, {14, "mallow"}, {15, "nettle"}, {16, "orchid"}, {17, "primrose"}};
  const std::vector<std::string> urls{
      "http://" + address,  address, "HTTP://" + address,  "//" + address,     "http:" + address, "ftp://" + address,
      "file:///etc/passwd", "://",   " http://" + address, "http:\\" + address};
  ReportingServer server;
  for (std::size_t i = 0; i < urls.size(); ++i) {
    server.setStorebag(types[i].second, storebagWith(server, {{"post_url", urls[i]}}));
  }
  Daemon daemon(server);
  for (const auto& type : types) {
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(type.first, 1).size(), 3U);
    session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
    EXPECT_EQ(session.finish(), 0);
  }
  plain.closeConnections();
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_TRUE(plain.requests().empty());
}

TEST(Post, ServerErrorsDisableTheBackend) {
  for (const int status : {500, 503, 599}) {
    Poster poster({}, {{"BatchEvents", true}});
    poster.server.setPostResponse({status, "", {}, {}, "", false});
    const std::string error = "backend splunk disabled by server " + std::to_string(status) + " return code";
    EXPECT_EQ(errorOf(poster.flush()), error);
    EXPECT_TRUE(poster.daemon.log().waitForPart("postJSONMessage: " + error));
    poster.server.setPostResponse({});
    poster.session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
    EXPECT_EQ(errorOf(poster.flush()), "Nothing to flush");
    EXPECT_EQ(poster.server.posts().size(), 1U);
  }
}

TEST(Post, OtherAnswersDoNotDisableTheBackend) {
  for (const int status : {404, 400, 301, 204}) {
    Poster poster({}, {{"BatchEvents", true}});
    poster.server.setPostResponse({status, "", {{"Location", poster.server.url("/elsewhere")}}, {}, "", false});
    EXPECT_EQ(errorOf(poster.flush()), "no error") << status;
    poster.session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
    EXPECT_EQ(errorOf(poster.flush()), "no error") << status;
    const auto posts = poster.server.posts();
    EXPECT_EQ(posts.size(), 2U);
    for (const auto& post : posts) EXPECT_EQ(post.request.target, "/post") << "redirects are not followed";
  }
}

TEST(Post, ManySingleEventsAllArrive) {
  Poster poster;
  constexpr std::size_t kCount = 300;
  for (std::size_t i = 0; i < kCount; ++i) poster.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  EXPECT_EQ(poster.session.finish(), 0);
  EXPECT_TRUE(poster.server.waitForEvents(kCount, {7}));
  std::set<std::int64_t> numbers;
  for (const auto& event : eventsOf(poster.server, 7)) numbers.insert(integerValue(event.find("number")));
  EXPECT_EQ(numbers.size(), kCount);
}

}  // namespace
}  // namespace velk::test
