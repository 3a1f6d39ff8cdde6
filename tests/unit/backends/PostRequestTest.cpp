#include "backends/PostRequest.h"

#include "foundation/Text.h"
#include "platform/Cryptography.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

using Header = std::pair<std::string, std::string>;

class PostRequestTest : public ::testing::Test {
 protected:
  PostRequestTest() {
    post.url = "https://collector.example/events";
    post.body = std::make_shared<const std::string>("{\"events\":[]}");
    post.json = post.body.get();
    post.userInfo = &userInfo;
    post.selfVersion = {8, 1, 2};
    post.hardwareType = &hardwareType;
    post.productVersion = &productVersion;
    post.clientVersion = 12;
    post.compType = 20;
  }

  PropertyDictionary userInfo{{"_clientName", "Media"}, {"_serviceName", "Calls"}};
  std::string hardwareType = "Lamp9,1";
  std::string productVersion = "10.2";
  std::string sessionID = "0123456789012345678901234567890123456789ABC";
  ByteData key{'k', 'e', 'y'};
  PostDescription post;
};

TEST_F(PostRequestTest, SetsEveryHeaderInOrder) {
  post.isInternal = true;
  post.method = 7;
  post.respCode = 3;
  post.isCompressed = true;
  post.sessionID = &sessionID;
  post.digestKey = &key;
  const std::string json = "The quick brown fox jumps over the lazy dog";
  post.json = &json;
  const auto request = makePostRequest(post);
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.body, post.body);
  EXPECT_THAT(
      request.headers,
      ::testing::ElementsAre(
          Header("X-Velk-Client-Name", "Media"), Header("X-Velk-Service-Name", "Calls"),
          Header("X-Velk-Internal-Build", "1"), Header("User-Agent", "VelkReporting/8.1.2 (Lamp9,1; 10.2)"),
          Header("X-Velk-Client-Version", "12"), Header("X-Velk-Sender", std::string(componentShortCode(20))),
          Header("X-Velk-Event-Map", "7 3"), Header("Accept", "application/json"),
          Header("Content-Type", "application/json"), Header("Content-Length", "13"),
          Header("Content-Encoding", "gzip"), Header("X-Velk-Session-ID", "0123456789012345678901234567890123456789"),
          Header("X-Velk-DIGEST", "de7c9b85b8b78aa6bc8a7a36f70a90701c9db4d9")));
}

TEST_F(PostRequestTest, SetsOnlyWhatThereIs) {
  post.userInfo = nullptr;
  post.selfVersion = {8, 0, 0};
  const auto request = makePostRequest(post);
  EXPECT_THAT(request.headers,
              ::testing::ElementsAre(
                  Header("User-Agent", "VelkReporting/8.0 (Lamp9,1; 10.2)"), Header("X-Velk-Client-Version", "12"),
                  Header("X-Velk-Sender", std::string(componentShortCode(20))), Header("Accept", "application/json"),
                  Header("Content-Type", "application/json"), Header("Content-Length", "13")));
}

TEST_F(PostRequestTest, SendsEmptyNamesAsEmpty) {
  userInfo = {{"_clientName", ""}, {"_serviceName", 5}};
  const auto request = makePostRequest(post);
  EXPECT_EQ(headerOf(request, "X-Velk-Client-Name"), "");
  EXPECT_EQ(headerOf(request, "X-Velk-Service-Name"), "5");
}

TEST_F(PostRequestTest, SaysWhatItDoesNotKnowOfTheDevice) {
  post.hardwareType = nullptr;
  post.productVersion = nullptr;
  EXPECT_EQ(headerOf(makePostRequest(post), "User-Agent"), "VelkReporting/8.1.2 ((null); (null))");
}

TEST_F(PostRequestTest, MapsEventsOnlyWithBothNumbers) {
  post.method = 7;
  EXPECT_EQ(headerOf(makePostRequest(post), "X-Velk-Event-Map"), std::nullopt);
  post.respCode = 0;
  EXPECT_EQ(headerOf(makePostRequest(post), "X-Velk-Event-Map"), "7 0");
}

TEST_F(PostRequestTest, KeepsAShortSessionIDWhole) {
  sessionID = "short";
  post.sessionID = &sessionID;
  EXPECT_EQ(headerOf(makePostRequest(post), "X-Velk-Session-ID"), "short");
}

TEST_F(PostRequestTest, DigestsAsAnIndependentComputationDoes) {
  // HMAC by its definition, over a key longer than a block.
  const ByteData longKey(80, 0xaa);
  const std::string json = "Test Using Larger Than Block-Size Key - Hash Key First";
  ByteData block(64, 0);
  const auto hashedKey = sha1(longKey);
  std::copy(hashedKey.begin(), hashedKey.end(), block.begin());
  const auto padded = [&block](std::uint8_t pad, std::span<const std::uint8_t> rest) {
    ByteData bytes;
    for (const auto byte : block) bytes.push_back(byte ^ pad);
    bytes.insert(bytes.end(), rest.begin(), rest.end());
    return sha1(bytes);
  };
  const auto inner = padded(0x36, std::span(reinterpret_cast<const std::uint8_t*>(json.data()), json.size()));
  post.digestKey = &longKey;
  post.json = &json;
  const auto digest = headerOf(makePostRequest(post), "X-Velk-DIGEST");
  EXPECT_EQ(digest, hexadecimal(padded(0x5c, inner)));
  EXPECT_EQ(digest, "aa4ae5e15272d00e95705637ce8a3b55ed402112");
}

TEST_F(PostRequestTest, SpeaksOnlyHttpsOutsideInternalBuilds) {
  post.url = "http://collector.example/events?x=1";
  auto request = makePostRequest(post);
  EXPECT_EQ(request.url, "https://collector.example/events?x=1");
  EXPECT_TRUE(request.requiresHttps);
  post.isInternal = true;
  request = makePostRequest(post);
  EXPECT_EQ(request.url, "http://collector.example/events?x=1");
  EXPECT_FALSE(request.requiresHttps);
}

TEST_F(PostRequestTest, StaysOffMobileNetworksWhereToldTo) {
  EXPECT_TRUE(makePostRequest(post).allowsCellularAccess);
  post.wifiOnly = true;
  EXPECT_FALSE(makePostRequest(post).allowsCellularAccess);
}

TEST(AddressWithHttps, ReplacesTheSchemeAlone) {
  EXPECT_EQ(addressWithHttps("http://host:81/p?q=1#f"), "https://host:81/p?q=1#f");
  EXPECT_EQ(addressWithHttps("ftp://host/"), "https://host/");
  EXPECT_EQ(addressWithHttps("://host/"), "https://host/");
  EXPECT_EQ(addressWithHttps("https://host/a"), "https://host/a");
  EXPECT_EQ(addressWithHttps("HTTPS://host/a://b"), "HTTPS://host/a://b");
}

TEST(AddressWithHttps, CutsWhatFollowsASecondSeparator) {
  EXPECT_EQ(addressWithHttps("http://host/a?to=http://other/"), "https://host/a?to=http");
}

TEST(AddressWithHttps, LeavesAnAddressWithoutScheme) {
  EXPECT_EQ(addressWithHttps("host/path"), "host/path");
  EXPECT_EQ(addressWithHttps(""), "");
}

}  // namespace
}  // namespace velk::test
