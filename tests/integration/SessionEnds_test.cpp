// How sessions end: the figures of the stop message, and clients that are killed in the middle of something.
#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "tests/integration/HierarchyFixture.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

class SessionEnds : public HierarchyTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.logLevel = "debug";
    lay(std::move(options));
    putBag("cadmor", {entry("a"), entry("b"), entry("ends"), entry("killed"), entry("other")});
    putBag("dulvek", {entry("c")});
    // One heap for all threads, so that memory which comes back is seen to.
    ::setenv("MALLOC_ARENA_MAX", "1", 1);
    startDaemon();
    ::unsetenv("MALLOC_ARENA_MAX");
  }
  Process openAs(const std::string& name, int clientType, int sessionID) {
    Process client = process();
    client->step(opening(name, -1, sessionID, false, clientType));
    EXPECT_EQ(client->ask(R"({"do":"configure"})"), "live: httppost") << daemonLog();
    return client;
  }

  // Of the daemon's process.
  std::string procPath(const std::string& name) const {
    return "/proc/" + std::to_string(stage_->daemon()->pid()) + "/" + name;
  }
  long statusNumber(const std::string& key) const {
    std::ifstream status(procPath("status"));
    for (std::string line; std::getline(status, line);)
      if (line.rfind(key + ":", 0) == 0) return std::stol(line.substr(key.size() + 1));
    return -1;
  }
  // 0 where the system does not show them to this user: the daemon's process is not dumpable.
  size_t descriptors() const {
    std::error_code error;
    const std::filesystem::directory_iterator entries(procPath("fd"), error);
    return error ? 0 : static_cast<size_t>(std::distance(entries, {}));
  }
  // Sessions whose end has begun.
  size_t ended() const { return countLogged("dealloc: ReportingdSession dealloc:"); }
  // The daemon holds no more descriptors than that, within the deadline.
  bool comesBackTo(size_t count) const {
    return eventually([&] { return descriptors() <= count; });
  }
};

uint64_t numberOf(const Dictionary& record, const char* key) {
  const Value* value = record.find(key);
  return value != nullptr ? static_cast<uint64_t>(value->longLongValue()) : 0;
}

TEST_F(SessionEnds, TheStopMessageTellsWhatTheDaemonHolds) {
  // Two QPW (20) and one QJ (8) stay, and one of a type without a storebag; a third QPW ends.
  const Process a = openAs("a", 20, 1), b = openAs("b", 20, 2), c = openAs("c", 8, 3);
  const Process unknown = process();
  unknown->step(opening("unknown", -1, 4, false, 2));
  EXPECT_EQ(unknown->ask(R"({"do":"configure"})"), "no storebag");
  sendAndSettle(*a, 10, R"({"text":")" + std::string(500, 'x') + "\"}");
  {
    const Process ends = openAs("ends", 20, 5);
    finish(*ends);
  }
  ASSERT_TRUE(arrive("client=ends&method=0&status=1", 1)) << daemonLog();
  const Dictionary stop = records("ends", 0, 1).at(0);
  EXPECT_EQ(textOf(stop, "StorebagVersion"), "1");
  EXPECT_EQ(textOf(stop, "GracefulTermination"), "1");
  EXPECT_EQ(textOf(stop, "SessionsCount_QPW"), "3") << "two that stay, and the one that ends counts once";
  EXPECT_EQ(textOf(stop, "SessionsCount_QJ"), "1");
  EXPECT_EQ(textOf(stop, "SessionsCount_Unknown"), "1");
  EXPECT_EQ(textOf(stop, "StorebagsCount"), "2");
  // Each holds its start message at least, one of them a larger event too.
  const uint64_t ofQJ = numberOf(stop, "BatchSize_QJ"), ofQPW = numberOf(stop, "BatchSize_QPW");
  EXPECT_GT(ofQJ, 500U);
  EXPECT_GT(ofQPW, 3 * ofQJ + 500);
  EXPECT_LT(ofQPW, 6 * ofQJ + 2000);
  EXPECT_EQ(textOf(stop, "BatchSize_Unknown"), "0");
  EXPECT_GT(numberOf(stop, "StorebagsSize"), 1000U);
  EXPECT_EQ(numberOf(stop, "CalculatedMemoryUsage"), ofQJ + ofQPW + numberOf(stop, "StorebagsSize"));
  if (!kSanitized) {
    const uint64_t anonymous = static_cast<uint64_t>(statusNumber("RssAnon")) * 1024;
    EXPECT_GT(numberOf(stop, "ProcessMemoryUsage"), anonymous / 4);
    EXPECT_LT(numberOf(stop, "ProcessMemoryUsage"), anonymous * 4);
  }
}

TEST_F(SessionEnds, AClientKilledWhileItsStorebagIsFetchedLeavesNothing) {
  const Process other = openAs("other", 20, 1);
  const size_t before = descriptors();
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/bags/tolvar/dulvek","hang":true})"));
  Process killed = process();
  killed->step(opening("c", -1, 2, false, 8));
  killed->step(R"({"do":"configure"})");
  ASSERT_TRUE(
      eventually([this] { return logged("fetchAndCacheStorebag: Fetching storebag for client type 8"); }));
  killed->kill();
  static_cast<void>(stage_->query("/control/reset"));
  EXPECT_TRUE(eventually([this] { return logged("dealloc: ReportingdSession dealloc: 2"); })) << daemonLog();
  EXPECT_TRUE(comesBackTo(before)) << descriptors() << " after " << before;
  // And the storebag can be had afterwards by another; the failure keeps from that for a while.
  sendAndSettle(*other, 10);
  finish(*other);
  EXPECT_TRUE(arrive("client=other&method=10", 1));
}

TEST_F(SessionEnds, AClientKilledWhileAFlushWaitsLosesNothingThatIsOnItsWay) {
  const Process other = openAs("other", 20, 1);
  flush(*other);
  const size_t before = descriptors();
  Process killed = openAs("killed", 20, 2);
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/events","delayMs":500,"times":1})"));
  sendAndSettle(*killed, 10);
  killed->step(R"({"do":"flush"})");
  ASSERT_TRUE(
      eventually([this] { return logged("flushMessagesWithCompletion: Flushing messages for session 2"); }));
  killed->kill();
  EXPECT_TRUE(arrive("client=killed&method=10", 1)) << daemonLog();
  EXPECT_TRUE(arrive("client=killed&method=0&status=1", 1)) << "the stop message of a session that crashed";
  EXPECT_EQ(textOf(records("killed", 0, 1).at(0), "GracefulTermination"), "0");
  sendAndSettle(*other, 11);
  flush(*other);
  EXPECT_TRUE(arrive("client=other&method=11", 1));
  EXPECT_TRUE(comesBackTo(before)) << descriptors() << " after " << before;
}

TEST_F(SessionEnds, AClientKilledWhileItsPostWaitsForAnAnswer) {
  const Process other = openAs("other", 20, 1);
  flush(*other);
  const size_t before = descriptors();
  Process killed = openAs("killed", 20, 2);
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/events","close":true,"times":1})"));
  killed->step(R"({"do":"send","category":10,"type":1,"flag":1,"repeat":20,"payload":{}})");
  EXPECT_EQ(killed->ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  killed->kill();
  // The first post, of the start message, broke; what was sent after it arrives.
  EXPECT_TRUE(arrive("client=killed&method=10", 19)) << arrived("client=killed") << daemonLog();
  EXPECT_TRUE(eventually([this] { return logged("dealloc: ReportingdSession dealloc: 2"); }));
  sendAndSettle(*other, 11);
  flush(*other);
  EXPECT_TRUE(arrive("client=other&method=11", 1));
  EXPECT_TRUE(comesBackTo(before)) << descriptors() << " after " << before;
}

TEST_F(SessionEnds, NothingOfHundredsOfKilledClientsStays) {
  // In rounds of clients that die with events in their batches, in a hierarchy, with shared data.
  const auto round = [this](int clients, int firstID) {
    const size_t endedBefore = ended();
    std::vector<Process> processes;
    for (int i = 0; i < clients; ++i) {
      processes.push_back(process());
      processes.back()->step(opening("killed", i % 3, firstID + i, i % 3 == 0));
      processes.back()->step(R"({"do":"configure"})");
      processes.back()->step(R"({"do":"sharedData","entries":{"k":"v"}})");
      processes.back()->step(R"({"do":"send","category":10,"type":1,"repeat":20,"payload":{"a":1,"b":"x"}})");
      if (i % 2 == 0) processes.back()->step(R"({"do":"displayURL"})");
    }
    for (size_t i = 0; i < processes.size(); i += 2)
      for (std::string line; line != "https://display.example.org/" && line != "(nothing)";)
        line = processes[i]->line();
    for (const Process& client : processes) client->kill();
    // Those that were not waited for may have died before they connected.
    EXPECT_TRUE(eventually([&] { return ended() >= endedBefore + static_cast<size_t>(clients) / 2; }));
    EXPECT_TRUE(eventually([&] { return countLogged("listener: Accepting new") == ended(); }))
        << "sessions stay";
  };
  // The allocator's heap takes some rounds to settle.
  int next = 1;
  for (int i = 0; i < (kSanitized ? 3 : 15); ++i) round(30, 100 * next++);
  const size_t before = descriptors();
  const long threads = statusNumber("Threads");
  // Threads that a crowded machine adds bring heaps along, once; what a session leaves comes with every one.
  long growth = 0;
  for (int attempt = 0; attempt == 0 || (attempt < 5 && !kSanitized && growth >= 600); ++attempt) {
    const long memory = statusNumber("RssAnon");
    for (int i = 0; i < (kSanitized ? 3 : 10); ++i) round(30, 100 * next++);
    growth = statusNumber("RssAnon") - memory;
  }
  EXPECT_TRUE(comesBackTo(before)) << descriptors() << " after " << before;
  EXPECT_TRUE(eventually([&] { return statusNumber("Threads") <= threads + 8; }))
      << statusNumber("Threads") << " after " << threads;
  if (!kSanitized) {
    EXPECT_LT(growth, 600) << "KiB: 2 KiB for each session";
  }
}

// A download happens while the agent's lock is held. Who needs the lock waits for it, as long as it takes and
// no longer: new sessions, storebags, sessions of hierarchies. Standalone sessions need no lock for events,
// flushes and user information.
TEST_F(SessionEnds, ADownloadHoldsUpOnlyWhoNeedsTheAgentsLock) {
  using Clock = std::chrono::steady_clock;
  const auto milliseconds = [](Clock::duration duration) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(duration).count();
  };
  const Process standalone = openAs("a", 20, 1), member = open("b", 0, 2);
  ASSERT_TRUE(
      stage_->control("/control/reply", R"({"path":"/bags/tolvar/dulvek","delayMs":10000,"times":1})"));
  const Process slow = process();
  slow->step(opening("c", -1, 3, false, 8));
  const auto begin = Clock::now();
  slow->step(R"({"do":"configure"})");
  ASSERT_TRUE(
      eventually([this] { return logged("fetchAndCacheStorebag: Fetching storebag for client type 8"); }));

  // These wait: a member of a hierarchy, and sessions that want another storebag, which is even cached; so
  // many of them that they would use up any small number of workers.
  member->step(sending(10));
  member->step(R"({"do":"displayURL"})");
  const Process late = process();
  late->step(opening("a", -1, 4));
  late->step(R"({"do":"configure"})");
  constexpr int kWaiting = 100;
  std::atomic<int> configured{0};
  std::vector<std::unique_ptr<KYTReporting>> waiting;
  for (int i = 0; i < kWaiting; ++i) {
    KYTReporting::Options options;
    options.socketPath = socket();
    options.sessionInfo =
        Dictionary{{kKYTReportingSessionInfoSessionID, 100 + i}, {kKYTReportingSessionInfoClientType, 20}};
    waiting.push_back(KYTReporting::open(std::move(options)));
    waiting.back()->startConfiguration([&configured](std::optional<std::vector<std::string>> states,
                                                     std::optional<Error>) { configured += states ? 1 : 0; });
  }

  // These do not.
  Clock::duration longest{};
  int calls = 0;
  while (Clock::now() - begin < std::chrono::seconds(4)) {
    const auto start = Clock::now();
    sendAndSettle(*standalone, 10);
    if (calls % 50 == 0) flush(*standalone);
    EXPECT_EQ(standalone->ask(R"({"do":"states","userInfo":{"ClientName":"a","ServiceName":"s)" +
                              std::to_string(calls++) + R"("}})"),
              "live: httppost");
    longest = std::max(longest, Clock::now() - start);
  }
  // A call held up by the download would have been answered after it.
  EXPECT_EQ(slow->line(std::chrono::milliseconds(0)), "(nothing)") << milliseconds(longest);
  RecordProperty("longestMilliseconds", std::to_string(milliseconds(longest)));
  RecordProperty("calls", std::to_string(calls));
  EXPECT_GT(calls, 10);
  EXPECT_GT(arrived("client=a&method=10"), 0) << "they even arrive meanwhile";
  EXPECT_EQ(member->line(std::chrono::milliseconds(0)), "(nothing)");
  EXPECT_EQ(late->line(std::chrono::milliseconds(0)), "(nothing)");
  EXPECT_EQ(configured, 0);

  EXPECT_EQ(slow->line(), "live: httppost");
  const auto download = Clock::now();
  EXPECT_GE(milliseconds(download - begin), 9900);
  EXPECT_EQ(member->line(), "https://display.example.org/");
  EXPECT_EQ(late->line(), "live: httppost");
  EXPECT_TRUE(eventually([&] { return configured == kWaiting; })) << configured;
  EXPECT_LT(milliseconds(Clock::now() - download), 9000) << "nobody waits for one more download";
}

}  // namespace
}  // namespace kyt
