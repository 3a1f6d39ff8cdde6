// An agent over fakes, with sessions made by hand.
#pragma once

#include <memory>
#include <thread>
#include <vector>

#include "daemon/ReportingdAgent.h"
#include "tests/unit/daemon/FakeIncomingConnection.h"
#include "tests/unit/daemon/FakeReportingdSession.h"
#include "tests/unit/daemon/StorebagFixture.h"

namespace velk::test {

class AgentFixture : public StorebagFixture {
 protected:
  // An open connection, its handlers and its session hold each other until it ends.
  ~AgentFixture() override {
    for (const auto& connection : connections) connection->end();
  }

  /// A session that came in over a connection.
  std::shared_ptr<FakeIncomingConnection> connect(std::set<std::string, std::less<>> entitlements = {
                                                      std::string(kServiceEntitlement)}) {
    auto connection = std::make_shared<FakeIncomingConnection>(std::move(entitlements));
    accepted = agent->shouldAcceptNewConnection(connection);
    connections.push_back(connection);
    return connection;
  }
  /// A session that the agent made for no connection.
  std::shared_ptr<FakeReportingdSession> create() {
    static_cast<void>(agent->createReportingSessionWithDelegate(*agent, nullptr));
    return made.back();
  }
  /// One that has told its client type.
  std::shared_ptr<FakeReportingdSession> configured(std::int64_t clientType, bool& limitReached) {
    auto session = create();
    session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, clientType}};
    limitReached = agent->isActiveClientLimitReachedForSession(*session, *session->info);
    return session;
  }
  /// Returns when every departure that has been heard of has been dealt with: they go in order, and this one shows.
  void settleDepartures() {
    constexpr std::int32_t kTypeOfNobodyElse = 29;
    const auto last = connect();
    const auto session = made.back();
    session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, kTypeOfNobodyElse}};
    static_cast<void>(agent->isActiveClientLimitReachedForSession(*session, *session->info));
    last->depart();
    while (activeClients(kTypeOfNobodyElse) != 0) std::this_thread::yield();
    last->end();
  }
  [[nodiscard]] std::size_t sessionCount() { return agent->copyReportingAgentState().sessions.size(); }
  [[nodiscard]] std::int64_t keepAliveCount() { return integerValue(agent->copyStatus().find("keepAliveCount")); }
  [[nodiscard]] std::int64_t activeClients(std::int32_t clientType) {
    const auto status = agent->copyStatus();
    return integerValue(status.dictionary("activeClients")->find(std::to_string(clientType)));
  }

  bool accepted = false;
  std::vector<std::shared_ptr<FakeIncomingConnection>> connections;
  std::vector<std::shared_ptr<FakeReportingdSession>> made;
  const std::shared_ptr<ReportingdAgent> agent = ReportingdAgent::make(
      platform(), service, [this](ReportingdSessionDelegate&, std::shared_ptr<SessionConnection> connection) {
        made.push_back(std::make_shared<FakeReportingdSession>(std::move(connection)));
        return made.back();
      });
};

}  // namespace velk::test
