// A machine without a network, and the network that comes and goes. Root only.
#pragma once

#include <functional>

namespace velk::test {

/// Runs `body` on a thread in a network namespace of its own, without any address. Threads and processes that it starts
/// are in it as well. False where the system does not allow that.
[[nodiscard]] bool runInEmptyNetworkNamespace(const std::function<void()>& body);

// For that thread.
/// Brings the loopback addresses up.
void startLoopback();
/// Gives the machine TlsTestServer::kOtherAddress, its one address that is none of loopback.
void connectNetwork();
/// Takes it away again.
void disconnectNetwork();

}  // namespace velk::test
