#include "tests/unit/session/SessionFixture.h"

#include <algorithm>

#include "foundation/Format.h"

namespace velk::test {

void Journal::note(std::string entry) {
  Guard guard(_lock);
  _entries.push_back(std::move(entry));
}

std::vector<std::string> Journal::entries() const {
  Guard guard(_lock);
  return _entries;
}

int Journal::count(std::string_view entry) const {
  const auto all = entries();
  return static_cast<int>(std::count(all.begin(), all.end(), entry));
}

void Journal::clear() {
  Guard guard(_lock);
  _entries.clear();
}

Result<void> FakeConnection::sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                                 std::uint16_t category, std::uint16_t type,
                                                 const std::optional<PropertyDictionary>& payload) {
  if (full) return failure("ipc", 1, "outbox full");
  Guard guard(_lock);
  _calls.push_back(Call{sessionInfo, timestamp, category, type, payload});
  return {};
}

std::vector<FakeConnection::Call> FakeConnection::calls() const {
  Guard guard(_lock);
  return _calls;
}

FakeBackend::FakeBackend(const BackendContext& context, std::string name, PropertyValue profile,
                         std::optional<std::string> productFamily, std::int32_t type, Journal& itsJournal)
    : VelkReportingBackend(context, std::move(name), std::move(profile), std::move(productFamily)),
      journal(itsJournal),
      clientType(type) {}

std::int32_t FakeBackend::updateState() {
  ++stateUpdates;
  setState(nextState);
  return nextState;
}

std::optional<std::string> FakeBackend::sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                               const TimeValue& timestamp, std::uint16_t method,
                                                               std::uint16_t respCode, std::uint16_t eventID,
                                                               std::uint32_t flag) {
  journal.note(formatText("send %@ %d/%d", {name(), method, respCode}));
  sent.push_back(Sent{message, timestamp, method, respCode, eventID, flag});
  return text;
}

std::optional<std::string> FakeBackend::flushMessagesWithCompletion(BackendFlushCompletion completion) {
  journal.note("flush " + name());
  flushes.push_back(std::move(completion));
  return std::nullopt;
}

bool FakeBackend::uploadFileAtPath(FileUpload& upload) {
  journal.note(formatText("upload %@ %@ %@", {name(), upload.path, upload.extensionToken}));
  uploadsUser = upload.user;
  if (deliversUploads) upload.isDelivered = true;
  return takesUploads;
}

bool FakeBackend::uploadLogData(const PropertyArray& logData) {
  journal.note(formatText("logData %@ %d", {name(), logData.size()}));
  return takesUploads;
}

std::string FakeBackend::attributes() const {
  return formatText("%u %d %d %@ %@ %@ %@ %d %d %d %d %.6f %@",
                    {_sessionID, _compType, _clientVersion, _udid, _productVersion, _buildVersion, _hardwareType,
                     _isInternal, _requireUserInfo, _batchEvents, _allowNestedData, _startTimestamp, _productFamily});
}

void FakeDelegate::updateCorrelatedSessions(ReportingdSession& session) {
  _journal.note(formatText("updateCorrelatedSessions %@ %u", {session.hierarchyToken(), session.hierarchyLevel()}));
}

void FakeDelegate::updateSharedDataForSession(ReportingdSession&, const PropertyDictionary& data) {
  if (!sharedData) sharedData.emplace();
  sharedData->merge(data);
}

void FakeDelegate::removeObjectFromSharedDataForSession(ReportingdSession&, const std::string& key) {
  if (sharedData) sharedData->remove(key);
}

void FakeDelegate::releaseIPCTransactions(std::uint32_t count) {
  _journal.note(formatText("releaseIPCTransactions %u", {count}));
}

std::shared_ptr<ReportingSessionConnectivityHelper> FakeDelegate::copySharedConnectivityHelperForReportingSession(
    ReportingdSession& session, std::int32_t mode) {
  if (!session.hasValidUserInfoKeys()) return nullptr;
  const auto userInfo = *session.userInfo();
  const std::string key = userInfoIdentifierString(userInfo);
  _journal.note(formatText("copyHelper %@ %d", {key, mode}));
  auto& helper = _helpers[key];
  if (!helper) helper = ReportingSessionConnectivityHelper::initWithDelegate(_platform, {}, mode, userInfo);
  helper->ownerIncrementUsageCount();
  return helper;
}

void FakeDelegate::releaseSharedConnectivityHelperForReportingSession(ReportingdSession& session) {
  const std::string key = userInfoIdentifierString(session.userInfo().value_or(PropertyDictionary()));
  _journal.note("releaseHelper " + key);
  if (const auto found = helper(key)) found->ownerDecrementUsageCountWithBlock([](std::uint32_t) {}, nullptr);
}

bool FakeDelegate::isActiveClientLimitReachedForSession(ReportingdSession& session,
                                                        const PropertyDictionary& sessionInfo) {
  limitQuestions.push_back(sessionInfo);
  if (limitReached) session.invalidate();
  return limitReached;
}

std::shared_ptr<ReportingSessionConnectivityHelper> FakeDelegate::helper(const std::string& key) const {
  const auto found = _helpers.find(key);
  return found != _helpers.end() ? found->second : nullptr;
}

void FakeDelegate::invalidateHelpers() {
  for (auto& [key, helper] : _helpers) helper->invalidate();
  _helpers.clear();
}

SessionTest::SessionTest()
    : platform(fakes.platform()),
      environment(fakes.defaults, fakes.device),
      services{
          BackendContext{platform, environment}, messageLog,
          [this](const BackendContext& context, const std::string& name, const PropertyValue& profile,
                 const std::optional<std::string>& productFamily,
                 std::int32_t clientType) -> std::shared_ptr<VelkReportingBackend> {
            if (profile.dictionary() == nullptr) return nullptr;
            made.push_back(std::make_shared<FakeBackend>(context, name, profile, productFamily, clientType, journal));
            if (prepareBackend) prepareBackend(*made.back());
            return made.back();
          }},
      delegate(platform, journal) {
  fakes.setHttpSessionService(&http);
  fakes.device.set("UniqueDeviceID", "0123456789abcdef0123456789abcdef01234567");
  fakes.device.set("ProductVersion", "12.5");
  fakes.device.set("BuildVersion", "12A5");
  fakes.device.set("ProductType", "Oak");
  fakes.device.set("DeviceName", "Tree");
  session = makeSession(connection);
}

SessionTest::~SessionTest() {
  session.reset();
  made.clear();
  delegate.ancestor.reset();
  delegate.parent.reset();
  delegate.state = {};
  delegate.invalidateHelpers();
  fakes.scheduler.runUntilIdle();
}

std::shared_ptr<ReportingdSession> SessionTest::makeSession(std::shared_ptr<FakeConnection> itsConnection) {
  return ReportingdSession::initWithSessionDelegate(delegate, std::move(itsConnection), services);
}

void SessionTest::serveBackends(const std::vector<std::string>& names) {
  PropertyDictionary bag;
  for (const auto& name : names) bag.set(name, PropertyDictionary());
  delegate.storebag = bag;
}

void SessionTest::describe(PropertyDictionary additions, std::optional<PropertyDictionary> userInfo,
                           bool hasAggregationBlock) {
  PropertyDictionary info{{kVelkReportingSessionInfoClientType, 8}, {kVelkReportingSessionInfoSessionID, 7}};
  info.merge(additions);
  session->setSessionInfo(info, std::move(userInfo), PropertyArray(), hasAggregationBlock);
}

namespace {

ConfigurationReply recordInto(ConfigurationAnswer& answer) {
  return ConfigurationReply([&answer](std::optional<PropertyArray> states, std::optional<PropertyArray> whitelist,
                                      std::optional<PropertyArray> blacklist) {
    answer = ConfigurationAnswer{answer.calls + 1, std::move(states), std::move(whitelist), std::move(blacklist)};
  });
}

}  // namespace

ConfigurationAnswer SessionTest::configure() {
  ConfigurationAnswer answer;
  session->startConfigWithCompletionHandler(test::recordInto(answer));
  return answer;
}

ConfigurationAnswer SessionTest::fetchStates(std::optional<PropertyDictionary> userInfo) {
  ConfigurationAnswer answer;
  session->fetchStatesWithUserInfo(std::move(userInfo), test::recordInto(answer));
  return answer;
}

void SessionTest::start(const std::vector<std::string>& names, PropertyDictionary additions,
                        std::optional<PropertyDictionary> userInfo, bool hasAggregationBlock) {
  serveBackends(names);
  describe(std::move(additions), std::move(userInfo), hasAggregationBlock);
  configure();
  for (const auto& each : made) each->sent.clear();
  journal.clear();
  messageLog.journal.clear();
}

std::optional<std::string> SessionTest::send(PropertyDictionary dictionary) {
  std::optional<std::string> answer;
  int calls = 0;
  session->sendMessageWithDictionary(std::move(dictionary), [&](std::optional<std::string> text) {
    ++calls;
    answer = std::move(text);
  });
  EXPECT_EQ(calls, 1);
  return answer;
}

std::string SessionTest::sendOnce(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                  std::optional<PropertyDictionary> payload, std::uint16_t category,
                                  std::uint16_t type) {
  std::optional<std::string> answer;
  session->sendMessageWithSessionInfo(std::move(sessionInfo), std::move(userInfo), category, type, std::move(payload),
                                      [&](std::optional<std::string> text) { answer = std::move(text); });
  return answer.value_or("(no reply)");
}

FlushReply SessionTest::recordInto(FlushAnswer& answer) {
  return FlushReply(
      [&answer](std::optional<std::string> text, std::optional<Error> error) {
        ++answer.calls;
        answer.text = std::move(text);
        answer.error = std::move(error);
      },
      [&answer] { ++answer.dropped; });
}

FakeBackend& SessionTest::backend(const std::string& name) {
  for (auto each = made.rbegin(); each != made.rend(); ++each) {
    if ((*each)->name() == name) return **each;
  }
  ADD_FAILURE() << "no backend named " << name;
  std::abort();
}

PropertyDictionary message(PropertyValue category, PropertyValue type, std::optional<PropertyDictionary> payload) {
  PropertyDictionary dictionary{{kVelkReportingMessageParametersCategory, std::move(category)},
                                {kVelkReportingMessageParametersType, std::move(type)}};
  if (payload) dictionary.set(kVelkReportingMessageParametersPayload, std::move(*payload));
  return dictionary;
}

PropertyDictionary userNamed(std::string_view client, std::string_view service) {
  return PropertyDictionary{{kVelkReportingUserInfoClientName, client}, {kVelkReportingUserInfoServiceName, service}};
}

PropertyArray numbers(std::initializer_list<int> values) {
  PropertyArray array;
  for (const int value : values) array.append(value);
  return array;
}

}  // namespace velk::test
