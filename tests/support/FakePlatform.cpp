#include "tests/support/FakePlatform.h"

#include "platform/Files.h"

namespace velk::test {

Result<void> FakeLogSubmission::createSubmittableLog(const std::string& path, const std::string& logType) {
  {
    Guard guard(_lock);
    _created.push_back({path, logType});
  }
  return creates ? files::createEmpty(path) : Result<void>();
}

bool FakeLogSubmission::moveForSubmission(const std::string& path, const std::string& logType) {
  if (!accepts || !files::remove(path)) return false;
  Guard guard(_lock);
  _moved.push_back({path, logType});
  return true;
}

std::vector<FakeLogSubmission::Entry> FakeLogSubmission::created() const {
  Guard guard(_lock);
  return _created;
}

std::vector<FakeLogSubmission::Entry> FakeLogSubmission::moved() const {
  Guard guard(_lock);
  return _moved;
}

FakePlatform::FakePlatform() = default;
FakePlatform::~FakePlatform() = default;

Platform FakePlatform::platform() {
  Platform platform{clock(), scheduler, defaults, device,  locale,       _http,
                    random,  keepAlive, consent,  process, logSubmission};
  platform.udpSockets = &udpSockets;
  return platform;
}

std::shared_ptr<HttpSession> FakePlatform::ForwardingHttpService::makeSession(
    HttpSessionConfiguration configuration, std::shared_ptr<HttpSessionDelegate> delegate,
    std::shared_ptr<Queue> delegateQueue) {
  HttpSessionService* current = service;
  if (current == nullptr) return nullptr;
  return current->makeSession(std::move(configuration), std::move(delegate), std::move(delegateQueue));
}

}  // namespace velk::test
