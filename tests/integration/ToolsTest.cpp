// The tools beside the daemon, as people and scripts use them.

#include <gtest/gtest.h>
#include <signal.h>

#include "foundation/Json.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

PropertyDictionary parsed(const std::string& text) {
  const auto value = json::parse(text, json::Extensions::tagged);
  return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
}

struct Served {
  explicit Served(const Daemon::Options& options = {}) : daemon(prepared(server), options), session(daemon) {}
  static ReportingServer& prepared(ReportingServer& server) {
    server.setStorebag("heather", storebagWith(server));
    return server;
  }
  ReportingServer server;
  Daemon daemon;
  ControlledSession session;
};

TEST(SendTool, SendsOneEvent) {
  Served served;
  const auto sent =
      runControl(served.daemon, {"send", "--type", "9", "--client-name", "Tool", "--service", "cli", "--category", "7",
                                 "--event-type", "3", "--payload", "{\"answer\": 42}"});
  EXPECT_EQ(sent.status, 0) << sent.errors;
  ASSERT_TRUE(served.server.waitForEvents(1, {7}));
  const auto event = eventsOf(served.server, 7)[0];
  EXPECT_EQ(integerValue(event.find("answer")), 42);
  EXPECT_EQ(*event.string("_clientName"), "Tool");
  EXPECT_EQ(*event.string("_serviceName"), "cli");
}

TEST(SendTool, SaysWhyItCouldNot) {
  Served served;
  const auto without = runControl(
      served.daemon, {"send", "--type", "3", "--client-name", "Tool", "--category", "7", "--event-type", "3"});
  EXPECT_EQ(without.status, 69);
  EXPECT_NE((without.output + without.errors).find("storebag not available"), std::string::npos);
  EXPECT_EQ(runControl(served.daemon, {"send", "--type", "9"}).status, 64);
  const auto payload = runControl(served.daemon, {"send", "--type", "9", "--client-name", "T", "--category", "7",
                                                  "--event-type", "3", "--payload", "not json"});
  EXPECT_TRUE(payload.status == 64 || payload.status == 65) << payload.status;
  EXPECT_EQ(served.daemon.stop(), 0);
  EXPECT_EQ(
      runControl(served.daemon, {"send", "--type", "9", "--client-name", "T", "--category", "7", "--event-type", "3"})
          .status,
      69);
}

TEST(StatusTool, ShowsTheDaemon) {
  Served served;
  ASSERT_EQ(served.session.open(9, 1)[0], kSplunk);
  const auto status = runControl(served.daemon, {"--json", "status"});
  EXPECT_EQ(status.status, 0) << status.errors;
  EXPECT_FALSE(parsed(status.output).empty()) << status.output;
  EXPECT_EQ(runControl(served.daemon, {"status"}).status, 0);
  served.daemon.stop();
  EXPECT_EQ(runControl(served.daemon, {"status"}).status, 69);
}

TEST(DefaultsTool, ReadsWritesAndDeletes) {
  Served served;
  const auto run = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "defaults");
    return runControl(served.daemon, arguments);
  };
  EXPECT_EQ(run({"read", "environmentType"}).status, 66);
  EXPECT_EQ(run({"write", "environmentType", "4"}).status, 0);
  EXPECT_EQ(run({"read", "environmentType"}).output, "4\n");
  EXPECT_EQ(run({"write", "word", "plain"}).status, 0);
  EXPECT_NE(run({"read", "word"}).output.find("plain"), std::string::npos);
  ASSERT_EQ(served.session.open(9, 1)[0], kSplunk);
  EXPECT_TRUE(served.daemon.log().waitForPart("userDefaultsEnvironment: Environment type 4")) << "without a restart";
  EXPECT_EQ(run({"delete", "environmentType"}).status, 0);
  EXPECT_EQ(run({"read", "environmentType"}).status, 66);
  EXPECT_EQ(run({"write"}).status, 64);
  EXPECT_EQ(run({"nonsense"}).status, 64);
}

TEST(ConsentTool, DecidesForLaterSessions) {
  Served served;
  ASSERT_EQ(served.session.open(9, 1)[0], kSplunk);
  EXPECT_EQ(runControl(served.daemon, {"consent", "off"}).status, 0);
  EXPECT_EQ(parsed(runControl(served.daemon, {"--json", "consent", "show"}).output),
            (PropertyDictionary{{"consent", false}}));
  ControlledSession refused(served.daemon);
  EXPECT_EQ(refused.open(9, 2)[0], PropertyValue(PropertyArray{}));
  EXPECT_EQ(runControl(served.daemon, {"consent", "on"}).status, 0);
  ControlledSession accepted(served.daemon);
  EXPECT_EQ(accepted.open(9, 3)[0], kSplunk);
}

TEST(StorebagTool, SignsVerifiesAndShows) {
  Served served;
  TemporaryDirectory directory;
  const auto run = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "storebag");
    return runControl(served.daemon, arguments);
  };
  ASSERT_EQ(run({"keygen", "--out", directory.path()}).status, 0);
  EXPECT_NE(run({"keygen", "--out", directory.path()}).status, 0) << "a private key is not replaced unasked";
  const auto bag = directory.write("bag.json", "{\"version\": \"1\", \"release\": {\"splunk\": {\"clients\": []}}}");
  const std::string envelope = directory / "bag.signed";
  ASSERT_EQ(run({"sign", "--key", directory / "privateKey.pem", bag, "-o", envelope}).status, 0);
  EXPECT_EQ(run({"verify", "--public", directory / "publicKey.der", envelope}).status, 0);
  EXPECT_NE(run({"show", envelope}).output.find("splunk"), std::string::npos);

  const auto other =
      directory.write("other.der", std::string(served.server.publicKey().begin(), served.server.publicKey().end()));
  EXPECT_EQ(run({"verify", "--public", other, envelope}).status, 65);
  EXPECT_EQ(run({"verify", "--public", other, directory / "absent"}).status, 66);
  EXPECT_EQ(run({"show", directory.write("garbage", "garbage")}).status, 65);
  EXPECT_EQ(run({"sign", "--key", directory / "absent", bag}).status, 66);
  EXPECT_EQ(run({"sign", "--key", directory / "privateKey.pem", directory.write("list.json", "[1]")}).status, 65);
}

TEST(SessionTool, ReportsUnusableLinesAndGoesOn) {
  Served served;
  auto& process = served.session.process();
  process.write("not json\n[1]\n{\"no\": 1}\n{\"method\": \"unheardOf\"}\n\n{\"method\": \"fetchDisplayURL\"}\n");
  process.closeInput();
  EXPECT_EQ(process.wait(), 0);
  static_cast<void>(process.output().waitForPart("no such line"));  // to the end of the output
  const auto lines = process.output().lines();
  std::vector<std::int64_t> errors;
  for (const auto& line : lines) {
    const auto object = parsed(line);
    if (object.contains("error")) errors.push_back(integerValue(object.find("line")));
  }
  EXPECT_EQ(errors, (std::vector<std::int64_t>{1, 2, 3, 4}));
  const auto reply = parsed(lines.back());
  EXPECT_EQ(*reply.string("method"), "fetchDisplayURL");
  EXPECT_EQ(integerValue(reply.find("line")), 6);
  EXPECT_EQ(*reply.array("reply"), PropertyArray{"URL not available"});
}

TEST(SessionTool, WaitsWhereToldAndAnswersAtTheEnd) {
  Served served;
  auto& process = served.session.process();
  const auto start = std::chrono::steady_clock::now();
  process.write("{\"method\": \"wait\", \"seconds\": 1.5}\n{\"method\": \"flushMessagesWithCompletion\"}\n");
  process.closeInput();
  EXPECT_EQ(process.wait(), 0);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1500));
  EXPECT_TRUE(process.output().waitForPart("No backends available to send message"));
}

TEST(SessionTool, CarriesDatesAndData) {
  Served served;
  ASSERT_EQ(served.session.open(9, 1)[0], kSplunk);
  served.session.sendEvent(7, 1, PropertyDictionary{{"when", Date{99.5}}});
  ASSERT_TRUE(served.server.waitForEvents(1, {7}));
  EXPECT_EQ(*eventsOf(served.server, 7)[0].find("when"), PropertyValue(99.5));
}

TEST(SessionTool, EndsWith69WhenTheDaemonGoes) {
  Served served;
  ASSERT_EQ(served.session.open(9, 1)[0], kSplunk);
  served.daemon.kill();
  EXPECT_EQ(served.session.process().wait(), 69);
  EXPECT_FALSE(served.session.event("interrupted").empty());
  EXPECT_EQ(runControl(served.daemon, {"session"}).status, 69) << "nobody there";
}

/// velkcollector with storebags that this class signs through the tools.
struct Collector {
  explicit Collector(std::vector<std::string> more = {}) {
    ChildProcess::Options keygen;
    keygen.command = {controlProgram(), "storebag", "keygen", "--out", directory.path()};
    EXPECT_EQ(runProgram(keygen).status, 0);
    ChildProcess::Options options;
    std::filesystem::create_directory(directory / "bags");
    options.command = {collectorProgram(), "--port",           "0",     "--state", directory / "state",
                       "--storebags",      directory / "bags", "--json"};
    options.command.insert(options.command.end(), more.begin(), more.end());
    process = std::make_unique<ChildProcess>(options);
    const auto line = process->output().waitFor(
        [](const std::string& text) { return text.find("\"listening\"") != std::string::npos; });
    listening = parsed(line.value_or("{}"));
  }
  /// Signs and serves a storebag whose post backend has this name.
  void serve(const std::string& name, const std::string& backend) {
    const PropertyDictionary client{{"locale_whitelist", PropertyArray{"US"}},
                                    {"filters", PropertyArray{}},
                                    {"sampling_threshold", 1.0},
                                    {"post_url", *listening.string("url") + "/post"}};
    std::string text;
    const bool written =
        json::write(storebagOf({{backend, PropertyDictionary{{"clients", PropertyArray{client}}}}}), text);
    ASSERT_TRUE(written);
    ChildProcess::Options sign;
    sign.command = {controlProgram(),
                    "storebag",
                    "sign",
                    "--key",
                    directory / "privateKey.pem",
                    directory.write("bag.json", text),
                    "-o",
                    directory / "bags/" + name};
    const auto done = runProgram(sign);
    ASSERT_EQ(done.status, 0) << done.errors;
  }
  /// Options of a daemon that trusts and uses this collector.
  Daemon::Options options() {
    Daemon::Options options;
    options.environment = {{"SSL_CERT_FILE", *listening.string("ca")}};
    options.defaults = {{"velkreporting_storebag_url", *listening.string("url") + "/bags/vindle"}};
    options.starts = false;
    return options;
  }
  void adopt(const Daemon& daemon) {
    std::filesystem::copy_file(directory / "publicKey.der", daemon.directory() + "/config/publicKey.der",
                               std::filesystem::copy_options::overwrite_existing);
    std::filesystem::permissions(daemon.directory() + "/config/publicKey.der", std::filesystem::perms(0600));
  }

  TemporaryDirectory directory;
  std::unique_ptr<ChildProcess> process;
  PropertyDictionary listening;
};

TEST(CollectorTool, TakesWhatTheDaemonSends) {
  Collector collector;
  ASSERT_NE(collector.listening.string("url"), nullptr);
  collector.serve("heather", "splunk");
  ReportingServer unused;
  Daemon daemon(unused, collector.options());
  collector.adopt(daemon);
  daemon.start();
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], kSplunk);
  session.sendEvent(7, 3, PropertyDictionary{{"answer", 4242}});

  EXPECT_TRUE(collector.process->output().waitForPart("4242"));
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
  collector.process->signal(SIGTERM);
  EXPECT_EQ(collector.process->wait(), 0);
}

TEST(CollectorTool, ChecksDigests) {
  Collector collector({"--digest-key", "736563726574"});  // "secret"
  ASSERT_NE(collector.listening.string("url"), nullptr);
  collector.serve("heather", "qrs");
  ReportingServer unused;
  Daemon daemon(unused, collector.options());
  collector.adopt(daemon);
  daemon.start();
  const std::string key = "secret";
  const auto sendSigned = [&](const std::string& with, int answer) {
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(9, 1)[0], PropertyValue(PropertyArray{"qrs"}));
    session.send({{"method", "setDigestKey"}, {"key", ByteData(with.begin(), with.end())}, {"algorithm", 0}});
    session.sendEvent(7, 3, PropertyDictionary{{"answer", answer}});
    EXPECT_EQ(session.finish(), 0);
  };
  sendSigned("wrong", 1111);
  sendSigned(key, 4242);
  EXPECT_TRUE(collector.process->output().waitForPart("4242"));
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_EQ(collector.process->output().count("\"answer\":1111"), 0U);
}

}  // namespace
}  // namespace velk::test
