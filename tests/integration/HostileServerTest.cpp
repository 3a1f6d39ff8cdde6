// Servers that answer nonsense, too much, too late or not at all.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

/// The lists of a session whose storebag server answers like this; the daemon must serve another client type after.
PropertyArray openAgainst(ReportingServer& server, const TlsTestServer::Response& response) {
  server.setStorebagAnswer("heather", response);
  server.setStorebag("clover", storebagWith(server));
  Daemon daemon(server);
  PropertyArray lists;
  {
    ControlledSession session(daemon);
    lists = session.open(9, 1);
    EXPECT_EQ(session.finish(), 0);
  }
  EXPECT_EQ(server.storebagRequests("heather"), 1U) << "it did answer, and was not asked twice";
  EXPECT_FALSE(fileNamed(daemon.directory() + "/cache", "heather"));
  ControlledSession after(daemon);
  const auto good = after.open(6, 2);
  EXPECT_TRUE(good.size() == 3 && good[0] == kSplunk);
  EXPECT_EQ(after.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
  return lists;
}

PropertyArray openAgainst(const TlsTestServer::Response& response) {
  ReportingServer server;
  return openAgainst(server, response);
}

TlsTestServer::Response body(std::string text, int status = 200) {
  TlsTestServer::Response response;
  response.status = status;
  response.body = std::move(text);
  return response;
}

TlsTestServer::Response raw(std::string bytes) {
  TlsTestServer::Response response;
  response.raw = std::move(bytes);
  return response;
}

TEST(HostileServer, OfStorebagsWithNonsenseConfiguresNothing) {
  const std::vector<std::string> bodies{
      "",
      "garbage",
      "<?xml",
      "{\"signature\": \"x\", \"bag\": \"y\"}",
      std::string(100000, '<'),
      "bplist00\xff\xff\xff",
      std::string("bplist00") + std::string(8, '\0') + std::string(16, '\xff'),
      "<?xml version=\"1.0\"?><!DOCTYPE p [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b \"&a;&a;&a;&a;&a;&a;\">"
      "<!ENTITY c SYSTEM "
      "\"file:///etc/passwd\">]><plist><dict><key>signature</key><string>&b;&c;</string></dict></plist>",
      "<plist><dict><key>signature</key><integer>1</integer><key>bag</key><true/></dict></plist>",
      "<plist><dict><key>signature</key><string>AAAA</string><key>bag</key><string>!!!!</string></dict></plist>"};
  for (const auto& text : bodies) EXPECT_EQ(openAgainst(body(text)), noLists()) << text.substr(0, 60);
}

TEST(HostileServer, OfStorebagsWithDeepNestingConfiguresNothing) {
  std::string deep = "<plist>";
  for (int i = 0; i < 100000; ++i) deep += "<array>";
  EXPECT_EQ(openAgainst(body(deep)), noLists());
}

TEST(HostileServer, OfStorebagsWithoutEndConfiguresNothing) {
  EXPECT_EQ(openAgainst(raw("HTTP/1.1 200 OK\r\nContent-Length: 1000000\r\n\r\nonly this")), noLists());
  EXPECT_EQ(openAgainst(raw("HTTP/1.1 200 OK\r\nContent-Length: -5\r\n\r\nx")), noLists());
  EXPECT_EQ(openAgainst(raw("SSH-2.0-OpenSSH\r\n")), noLists());
  EXPECT_EQ(openAgainst(raw("HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\nffffffffffffffff\r\nx")), noLists());
}

TEST(HostileServer, OfStorebagsThatIsTooLargeConfiguresNothing) {
  EXPECT_EQ(openAgainst(body(std::string(64U << 20U, 'x'))), noLists());
}

TEST(HostileServer, OfStorebagsThatRedirectsIsNotFollowed) {
  ReportingServer server;
  server.setStorebag("juniper", storebagWith(server));
  auto response = body("", 302);
  response.headers = {{"Location", server.url("/bags/vindle/juniper")}};
  EXPECT_EQ(openAgainst(server, response), noLists());
  EXPECT_EQ(server.storebagRequests("juniper"), 0U);
}

TEST(HostileServer, OfStorebagsThatIsSilentIsGivenUp) {
  TlsTestServer::Response never;
  never.silent = true;
  EXPECT_EQ(openAgainst(never), noLists()) << "after fifteen seconds";
}

TEST(HostileServer, HeadersForgeNoLogLines) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server),
                     {{"Last-Modified", "x\x1b[31m \x01"}, {"Cache-Control", "max-age=99999999999999999999"}});
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 1)[0], kSplunk);
  for (const auto& line : daemon.log().lines()) {
    EXPECT_EQ(line.find('\x1b'), std::string::npos) << line;
    EXPECT_EQ(line.rfind('<', 0), 0U) << line;
  }
}

TEST(HostileServer, OfPostsNeverHurtsTheDaemon) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  const std::vector<std::string> answers{"garbage",
                                         "HTTP/1.1 999999 Odd\r\n\r\n",
                                         "HTTP/1.1 200 OK\r\nContent-Length: 9\r\n\r\n",
                                         "HTTP/1.1 100 Continue\r\n\r\n",
                                         "HTTP/9.9 200\r\n\r\n",
                                         "\r\n\r\n",
                                         "HTTP/1.1 200 OK\r\nSet-Cookie: " + std::string(300000, 'c') + "\r\n\r\n"};
  for (const auto& answer : answers) {
    server.setPostResponse(raw(answer));
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}})[0], kSplunk);
    session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
    EXPECT_EQ(session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);
    EXPECT_EQ(session.finish(), 0);
  }
  server.setPostResponse({});
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 1)[0], kSplunk);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(HostileServer, OfPostsWithHugeAnswersIsCutShort) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  server.setPostResponse(body(std::string(64U << 20U, 'x')));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}})[0], kSplunk);
  EXPECT_EQ(session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
