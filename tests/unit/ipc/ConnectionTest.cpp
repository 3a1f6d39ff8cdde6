#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "tests/unit/ipc/ConnectionFixture.h"

namespace velk {
namespace {

using namespace test;
using ipc::FrameKind;
using End = Connection::End;

constexpr std::uint32_t kQuickMethod = 5;
TEST_F(ConnectionTest, RunsCallsInTheOrderOfSending) {
  makeOpen();
  auto bytes = callBytes(1, 0, {});
  for (std::uint32_t method = 2; method <= 9; ++method) {
    const auto next = callBytes(method, 0, {});
    bytes.insert(bytes.end(), next.begin(), next.end());
  }
  peer->send(bytes);
  runUntil("call 9");
  EXPECT_EQ(events.size(), 9U);
}

TEST_F(ConnectionTest, ReadsNothingBeforeItIsResumed) {
  make(true);
  peer->send(callBytes(1, 0, {}));
  Event turned;
  loop.post([&] { turned.happen(); });
  ASSERT_TRUE(turned.wait());
  EXPECT_TRUE(events.empty());
  connection->resume();
  runUntil("call 1");
}

TEST_F(ConnectionTest, AnswersACall) {
  makeOpen();
  dispatch = [](IncomingCall& call) {
    call.reply.sendValues({call.arguments[0], 2});
    return Result<void>();
  };
  peer->send(callBytes(kMethod, 77, {"text"}));
  runUntil("call 2");
  const auto reply = peer->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->header.kind, FrameKind::reply);
  EXPECT_EQ(reply->header.serial, 77U);
  EXPECT_EQ(reply->body, PropertyValue(PropertyArray({"text", 2})));
}

TEST_F(ConnectionTest, SendsAnAnswerWhileTheNextCallOfTheBatchBlocks) {
  makeOpen();
  std::optional<RawPeer::Frame> received;
  dispatch = [&](IncomingCall& call) {
    if (call.method == kQuickMethod) {
      call.reply.sendValues({1});
    } else {
      received = peer->receive();
    }
    return Result<void>();
  };
  auto bytes = callBytes(kQuickMethod, 9, {});
  const auto blocking = callBytes(kMethod, 0, {});
  bytes.insert(bytes.end(), blocking.begin(), blocking.end());
  peer->send(bytes);
  runUntil("call 2");
  ASSERT_TRUE(received);
  EXPECT_EQ(received->header.serial, 9U);
}

TEST_F(ConnectionTest, AnswersWithAnErrorWhenTheReplyIsDropped) {
  makeOpen();
  peer->send(callBytes(kMethod, 5, {}));
  runUntil("call 2");
  const auto reply = peer->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->header.kind, FrameKind::errorReply);
  EXPECT_EQ((*reply->body.array())[1], PropertyValue(static_cast<int>(ConnectionError::dropped)));
}

TEST_F(ConnectionTest, FailsAReplyThatIsTooLargeAndStays) {
  makeOpen();
  dispatch = [](IncomingCall& call) {
    call.reply.sendValues({std::string(ipc::kMaximumFrameBytes, 'x')});
    return Result<void>();
  };
  peer->send(callBytes(kMethod, 5, {}));
  runUntil("call 2");
  const auto reply = peer->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->header.kind, FrameKind::errorReply);
  EXPECT_EQ((*reply->body.array())[1], PropertyValue(static_cast<int>(ConnectionError::tooLarge)));
  EXPECT_EQ(
      recorded.count(formatText(ipc::texts::kReplyNotSent,
                                {connection->description(), CborWriter::description(CborWriter::Fault::tooLarge)})),
      1);
  EXPECT_FALSE(connection->hasEnded());
}

TEST_F(ConnectionTest, RefusesACallAndStays) {
  makeOpen();
  dispatch = [](IncomingCall&) { return Result<void>(Failure(connectionError(ConnectionError::refused, "no"))); };
  peer->send(callBytes(kMethod, 5, {}));
  runUntil("call 2");
  EXPECT_EQ(peer->receive()->header.kind, FrameKind::errorReply);
  EXPECT_EQ(recorded.count(formatText(ipc::texts::kRefusedCall, {kMethod, connection->description(), "no"})), 1);
  // Text that is not UTF-8 costs this call alone.
  peer->send(frameBytes(FrameKind::call, 6, {0x82, 0x02, 0x61, 0xFF}));
  peer->send(callBytes(kMethod, 0, {}));
  runUntil("call 2");
  queue->runUntil([&] { return events.size() == 2; });
  const auto refused = peer->receive();
  EXPECT_EQ(refused->header.serial, 6U);
  EXPECT_EQ((*refused->body.array())[1], PropertyValue(static_cast<int>(ConnectionError::refused)));
}

TEST_F(ConnectionTest, LogsOnlySoManyRefusalsOfOnePeer) {
  makeOpen();
  dispatch = [](IncomingCall&) { return Result<void>(Failure(connectionError(ConnectionError::refused, "no"))); };
  for (int count = 0; count < 40; ++count) peer->send(callBytes(kMethod, 0, {}));
  queue->runUntil([&] { return events.size() == 40; });
  EXPECT_EQ(recorded.count(formatText(ipc::texts::kRefusedCall, {kMethod, connection->description(), "no"})), 16);
  EXPECT_EQ(recorded.count(formatText(ipc::texts::kFurtherRefusals, {connection->description()})), 1);
}

TEST_F(ConnectionTest, ClosesOnMalformedFramesWithOneLine) {
  auto version = callBytes(1, 0, {});
  version[4] = 9;
  expectBadFrame(version, "unknown protocol version");
  auto kind = callBytes(1, 0, {});
  kind[5] = 0;
  expectBadFrame(kind, "unknown kind of frame");
  auto large = callBytes(1, 0, {});
  large[3] = 1;
  expectBadFrame(large, "frame too large");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0x82, 0x01, 0x1C}), "not CBOR");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0xFF}), "not CBOR");
  expectBadFrame(frameBytes(FrameKind::call, 7, {0x82, 0x01, 0xFF}), "not CBOR");
  expectBadFrame(frameBytes(FrameKind::call, 0, {}), "body cut short");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0x01}), "body is no array");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0x81, 0x61, 'a'}), "number missing");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0x81, 0x01, 0x00}), "bytes after the body");
  std::vector<std::uint8_t> deep{0x82, 0x01};
  deep.resize(deep.size() + 40, 0x81);
  deep.push_back(0);
  expectBadFrame(frameBytes(FrameKind::call, 0, deep), "nested too deep");
  expectBadFrame(frameBytes(FrameKind::call, 0, {0x81, 0x01}, 1), "fewer descriptors than the frame says");
  expectBadFrame(frameBytes(FrameKind::reply, 12, {0x80}), "reply to no call");
  auto cut = callBytes(1, 0, {"text"});
  cut.pop_back();
  expectBadFrame(cut, "frame cut short", true);
}

TEST_F(ConnectionTest, RunsWhatCameBeforeAMalformedFrame) {
  makeOpen();
  auto bytes = callBytes(1, 0, {});
  bytes.resize(bytes.size() + ipc::kFrameHeaderBytes, 0xFF);
  peer->send(bytes);
  runUntil("invalidated");
  EXPECT_EQ(events, (std::vector<std::string>{"call 1", "invalidated"}));
}

TEST_F(ConnectionTest, RunsEverythingReceivedBeforeTheHangUp) {
  makeOpen();
  for (int count = 0; count < 600; ++count) peer->send(callBytes(1, 0, {}));
  peer->hangUp();
  runUntil("invalidated");
  EXPECT_EQ(events.size(), 602U);
  EXPECT_EQ(events[600], "interrupted");
  EXPECT_EQ(connection->end(), End::endOfFile);
  EXPECT_TRUE(closed.wait());
}

TEST_F(ConnectionTest, RunsEverythingReceivedAlthoughAnswersCanNoLongerBeSent) {
  makeOpen();
  dispatch = [](IncomingCall& call) {
    call.reply.sendValues({});
    return Result<void>();
  };
  for (int count = 0; count < 300; ++count) peer->send(callBytes(kMethod, 1, {}));
  peer->hangUp();
  runUntil("invalidated");
  EXPECT_EQ(events.size(), 302U);
}

TEST_F(ConnectionTest, ShowsAGoodbyeAsInvalidated) {
  makeOpen(false);
  peer->send(frameBytes(FrameKind::goodbye, 0, {}));
  runUntil("invalidated");
  EXPECT_EQ(events, std::vector<std::string>{"invalidated"});
  EXPECT_EQ(connection->end(), End::goodbye);
}

TEST_F(ConnectionTest, TellsOfThePeersDepartureBeforeWhatItLeftBehindHasRun) {
  for (const bool saysGoodbye : {true, false}) {
    events.clear();
    makeOpen();
    peer->send(callBytes(kMethod, 0, {}));
    if (saysGoodbye) peer->send(frameBytes(FrameKind::goodbye, 0, {}));
    if (!saysGoodbye) peer->hangUp();
    EXPECT_TRUE(departed.wait());
    EXPECT_TRUE(events.empty());
    runUntil("invalidated");
    EXPECT_EQ(events.front(), "call 2");
  }
}

TEST_F(ConnectionTest, ShowsABareEndOfFileToAClientAsInterruptedUntilItInvalidates) {
  makeOpen(false);
  peer->hangUp();
  runUntil("interrupted");
  EXPECT_TRUE(connection->hasEnded());
  EXPECT_EQ(connection->send(kMethod, 0, encodeNothing).error().code, static_cast<int>(ConnectionError::ended));
  connection->invalidate();
  connection->invalidate();
  runUntil("invalidated");
  EXPECT_EQ(events, (std::vector<std::string>{"interrupted", "invalidated"}));
}

TEST_F(ConnectionTest, ClosesAfterAnInterruptionToo) {
  makeOpen(false);
  peer->hangUp();
  runUntil("interrupted");
  connection->closeAfterSending();
  runUntil("invalidated");
}

TEST_F(ConnectionTest, InvalidateDiscardsLaterCallsAndDeliversTheReplyInProgress) {
  makeOpen();
  dispatch = [this](IncomingCall& call) {
    connection->invalidate();
    call.reply.sendValues({"last"});
    return Result<void>();
  };
  auto bytes = callBytes(kMethod, 1, {});
  const auto pipelined = callBytes(3, 2, {});
  bytes.insert(bytes.end(), pipelined.begin(), pipelined.end());
  peer->send(bytes);
  runUntil("invalidated");
  EXPECT_EQ(events, (std::vector<std::string>{"call 2", "invalidated"}));
  EXPECT_EQ(peer->receive()->body, PropertyValue(PropertyArray{"last"}));
  EXPECT_EQ(peer->receive()->header.kind, FrameKind::goodbye);
  EXPECT_FALSE(peer->receive());
  EXPECT_EQ(connection->end(), End::here);
}

TEST_F(ConnectionTest, ClosesBehindEverythingSent) {
  makeOpen(false);
  for (int count = 0; count < 100; ++count) ASSERT_TRUE(connection->callMethod(kMethod, {count}, {}));
  connection->closeAfterSending();
  EXPECT_FALSE(connection->callMethod(kMethod, {}, {}));
  for (int count = 0; count < 100; ++count) EXPECT_EQ((*peer->receive()->body.array())[1], PropertyValue(count));
  EXPECT_EQ(peer->receive()->header.kind, FrameKind::goodbye);
  EXPECT_FALSE(peer->receive());
  runUntil("invalidated");
  EXPECT_EQ(events.size(), 1U);
}

TEST_F(ConnectionTest, GivesUpOnAPeerThatDoesNotReadItsLastWords) {
  makeOpen();
  for (int count = 0; count < 3; ++count) {
    ASSERT_TRUE(connection->callMethod(kMethod, {std::string(500'000, 'x')}, {}));
  }
  connection->invalidate();
  runUntil("invalidated");
  EXPECT_TRUE(closed.wait());
}

TEST_F(ConnectionTest, HandsRepliesToTheirCallsInWhateverOrder) {
  makeOpen(false);
  std::vector<std::string> answers;
  for (const char* name : {"a", "b"}) {
    ASSERT_TRUE(connection->callMethod(kMethod, {name}, [&answers, name](Result<PropertyArray> result) {
      answers.push_back(std::string(name) + *(*result)[0].string());
    }));
  }
  const auto first = peer->receive();
  const auto second = peer->receive();
  const auto answer = [](const char* text) { return body(1, [&](CborWriter& writer) { writer.text(text); }); };
  peer->send(frameBytes(FrameKind::reply, second->header.serial, answer("2")));
  peer->send(frameBytes(FrameKind::reply, first->header.serial, answer("1")));
  queue->runUntil([&] { return answers.size() == 2; });
  EXPECT_EQ(answers, (std::vector<std::string>{"b2", "a1"}));
  // Nobody waits for it any more.
  peer->send(frameBytes(FrameKind::reply, first->header.serial, answer("1")));
  runUntil("invalidated");
}

TEST_F(ConnectionTest, FailsPendingRepliesOnceWhenThePeerHangsUp) {
  makeOpen(false);
  int failures = 0;
  for (int count = 0; count < 3; ++count) {
    ASSERT_TRUE(connection->callMethod(kMethod, {}, [&](Result<PropertyArray> result) {
      ASSERT_FALSE(result);
      EXPECT_EQ(result.error().code, static_cast<int>(ConnectionError::ended));
      ++failures;
    }));
  }
  const auto call = peer->receive();
  peer->send(frameBytes(FrameKind::errorReply, call->header.serial, body(3, [](CborWriter& writer) {
                          writer.text(kConnectionErrorDomain);
                          writer.integer(1);
                          writer.text("told");
                        })));
  peer->hangUp();
  runUntil("interrupted");
  EXPECT_EQ(failures, 3);
  connection->invalidate();
  runUntil("invalidated");
  EXPECT_EQ(failures, 3);
}

TEST_F(ConnectionTest, PassesDescriptorsBothWaysAndLeaksNone) {
  const auto before = openDescriptors();
  {
    makeOpen();
    int received = -1;
    dispatch = [&](IncomingCall& call) {
      EXPECT_EQ(call.descriptors.size(), 2U);
      received = call.descriptors[0].get();
      EXPECT_NE(::fcntl(received, F_GETFD) & FD_CLOEXEC, 0);
      return Result<void>();
    };
    std::vector<FileDescriptor> riders;
    riders.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    riders.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    auto bytes = callBytes(1, 0, {});
    bytes[6] = 2;
    peer->send(bytes, std::move(riders));
    runUntil("call 1");
    EXPECT_EQ(::fcntl(received, F_GETFD), -1);  // unclaimed: closed after the call

    std::vector<FileDescriptor> back;
    back.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(connection->callMethod(kMethod, {"before"}, {}));
    ASSERT_TRUE(connection->callMethod(kMethod, {}, {}, std::move(back)));
    ASSERT_TRUE(connection->callMethod(kMethod, {"after"}, {}));
    EXPECT_EQ(peer->receive()->header.descriptors, 0);
    EXPECT_EQ(peer->receive()->header.descriptors, 1);
    EXPECT_EQ(peer->receive()->header.descriptors, 0);
    EXPECT_EQ(peer->descriptors.size(), 1U);
    peer->descriptors.clear();

    // Descriptors that no frame claims end the connection, and are closed.
    dispatch = nullptr;
    std::vector<FileDescriptor> stray;
    stray.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    peer->send(callBytes(1, 0, {}), std::move(stray));
    runUntil("invalidated");
    EXPECT_EQ(connection->end(), End::badFrame);
    ASSERT_TRUE(closed.wait());
    connection.reset();
    peer.reset();
    loop.stop();
  }
  EXPECT_LE(openDescriptors(), before + 4);  // the loop's own
}

TEST_F(ConnectionTest, DropsHandlersWhenItHasEnded) {
  make(true);
  auto token = std::make_shared<int>(1);
  connection->setInterruptionHandler([token] {});
  connection->setExportedDispatcher(
      std::make_shared<FunctionDispatcher>([token](IncomingCall&) { return Result<void>(); }));
  connection->setInvalidationHandler([this, token] { events.push_back("invalidated"); });
  connection->resume();
  connection->invalidate();
  runUntil("invalidated");
  EXPECT_EQ(token.use_count(), 1);
}

TEST_F(ConnectionTest, NamesNothingThatThePeerChose) {
  make(true);
  EXPECT_NE(connection->description().find(" pid 345 uid 1000>"), std::string::npos);
  EXPECT_EQ(connection->description().find("<connection "), 0U);
}

TEST_F(ConnectionTest, IsInertInAForkedChild) {
  makeOpen(false);
  ASSERT_TRUE(connection->callMethod(kMethod, {}, {}));
  ASSERT_TRUE(peer->receive());
  const pid_t child = ::fork();
  if (child == 0) {
    const auto sent = connection->callMethod(kMethod, {}, {});
    connection->invalidate();
    connection->closeAfterSending();
    connection.reset();
    ::_exit(!sent && sent.error().code == static_cast<int>(ConnectionError::forked) ? 0 : 1);
  }
  int status = 1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  ASSERT_TRUE(connection->callMethod(kMethod, {"parent"}, {}));
  EXPECT_EQ((*peer->receive()->body.array())[1], PropertyValue("parent"));
}

TEST_F(ConnectionTest, FailsToConnectWhereNobodyListens) {
  const auto result = Connection::connect("/nonexistent/socket", loop, queue);
  ASSERT_FALSE(result);
  EXPECT_EQ(result.error().code, static_cast<int>(ConnectionError::notConnected));
}

}  // namespace
}  // namespace velk
