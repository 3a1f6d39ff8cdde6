// What becomes of a flush, and of the backend, when the server answers or the transport does not.
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

class AnswerTest : public BackendTest {
 protected:
  std::shared_ptr<HTTPSPostBackend> flushing(FlushOutcome& outcome) {
    auto backend = makeBatching(openEntry());
    sendMany(*backend, 1);
    text = backend->flushMessagesWithCompletion(outcome.completion());
    return backend;
  }
  std::optional<std::string> text;
};

TEST_F(AnswerTest, DisablesTheBackendFrom500To599) {
  for (const int status : {500, 503, 599}) {
    auto backend = makeConfigured(openEntry());
    send(*backend, {{"n", 1}});
    transport->answer(transport->count() - 1, status);
    EXPECT_EQ(backend->state(), kBackendDisabled);
    EXPECT_EQ(log.count(formatText("postJSONMessage: backend korrin disabled by server %d return code", {status})), 1);
  }
  for (const int status : {200, 304, 404, 499, 600}) {
    auto backend = makeConfigured(openEntry());
    send(*backend, {{"n", 1}});
    transport->answer(transport->count() - 1, status);
    EXPECT_EQ(backend->state(), kBackendEnabled);
  }
}

TEST_F(AnswerTest, CompletesAFlushWithItsText) {
  FlushOutcome outcome;
  auto backend = flushing(outcome);
  EXPECT_EQ(outcome.calls, 0);
  transport->answer(0, 404);
  EXPECT_EQ(outcome.calls, 1);
  ASSERT_TRUE(text);
  EXPECT_EQ(outcome.text, text);
  EXPECT_EQ(outcome.error, std::nullopt);
  EXPECT_EQ(log.count("HTTPSPostBackend(flushMessagesWithCompletion): called"), 1);
}

TEST_F(AnswerTest, CompletesAFlushWithTheServersRefusal) {
  FlushOutcome outcome;
  auto backend = flushing(outcome);
  transport->answer(0, 503);
  EXPECT_EQ(outcome.text, text);
  EXPECT_EQ(outcome.error,
            (Error{"VelkReportingErrorDomain", 503, "backend korrin disabled by server 503 return code"}));
}

TEST_F(AnswerTest, CompletesAFlushWithTheTransportsError) {
  FlushOutcome outcome;
  auto backend = flushing(outcome);
  const Error error{"http", 7, "no route"};
  transport->fail(0, error);
  EXPECT_EQ(outcome.error, error);
  EXPECT_EQ(log.count(log::Level::error, "HTTPSPostBackend(postJsonMessage): post error: no route"), 1);
  EXPECT_EQ(backend->state(), kBackendEnabled);
}

TEST_F(AnswerTest, AbandonsAFlushThatTheTransportDrops) {
  FlushOutcome outcome;
  auto backend = flushing(outcome);
  EXPECT_FALSE(outcome.abandoned);
  transport->drop(0);
  EXPECT_TRUE(outcome.abandoned);
  EXPECT_EQ(outcome.calls, 0);
}

TEST_F(AnswerTest, AbandonsAFlushWithoutTransport) {
  FlushOutcome outcome;
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 1);
  transport.reset();
  EXPECT_FALSE(backend->flushMessagesWithCompletion(outcome.completion()));
  EXPECT_TRUE(outcome.abandoned);
  EXPECT_EQ(outcome.calls, 0);
}

TEST_F(AnswerTest, AnswersAfterTheBackendHasGone) {
  FlushOutcome outcome;
  auto backend = flushing(outcome);
  std::weak_ptr<HTTPSPostBackend> weak = backend;
  backend.reset();
  EXPECT_TRUE(weak.expired());
  transport->answer(0, 503);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(outcome.error->code, 503);
}

TEST_F(AnswerTest, HasNothingToFlushWithoutBatch) {
  FlushOutcome outcome;
  auto backend = makeBatching(openEntry());
  EXPECT_EQ(backend->flushMessagesWithCompletion(outcome.completion()), std::nullopt);
  EXPECT_EQ(outcome.calls, 1);
  EXPECT_EQ(outcome.error, (Error{"VelkReportingErrorDomain", -1, "Nothing to flush"}));
}

TEST_F(AnswerTest, DropsWhatTheListsDoNotLetPass) {
  FlushOutcome outcome;
  auto entry = openEntry();
  entry.set("event_whitelist", PropertyArray{7, 8});
  entry.set("event_blacklist", PropertyArray{8});
  auto backend = makeBatching(entry);
  for (const std::uint16_t method : {6, 7, 8}) sendMany(*backend, 1, method);
  backend->flushMessagesWithCompletion(outcome.completion());
  EXPECT_EQ(eventsOf(lastRequest()).size(), 1U);
  EXPECT_EQ(
      log.count(
          "flushMessagesWithCompletion: Dropping event with category 6 as it is not whitelisted for backend korrin"),
      1);
  EXPECT_EQ(
      log.count("flushMessagesWithCompletion: Dropping event with category 8 as it is blacklisted for backend korrin"),
      1);
}

TEST_F(AnswerTest, DiscardsABatchThatTheListsEmptied) {
  FlushOutcome outcome;
  auto backend = makeBatching(with(openEntry(), "event_blacklist", PropertyArray{7}));
  sendMany(*backend, 3);
  EXPECT_EQ(backend->flushMessagesWithCompletion(outcome.completion()), std::nullopt);
  EXPECT_EQ(outcome.error,
            (Error{"VelkReportingErrorDomain", -1, "Nothing to flush: batched events were completely filtered out"}));
  EXPECT_EQ(backend->batchedEventsSize(), 0U);
  backend->flushMessagesWithCompletion(outcome.completion());
  EXPECT_EQ(outcome.error->description, "Nothing to flush");
}

}  // namespace
}  // namespace velk::test
