// What goes wrong around a receiver: hostile posts, processes that die, a log and a disk that are full.
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "receiver/EventLog.h"
#include "receiver/PostCheck.h"
#include "tests/receiver/Load.h"
#include "tests/receiver/ReceiverTest.h"
#include "tests/support/ChildProcess.h"
#include "tools/demo/Ports.h"

namespace kyt::receiver {
namespace {

class ReceiverInTrouble : public ReceiverTest {
 protected:
  // What the server has not read of its connections, in bytes.
  [[nodiscard]] static uint64_t unreadBytes(uint16_t port) {
    char wanted[32];
    std::snprintf(wanted, sizeof wanted, " 0100007F:%04X ", port);
    std::ifstream table("/proc/net/tcp");
    uint64_t most = 0;
    for (std::string line; std::getline(table, line);) {
      if (line.find(wanted) == std::string::npos || line.find(wanted) > 8) continue;
      const size_t colon = line.find(':', line.find(" 01 "));
      if (colon != std::string::npos)
        most = std::max<uint64_t>(most, std::stoull(line.substr(colon + 1, 8), nullptr, 16));
    }
    return most;
  }
  void expectOthersAreServed(std::chrono::seconds within = std::chrono::seconds(1)) {
    for (uint64_t i = 0; i < 50; ++i) {
      const HttpReply reply = receiver_->post(postText(i));
      EXPECT_EQ(reply.status, 200);
      EXPECT_LT(reply.took, within);
    }
  }
  [[nodiscard]] uint16_t serverPort() const {
    const std::string url = servers_.url(0);
    return static_cast<uint16_t>(std::stoi(url.substr(url.rfind(':') + 1)));
  }
};

TEST_F(ReceiverInTrouble, OpensPostsWhereItIsToldToAndRefusesBombsAndWrongJSON) {
  ReceiverProcess::Options options;
  options.arguments = {"--check", "full"};
  start(options);
  const auto post = [&](const std::string& body) {
    return receiver_->post(body, {"Content-Encoding: gzip"}).status;
  };
  EXPECT_EQ(post(gzipped(postText(1))), 200);
  EXPECT_EQ(post(gzipped("[1]")), 400);
  EXPECT_EQ(post(gzipped(postText(2)).substr(0, 40)), 400);
  EXPECT_EQ(post(gzipped(R"({"events":[)" + std::string(64 << 20, ' ') + "]}")), 400);
  EXPECT_EQ(post(gzipped(R"({"events":[{"a":")" + std::string(64 << 20, 'x') + "\"}]}")), 400);
  EXPECT_EQ(view_->messages(), 1U);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"not-json\"}"), 2) << "a string that is too long";
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"not-gzip\"}"), 2);
}

TEST_F(ReceiverInTrouble, BombsInFlightSlowNobodyElse) {
  ReceiverProcess::Options options;
  options.arguments = {"--check", "full"};
  start(options);
  // The most that a body of its size may hold: many short values, of which each is looked at.
  std::string values;
  while (values.size() < (64 << 20)) values += "{\"a\":1,\"b\":2,\"c\":3},";
  values.back() = ']';
  const std::string bomb = gzipped("{\"events\":[" + values + "}");
  ASSERT_LT(bomb.size(), 2U << 20);
  values.clear();
  std::atomic<int> posted{0}, others{0};
  std::vector<std::thread> bombers;
  for (int i = 0; i < 32; ++i)
    bombers.emplace_back([&] {
      HttpConnection connection(receiver_->port());
      ++posted;
      const int status = connection.post("/v1/events", bomb, {"Content-Encoding: gzip"}).status;
      if (status != 200 && status != 400 && status != 429) ++others;
    });
  ASSERT_TRUE(eventually(
      [&] { return posted == 32 && receiver_->metric("kyt_bodies_bytes").value_or(0) > bomb.size(); }));
  // One behind the other they take far longer, also on a machine that is busy with a sanitizer.
  expectOthersAreServed(std::chrono::seconds(5));
  for (std::thread& bomber : bombers) bomber.join();
  EXPECT_EQ(others, 0);
}

TEST_F(ReceiverInTrouble, AMetricsPortThatIsTakenEndsTheStartInOrderThoughPostsCome) {
  start();
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  options.port = tools::freePort();
  options.metricsPort = receiver_->metricsPort();
  std::atomic<bool> isOver{false};
  std::vector<std::thread> posting;
  for (int i = 0; i < 2; ++i)
    posting.emplace_back([&] {
      while (!isOver) static_cast<void>(HttpConnection(options.port).post("/v1/events", postText(1)));
    });
  for (int i = 0; i < 10; ++i) {
    ReceiverProcess second(options);
    EXPECT_FALSE(second.isReady());
    EXPECT_EQ(second.terminate(), 1) << second.output();
    EXPECT_NE(second.output().find("start: metrics: "), std::string::npos) << second.output();
  }
  isOver = true;
  for (std::thread& thread : posting) thread.join();
}

// Sends a byte now and then until the other side ends the connection or this object ends.
class Dribble {
 public:
  Dribble(uint16_t port, const std::string& beginning) : connection_(port) {
    connection_.send(beginning);
    thread_ = std::thread([this] {
      while (!isOver_ && connection_.send("x")) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    });
  }
  ~Dribble() {
    isOver_ = true;
    thread_.join();
  }
  Dribble(const Dribble&) = delete;
  Dribble& operator=(const Dribble&) = delete;
  [[nodiscard]] bool isCutOff() { return connection_.isClosed(); }

 private:
  HttpConnection connection_;
  std::atomic<bool> isOver_{false};
  std::thread thread_;
};

TEST_F(ReceiverInTrouble, ASlowBodyIsCutOffAndSlowsNobodyElse) {
  ReceiverProcess::Options options;
  options.limits = "body_seconds = 2\n";
  start(options);
  // One is silent, one sends a byte now and then: neither is whole in time.
  const std::string beginning = "POST /v1/events HTTP/1.1\r\nHost: t\r\nContent-Length: 100000\r\n\r\n{";
  HttpConnection silent(receiver_->port());
  silent.send(beginning);
  Dribble dribbling(receiver_->port(), beginning);
  expectOthersAreServed();
  EXPECT_TRUE(silent.isClosed());
  EXPECT_TRUE(dribbling.isCutOff());
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_refused_total{reason=\"too-slow\"}") == 2; }))
      << receiver_->get("/metrics").body;
  EXPECT_EQ(view_->messages(), 50U);
}

TEST_F(ReceiverInTrouble, SlowHeadersAreCutOffAndSlowNobodyElse) {
  ReceiverProcess::Options options;
  options.limits = "idle_seconds = 2\n";
  start(options);
  const auto begun = std::chrono::steady_clock::now();
  HttpConnection mute(receiver_->port());
  std::vector<std::unique_ptr<Dribble>> dribbling;
  for (int i = 0; i < 20; ++i)
    dribbling.push_back(
        std::make_unique<Dribble>(receiver_->port(), "POST /v1/events HTTP/1.1\r\nHost: t\r\nX-Slow: "));
  expectOthersAreServed();
  for (const auto& one : dribbling) EXPECT_TRUE(one->isCutOff());
  EXPECT_TRUE(mute.isClosed());
  EXPECT_GE(std::chrono::steady_clock::now() - begun, std::chrono::seconds(2));
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_connections") == 0; }));
  EXPECT_EQ(view_->messages(), 50U);
}

TEST_F(ReceiverInTrouble, AnIdleConnectionOutlivesTheTimeOfABody) {
  ReceiverProcess::Options options;
  options.limits = "body_seconds = 1\n";
  start(options);
  HttpConnection front(receiver_->port());
  EXPECT_EQ(front.post("/v1/events", postText(1)).status, 200);
  EXPECT_FALSE(front.isClosed(std::chrono::milliseconds(3500)));
  EXPECT_EQ(front.post("/v1/events", postText(2)).status, 200);
}

TEST_F(ReceiverInTrouble, AHangUpSignalChangesNothing) {
  start();
  const int before = receiver_->pid();
  receiver_->signal(SIGHUP);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->get("/readyz").status, 200);
  EXPECT_EQ(receiver_->pid(), before);
  EXPECT_EQ(receiver_->terminate(), 0) << receiver_->output();
}

class ReceiverOnASmallLog : public ReceiverTest {
 protected:
  ReceiverOnASmallLog() : ReceiverTest({1, "max_payload: 1MB"}) {}
  static constexpr size_t kTooLarge = 2 << 20, kTaken = 1000 << 10;
  static constexpr char kTooLargeReason[] = "kyt_refused_total{reason=\"too-large\"}";
};

TEST_F(ReceiverOnASmallLog, SaysSoAtItsStartAndRefusesWhatThatNeverTakes) {
  start();
  EXPECT_NE(receiver_->output().find("posts over 1040384 bytes are refused"), std::string::npos);
  EXPECT_EQ(receiver_->post(std::string(kTooLarge, 'x')).status, 413);
  EXPECT_EQ(receiver_->post(std::string(kTaken, 'x')).status, 200);
  servers_.kill(0);
  EXPECT_EQ(receiver_->post(std::string(kTooLarge, 'x')).status, 413) << "it knows it still";
  EXPECT_EQ(receiver_->metric(kTooLargeReason), 2);
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 0);
}

TEST_F(ReceiverOnASmallLog, KeepsNothingThatTheLogMayNeverTakeBeforeTheLogWasThere) {
  servers_.kill(0);
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  receiver_.emplace(options);
  ASSERT_TRUE(receiver_->isReady()) << receiver_->output();
  EXPECT_EQ(receiver_->post(std::string(kTooLarge, 'x')).status, 429);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"log-limit-unknown\"}"), 1);
  EXPECT_EQ(receiver_->post(std::string(kTaken, 'x')).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
  servers_.start(0);
  start();
  EXPECT_TRUE(spoolBecomesEmpty());
  EXPECT_EQ(receiver_->metric("kyt_spool_stuck_total"), 0);
  EXPECT_EQ(receiver_->post(std::string(kTooLarge, 'x')).status, 413);
}

class ReceiverOnALogForTinyMessages : public ReceiverTest {
 protected:
  ReceiverOnALogForTinyMessages() : ReceiverTest({1, "max_payload: 8KB"}) {}
};

TEST_F(ReceiverOnALogForTinyMessages, IsNotReadyAndRefusesNothingForGood) {
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  receiver_.emplace(options);
  ASSERT_TRUE(eventually([&] {
    return receiver_->output().find("max_payload is below 73728") != std::string::npos;
  })) << receiver_->output();
  EXPECT_EQ(receiver_->post(std::string(2 << 20, 'x')).status, 429);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
  EXPECT_EQ(receiver_->metric("kyt_log_up"), 0);
  EXPECT_EQ(receiver_->get("/readyz").status, 503);
}

TEST_F(ReceiverInTrouble, AConnectionThatEndsInTheMiddleOfAPostIsCounted) {
  start();
  {
    HttpConnection cut(receiver_->port());
    cut.send("POST /v1/events HTTP/1.1\r\nHost: t\r\nContent-Length: 1000\r\n\r\n{");
    ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_bodies_bytes") == 1; }));
  }
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_refused_total{reason=\"cut-off\"}") == 1; }));
  EXPECT_EQ(receiver_->metric("kyt_bodies_bytes"), 0);
}

TEST_F(ReceiverInTrouble, KilledBetweenPublicationAndAnswerARepeatIsStoredOnce) {
  start();
  // What a server writes to the one that is gone resets their connection, and what it had not read is lost: then again.
  for (uint64_t i = 1, duplicates = 0; duplicates == 0; ++i) {
    ASSERT_LE(i, 10U) << "it was never published";
    const std::string body = postText(i, 3000);
    servers_.pause(0);
    HttpConnection device(receiver_->port());
    device.send("POST /v1/events HTTP/1.1\r\nHost: t\r\nContent-Length: " + std::to_string(body.size()) +
                "\r\n\r\n" + body);
    ASSERT_TRUE(eventually([&] { return unreadBytes(serverPort()) > body.size(); })) << "not published";
    receiver_->kill();
    servers_.resume(0);
    EXPECT_TRUE(device.isClosed());
    ASSERT_TRUE(eventually([&] { return unreadBytes(serverPort()) == 0; }));
    receiver_->start();
    ASSERT_TRUE(receiver_->becomesReady());
    EXPECT_EQ(receiver_->post(body).status, 200);
    EXPECT_EQ(view_->messages(), i);
    duplicates = static_cast<uint64_t>(receiver_->metric("kyt_duplicates_total").value_or(0));
  }
}

TEST_F(ReceiverInTrouble, KilledUnderLoadNoAnsweredPostIsLostAndNoneIsStoredTwice) {
  ReceiverProcess::Options options;
  options.port = tools::freePort();
  start(options);
  Load load({{receiver_->port()}});
  for (uint64_t times = 1; times <= 3; ++times) {
    ASSERT_TRUE(eventually([&] { return load.answered() > 200 * times; }));
    receiver_->kill();
    receiver_->start();
  }
  ASSERT_TRUE(eventually([&] { return load.answered() > 1000; }));
  load.stop();
  EXPECT_TRUE(spoolBecomesEmpty());
  const auto stored = view_->ids();
  EXPECT_EQ(load.missingIn(stored), 0U) << "of " << load.taken().size();
  for (const auto& [id, times] : stored) EXPECT_EQ(times, 1) << id;
  EXPECT_TRUE(load.others().empty());
}

TEST_F(ReceiverInTrouble, ToldToEndUnderLoadItLosesNoAnsweredPost) {
  ReceiverProcess::Options options;
  options.port = tools::freePort();
  const TemporaryFolder folder;
  options.spool = folder / "spool";
  start(options);
  Load load({{receiver_->port()}});
  ASSERT_TRUE(eventually([&] { return load.answered() > 300; }));
  EXPECT_EQ(receiver_->terminate(), 0) << receiver_->output();
  // With the log's server stopped, too: what is on its way goes to the spool before the end.
  receiver_->start();
  const uint64_t before = load.answered();
  ASSERT_TRUE(eventually([&] { return load.answered() > before + 300; }));
  servers_.pause(0);
  EXPECT_EQ(receiver_->terminate(), 0) << receiver_->output();
  servers_.resume(0);
  load.stop();
  receiver_->start();
  ASSERT_TRUE(receiver_->becomesReady());
  EXPECT_TRUE(spoolBecomesEmpty());
  const auto stored = view_->ids();
  EXPECT_EQ(load.missingIn(stored), 0U) << "of " << load.taken().size();
  for (const auto& [id, times] : stored) EXPECT_EQ(times, 1) << id;
}

TEST_F(ReceiverInTrouble, WithTheStreamFullItSpoolsAndWithTheSpoolFullItRefusesWith429) {
  ReceiverProcess::Options options;
  options.spoolMaxBytes = 2 << 20;
  start(options);
  ASSERT_TRUE(view_->setMaxBytes(1 << 20));
  std::map<int, int> statuses;
  std::set<std::string> taken;
  for (uint64_t i = 0; i < 40 && statuses[429] < 5; ++i) {
    const std::string body = postText(i, 100000);
    const HttpReply reply = receiver_->post(body);
    ++statuses[reply.status];
    if (reply.status == 200) taken.insert(body);
    if (reply.status == 429) {
      EXPECT_NE(reply.headers.find("retry-after"), reply.headers.end());
    }
  }
  EXPECT_EQ(statuses[200] + statuses[429], statuses[200] + 5) << "no other answer";
  EXPECT_GT(statuses[200], 25);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"spool-full\"}"), 5);
  EXPECT_EQ(receiver_->metric("kyt_log_up"), 0) << "it takes nothing";
  EXPECT_EQ(receiver_->get("/readyz").status, 503);
  ASSERT_TRUE(view_->setMaxBytes(-1));
  EXPECT_TRUE(spoolBecomesEmpty());
  EXPECT_EQ(receiver_->metric("kyt_log_up"), 1);
  EXPECT_EQ(receiver_->get("/readyz").status, 200);
  EXPECT_EQ(receiver_->post(postText(1000)).status, 200);
  EXPECT_EQ(view_->messages(), taken.size() + 1);
}

TEST_F(ReceiverInTrouble, WithTheSpoolsDiskFullItRefusesWith429AndGoesOnWhenTheLogTakesPostsAgain) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "this user may mount nothing";
  const TemporaryFolder folder;
  ReceiverProcess::Options options;
  options.spool = folder.path();
  options.wrapper = {
      "unshare",    "--mount", "sh", "-c", "mount -t tmpfs -o size=4m none \"$0\" && exec \"$@\"",
      folder.path()};
  start(options);
  ASSERT_TRUE(view_->setMaxBytes(1 << 20));
  int taken = 0, refused = 0;
  for (uint64_t i = 0; i < 100 && refused < 5; ++i) {
    const int status = receiver_->post(postText(i, 100000)).status;
    ASSERT_TRUE(status == 200 || status == 429) << status;
    ++(status == 200 ? taken : refused);
  }
  EXPECT_EQ(refused, 5);
  EXPECT_GT(taken, 15);
  EXPECT_GE(receiver_->metric("kyt_refused_total{reason=\"spool-broken\"}"), 5);
  EXPECT_EQ(receiver_->get("/readyz").status, 503) << "another receiver may have a better disk";
  ASSERT_TRUE(view_->setMaxBytes(-1));
  EXPECT_TRUE(eventually([&] { return receiver_->post(postText(1000)).status == 200; }));
  EXPECT_TRUE(spoolBecomesEmpty()) << receiver_->output();
  EXPECT_EQ(view_->messages(), static_cast<uint64_t>(taken) + 1);
}

TEST_F(ReceiverInTrouble, WithoutASpoolItStartsAndServesAndTakesItUpWhenTheDiskGivesIt) {
  const TemporaryFolder folder;
  const std::string inTheWay = folder.write("spool", "no folder");
  ReceiverProcess::Options options;
  options.spool = inTheWay;
  start(options);
  EXPECT_NE(receiver_->output().find("posts that the log does not take are refused"), std::string::npos)
      << receiver_->output();
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->get("/readyz").status, 200);
  servers_.kill(0);
  ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_log_up") == 0; }));
  EXPECT_EQ(receiver_->post(postText(2)).status, 429);
  EXPECT_EQ(receiver_->get("/readyz").status, 503);
  std::filesystem::remove(inTheWay);
  EXPECT_TRUE(eventually([&] { return receiver_->post(postText(3)).status == 200; })) << receiver_->output();
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
  EXPECT_EQ(receiver_->get("/readyz").status, 200);
}

TEST_F(ReceiverInTrouble, WithTheBrakeOnItRefusesWith503) {
  ReceiverProcess::Options options;
  options.spoolMaxBytes = 1 << 20;
  options.arguments = {"--refuse-with", "503"};
  start(options);
  ASSERT_TRUE(view_->setMaxBytes(1 << 20));
  EXPECT_TRUE(eventually(
      [&, i = uint64_t{0}]() mutable { return receiver_->post(postText(i++, 300000)).status == 503; }));
}

TEST_F(ReceiverInTrouble, APartitionThatNoStreamTakesGoesToTheSpoolAtOnceAndTheOthersToTheLog) {
  ReceiverProcess::Options options;
  options.log = "partitions = 3\npublish_seconds = 4\n";
  start(options);
  ASSERT_TRUE(view_->setSubject("kyt.events.0"));
  // No answer may be lost that is on its way while others are refused.
  std::atomic<uint64_t> ofTheStream{0}, slow{0}, failed{0};
  std::vector<std::thread> devices;
  for (uint64_t device = 0; device < 8; ++device)
    devices.emplace_back([&, device] {
      for (uint64_t i = device * 100; i < device * 100 + 50; ++i) {
        if (partitionOf(messageID(postText(i)), 3) == 0) ++ofTheStream;
        const HttpReply reply = receiver_->post(postText(i));
        if (reply.status != 200) ++failed;
        if (reply.took > std::chrono::seconds(3)) ++slow;
      }
    });
  for (std::thread& device : devices) device.join();
  EXPECT_EQ(failed, 0U);
  EXPECT_EQ(slow, 0U) << "answers waited until the log's time was over";
  EXPECT_GT(ofTheStream, 0U);
  EXPECT_EQ(view_->messages(), ofTheStream.load());
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), static_cast<double>(400 - ofTheStream));
  ASSERT_TRUE(view_->setSubject("kyt.events.*"));
  EXPECT_TRUE(spoolBecomesEmpty());
  EXPECT_EQ(view_->messages(), 400U);
}

TEST_F(ReceiverInTrouble, ManyPartitionsLoseNothingWhereAStreamTakesOneAlone) {
  ReceiverProcess::Options options;
  options.log = "partitions = 130\npublish_seconds = 4\n";  // more than are told apart
  start(options);
  for (uint64_t i = 0; i < 150; ++i) EXPECT_EQ(receiver_->post(postText(i)).status, 200);
  EXPECT_EQ(view_->messages(), 150U);
  ASSERT_TRUE(view_->setSubject("kyt.events.7"));
  for (uint64_t i = 150; i < 300; ++i) {
    const HttpReply reply = receiver_->post(postText(i));
    EXPECT_EQ(reply.status, 200);
    EXPECT_LT(reply.took, std::chrono::seconds(3)) << "it waited until the log's time was over";
  }
  EXPECT_GT(receiver_->metric("kyt_spool_posts"), 100.0);
  ASSERT_TRUE(view_->setSubject("kyt.events.*"));
  EXPECT_TRUE(spoolBecomesEmpty());
  EXPECT_EQ(view_->messages(), 300U);
}

TEST_F(ReceiverInTrouble, ASecondReceiverOnTheSameSpoolDoesNotStart) {
  const TemporaryFolder folder;
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  options.spool = folder / "spool";
  receiver_.emplace(options);
  ASSERT_TRUE(receiver_->isReady());
  ReceiverProcess second(options);
  EXPECT_FALSE(second.isReady());
  EXPECT_NE(second.output().find("another receiver has the folder"), std::string::npos);
  second.kill();
}

// An operator's "rm -r": what has no name any more would be gone with the process, though devices were told 200.
TEST_F(ReceiverInTrouble, TellsNoDeviceThatAPostIsKeptInASpoolThatWasRemoved) {
  const TemporaryFolder folder;
  ReceiverProcess::Options options;
  options.spool = folder / "spool";
  start(options);
  servers_.kill(0);
  ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_log_up") == 0; }));
  ASSERT_EQ(receiver_->post(postText(1)).status, 200);
  std::filesystem::remove_all(options.spool);
  EXPECT_EQ(receiver_->post(postText(2)).status, 429);
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
  // What the open file has still goes to the log, and then there is a spool again.
  servers_.start(0);
  ASSERT_TRUE(spoolBecomesEmpty());
  EXPECT_TRUE(eventually([&] { return view_->messages() == 1U; }));
  EXPECT_TRUE(eventually([&] { return std::filesystem::exists(options.spool + "/lock"); }));
  EXPECT_EQ(receiver_->post(postText(3)).status, 200);
  servers_.kill(0);
  ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_log_up") == 0; }));
  EXPECT_TRUE(eventually([&] { return receiver_->post(postText(4)).status == 200; }));
  receiver_->kill();
  receiver_->start();
  ASSERT_TRUE(receiver_->isReady());
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
  servers_.start(0);
  ASSERT_TRUE(spoolBecomesEmpty());
}

TEST_F(ReceiverInTrouble, MakesASpoolThatWasRemovedWhileItWasEmptyAnew) {
  const TemporaryFolder folder;
  ReceiverProcess::Options options;
  options.spool = folder / "spool";
  start(options);
  std::filesystem::remove_all(options.spool);
  servers_.kill(0);
  ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_log_up") == 0; }));
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_TRUE(std::filesystem::exists(options.spool + "/outbox.sqlite"));
  servers_.start(0);
  ASSERT_TRUE(spoolBecomesEmpty());
}

}  // namespace
}  // namespace kyt::receiver
