#include <sys/stat.h>

#include "platform/Files.h"
#include "tests/unit/connectivity/HelperFixture.h"

namespace velk {
namespace {

using namespace std::chrono_literals;

class HelperRequestsTest : public ConnectivityHelperTest {};

TEST_F(HelperRequestsTest, APostRunsAsADataTask) {
  const auto helper = makeActive(4);
  auto post = request("https://example.net/events");
  post.method = "POST";
  post.body = std::make_shared<const std::string>("{}");
  Answer answer;
  helper->postURLRequestWithCompletionHandler(post, answer.completion());
  EXPECT_TRUE(http.startedTasks().empty());
  scheduler().runUntilIdle();
  ASSERT_EQ(http.startedTasks().size(), 1u);
  EXPECT_EQ(lastTask()->request().body, post.body);
  EXPECT_EQ(*helper->status().find("runningTasks"), PropertyValue(1));
  const auto task = lastTask()->taskDescription();
  EXPECT_EQ(task.substr(0, 5), "Task_");
  EXPECT_EQ(task.size(), 13u);
  EXPECT_EQ(logged("ConnectivityHelperTask with ID <%@> created", {task}), 1);
  EXPECT_EQ(logged("createHelperForTask: created helperTask for task <%@>", {task}), 1);

  lastTask()->reportBodyDataSent(2, 2);
  lastTask()->announceResponse({.statusCode = 200});
  lastTask()->deliverData("he");
  lastTask()->deliverData("llo");
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 0);
  lastTask()->complete();
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text(), "hello");
  EXPECT_EQ(answer.response->statusCode, 200);
  EXPECT_FALSE(answer.error);
  EXPECT_EQ(*helper->status().find("runningTasks"), PropertyValue(0));
  EXPECT_EQ(
      logged("didSendBodyData: for <session>:<task> <%@>:<%@>: Sent %lld out of %lld", {identifier(), task, 2, 2}), 1);
  EXPECT_EQ(logged("didReceiveResponse: for <session>:<task> <%@>:<%@>", {identifier(), task}), 1);
  EXPECT_EQ(logged("didReceiveData: received %d bytes for <session>:<task> <%@>:<%@>", {3, identifier(), task}), 1);
  EXPECT_EQ(logged("didCompleteWithError: for <session>:<task> <%@>:<%@> with response %@, error %@",
                   {identifier(), task, "status 200", nullptr}),
            1);
  EXPECT_EQ(logged("ConnectivityHelperTask with ID <%@> dealloced", {task}), 1);
}

TEST_F(HelperRequestsTest, TasksAreNumberedAcrossHelpers) {
  const auto first = makeActive(4);
  first->postURLRequestWithCompletionHandler(request(), nullptr);
  scheduler().runUntilIdle();
  const auto one = std::stoul(lastTask()->taskDescription().substr(5), nullptr, 16);
  const auto second = makeActive(4);
  second->postURLRequestWithCompletionHandler(request(), nullptr);
  scheduler().runUntilIdle();
  EXPECT_EQ(std::stoul(lastTask()->taskDescription().substr(5), nullptr, 16), one + 1);
  for (const auto& task : http.startedTasks()) task->respond(200);
}

TEST_F(HelperRequestsTest, ANetworkFailureReachesTheRequester) {
  const auto helper = makeActive(4);
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  scheduler().runUntilIdle();
  lastTask()->fail(7, "refused");
  scheduler().runUntilIdle();
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->code, 7);
  EXPECT_EQ(answer.response, nullptr);
}

TEST_F(HelperRequestsTest, APostOnAnInactiveHelperIsDroppedSilently) {
  const auto helper = make(4);
  log.clear();
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 0);
  EXPECT_EQ(answer.abandoned, 1);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(HelperRequestsTest, APostInAModeForPullsIsAnErrorWithoutCompletion) {
  const auto helper = makeActive(8);
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 0);
  EXPECT_EQ(answer.abandoned, 1);
  EXPECT_TRUE(http.startedTasks().empty());
  EXPECT_EQ(loggedError("postURLRequestWithCompletionHandler: wrong mode for POST operation detected %d", {8}), 1);
}

TEST_F(HelperRequestsTest, APostOnASessionThatWasInvalidatedIsDroppedWithALine) {
  const auto helper = makeActive(4);
  http.failTaskCreation(Error{kHttpErrorDomain, kHttpSessionInvalidatedCode, "gone"});
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.abandoned, 1);
  EXPECT_EQ(loggedError(texts::kPostSessionInvalidated, {"gone"}), 1);
}

TEST_F(HelperRequestsTest, APostToAnAddressThatCannotBeUsedFailsWithTheTransportsError) {
  const auto helper = makeActive(4);
  http.failTaskCreation(Error{kHttpErrorDomain, 3, "host: the address is malformed"});
  log.clear();
  Answer answer;
  helper->postURLRequestWithCompletionHandler(request(), answer.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.abandoned, 0);
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->description, "host: the address is malformed");
  EXPECT_EQ(answer.response, nullptr);
  EXPECT_FALSE(log.contains("invalidated"));
}

TEST_F(HelperRequestsTest, AFileBackedPostSendsTheFileAndRemovesIt) {
  ASSERT_TRUE(files::createDirectories(Helper::storageRootFolder()));
  const auto helper = makeActive(1);
  const auto before = files::list(Helper::storageRootFolder()).value();
  auto post = request();
  post.body = std::make_shared<const std::string>("from a file");
  Answer answer;
  helper->postURLRequestWithCompletionHandler(post, answer.completion());
  scheduler().runUntilIdle();
  ASSERT_EQ(http.startedTasks().size(), 1u);
  EXPECT_EQ(lastTask()->body(), "from a file");
  EXPECT_EQ(files::list(Helper::storageRootFolder()).value(), before);
  lastTask()->respond(200);
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 1);
}

TEST_F(HelperRequestsTest, AnUrgentPullStartsAtOnce) {
  const auto helper = makeActive(8);
  Answer answer;
  helper->getURLRequestWithCompletionHandler(request(), true, answer.completion());
  scheduler().runUntilIdle();
  ASSERT_EQ(http.startedTasks().size(), 1u);
  EXPECT_EQ(logged(texts::kGetUrgent, {"https://example.net/bag"}), 1);
  EXPECT_TRUE(fakes.random.bounds().empty());
  EXPECT_TRUE(lastTask()->request().isUrgent);
  lastTask()->respond(200, "bag");
  scheduler().runUntilIdle();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text(), "bag");
  EXPECT_EQ(logged(texts::kGetCompleted, {"https://example.net/bag", nullptr}), 1);
}

TEST_F(HelperRequestsTest, APullThatIsNotUrgentWaitsARandomWholeNumberOfSeconds) {
  const auto helper = makeActive(8);
  fakes.random.push(7199);
  const auto now = fakes.clock().wallTime().seconds;
  EXPECT_EQ(helper->getURLRequestWithCompletionHandler(request(), false, nullptr), 7199u);
  scheduler().runUntilIdle();
  EXPECT_EQ(fakes.random.bounds(), (std::vector<std::uint32_t>{7200}));
  EXPECT_EQ(logged(texts::kGetDelayed, {"https://example.net/bag", 7199, now, now + 7199}), 1);
  scheduler().advance(7198s);
  EXPECT_TRUE(http.startedTasks().empty());
  scheduler().advance(1s);
  ASSERT_EQ(http.startedTasks().size(), 1u);
  EXPECT_FALSE(lastTask()->request().isUrgent);
  lastTask()->respond(304);
}

TEST_F(HelperRequestsTest, APullWithAGivenDelayWaitsThatLong) {
  const auto helper = makeActive(8);
  const auto now = fakes.clock().wallTime().seconds;
  EXPECT_EQ(helper->getURLRequestWithCompletionHandler(request(), false, nullptr, 40), 40u);
  EXPECT_EQ(helper->getURLRequestWithCompletionHandler(request(), false, nullptr, 50), std::nullopt);
  EXPECT_EQ(helper->getURLRequestWithCompletionHandler(request("https://a/"), false, nullptr, 0), 0u);
  scheduler().advance(0s);
  EXPECT_EQ(http.startedTasks().size(), 1u);
  EXPECT_TRUE(fakes.random.bounds().empty());
  EXPECT_EQ(logged(texts::kGetDelayed, {"https://example.net/bag", 40, now, now + 40}), 1);
  scheduler().advance(40s);
  ASSERT_EQ(http.startedTasks().size(), 2u);
  for (const auto& task : http.startedTasks()) task->respond(304);
}

TEST_F(HelperRequestsTest, ASecondPullOfAnAddressIsIgnored) {
  const auto helper = makeActive(8);
  Answer first;
  Answer pending;
  Answer finished;
  helper->getURLRequestWithCompletionHandler(request(), true, first.completion());
  helper->getURLRequestWithCompletionHandler(request(), true, pending.completion());
  EXPECT_EQ(pending.abandoned, 1);
  scheduler().runUntilIdle();
  lastTask()->respond(200);
  scheduler().runUntilIdle();
  EXPECT_EQ(first.calls, 1);
  helper->getURLRequestWithCompletionHandler(request(), true, finished.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(finished.calls + pending.calls, 0);
  EXPECT_EQ(finished.abandoned, 1);
  EXPECT_EQ(http.startedTasks().size(), 1u);
  EXPECT_EQ(logged(texts::kGetDuplicate, {"https://example.net/bag"}), 2);
}

TEST_F(HelperRequestsTest, ADelayedPullBlocksAnUrgentOne) {
  const auto helper = makeActive(8);
  fakes.random.push(100);
  Answer urgent;
  helper->getURLRequestWithCompletionHandler(request(), false, nullptr);
  helper->getURLRequestWithCompletionHandler(request(), true, urgent.completion());
  scheduler().runUntilIdle();
  EXPECT_TRUE(http.startedTasks().empty());
  EXPECT_EQ(urgent.abandoned, 1);
  scheduler().advance(100s);
  lastTask()->respond(200);
}

TEST_F(HelperRequestsTest, OtherAddressesAndOtherHelpersAreNotBlocked) {
  const auto first = makeActive(8);
  const auto second = makeActive(8);
  first->getURLRequestWithCompletionHandler(request(), true, nullptr);
  first->getURLRequestWithCompletionHandler(request("https://example.net/other"), true, nullptr);
  second->getURLRequestWithCompletionHandler(request(), true, nullptr);
  scheduler().runUntilIdle();
  EXPECT_EQ(http.startedTasks().size(), 3u);
  for (const auto& task : http.startedTasks()) task->respond(200);
}

TEST_F(HelperRequestsTest, APullOnAnInactiveHelperFails) {
  const auto helper = make(8);
  Answer answer;
  helper->getURLRequestWithCompletionHandler(request(), true, answer.completion());
  scheduler().runUntilIdle();
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->domain, "VelkReportingErrorDomain");
  EXPECT_EQ(answer.error->code, -1);
  EXPECT_EQ(answer.error->description, "ConnectivityHelper is not ative");
  EXPECT_EQ(logged(texts::kGetCancelledInactive, {"https://example.net/bag"}), 1);
}

TEST_F(HelperRequestsTest, APullInAModeForPostsFailsWithTheModeAsCode) {
  const auto helper = makeActive(4);
  Answer answer;
  helper->getURLRequestWithCompletionHandler(request(), true, answer.completion());
  EXPECT_EQ(answer.calls, 1);
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->code, 4);
  EXPECT_EQ(answer.error->description, "getURLRequestWithCompletionHandler: unrecognized mode");
  EXPECT_EQ(loggedError("getURLRequestWithCompletionHandler: wrong mode for GET operation detected %d", {4}), 1);
}

TEST_F(HelperRequestsTest, APullWithoutATaskFails) {
  const auto helper = makeActive(8);
  Answer refused;
  Answer missing;
  http.failTaskCreation(Error{"d", 1, "gone"});
  helper->getURLRequestWithCompletionHandler(request("https://a/"), true, refused.completion());
  scheduler().runUntilIdle();
  EXPECT_EQ(logged(texts::kGetSessionInvalidated, {"gone"}), 1);
  EXPECT_EQ(logged(texts::kGetCancelledNoTask, {"https://a/"}), 1);
  http.failTaskCreation(std::nullopt);
  http.makeNoTasks(true);
  helper->getURLRequestWithCompletionHandler(request("https://b/"), true, missing.completion());
  scheduler().runUntilIdle();
  for (const auto* answer : {&refused, &missing}) {
    ASSERT_TRUE(answer->error);
    EXPECT_EQ(answer->error->code, -1);
    EXPECT_EQ(answer->error->description, "getURLRequestWithCompletionHandler: unable to create data task");
  }
}

TEST_F(HelperRequestsTest, ADelayedPullThatIsDroppedWakesItsWaiter) {
  Answer answer;
  {
    test::FakePlatform other;
    other.setHttpSessionService(&http);
    const auto helper = Helper::initWithDelegate(other.platform(), owner, 8, {});
    helper->getURLRequestWithCompletionHandler(request(), false, answer.completion());
  }
  EXPECT_EQ(answer.calls, 0);
  EXPECT_EQ(answer.abandoned, 1);
}

TEST_F(HelperRequestsTest, BecomingADownloadIsAnError) {
  const auto helper = makeActive(4);
  helper->postURLRequestWithCompletionHandler(request(), nullptr);
  scheduler().runUntilIdle();
  lastTask()->becomeDownloadTask();
  lastTask()->respond(200);
  scheduler().runUntilIdle();
  EXPECT_EQ(loggedError("didBecomeDownloadTask: session <%@> has become downoad task. SHOULD NEVER HAPPEN!!!",
                        {identifier()}),
            1);
}

}  // namespace
}  // namespace velk
