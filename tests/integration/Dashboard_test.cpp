// The dashboard back end against a real server: the feed with and without loss, and log data from a client's
// call to its location.
#include <algorithm>
#include <future>

#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

class DashboardFeedProgram : public StageTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.serverArguments = {"--udp-port", "0"};
    lay(std::move(options));
    ASSERT_NE(stage_->udpPort(), 0);
  }
  [[nodiscard]] ProgramRun feed(std::vector<std::string> arguments, const std::string& events) const {
    arguments.insert(arguments.begin(), {"--server", "127.0.0.1", "--port", std::to_string(stage_->udpPort()),
                                         "--session", "1", "--client-type", "6", "--client-version", "3"});
    return runProgram(stage_->program("kytfeed"), arguments, events);
  }
  static std::string events(int count) {
    std::string text;
    for (int i = 1; i <= count; ++i)
      text += R"({"method":2,"respCode":3,"time":5.123456,"message":{"k2":12345,"k1":"a=b)" +
              std::to_string(i) + "\"}}\n";
    return text;
  }
  [[nodiscard]] bool arrivedLines(int count) const {
    const Value answer = stage_->query("/api/wait?timeout=30&lines=" + std::to_string(count));
    return answer.dictionary() != nullptr && answer.dictionary()->find("reached")->boolValue();
  }
  // Of every datagram that arrived, in order.
  [[nodiscard]] std::vector<int> eventNumbers() const {
    std::vector<int> numbers;
    const Value answer = stage_->query("/api/lines?since=0&limit=1000");
    for (const Value& line : *answer.dictionary()->find("lines")->array())
      numbers.push_back(line.dictionary()->find("content")->dictionary()->find("event")->intValue());
    return numbers;
  }
};

TEST_F(DashboardFeedProgram, SendsEachEventOnceAndPrintsItsLine) {
  const ProgramRun run = feed({}, events(3));
  EXPECT_EQ(run.status, 0) << run.text;
  const std::string front = "5.120 " + std::string(40, '0') + " 127.0.0.1 QG     3     1     ";
  EXPECT_EQ(run.text, front + "1     2     3  k1=a\\=b1 k2=12345\n" + front +
                          "2     2     3  k1=a\\=b2 k2=12345\n" + front +
                          "3     2     3  k1=a\\=b3 k2=12345\n");
  ASSERT_TRUE(arrivedLines(3));
  EXPECT_EQ(eventNumbers(), (std::vector<int>{1, 2, 3}));
}

TEST_F(DashboardFeedProgram, AnEventCannotSteerTheTerminal) {
  const ProgramRun run = feed({}, R"({"method":2,"respCode":3,"message":{"k":"\u001b[31m\u202e"}})"
                                  "\nno \x1b[31m event\n");
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.text.find("k=\\x1b[31m\\xe2\\x80\\xae\n"), std::string::npos) << run.text;
  EXPECT_NE(run.text.find("kytfeed: line 2 is no event: "), std::string::npos) << run.text;
  EXPECT_NE(run.text.find(": no \\x1b[31m event\n"), std::string::npos) << run.text;
}

// 5.004 is a little less as a binary number.
TEST_F(DashboardFeedProgram, ATimeKeepsItsMilliseconds) {
  std::string lines;
  for (const char* time : {"5.004", "5.999999", "1769860800.252"})
    lines += R"({"method":2,"respCode":3,"time":)" + std::string(time) + R"(,"message":{}})" + "\n";
  const ProgramRun run = feed({}, lines);
  EXPECT_EQ(run.status, 0) << run.text;
  const std::string device = " " + std::string(40, '0') + " ";
  for (const char* time : {"5.004", "5.996", "1769860800.252"})
    EXPECT_NE(run.text.find(time + device), std::string::npos) << time << "\n" << run.text;
}

TEST_F(DashboardFeedProgram, SendsAgainWhatIsNotAcknowledged) {
  ASSERT_TRUE(stage_->control("/control/acknowledgements", R"({"action":"lose","times":1})"));
  ASSERT_TRUE(stage_->control("/control/acknowledgements", R"({"action":"corrupt","times":1})"));
  ASSERT_TRUE(stage_->control("/control/acknowledgements", R"({"action":"shorten","times":1})"));
  ASSERT_TRUE(stage_->control("/control/acknowledgements", R"({"action":"repeat","times":1})"));
  // Long enough that all five leave before the first is sent again, which would take the next one's treatment.
  const ProgramRun run = feed({"--reliable", "2000"}, events(5));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("DashboardBackend(myPeriodicTask): clean up at myPeriodicTask."),
            std::string::npos);
  ASSERT_TRUE(arrivedLines(8));
  std::vector<int> numbers = eventNumbers();
  ASSERT_GE(numbers.size(), 8u);  // more when this machine is slow
  EXPECT_EQ(std::vector<int>(numbers.begin(), numbers.begin() + 5), (std::vector<int>{1, 2, 3, 4, 5}));
  for (const int again : {1, 2, 3}) EXPECT_GE(std::count(numbers.begin(), numbers.end(), again), 2) << again;
}

TEST_F(DashboardFeedProgram, GivesUpAfterFourRetransmissions) {
  ASSERT_TRUE(stage_->control("/control/acknowledgements", R"({"action":"lose","times":0})"));
  const ProgramRun run = feed({"--reliable", "10"}, events(2));
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_NE(run.text.find("kytfeed: 2 of 2 events were never acknowledged\n"), std::string::npos) << run.text;
  ASSERT_TRUE(arrivedLines(10));
  std::vector<int> numbers = eventNumbers();
  std::sort(numbers.begin(), numbers.end());  // on a slow machine the first is sent again before the second
  EXPECT_EQ(numbers, (std::vector<int>{1, 1, 1, 1, 1, 2, 2, 2, 2, 2}));
}

TEST_F(DashboardFeedProgram, WithoutAProfileIsReliable) {
  const ProgramRun run = feed({"--without-profile"}, events(1));
  EXPECT_EQ(run.status, 0) << run.text;
  ASSERT_TRUE(arrivedLines(1));
  const Value answer = stage_->query("/api/lines");
  const Value& line = (*answer.dictionary()->find("lines")->array())[0];
  EXPECT_EQ(line.dictionary()->find("content")->dictionary()->find("flags")->intValue(), 3);
}

TEST_F(DashboardFeedProgram, EndsWithAnErrorWithoutAnEventOrAServer) {
  EXPECT_EQ(feed({}, "{\"method\":1}\n").status, 1);
  EXPECT_EQ(feed({}, "nonsense\n").status, 1);
  EXPECT_EQ(feed({"/nonexistent/file"}, {}).status, 1);
  const ProgramRun run =
      runProgram(stage_->program("kytfeed"), {"--server", "nowhere.example.org", "--port", "1"}, events(1));
  EXPECT_EQ(run.status, 2);
  EXPECT_NE(run.text.find("DashboardBackend(initWithName): socket connect() failed."), std::string::npos);
}

class DashboardInTheDaemon : public DashboardFeedProgram {
 protected:
  void SetUp() override {
    DashboardFeedProgram::SetUp();
    const Dictionary profile{{"ip", "127.0.0.1"},
                             {"port", static_cast<int64_t>(stage_->udpPort())},
                             {"reliable", 100},
                             {"display_url", "https://dashboard.example.org"},
                             {"post_url", stage_->httpsBase() + "/logdata"}};
    const Dictionary bag{{"version", "1"}, {"release", Dictionary{{"dashboard", profile}}}};
    const auto problem = stage_->putStorebag("torvel", bag);
    ASSERT_FALSE(problem) << problem->localizedDescription;
    startDaemon();
  }
  static std::string upload(TestClient& client, const Array& data) {
    auto answer = std::make_shared<std::promise<std::string>>();
    client->uploadLogData(data, [answer](bool accepted, std::optional<Error> error) {
      answer->set_value(error ? error->localizedDescription : accepted ? "accepted" : "refused");
    });
    return TestClient::waitFor(answer);
  }
};

TEST_F(DashboardInTheDaemon, TakesLogDataToItsServer) {
  TestClient client(socket(), 5);
  EXPECT_EQ(client.configure(), "live: dashboard") << daemonLog();
  EXPECT_EQ(client.displayURL(), "https://dashboard.example.org");
  EXPECT_EQ(
      upload(client, Array{Dictionary{{"text", "it went wrong"}, {"time", Date{1769860800}}}, "second"}),
      "accepted")
      << daemonLog();
  const Value logs = stage_->query("/api/logs");
  ASSERT_NE(logs.dictionary(), nullptr);
  const Array& rows = *logs.dictionary()->find("logs")->array();
  ASSERT_EQ(rows.size(), 1u);
  const Dictionary& content = *rows[0].dictionary()->find("content")->dictionary();
  EXPECT_EQ(
      *content.find("data"),
      Value(Array{Dictionary{{"text", "it went wrong"}, {"time", "2026-01-31 12:00:00 +0000"}}, "second"}));
  EXPECT_TRUE(logged("DashboardBackend(uploadLogData): Log data uploaded to " +
                     content.find("location")->string()->str()))
      << daemonLog();
  EXPECT_TRUE(client.finish());
}

// Deliberately: events go by the send with a flag, which this back end does not have.
TEST_F(DashboardInTheDaemon, SendsNoEventThatIsRouted) {
  TestClient client(socket(), 5);
  ASSERT_EQ(client.configure(), "live: dashboard") << daemonLog();
  EXPECT_TRUE(client.send(3, 4, {{"key", "value"}}));
  EXPECT_EQ(client.flush(), "flushed");
  EXPECT_TRUE(client.finish());
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0) << daemonLog();
  EXPECT_EQ(total("lines"), 0);
}

TEST_F(DashboardInTheDaemon, TellsAClientWhoseLogDataCannotBeTaken) {
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/logdata","close":true})"));
  TestClient client(socket(), 5);
  ASSERT_EQ(client.configure(), "live: dashboard") << daemonLog();
  EXPECT_EQ(upload(client, Array{"entry"}), "refused");
  EXPECT_TRUE(logged("DashboardBackend(uploadLogData): Error uploading log data array (")) << daemonLog();
  EXPECT_EQ(upload(client, Array{"entry"}), "accepted");
  EXPECT_TRUE(client.finish());
}

}  // namespace
}  // namespace kyt
