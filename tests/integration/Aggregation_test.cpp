// Aggregation over client processes: who receives whose messages, and how it ends.
#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

constexpr char kAllZero[] = R"({"aggregated":{"timestamp":0,"category":0,"type":0}})";

class Aggregation : public HierarchyTest {
 protected:
  void start(const char* logLevel = "debug") {
    tools::Stage::Options options;
    options.logLevel = logLevel;
    lay(std::move(options));
    putBag("cadmor", {entry("top"), entry("middle"), entry("deep"), entry("alone")});
    startDaemon();
  }
  // Configures; the messages that came before the answer.
  std::vector<std::string> configure(ScriptedClient& client) {
    client.step(R"({"do":"configure"})");
    return linesUntil(client, "live: httppost");
  }
  std::vector<std::string> linesUntil(ScriptedClient& client, const std::string& last) {
    std::vector<std::string> lines;
    for (std::string line = client.line(); line != last; line = client.line()) {
      lines.push_back(line);
      if (line == "(nothing)" || line == "(the end)") break;
    }
    return lines;
  }
  // The next message, without its time.
  static std::string next(ScriptedClient& client) {
    std::string line = client.line();
    const size_t begin = line.find("\"timestamp\":");
    const size_t end = line.find(',', begin);
    if (begin == std::string::npos || end == std::string::npos) return line;
    EXPECT_GT(std::stod(line.substr(begin + 12)), 1e9) << line;
    return line.substr(0, begin) + line.substr(end + 1);
  }
  static std::string message(const std::string& name, int level, int sessionID, int category,
                             const std::string& payload) {
    return "{\"aggregated\":{\"category\":" + std::to_string(category) +
           ",\"type\":1,\"sessionInfo\":{\"SessionID\":" + std::to_string(sessionID) +
           ",\"ClientType\":20,\"ClientVersion\":1,\"BatchEvent\":true,\"RequireUserInfo\":true,"
           "\"HierarchyToken\":{\"TokenID\":\"4f1c\",\"Level\":" +
           std::to_string(level) + "},\"ClientName\":\"" + name +
           "\",\"ServiceName\":\"test\"},\"payload\":" + payload + "}}";
  }
  // Of the internal start message; its payload is not looked at.
  static bool isStartOf(const std::string& line, int sessionID) {
    return line.find("\"category\":0,\"type\":0,\"sessionInfo\":{\"SessionID\":" + std::to_string(sessionID) +
                     ",") != std::string::npos;
  }
};

TEST_F(Aggregation, TheRootMostAggregatorReceivesWhatItsDescendantsSend) {
  start();
  const Process top = process(), middle = process();
  top->step(opening("top", 0, 1, true));
  const std::vector<std::string> own = configure(*top);
  ASSERT_EQ(own.size(), 1U) << "its own start message";
  EXPECT_TRUE(isStartOf(own[0], 1)) << own[0];

  middle->step(opening("middle", 1, 2, true));
  EXPECT_EQ(configure(*middle), std::vector<std::string>{kAllZero})
      << "beneath an aggregating session only the top-most aggregator stays";
  EXPECT_TRUE(isStartOf(next(*top), 2));
  const Process deep = open("deep", 2, 3);
  EXPECT_TRUE(isStartOf(next(*top), 3));

  sendAndSettle(*deep, 10, R"({"step":1})");
  EXPECT_EQ(next(*top), message("deep", 2, 3, 10, R"({"step":1})"));
  sendAndSettle(*middle, 11, R"({"step":2})");
  EXPECT_EQ(next(*top), message("middle", 1, 2, 11, R"({"step":2})"));
  top->step(sending(12, R"({"step":3})"));
  EXPECT_EQ(next(*top), message("top", 0, 1, 12, R"({"step":3})"));
  EXPECT_EQ(countLogged("shutdownSessionAggregation: Disable aggregation module for session 2"), 1U);

  // Both ends are messages of their own; the middle gets nothing any more.
  for (const Process* client : {&deep, &middle}) {
    (*client)->step(R"({"do":"finish"})");
    EXPECT_EQ((*client)->end().back(), "status 0");
    EXPECT_NE(next(*top).find("\"category\":0,\"type\":1"), std::string::npos);
  }
}

TEST_F(Aggregation, AnAggregatorThatJoinsAboveEndsTheOneBelow) {
  start();
  const Process middle = process();
  middle->step(opening("middle", 1, 2, true));
  EXPECT_TRUE(isStartOf(configure(*middle).at(0), 2));
  const Process deep = open("deep", 2, 3);
  EXPECT_TRUE(isStartOf(next(*middle), 3));

  const Process top = process();
  top->step(opening("top", 0, 1, true));
  configure(*top);
  EXPECT_EQ(middle->line(), kAllZero);
  sendAndSettle(*deep, 10, R"({"step":1})");
  EXPECT_EQ(next(*top), message("deep", 2, 3, 10, R"({"step":1})"));
}

TEST_F(Aggregation, EndsWithExactlyOneMessageOfZerosWhenTheDaemonEnds) {
  start();
  const Process top = process();
  top->step(opening("top", 0, 1, true));
  configure(*top);
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0) << daemonLog();
  std::string line = next(*top);
  EXPECT_NE(line.find("\"category\":0,\"type\":1"), std::string::npos) << "its own stop message: " << line;
  EXPECT_EQ(top->line(), kAllZero);
  EXPECT_EQ(top->end(), std::vector<std::string>{"status 0"}) << "nothing after it";
}

TEST_F(Aggregation, OfADeadAggregatorFallsToTheDescendantsOwn) {
  start();
  const Process top = process(), deep = process();
  top->step(opening("top", 0, 1, true));
  configure(*top);
  top->kill();
  ASSERT_TRUE(eventually([this] { return logged("dealloc: ReportingdSession dealloc: 1"); }));
  deep->step(opening("deep", 2, 3, true));
  EXPECT_TRUE(isStartOf(configure(*deep).at(0), 3)) << "nobody aggregates above any more";
}

TEST_F(Aggregation, IsNotForSessionsOfAnotherHierarchyOrOfNone) {
  start();
  const Process top = process(), other = process();
  top->step(opening("top", 0, 1, true));
  configure(*top);
  const Process alone = open("alone", -1, 5);
  other->step(opening("deep", 2, 6, false, 20, "another"));
  EXPECT_EQ(other->ask(R"({"do":"configure"})"), "live: httppost");
  sendAndSettle(*alone, 10);
  sendAndSettle(*other, 10);
  // Calls of one session are handled in order, so nothing of the others can come after this.
  top->step(sending(12, "{}"));
  EXPECT_EQ(next(*top), message("top", 0, 1, 12, "{}"));
}

TEST_F(Aggregation, AnAggregatorThatReadsNothingCutsOffNobody) {
  start("default");
  const Process top = process();
  top->step(opening("top", 0, 1, true));
  configure(*top);
  ::kill(top->pid(), SIGSTOP);
  const Process deep = open("deep", 1, 3);
  const std::string payload = "{\"text\":\"" + std::string(2000, 'x') + "\"}";
  for (int round = 0; round < 10; ++round) {
    deep->step("{\"do\":\"send\",\"category\":10,\"type\":1,\"repeat\":400,\"payload\":" + payload + "}");
    EXPECT_EQ(deep->ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  }
  finish(*deep);
  EXPECT_TRUE(arrive("client=deep&method=10", 4000)) << arrived("client=deep&method=10");
  ::kill(top->pid(), SIGCONT);
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  EXPECT_TRUE(logged("shutDown: aggregator-message-dropped: "));
}

}  // namespace
}  // namespace kyt
