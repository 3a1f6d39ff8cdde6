// A connection under test, for the tests of its calls and ends and for those of its bounds.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ipc/LogTexts.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/ipc/WireHarness.h"

namespace velk::test {

inline constexpr std::uint32_t kMethod = 2;

/// One real connection, whose frames run when the test says so, and a bare socket at the other end.
class ConnectionTest : public testing::Test {
 protected:
  ~ConnectionTest() override {
    connection.reset();
    loop.stop();
    queue->dropTasks();
  }

  void make(bool accepted) {
    auto ends = makeLocalSocketPair();
    peer.emplace(std::move(ends->second));
    connection = Connection::adopt(std::move(ends->first), self(), accepted, loop, queue, [this] { closed.happen(); });
    connection->setInterruptionHandler([this] { events.push_back("interrupted"); });
    connection->setInvalidationHandler([this] { events.push_back("invalidated"); });
    connection->setDepartureHandler([this] { departed.happen(); });
    connection->setExportedDispatcher(std::make_shared<FunctionDispatcher>([this](IncomingCall& call) {
      events.push_back("call " + std::to_string(call.method));
      return dispatch ? dispatch(call) : Result<void>();
    }));
  }
  void makeOpen(bool accepted = true) {
    make(accepted);
    connection->resume();
  }
  void runUntil(const std::string& event) {
    queue->runUntil([&] { return !events.empty() && events.back() == event; });
  }
  [[nodiscard]] std::string refusalText(const char* reason) const {
    return formatText(ipc::texts::kBadFrame, {connection->description(), reason});
  }
  /// Sends bytes that must end the accepted connection for this reason.
  void expectBadFrame(const std::vector<std::uint8_t>& bytes, const char* reason, bool thenHangUp = false) {
    events.clear();
    makeOpen();
    peer->send(bytes);
    if (thenHangUp) peer->hangUp();
    runUntil("invalidated");
    EXPECT_EQ(connection->end(), Connection::End::badFrame);
    EXPECT_EQ(recorded.count(log::Level::error, refusalText(reason)), 1) << reason;
    EXPECT_TRUE(closed.wait());
    recorded.clear();
  }

  RecordingLog recorded;
  EventLoop loop{"test-io"};
  std::shared_ptr<HandQueue> queue = std::make_shared<HandQueue>();
  Event closed;
  Event departed;
  std::vector<std::string> events;
  std::function<Result<void>(IncomingCall&)> dispatch;
  std::optional<RawPeer> peer;
  std::shared_ptr<Connection> connection;
};

}  // namespace velk::test
