#include "daemon/SharedConnectivityHelpers.h"

#include <gtest/gtest.h>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "daemon/LogTexts.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "tests/support/FakeHttpSession.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
using Helper = ReportingSessionConnectivityHelper;

constexpr auto kPost = Helper::POSTRequestMode();

class SharedConnectivityHelpersTest : public ::testing::Test {
 protected:
  SharedConnectivityHelpersTest() { fakes.setHttpSessionService(&http); }

  static PropertyDictionary user(const char* client, const char* service) {
    return {{kVelkReportingUserInfoClientName, client}, {kVelkReportingUserInfoServiceName, service}};
  }
  std::shared_ptr<Helper> request(const PropertyDictionary& userInfo, std::int32_t mode = kPost) {
    auto helper = helpers->request(userInfo, mode, {});
    fakes.scheduler.runUntilIdle();
    return helper;
  }
  void release(const PropertyDictionary& userInfo) {
    helpers->release(userInfo);
    fakes.scheduler.runUntilIdle();
  }
  std::int64_t count(const char* name, std::size_t row = 0) {
    const auto rows = helpers->status();
    return row < rows.size() ? integerValue(rows[row].dictionary()->find(name)) : -1;
  }
  int logged(std::string_view format, const char* key = "media:calls") { return log.count(formatText(format, {key})); }

  test::RecordingLog log;
  test::FakeHttpSessionService http;
  test::FakePlatform fakes;
  const std::shared_ptr<SharedConnectivityHelpers> helpers =
      std::make_shared<SharedConnectivityHelpers>(fakes.platform());
  const PropertyDictionary media = user("Media", "Calls");
};

TEST_F(SharedConnectivityHelpersTest, SharesOneTransportAmongUsersOfTheSameNamesInAnyCase) {
  const auto first = request(media);
  EXPECT_EQ(request(media), first);
  EXPECT_EQ(request(user("media", "calls")), first);
  EXPECT_EQ(count("usage"), 3);
  EXPECT_EQ(count("usageCount"), 3);
  EXPECT_EQ(logged(daemontexts::kCreatingHelper), 1);
  EXPECT_EQ(logged(daemontexts::kFoundHelper), 2);
  EXPECT_EQ(logged(daemontexts::kIncrementingHelper), 3);
}

TEST_F(SharedConnectivityHelpersTest, GivesAnotherServiceItsOwn) {
  EXPECT_NE(request(media), request(user("Media", "Music")));
  EXPECT_EQ(helpers->status().size(), 2U);
}

TEST_F(SharedConnectivityHelpersTest, ReturnsTheExistingTransportWhateverModeIsAskedFor) {
  const auto pulling = request(media, Helper::GETRequestMode());
  EXPECT_EQ(request(media, kPost), pulling);
  EXPECT_EQ(count("mode"), Helper::GETRequestMode());
}

TEST_F(SharedConnectivityHelpersTest, LetsATransportGoWhenItsLastUserHasBeenGoneForAWhile) {
  const auto helper = request(media);
  helper->activate(30);
  request(media);
  request(media);
  for (int user = 0; user < 3; ++user) release(media);
  EXPECT_EQ(helpers->status().size(), 1U);
  fakes.scheduler.advance(31s);
  EXPECT_EQ(helpers->status().size(), 0U);
  EXPECT_TRUE(http.lastSession()->isInvalidated());
  EXPECT_EQ(logged(daemontexts::kHelperReachedZero), 1);
  EXPECT_NE(request(media), helper);
}

TEST_F(SharedConnectivityHelpersTest, KeepsATransportThatIsTakenAgainInTime) {
  const auto helper = request(media);
  release(media);
  fakes.scheduler.advance(29s);
  EXPECT_EQ(request(media), helper);
  fakes.scheduler.advance(60s);
  EXPECT_EQ(helpers->status().size(), 1U);
  EXPECT_EQ(logged(daemontexts::kHelperReachedZero), 0);
  EXPECT_EQ(count("usage"), 1);
}

// The report of zero stands in the queue behind a request that has taken the transport again.
TEST_F(SharedConnectivityHelpersTest, IgnoresAZeroThatIsOlderThanTheLatestRequest) {
  const auto helper = request(media);
  release(media);
  // The timer has fired when the request comes, but what it reports has not been heard.
  fakes.clock().advance(31s);
  std::shared_ptr<Helper> again;
  const auto userQueue = fakes.scheduler.makeSerialQueue("user");
  userQueue->async([&] { again = helpers->request(media, kPost, {}); });
  fakes.scheduler.runUntilIdle();
  fakes.scheduler.advance(0s);
  EXPECT_EQ(again, helper);
  EXPECT_EQ(helpers->status().size(), 1U);
  EXPECT_EQ(logged(daemontexts::kHelperReachedZero), 0);
}

TEST_F(SharedConnectivityHelpersTest, ReleasingForNamesThatNobodyAskedForIsOnlyLogged) {
  release(media);
  EXPECT_EQ(logged(daemontexts::kReleasingHelper), 1);
  EXPECT_EQ(logged(daemontexts::kDecrementingHelper), 0);
}

TEST_F(SharedConnectivityHelpersTest, AnEverLastingTransportIsNeverLetGo) {
  request(media)->activate(0);
  release(media);
  fakes.scheduler.advance(24h);
  EXPECT_EQ(helpers->status().size(), 1U);
}

TEST_F(SharedConnectivityHelpersTest, LetsTheLongestUnusedGoWhenTooManyWait) {
  constexpr auto kMaximum = SharedConnectivityHelpers::kMaximumUnused;
  const auto numbered = [](std::size_t number) { return user("Media", std::to_string(number).c_str()); };
  const auto used = request(media);
  for (std::size_t number = 0; number < kMaximum; ++number) {
    static_cast<void>(request(numbered(number)));
    release(numbered(number));
  }
  EXPECT_EQ(helpers->count(), kMaximum + 1);
  const auto again = request(numbered(0));  // no longer the longest unused
  release(numbered(0));
  const auto next = request(numbered(1));
  release(numbered(1));
  static_cast<void>(request(numbered(kMaximum)));
  release(numbered(kMaximum));

  EXPECT_EQ(helpers->count(), kMaximum + 1);
  EXPECT_EQ(request(numbered(0)), again);
  EXPECT_EQ(request(numbered(1)), next);
  EXPECT_EQ(request(media), used);
  EXPECT_EQ(logged(daemontexts::kHelperReachedZero, "media:2"), 1);
}

TEST_F(SharedConnectivityHelpersTest, InvalidatesAllAtTheEnd) {
  request(media)->activate(30);
  helpers->invalidateAll();
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(http.lastSession()->isInvalidated());
  EXPECT_EQ(helpers->status().size(), 0U);
}

}  // namespace
}  // namespace velk
