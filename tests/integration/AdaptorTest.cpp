// The diagnostics adaptor in the real daemon: the sample that is installed beside it, and adaptors that misbehave.
// And what sessions deliver to the power log, which is nothing.

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <sstream>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kQuill = PropertyArray{"quill"};

/// A daemon whose conferencing clients have a "quill" section, and the adaptor that its administrator named.
class Adaptor : public testing::Test {
 protected:
  Adaptor() {
    const PropertyDictionary section{{"quill", PropertyDictionary{{"active", true}}}};
    server.setStorebag("sorrel", storebagOf(section));
    server.setStorebag("heather", storebagWith(server));
    Daemon::Options options;
    options.starts = false;
    options.deviceConfiguration = kDeviceLines;
    prepare(options);
  }

  void prepare(Daemon::Options options) {
    options.environment["QUILL_ADAPTOR_FILE"] = events.path() + "/events";
    daemon = std::make_unique<Daemon>(server, options);
  }
  /// Copies a shared object to where only this user can write, and names it.
  void install(const char* built) {
    std::filesystem::copy_file(built, path(), std::filesystem::copy_options::overwrite_existing);
    ::chmod(path().c_str(), 0600);
    name(path());
  }
  void name(const std::string& adaptor) const {
    writeContents(daemon->directory() + "/config/adaptors.conf", "QuillAdaptor=" + adaptor + "\n");
    ::chmod((daemon->directory() + "/config/adaptors.conf").c_str(), 0600);
  }
  [[nodiscard]] std::string path() const { return daemon->directory() + "/config/quill.so"; }
  /// An event, and the daemon done with it.
  static void sendAndWait(ControlledSession& session, const PropertyValue& payload) {
    ASSERT_FALSE(session.reply(session.sendEvent(70, 3, payload)).empty());
  }
  [[nodiscard]] std::vector<std::string> forwarded() const {
    std::vector<std::string> lines;
    std::istringstream text(contentsOf(events.path() + "/events"));
    for (std::string line; std::getline(text, line);) lines.push_back(line);
    return lines;
  }
  /// Whatever is named as adaptor, the session lives, and each of its events is refused.
  void expectAbsent(const std::string& reason) {
    const std::size_t from = daemon->log().lines().size();
    ControlledSession session(*daemon);
    EXPECT_EQ(session.open(7, 1)[0], kQuill);
    sendAndWait(session, PropertyDictionary{{"a", 1}});
    EXPECT_TRUE(daemon->log().waitForPart("<3>QuillBackend(initWithName): no Quill adaptor: ", from)) << reason;
    EXPECT_TRUE(daemon->log().waitForPart(reason, from)) << reason;
    EXPECT_TRUE(daemon->log().waitForPart(
        "<3>QuillBackend(sendMessage): Quill adaptor (null) does not respond to forwarding selector "
        "sendMessageWithMethod:respCode:dict:",
        from));
    EXPECT_EQ(session.finish(), 0);
  }

  ReportingServer server;
  const TemporaryDirectory events;
  std::unique_ptr<Daemon> daemon;
};

TEST_F(Adaptor, GetsTheEventsOfConferencingSessions) {
  install(VELK_SAMPLE_ADAPTOR);
  daemon->start();
  ControlledSession session(*daemon);
  ASSERT_EQ(session.open(7, 1, {{"HierarchyToken", PropertyDictionary{{"token", "t"}, {"level", 0}}}})[0], kQuill);
  session.send({{"method", "updateSharedDataForKey"}, {"key", "room"}, {"value", 4}});
  sendAndWait(session, PropertyDictionary{{"text", "two\nlines"}, {"when", Date{5}}});
  sendAndWait(session, PropertyValue());

  const auto lines = forwarded();
  ASSERT_EQ(lines.size(), 3U);
  EXPECT_EQ(lines[0].rfind("0 ", 0), 0U) << "the start message: " << lines[0];
  EXPECT_EQ(lines[1], R"(70 3 {"SharedData":{"room":4},"ClientData":{"text":"two\nlines","when":{"$date":5.0}}})");
  EXPECT_EQ(lines[2], R"(70 3 {"SharedData":{"room":4}})");
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon->stop(), 0);
  EXPECT_EQ(forwarded().size(), 4U) << "and the health message";
}

TEST_F(Adaptor, GetsMessagesThatComeWithoutASession) {
  install(VELK_SAMPLE_ADAPTOR);
  daemon->start();
  ControlledSession session(*daemon);
  EXPECT_EQ(session.call({{"method", "sendMessageWithSessionInfo"},
                          {"sessionInfo", PropertyDictionary{{"ComponentType", 13}, {"SessionID", 5}}},
                          {"userInfo", PropertyDictionary{{"_clientName", "Test"}, {"_serviceName", "unit"}}},
                          {"category", 71},
                          {"type", 4},
                          {"payload", PropertyDictionary{{"a", 1}}}}),
            PropertyArray{"finished"});
  EXPECT_EQ(forwarded(), std::vector<std::string>{R"(71 4 {"a":1})"});
}

TEST_F(Adaptor, ServesConferencingClientTypesAlone) {
  install(VELK_SAMPLE_ADAPTOR);
  daemon->start();
  // The last of them shares the storebag of the others.
  for (const auto& [type, expected] : {std::pair(7, kQuill), std::pair(11, kQuill), std::pair(13, kQuill),
                                       std::pair(20, PropertyValue(PropertyArray{}))}) {
    ControlledSession session(*daemon);
    EXPECT_EQ(session.open(type, type)[0], expected) << type;
    EXPECT_EQ(session.finish(), 0);
  }
  EXPECT_TRUE(daemon->log().waitForPart("<3>QuillBackend(initWithName): No matching bundle found for client type 20"));
}

TEST_F(Adaptor, IsKeptOffOneFamilyOfDevices) {
  Daemon::Options options;
  options.starts = false;
  options.deviceConfiguration = "ProductType=Hollin\n";
  prepare(options);
  install(VELK_SAMPLE_ADAPTOR);
  daemon->start();
  ControlledSession session(*daemon);
  EXPECT_EQ(session.open(7, 1)[0], PropertyValue(PropertyArray{}));
  EXPECT_TRUE(daemon->log().waitForPart("<3>VelkReportingBackend(newBackendWithName): quill"));
}

TEST_F(Adaptor, ThatCannotBeUsedIsExplainedAndMissedByNobody) {
  name(daemon->directory() + "/config/none.so");
  daemon->start();
  expectAbsent("adaptors.conf: QuillAdaptor: ");
  expectAbsent("none.so: No such file or directory");
  name("quill.so");
  expectAbsent("\"quill.so\" is not an absolute path");
  name(daemon->directory());
  expectAbsent("is not a regular file");
  writeContents(daemon->directory() + "/config/text.so", "not a library");
  name(daemon->directory() + "/config/text.so");
  expectAbsent("text.so is not a shared object of this machine");
  install(VELK_MUTE_ADAPTOR);
  expectAbsent("quill.so has no function VelkReportingCreateQuillAdaptor");
  std::filesystem::remove(path());
  install(VELK_SAMPLE_ADAPTOR);
  ::chmod(path().c_str(), 0620);
  expectAbsent("quill.so can be written by others than its owner");
  ::chmod(path().c_str(), 0600);
  ::chmod((daemon->directory() + "/config/adaptors.conf").c_str(), 0666);
  expectAbsent("adaptors.conf: others can write it");
  if (::geteuid() == 0) {
    name(path());
    ASSERT_EQ(::chown(path().c_str(), 65534, 65534), 0);
    expectAbsent("quill.so belongs to user 65534");
    ASSERT_EQ(::chown(path().c_str(), 0, 0), 0);
  }

  name(path());
  ControlledSession session(*daemon);
  EXPECT_EQ(session.open(7, 1)[0], kQuill);
  EXPECT_EQ(forwarded().size(), 1U) << "once it is mended it is used, without a restart";
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon->stop(), 0);
}

TEST_F(Adaptor, ThatThrowsOrRefusesLosesThatEventAlone) {
  install(VELK_HOSTILE_ADAPTOR);
  daemon->start();
  ControlledSession session(*daemon);
  ASSERT_EQ(session.open(7, 1)[0], kQuill);
  sendAndWait(session, PropertyDictionary{{"please", "throw an error"}});
  sendAndWait(session, PropertyDictionary{{"please", "throw a number"}});
  sendAndWait(session, PropertyDictionary{{"please", "refuse"}});
  sendAndWait(session, PropertyDictionary{{"please", "go on"}});
  EXPECT_TRUE(daemon->log().waitForPart(R"(quill.so> threw: an error with a\nline break)"));
  EXPECT_TRUE(daemon->log().waitForPart("quill.so> threw an exception"));
  EXPECT_TRUE(daemon->log().waitForPart("quill.so> failed with status 7"));
  EXPECT_EQ(linesWith(daemon->log(), "<3>QuillBackend(sendMessage): an event is lost: ").size(), 3U);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_TRUE(daemon->log().waitForPart("hostile adaptor: released"));
  EXPECT_EQ(daemon->stop(), 0);
}

TEST_F(Adaptor, ThatBlocksHoldsUpItsOwnSessionAlone) {
  install(VELK_HOSTILE_ADAPTOR);
  daemon->start();
  ControlledSession stuck(*daemon);
  ASSERT_EQ(stuck.open(7, 1)[0], kQuill);
  stuck.sendEvent(70, 3, PropertyDictionary{{"please", "block"}});
  ASSERT_TRUE(daemon->log().waitForPart("hostile adaptor: blocking"));

  // Others open, report and end, those of the same kind and adaptor included.
  ControlledSession beside(*daemon);
  ASSERT_EQ(beside.open(11, 2)[0], kQuill);
  sendAndWait(beside, PropertyDictionary{{"please", "go on"}});
  EXPECT_EQ(beside.finish(), 0);
  ControlledSession other(*daemon);
  ASSERT_EQ(other.open(9, 3)[0], PropertyValue(PropertyArray{"splunk"}));
  other.sendEvent(777, 1, PropertyDictionary{{"a", 1}});
  EXPECT_TRUE(server.waitForEvents(1, {777}));
  EXPECT_EQ(other.finish(), 0);
  EXPECT_TRUE(daemon->log().waitForPart("hostile adaptor: released"));

  stuck.kill();
  EXPECT_EQ(daemon->stop(), 70) << "it ends, and says that something was wrong";
  EXPECT_TRUE(daemon->log().waitForPart(
      "<3>stop: the diagnostics adaptor does not return from its calls; the process ends without it"));
}

TEST_F(Adaptor, ThatBlocksAtItsCreationHoldsUpItsOwnSessionAlone) {
  Daemon::Options options;
  options.starts = false;
  options.environment["HOSTILE_ADAPTOR"] = "block";
  prepare(options);
  install(VELK_HOSTILE_ADAPTOR);
  daemon->start();
  ControlledSession stuck(*daemon);
  stuck.sendOpening(7, 1);
  ASSERT_TRUE(daemon->log().waitForPart("hostile adaptor: blocking"));

  ControlledSession other(*daemon);
  EXPECT_EQ(other.open(9, 3)[0], PropertyValue(PropertyArray{"splunk"}));
  EXPECT_EQ(other.finish(), 0);
  daemon->kill();
}

TEST(PowerLog, GetsNothingOfWhatSessionsDeliver) {
  const TemporaryDirectory directory;
  const FileDescriptor journal(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, (directory / "journal").c_str(), sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(journal.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"power", PropertyDictionary{{"active", true}}}}));
  Daemon::Options options;
  options.defaults.set("powerLogSocket", directory / "journal");
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], PropertyValue(PropertyArray{"power"}));
  EXPECT_FALSE(session.reply(session.sendEvent(7, 3, PropertyDictionary{{"wakeups", 12}})).empty());
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);

  char byte = 0;
  EXPECT_LT(::recv(journal.get(), &byte, 1, MSG_DONTWAIT), 0);
}

}  // namespace
}  // namespace velk::test
