// The programs of examples/client, as somebody runs them who tries the library: in C, C++ and Python.

#include <gtest/gtest.h>

#include <optional>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

class Examples : public ::testing::Test {
 protected:
  Examples() {
    server.setStorebag("heather", storebagWith(server));
    daemon.emplace(server);
  }
  Finished run(std::vector<std::string> command, const std::map<std::string, std::string>& more = {}) {
    ChildProcess::Options options;
    options.command = std::move(command);
    options.environment = daemon->environment();
    for (const auto& [name, value] : more) options.environment[name] = value;
    return runProgram(options);
  }
  Finished runExample(const std::string& name) { return run({std::string(VELK_EXAMPLES_DIRECTORY) + "/" + name, "9"}); }

  ReportingServer server;
  std::optional<Daemon> daemon;
};

/// gcc's thread sanitizer does not know the locks of <threads.h>, and takes what they guard for races.
constexpr bool kKnowsLocksOfC =
#if defined(__SANITIZE_THREAD__)
    false;
#else
    true;
#endif

TEST_F(Examples, ReportAnEvent) {
  std::size_t expected = 0;
  for (const auto& [program, language] : {std::pair("report_event_c", "C"), std::pair("report_event_cpp", "C++")}) {
    if (!kKnowsLocksOfC && language == std::string("C")) continue;
    const Finished finished = runExample(program);
    EXPECT_EQ(finished.status, 0) << finished.errors;
    ASSERT_TRUE(server.waitForEvents(++expected, {101})) << program;
    const auto events = eventsOf(server, 101);
    EXPECT_EQ(integerValue(events.back().find("answer")), 42);
    EXPECT_EQ(*events.back().string("language"), language);
  }
}

TEST_F(Examples, ReportAnEventFromPython) {
#if defined(VELK_SANITIZED)
  GTEST_SKIP() << "the interpreter is not built with the sanitizer that the library needs";
#else
  const Finished finished =
      run({"/usr/bin/python3", VELK_PYTHON_EXAMPLE, "9"}, {{"VELKREPORTING_LIBRARY", VELK_CLIENT_LIBRARY}});
  EXPECT_EQ(finished.status, 0) << finished.errors;
  ASSERT_TRUE(server.waitForEvents(1, {101}));
  const auto events = eventsOf(server, 101);
  EXPECT_EQ(*events[0].string("language"), "Python");
#endif
}

TEST_F(Examples, SayWhatIsWrongWhenNoDaemonIsThere) {
  ASSERT_EQ(daemon->stop(), 0);
  const Finished finished = runExample(kKnowsLocksOfC ? "report_event_c" : "report_event_cpp");
  EXPECT_EQ(finished.status, 1);
  EXPECT_NE(finished.errors.find("is velkreportingd running?"), std::string::npos) << finished.errors;
}

TEST_F(Examples, ReportPeriodicModulesInOneEvent) {
  for (const auto& [program, category] :
       {std::pair("periodic_modules_c", 102), std::pair("periodic_modules_cpp", 103)}) {
    const Finished finished = runExample(program);
    EXPECT_EQ(finished.status, 0) << finished.errors;
    EXPECT_EQ(finished.output, "reported 1 times\n");
    ASSERT_TRUE(server.waitForEvents(1, {category}));
    const PropertyDictionary event = eventsOf(server, category)[0];
    EXPECT_EQ(integerValue(event.find("reader")), 1) << "the tick before was an update";
    EXPECT_TRUE(event.contains("writer")) << "merged into one";
  }
}

TEST_F(Examples, ShareAHierarchyBetweenParentAndChild) {
  for (const auto& [program, line] :
       {std::pair("shared_hierarchy_c", "event 104/1 of session 6: from the child\n"),
        std::pair("shared_hierarchy_cpp", "event 105/1 of session 8: from the child\n")}) {
    const Finished finished = runExample(program);
    EXPECT_EQ(finished.status, 0) << finished.errors;
    EXPECT_EQ(finished.output, line);
  }
  ASSERT_TRUE(server.waitForEvents(2, {104, 105}));
}

TEST_F(Examples, EveryFunctionOfTheCInterfaceGivesBackWhatItTook) {
  const std::string file = daemon->directory() + "/upload.txt";
  writeContents(file, "contents");
  for (const bool daemonIsThere : {true, false}) {
    if (!daemonIsThere) {
      ASSERT_EQ(daemon->stop(), 0);
    }
    const Finished finished = run({VELK_EVERY_FUNCTION_PROGRAM, "9", file}, {{"XDG_STATE_HOME", daemon->directory()}});
    EXPECT_EQ(finished.status, 0) << finished.output << finished.errors;
    EXPECT_NE(finished.output.find(daemonIsThere ? "backends: 1\n" : "backends: 0\n"), std::string::npos);
    EXPECT_EQ(finished.output.find("flushed: yes\n") != std::string::npos, daemonIsThere) << finished.output;
    EXPECT_NE(finished.output.find("contexts: "), std::string::npos);
  }
}

}  // namespace
}  // namespace velk::test
