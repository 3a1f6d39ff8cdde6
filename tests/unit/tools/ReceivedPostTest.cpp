#include "tools/collector/ReceivedPost.h"

#include <gtest/gtest.h>

#include "tests/unit/tools/Packing.h"

namespace velk::collector {
namespace {

using test::packed;

constexpr const char* kPost =
    R"({"postTime":1700000000.25,"clientId":"c-1","events":[)"
    R"({"_method":3,"_status":4,"_eventNumber":9,"_sender":"SORREL","_sessionID":"abc=","load":0.5},{"x":"}]"}]})";

std::string reasonFor(std::string_view json) {
  const auto post = readPost(json);
  return post ? "taken" : post.error().description;
}

TEST(ReceivedPost, ReadsTimeClientAndEvents) {
  const auto post = readPost(kPost);
  ASSERT_TRUE(post) << post.error().description;
  EXPECT_EQ(post->postTime, 1700000000.25);
  EXPECT_EQ(post->clientId, "c-1");
  ASSERT_EQ(post->events.size(), 2u);
  EXPECT_EQ(doubleValue(post->events[0].find("load")), 0.5);
}

TEST(ReceivedPost, GivesTheFieldsOfAnEvent) {
  const EventFields fields = eventFields(readPost(kPost)->events[0]);
  EXPECT_EQ(fields.method, 3);
  EXPECT_EQ(fields.status, 4);
  EXPECT_EQ(fields.eventNumber, 9);
  EXPECT_EQ(fields.sender, "SORREL");
  EXPECT_EQ(fields.session, "abc=");
}

TEST(ReceivedPost, LeavesFieldsOutThatAnEventLacksOrThatHaveAnotherType) {
  const EventFields fields = eventFields({{"_method", "3"}, {"_sender", PropertyArray()}, {"_sessionID", 17}});
  EXPECT_EQ(fields.method, std::nullopt);
  EXPECT_EQ(fields.status, std::nullopt);
  EXPECT_EQ(fields.sender, std::nullopt);
  EXPECT_EQ(fields.session, "17");
}

TEST(ReceivedPost, TakesAnEmptyListOfEvents) {
  EXPECT_EQ(reasonFor(R"({"postTime":1,"clientId":"","events":[]})"), "taken");
}

TEST(ReceivedPost, RefusesWhatIsNotJson) {
  EXPECT_NE(reasonFor("").find("not JSON"), std::string::npos);
  EXPECT_NE(reasonFor("{\"postTime\":1").find("not JSON"), std::string::npos);
  EXPECT_NE(reasonFor(std::string("\0\x01\xff", 3)).find("not JSON"), std::string::npos);
  EXPECT_NE(reasonFor(std::string(100'000, '[')).find("not JSON"), std::string::npos);
}

TEST(ReceivedPost, RefusesOtherShapes) {
  EXPECT_EQ(reasonFor("[]"), "the body is not a JSON object");
  EXPECT_EQ(reasonFor(R"({"clientId":"c","events":[]})"), "\"postTime\" is missing or not a number");
  EXPECT_EQ(reasonFor(R"({"postTime":"1","clientId":"c","events":[]})"), "\"postTime\" is missing or not a number");
  EXPECT_EQ(reasonFor(R"({"postTime":true,"clientId":"c","events":[]})"), "\"postTime\" is missing or not a number");
  EXPECT_EQ(reasonFor(R"({"postTime":1,"events":[]})"), "\"clientId\" is missing or not a string");
  EXPECT_EQ(reasonFor(R"({"postTime":1,"clientId":7,"events":[]})"), "\"clientId\" is missing or not a string");
  EXPECT_EQ(reasonFor(R"({"postTime":1,"clientId":"c"})"), "\"events\" is missing or not an array");
  EXPECT_EQ(reasonFor(R"({"postTime":1,"clientId":"c","events":{}})"), "\"events\" is missing or not an array");
  EXPECT_EQ(reasonFor(R"({"postTime":1,"clientId":"c","events":[{},5]})"), "event 1 of \"events\" is not an object");
}

TEST(PlainBody, PassesAPlainBodyOn) {
  EXPECT_EQ(*plainBody("{}", {}, PostBounds{}), "{}");
  EXPECT_EQ(*plainBody("{}", {{"Content-Encoding", "identity"}}, PostBounds{}), "{}");
}

TEST(PlainBody, UnpacksGzipWhateverTheCaseOfTheHeader) {
  EXPECT_EQ(*plainBody(packed("{}"), {{"content-encoding", "GZIP"}}, PostBounds{}), "{}");
}

TEST(PlainBody, RefusesOtherEncodings) {
  EXPECT_FALSE(plainBody("{}", {{"Content-Encoding", "br"}}, PostBounds{}));
  EXPECT_FALSE(plainBody("{}", {{"Content-Encoding", "gzip, gzip"}}, PostBounds{}));
}

TEST(PlainBody, RefusesWhatExceedsTheBounds) {
  const PostBounds bounds{100, 50};
  EXPECT_FALSE(plainBody(std::string(101, ' '), {}, bounds));
  EXPECT_FALSE(plainBody(std::string(51, ' '), {}, bounds));
  EXPECT_TRUE(plainBody(std::string(50, ' '), {}, bounds));
  EXPECT_FALSE(plainBody(packed(std::string(51, ' ')), {{"Content-Encoding", "gzip"}}, bounds));
}

TEST(CountEvents, CountsTheObjectsOfTheListOnly) {
  EXPECT_EQ(countEvents(kPost), 2u);
  EXPECT_EQ(countEvents(R"({"events":[]})"), 0u);
  EXPECT_EQ(countEvents(R"({"events":[{"a":{"b":[{},{}]}},{"events":[{}]}],"other":[{},{}]})"), 2u);
  EXPECT_EQ(countEvents(R"({"x":{"events":[{}]},"events":[{"s":"\"{[\\"}]})"), 1u);
}

TEST(CountEvents, StaysWithinTextThatIsNotJson) {
  for (const std::string_view text :
       {"", "\"", "\"\\", "}}}]]]", "{\"events\":[{", "{\"events\":[{\"", "{\"events\":[{\"\\"}) {
    EXPECT_LE(countEvents(text), 1u) << text;
  }
}

}  // namespace
}  // namespace velk::collector
