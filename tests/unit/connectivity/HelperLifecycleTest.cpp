#include "tests/unit/connectivity/HelperFixture.h"

namespace velk {
namespace {

using namespace std::chrono_literals;

TEST_F(ConnectivityHelperTest, IsInactiveWhenCreated) {
  const auto helper = make(4);
  EXPECT_TRUE(http.sessions().empty());
  EXPECT_EQ(logged("ReportingSessionConnectivityHelper created with delegate %d", {1}), 1);
  EXPECT_EQ(*helper->status().find("active"), PropertyValue(false));
  EXPECT_TRUE(helper->status().find("identifier")->isNull());
}

TEST_F(ConnectivityHelperTest, ActivationMakesOneSession) {
  const auto helper = make(4);
  helper->activate(10);
  EXPECT_EQ(logged("activate: activating connectivity helper for NetSession with ID <%@>", {"inactive"}), 1);
  EXPECT_TRUE(http.sessions().empty());
  scheduler().runUntilIdle();
  ASSERT_EQ(http.sessions().size(), 1u);
  EXPECT_EQ(identifier().size(), 36u);
  EXPECT_EQ(logged("NetSession created and activated with ID <%@>, delegate %d", {identifier(), 1}), 1);

  helper->activate(10);
  scheduler().runUntilIdle();
  EXPECT_EQ(http.sessions().size(), 1u);
  EXPECT_EQ(logged("activate: activating connectivity helper for NetSession with ID <%@>", {identifier()}), 1);
  EXPECT_EQ(logged("activate: connectivity helper is already active for NetSession with ID <%@>", {identifier()}), 1);
  EXPECT_EQ(*helper->status().find("active"), PropertyValue(true));
  EXPECT_EQ(*helper->status().string("identifier"), identifier());
}

TEST_F(ConnectivityHelperTest, ConfigurationFollowsTheMode) {
  const auto helper = make(4);
  for (const int mode : {4, 8}) {
    const auto configuration = helper->privateURLSessionConfigWithMode(mode);
    EXPECT_FALSE(configuration.backgroundIdentifier);
    EXPECT_FALSE(configuration.discretionary);
    EXPECT_EQ(configuration.networkServiceType, 0);
    EXPECT_EQ(configuration.sourceApplicationBundleIdentifier, "com.tavrin.system.diagnostics");
    EXPECT_EQ(configuration.sourceApplicationSecondaryIdentifier, "media:calls");
    EXPECT_TRUE(configuration.waitsForConnectivity);
  }
  const auto upload = helper->privateURLSessionConfigWithMode(1);
  EXPECT_EQ(upload.backgroundIdentifier.value_or("").size(), 36u);
  EXPECT_TRUE(upload.discretionary);
  EXPECT_TRUE(upload.requiresExternalPower);
  EXPECT_EQ(upload.networkServiceType, 3);
  EXPECT_TRUE(upload.waitsForConnectivity);
  const auto pull = helper->privateURLSessionConfigWithMode(2);
  EXPECT_TRUE(pull.backgroundIdentifier);
  EXPECT_TRUE(pull.discretionary);
  EXPECT_FALSE(pull.requiresExternalPower);
  EXPECT_EQ(pull.networkServiceType, 0);
  EXPECT_NE(pull.backgroundIdentifier, helper->privateURLSessionConfigWithMode(2).backgroundIdentifier);
}

TEST_F(ConnectivityHelperTest, ABackgroundSessionIsCalledByItsIdentifier) {
  const auto helper = makeActive(2);
  EXPECT_EQ(identifier(), http.lastSession()->configuration().backgroundIdentifier);
}

TEST_F(ConnectivityHelperTest, InvalidatingAnInactiveHelperReturnsTheTransactionsAtOnce) {
  const auto helper = make(4);
  helper->incrementTotalSessionsServedCount();
  helper->incrementTotalSessionsServedCount();
  helper->invalidate();
  scheduler().runUntilIdle();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{2}));
  EXPECT_EQ(logged("ReportingSessionConnectivityHelper:invalidate: release %d IPC transactions for inactive "
                   "connectivity helper",
                   {2}),
            1);
  EXPECT_EQ(*helper->status().find("totalSessionsServedCount"), PropertyValue(0));
}

TEST_F(ConnectivityHelperTest, InvalidatingAnActiveHelperReturnsTheTransactionsWhenItsTasksAreDone) {
  const auto helper = makeActive(4);
  helper->postURLRequestWithCompletionHandler(request(), nullptr);
  helper->incrementTotalSessionsServedCount();
  EXPECT_EQ(logged("Total Sessions Served Count is incremented for NetSession with ID <%@>", {identifier()}), 1);
  helper->invalidate();
  scheduler().runUntilIdle();
  EXPECT_TRUE(http.lastSession()->isInvalidated());
  EXPECT_EQ(logged("ReportingSessionConnectivityHelper:invalidate: NetSession with ID <%@>", {identifier()}), 1);
  EXPECT_TRUE(owner->released.empty());

  lastTask()->respond(200);
  scheduler().runUntilIdle();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1}));
  EXPECT_EQ(logged("didBecomeInvalidWithError: release %d IPC transactions for session %@", {1, identifier()}), 1);
  EXPECT_EQ(logged("didBecomeInvalidWithError: session <%@> invalidated with error %@", {identifier(), nullptr}), 1);
}

// A session may end after its transport: nobody would come by again to give its reference back.
TEST_F(ConnectivityHelperTest, ASessionThatEndsAfterItsTransportReturnsItsTransactionAtOnce) {
  const auto active = makeActive(4);
  active->incrementTotalSessionsServedCount();
  active->invalidate();
  scheduler().runUntilIdle();
  active->incrementTotalSessionsServedCount();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1, 1}));

  const auto inactive = make(4);
  inactive->invalidate();
  scheduler().runUntilIdle();
  inactive->incrementTotalSessionsServedCount();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1, 1, 0, 1}));
}

TEST_F(ConnectivityHelperTest, ATransportThatIsActiveAgainKeepsTransactionsUntilItIsInvalidAgain) {
  const auto helper = makeActive(4);
  helper->invalidate();
  helper->activate(30);
  scheduler().runUntilIdle();
  helper->incrementTotalSessionsServedCount();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{0}));
  helper->invalidate();
  scheduler().runUntilIdle();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{0, 1}));
}

TEST_F(ConnectivityHelperTest, ABackendActivatesItWithTheTimeoutThatWasSetLast) {
  const auto helper = make(Helper::POSTRequestMode());
  helper->setReleaseTimeout(5);
  helper->activate();
  helper->activate();
  scheduler().runUntilIdle();
  EXPECT_TRUE(booleanValue(helper->status().find("active")));
  EXPECT_EQ(integerValue(helper->status().find("releaseTimeout")), 5);
  EXPECT_EQ(http.sessions().size(), 1U);
}

TEST_F(ConnectivityHelperTest, ABackendDoesNotActivateWhatItsOwnerHasLetGoOf) {
  const auto helper = make(Helper::POSTRequestMode());
  helper->invalidate();
  helper->activate();
  scheduler().runUntilIdle();
  EXPECT_FALSE(booleanValue(helper->status().find("active")));
}

TEST_F(ConnectivityHelperTest, ItsSessionKeepsItAliveUntilItIsInvalid) {
  auto helper = makeActive(4);
  const std::weak_ptr<Helper> weak = helper;
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  helper->invalidate();
  helper.reset();
  scheduler().runUntilIdle();
  EXPECT_FALSE(weak.expired());
  lastTask()->respond(200, "late");
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text(), "late");
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(logged("ReportingSessionConnectivityHelper dealloced with ID <%@>", {identifier()}), 1);
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{0}));
}

TEST_F(ConnectivityHelperTest, WorksWithoutAnOwner) {
  auto helper = Helper::initWithDelegate(fakes.platform(), {}, 8, {});
  EXPECT_EQ(logged("ReportingSessionConnectivityHelper created with delegate %d", {0}), 1);
  helper->incrementTotalSessionsServedCount();
  helper->activate(30);
  helper->invalidate();
  scheduler().runUntilIdle();
  EXPECT_EQ(*helper->status().find("totalSessionsServedCount"), PropertyValue(0));
  EXPECT_EQ(http.lastSession()->configuration().sourceApplicationSecondaryIdentifier, ":");
}

TEST_F(ConnectivityHelperTest, ASessionThatEndsWhileTransactionsAreReturnedIsNotForgotten) {
  const auto helper = make(4);
  helper->incrementTotalSessionsServedCount();
  owner->onRelease = [&] { helper->incrementTotalSessionsServedCount(); };
  helper->releaseAllIPCTransactions();
  owner->onRelease = nullptr;
  helper->releaseAllIPCTransactions();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1, 1}));
}

TEST_F(ConnectivityHelperTest, ReturnsTransactionsUnderAHeldLock) {
  const auto helper = make(4);
  helper->incrementTotalSessionsServedCount();
  Guard guard(owner->monitor());
  helper->releaseAllIPCTransactions();
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1}));
}

TEST_F(ConnectivityHelperTest, TellsAnOwnerWithOtherUsersAtOnce) {
  const auto helper = makeActive(4);
  helper->ownerIncrementUsageCount();
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{1}));
  EXPECT_EQ(scheduler().pendingDeadlines(), 0u);
  EXPECT_EQ(logged(texts::kUsageIncremented, {identifier(), 2, 0}), 1);
  EXPECT_EQ(logged(texts::kUsageDecremented, {identifier(), 1, 0}), 1);
  EXPECT_EQ(logged(texts::kUsageAboveZero, {identifier(), 1, 0}), 1);
}

TEST_F(ConnectivityHelperTest, TheReleaseTimerTellsTheOwnerThatNobodyIsLeft) {
  const auto helper = makeActive(4, 12);
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_TRUE(counts.empty());
  EXPECT_EQ(*helper->status().find("releaseTimerRuns"), PropertyValue(true));
  EXPECT_EQ(integerValue(helper->status().find("releaseTimeout")), 12);
  EXPECT_EQ(*helper->status().find("releaseInSeconds"), PropertyValue(12.0));
  EXPECT_EQ(logged(texts::kUsageZero, {identifier()}), 1);
  EXPECT_EQ(logged(texts::kTimerStarted, {identifier()}), 1);
  scheduler().advance(11900ms);
  EXPECT_TRUE(counts.empty());
  EXPECT_NEAR(doubleValue(helper->status().find("releaseInSeconds")), 0.1, 0.001);
  scheduler().advance(200ms);
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{0}));
  EXPECT_EQ(logged(texts::kTimerFired, {identifier(), 12}), 1);
  EXPECT_EQ(logged(texts::kTimerCallsOwner, {0}), 1);
  EXPECT_EQ(*helper->status().find("releaseTimerRuns"), PropertyValue(false));
  EXPECT_TRUE(helper->status().find("releaseInSeconds")->isNull());
  scheduler().advance(1h);
  EXPECT_EQ(counts.size(), 1u);
}

TEST_F(ConnectivityHelperTest, ANewUserStopsTheReleaseTimerAndTheOwnerHearsOfIt) {
  const auto helper = makeActive(4);
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().advance(10s);
  log.clear();
  helper->ownerIncrementUsageCount();
  scheduler().runUntilIdle();
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{1}));
  EXPECT_EQ(logged(texts::kTimerStopping, {identifier()}), 1);
  EXPECT_EQ(logged(texts::kTimerCallsOwner, {1}), 1);
  scheduler().advance(1h);
  EXPECT_EQ(counts.size(), 1u);
}

TEST_F(ConnectivityHelperTest, AUserThatComesAndGoesAtOnceLeavesTheFullTime) {
  const auto helper = makeActive(4);
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().advance(20s);
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{1}));
  scheduler().advance(20s);
  EXPECT_EQ(counts.size(), 1u);
  scheduler().advance(11s);
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{1, 0}));
}

TEST_F(ConnectivityHelperTest, AnEverLastingHelperIsAlwaysInUseAndReturnsItsTransactions) {
  const auto helper = makeActive(4, 0);
  helper->ownerIncrementUsageCount();
  helper->incrementTotalSessionsServedCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{1}));
  EXPECT_EQ(owner->released, (std::vector<std::uint32_t>{1}));
  EXPECT_EQ(scheduler().pendingDeadlines(), 0u);
  const auto name = "ReportingSessionConnectivityHelper <" + identifier() + ">";
  EXPECT_EQ(logged(texts::kEverLasting, {name}), 1);
  EXPECT_EQ(logged(texts::kEverLastingRelease, {1, name}), 1);
}

TEST_F(ConnectivityHelperTest, ReleasingMoreOftenThanTakingStaysAtZero) {
  const auto helper = makeActive(4);
  helper->ownerDecrementUsageCountWithBlock(recordCount(), nullptr);
  scheduler().runUntilIdle();
  EXPECT_EQ(*helper->status().find("usageCount"), PropertyValue(0));
  scheduler().advance(31s);
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{0}));
}

TEST_F(ConnectivityHelperTest, TheReleaseTimeoutIsThirtySecondsUntilItIsSet) {
  const auto helper = make(4);
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_GE(scheduler().timeToNextDeadline().value(), 30s);
  helper->setReleaseTimeout(5);
  helper->ownerIncrementUsageCount();
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  EXPECT_LE(scheduler().timeToNextDeadline().value(), 5100ms);
}

TEST_F(ConnectivityHelperTest, AHelperThatGoesTellsItsOwner) {
  auto helper = make(4);
  helper->ownerDecrementUsageCountWithBlock(recordCount(), ownerQueue);
  scheduler().runUntilIdle();
  helper.reset();
  scheduler().runUntilIdle();
  EXPECT_EQ(counts, (std::vector<std::uint32_t>{0}));
  EXPECT_EQ(scheduler().pendingDeadlines(), 0u);
}

TEST_F(ConnectivityHelperTest, CleaningTheStorageFolderIsNotForForegroundPosts) {
  EXPECT_EQ(Helper::POSTRequestMode(), 4);
  EXPECT_EQ(Helper::GETRequestMode(), 8);
  Helper::cleanupStorageRootFolder();
  EXPECT_EQ(Helper::storageRootFolder(), "/tmp/velkstorage");
  const auto container = Helper::composeUniqueContainerURL();
  EXPECT_EQ(container.size(), std::string("/tmp/velkstorage/.velkdiag").size() + 36);
  EXPECT_NE(container, Helper::composeUniqueContainerURL());
}

}  // namespace
}  // namespace velk
