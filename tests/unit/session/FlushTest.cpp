#include <thread>

#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class FlushTest : public SessionTest {
 protected:
  void flush() { session->flushMessagesWithCompletion(recordInto(answer)); }
  void finish(const std::string& name, std::optional<std::string> text, std::optional<Error> error = std::nullopt) {
    auto completion = std::move(backend(name).flushes.back());
    backend(name).flushes.clear();
    completion(std::move(text), std::move(error));
    fakes.scheduler.runUntilIdle();
  }
  static Error refusal() { return Error{std::string(kVelkReportingErrorDomain), 503, "refused"}; }

  FlushAnswer answer;
};

TEST_F(FlushTest, FailsWithoutBackends) {
  describe();
  flush();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.text.has_value());
  EXPECT_EQ(answer.error, (Error{"VelkReportingErrorDomain", -1, "No backends available to send message"}));
  EXPECT_EQ(recordedLog.count("flushMessagesWithCompletion: Flushing messages for session 7"), 1);
  EXPECT_EQ(recordedLog.count("internalFlushMessagesWithCompletion: No backends available to send message"), 1);
}

TEST_F(FlushTest, FailsWhenTheStorebagNamedNoBackends) {
  start({});
  flush();
  EXPECT_EQ(answer.error, (Error{"VelkReportingErrorDomain", -1, "No backends available to send message"}));
}

TEST_F(FlushTest, LastResultAnswers) {
  start({"splunk", "korrin", "qrs"});
  flush();
  finish("korrin", "1");
  finish("splunk", "2");
  EXPECT_EQ(answer.calls, 0);
  finish("qrs", "3");
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text, "3");
  EXPECT_FALSE(answer.error.has_value());
}

TEST_F(FlushTest, FirstErrorAnswersAtOnceAndLaterResultsAreOnlyLogged) {
  start({"splunk", "korrin", "qrs"});
  flush();
  finish("splunk", "1");
  finish("korrin", std::nullopt, refusal());
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, refusal());
  finish("qrs", "3", refusal());
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.dropped, 0);
  EXPECT_EQ(messageLog.journal.entries(),
            (std::vector<std::string>{"[splunk -> flushMessages] 1", "[qrs -> flushMessages] 3"}));
  for (const auto* name : {"splunk", "korrin", "qrs"}) {
    EXPECT_EQ(recordedLog.count(std::string("internalFlushMessagesWithCompletion: ") + name), 1);
  }
}

TEST_F(FlushTest, DroppedCompletionDoesNotLeaveTheReplyUnanswered) {
  start({"splunk", "korrin"});
  flush();
  backend("splunk").flushes.clear();
  EXPECT_EQ(answer.dropped, 0);
  finish("korrin", "text");
  EXPECT_EQ(answer.calls, 0);
  EXPECT_EQ(answer.dropped, 1);
}

TEST_F(FlushTest, ErrorStillAnswersAfterADroppedCompletion) {
  start({"splunk", "korrin"});
  flush();
  backend("splunk").flushes.clear();
  finish("korrin", std::nullopt, refusal());
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.dropped, 0);
}

TEST_F(FlushTest, TextIsWrittenOnAQueueOfItsOwnAndBeforeTheAnswer) {
  start({"splunk"});
  flush();
  auto completion = std::move(backend("splunk").flushes.back());
  completion("text", std::nullopt);
  EXPECT_TRUE(messageLog.journal.entries().empty()) << "the transport's queue is kept waiting for the disk";
  EXPECT_EQ(answer.calls, 0);
  session->teardown();
  session.reset();
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(messageLog.journal.count("[splunk -> flushMessages] text"), 1);
  EXPECT_EQ(answer.text, "text");
}

TEST_F(FlushTest, ResultWithoutTextAnswersAtOnceUnlessOthersAreBeingWritten) {
  start({"splunk", "korrin"});
  flush();
  FlushAnswer second;
  session->flushMessagesWithCompletion(recordInto(second));
  for (auto* name : {"splunk", "korrin"}) backend(name).flushes[0](std::nullopt, std::nullopt);
  EXPECT_EQ(answer.calls, 1);
  backend("splunk").flushes[1]("text", std::nullopt);
  backend("korrin").flushes[1](std::nullopt, std::nullopt);
  EXPECT_EQ(second.calls, 0);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(second.calls, 1);
  EXPECT_FALSE(second.text.has_value());
}

TEST_F(FlushTest, FlushesDoNotAnswerEachOther) {
  start({"splunk"});
  FlushAnswer second;
  flush();
  auto first = std::move(backend("splunk").flushes[0]);
  session->flushMessagesWithCompletion(recordInto(second));
  backend("splunk").flushes[1]("second", std::nullopt);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(answer.calls, 0);
  EXPECT_EQ(second.text, "second");
  first("first", std::nullopt);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(answer.text, "first");
}

TEST_F(FlushTest, CompletionsDoNotKeepTheSession) {
  start({"splunk"});
  flush();
  const std::weak_ptr<ReportingdSession> weak = session;
  session.reset();
  EXPECT_TRUE(weak.expired());
  finish("splunk", "text");
  EXPECT_EQ(answer.text, "text");
}

TEST_F(FlushTest, AnswersOnceWhenBackendsFinishTogether) {
  const std::vector<std::string> names{"splunk", "korrin", "qrs", "quill"};
  for (int round = 0; round < 50; ++round) {
    made.clear();
    session = makeSession(connection);
    start(names);
    answer = {};
    flush();
    std::vector<std::thread> finishers;
    for (const auto& name : names) {
      finishers.emplace_back([completion = std::move(backend(name).flushes.back()), round]() mutable {
        completion("text", round % 2 == 0 ? std::optional<Error>() : std::optional<Error>(refusal()));
      });
    }
    for (auto& finisher : finishers) finisher.join();
    fakes.scheduler.runUntilIdle();
    EXPECT_EQ(answer.calls, 1);
  }
}

}  // namespace
}  // namespace velk::test
