// Hostile and broken clients on the real daemon, while a well-behaved one keeps sending: every one of its events
// arrives, and afterwards the daemon holds no more descriptors, threads and memory than before.
#include <fcntl.h>
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <random>
#include <sstream>
#include <thread>

#include "tests/integration/StageFixture.h"
#include "tests/ipc/WireTestSupport.h"
#include "tests/support/PlainClient.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define KYT_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define KYT_SANITIZED 1
#endif
#endif
#ifndef KYT_SANITIZED
#define KYT_SANITIZED 0
#endif

namespace kyt {
namespace {

using test::PlainClient;

constexpr int kDulvek = 8;

// What the daemon holds. Descriptors are -1 where the system does not show them to this user.
struct Holdings {
  long descriptors = -1, threads = 0, anonymousKiB = 0;

  static Holdings of(int pid) {
    Holdings found;
    const std::string folder = "/proc/" + std::to_string(pid);
    std::error_code error;
    std::filesystem::directory_iterator entries(folder + "/fd", error);
    if (!error) found.descriptors = std::distance(entries, {});
    std::ifstream status(folder + "/status");
    for (std::string line; std::getline(status, line);) {
      std::istringstream words(line);
      std::string key;
      long value = 0;
      words >> key >> value;
      if (key == "Threads:") found.threads = value;
      if (key == "RssAnon:") found.anonymousKiB = value;
    }
    return found;
  }
};

std::ostream& operator<<(std::ostream& out, const Holdings& h) {
  return out << h.descriptors << " descriptors, " << h.threads << " threads, " << h.anonymousKiB << " KiB";
}

// A session that sends and flushes all the time, at a moderate pace, on a thread of its own until it is told to end.
class SteadyClient {
 public:
  explicit SteadyClient(const std::string& socket) : client_(socket, kDulvek, "steady", 1) {}
  ~SteadyClient() { end(); }
  bool start() {
    if (client_.configure() != "live: httppost") return false;
    thread_ = std::thread([this] { run(); });
    return true;
  }
  // Waits for some more of its events to be taken and answered: the daemon serves it.
  [[nodiscard]] bool goesOn() {
    const long target = flushes_ + 2;
    return eventually([&] { return flushes_ >= target; });
  }
  // How many events it sent; all of them have left.
  long end() {
    if (thread_.joinable()) {
      ending_ = true;
      thread_.join();
      finished_ = client_.finish();
    }
    return sent_;
  }
  [[nodiscard]] bool finished() const { return finished_; }
  [[nodiscard]] const std::string& problem() const { return problem_; }
  [[nodiscard]] uint64_t lost() {
    const KYTReporting::Statistics figures = client_->statistics();
    return figures.accepted - figures.sent;
  }

 private:
  void run() {
    while (!ending_) {
      for (int i = 0; i < 20; ++i)
        if (client_.send(40, 1, Dictionary{{"number", sent_.load()}, {"text", "steady"}})) ++sent_;
      if (const std::string answer = client_.flush(); answer != "flushed") problem_ = answer;
      ++flushes_;
      tools::briefPause();
    }
  }
  TestClient client_;
  std::atomic<bool> ending_{false};
  std::atomic<long> sent_{0}, flushes_{0};
  std::string problem_;
  bool finished_ = false;
  std::thread thread_;
};

class BadInput : public StageTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.serverArguments = {"--keep-posts", "1000000"};
    lay(std::move(options));
    Dictionary victim = entry("victim");
    victim.set("event_threshold", 100);
    putBag("dulvek", {entry("steady"), victim});
    startDaemon();
    steady_ = std::make_unique<SteadyClient>(socket());
    ASSERT_TRUE(steady_->start());
    ASSERT_TRUE(steady_->goesOn());
    before_ = Holdings::of(pid());
  }
  void TearDown() override {
    if (steady_ != nullptr) {
      EXPECT_TRUE(steady_->goesOn());
      checkHoldings();
      const long sent = steady_->end();
      EXPECT_TRUE(steady_->finished());
      EXPECT_EQ(steady_->problem(), "");
      EXPECT_EQ(steady_->lost(), 0U);
      EXPECT_GT(sent, 0);
      EXPECT_TRUE(arrive("client=steady&method=40", sent)) << sent << " were sent";
      EXPECT_EQ(arrived("client=steady&method=40"), sent);
      EXPECT_EQ(total("bad"), 0);
      steady_.reset();
    }
    StageTest::TearDown();
  }
  // Within half a minute, the time in which idle workers and idle HTTP connections end: at most 2 descriptors and 8
  // threads (workers of the steady client) more than before, and without a sanitizer at most 8 MiB.
  void checkHoldings() {
    Holdings after;
    const bool returned = eventually([&] {
      after = Holdings::of(pid());
      return after.descriptors <= before_.descriptors + 2 && after.threads <= before_.threads + 8 &&
             (KYT_SANITIZED != 0 || after.anonymousKiB <= before_.anonymousKiB + 8192);
    });
    std::ostringstream text;
    text << before_ << "; then " << after;
    RecordProperty("holdings", text.str());
    EXPECT_TRUE(returned) << "before: " << before_ << "; after: " << after;
    if (before_.descriptors < 0) std::puts("the system does not show this user the daemon's descriptors");
  }
  [[nodiscard]] int pid() const { return stage_->daemon()->pid(); }
  // A new client is served as ever.
  void expectService() {
    PlainClient client(socket());
    ASSERT_TRUE(client.shakeHands());
    client.call("FetchDisplayURL");
    EXPECT_EQ(client.receiveText(), "URL not available");
  }
  void writeGrant(const std::string& user) {
    const auto problem = tools::writeFile(
        stage_->folder() + "/etc/kytreportingd/entitlements.d/stage.toml",
        "[[grant]]\nuser = " + user + "\n\"com.vantu.private.kytreportingd\" = true\n", 0644);
    ASSERT_FALSE(problem);
  }

  std::unique_ptr<SteadyClient> steady_;
  Holdings before_;
};

TEST_F(BadInput, MessagesCutAnywhereEndTheirConnectionAlone) {
  size_t cuts = 0;
  for (const std::string& call : test::everyCall()) {
    for (size_t length = 1; length < call.size(); length += 1 + call.size() / 24, ++cuts) {
      PlainClient client(socket());
      ASSERT_TRUE(client.shakeHands());
      EXPECT_TRUE(client.send(call.substr(0, length)));
      client.halfClose();
      EXPECT_TRUE(client.atEnd()) << "a message of " << call.size() << " bytes, cut after " << length;
    }
  }
  EXPECT_GT(cuts, 200U);
  expectService();
}

TEST_F(BadInput, ChangedBytesEndTheirConnectionAtMost) {
  std::mt19937 random(20260131);  // NOLINT: the same changes in each run
  const std::vector<std::string> calls = test::everyCall();
  for (int i = 0; i < 400; ++i) {
    std::string call = calls[random() % calls.size()];
    for (unsigned changes = 1 + random() % 4; changes != 0; --changes)
      call[random() % call.size()] = static_cast<char>(random());
    PlainClient client(socket());
    ASSERT_TRUE(client.shakeHands());
    client.send(call);
    client.halfClose();
    while (client.receive()) {
    }
  }
  expectService();
}

TEST_F(BadInput, GarbageInsteadOfAHandshakeEndsTheConnection) {
  std::string noise;
  std::mt19937 random(7);  // NOLINT
  for (int i = 0; i < 20000; ++i) noise.push_back(static_cast<char>(random() | 1));
  for (const std::string& garbage :
       {noise, std::string("GET / HTTP/1.1\r\nHost: localhost\r\n\r\n"),
        std::string(1, '\0') + std::string(40000, 'A'), std::string("\0BEGIN\r\n", 8),
        std::string("\0AUTH EXTERNAL 393939393939\r\nBEGIN\r\n", 36)}) {
    PlainClient client(socket());
    client.send(garbage);
    client.halfClose();
    while (client.fill()) client.received().clear();
  }
  expectService();
}

TEST_F(BadInput, AHugeLengthIsRefusedAtItsHeader) {
  for (const bool inFields : {false, true}) {
    PlainClient client(socket());
    ASSERT_TRUE(client.shakeHands());
    std::string call = test::everyCall()[3];
    const uint32_t length = 100u << 20;
    std::memcpy(call.data() + (inFields ? 12 : 4), &length, sizeof length);
    EXPECT_TRUE(client.send(call));
    EXPECT_TRUE(client.atEnd()) << "ended before those bytes could have come";
  }
  expectService();
}

// A call of SendMessageWithDictionary whose payload is so many variants within each other.
std::string nestedCall(int depth) {
  std::string body;
  const auto align = [&body](size_t to) { body.append((to - body.size() % to) % to, '\0'); };
  const auto put32 = [&body](uint32_t value) { body.append(reinterpret_cast<const char*>(&value), 4); };
  put32(0);
  align(8);
  const size_t first = body.size();
  put32(7);
  body += std::string("Payload\0", 8);
  for (int i = 0; i < depth; ++i) body += std::string("\1v\0", 3);
  body += std::string("\1y\0\7", 4);
  const auto length = static_cast<uint32_t>(body.size() - first);
  std::memcpy(body.data(), &length, 4);
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(1, {.member = "SendMessageWithDictionary", .signature = "a{sv}"});
  writer.writeEmptyDictionary();
  EXPECT_TRUE(writer.end());
  uint32_t written = 0;
  std::memcpy(&written, bytes.data() + 4, 4);
  bytes.resize(bytes.size() - written);
  const auto size = static_cast<uint32_t>(body.size());
  std::memcpy(bytes.data() + 4, &size, 4);
  return bytes + body;
}

TEST_F(BadInput, DeepNestingIsRefused) {
  for (const int depth : {30, 61, 62, 64, 65, 100, 10000, 300000}) {
    PlainClient client(socket());
    ASSERT_TRUE(client.shakeHands());
    client.send(nestedCall(depth));
    client.call("FetchDisplayURL");
    const auto answer = client.receive();
    EXPECT_EQ(answer.has_value(), depth <= 61) << depth << " variants within each other";
  }
  expectService();
}

TEST_F(BadInput, AClientThatNeverReadsHoldsUpNobody) {
  PlainClient client(socket());
  ASSERT_TRUE(client.shakeHands());
  std::string batch;
  for (uint32_t i = 1; i <= 64; ++i) {
    MessageWriter writer(batch);
    writer.beginCall(i, {.interface = "org.freedesktop.DBus.Introspectable", .member = "Introspect"});
    ASSERT_TRUE(writer.end());
  }
  ASSERT_EQ(::fcntl(client.descriptor(), F_SETFL, O_NONBLOCK), 0);
  // Until the daemon reads no more of it, which its log says.
  size_t sent = 0, offset = 0;
  const auto stopped = [this] { return logged("does not read its replies") || logged("it reads nothing"); };
  while (sent < (16u << 20)) {
    const ssize_t count =
        ::send(client.descriptor(), batch.data() + offset, batch.size() - offset, MSG_NOSIGNAL);
    if (count < 0 && errno != EAGAIN) break;
    if (count > 0) {
      sent += static_cast<size_t>(count);
      offset = (offset + static_cast<size_t>(count)) % batch.size();
      continue;
    }
    pollfd room{client.descriptor(), POLLOUT, 0};
    if (::poll(&room, 1, 100) == 0 && stopped()) break;
  }
  EXPECT_LT(sent, 16u << 20) << "a limit must have stopped it";
  EXPECT_TRUE(eventually(stopped)) << daemonLog();
  ASSERT_TRUE(steady_->goesOn());
  expectService();
}

TEST_F(BadInput, DescriptorsThatNobodyAskedForAreClosed) {
  const Descriptor file = ownDescriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  for (int i = 0; i < 50; ++i) {
    PlainClient client(socket());
    ASSERT_TRUE(client.shakeHands());
    client.call(
        "FetchDisplayURL", "", [](MessageWriter&) {}, true, std::vector<int>(16, file.get()));
    EXPECT_EQ(client.receiveText(), "URL not available");
    // More than a message may carry, with a call that stays incomplete.
    client.send(test::everyCall()[7].substr(0, 20), std::vector<int>(60, file.get()));
    if (i % 2 == 0) continue;
    client.halfClose();
    EXPECT_TRUE(client.atEnd());
  }
  for (int i = 0; i < 50; ++i) {
    PlainClient client(socket());
    client.send(ClientHandshake::opening(::getuid()), std::vector<int>(16, file.get()));
    client.halfClose();
    while (client.fill()) client.received().clear();
  }
  expectService();
}

TEST_F(BadInput, AByteAtATimeIsServedLikeAnyOther) {
  PlainClient client(socket());
  const std::string opening = ClientHandshake::opening(::getuid());
  for (const char byte : opening) ASSERT_TRUE(client.send(std::string(1, byte)));
  std::string calls;
  MessageWriter writer(calls);
  writer.beginCall(1, {.member = "SetSessionInfo", .signature = "a{sv}aa{sv}avb"});
  writer.writeDictionary({{"SessionID", 12345}, {"ClientType", kDulvek}});
  writer.writeOptionalDictionary(std::nullopt);
  writer.writeOptionalValue(Value());
  writer.writeBoolean(false);
  ASSERT_TRUE(writer.end());
  writer.beginCall(2, {.member = "FetchDisplayURL"});
  ASSERT_TRUE(writer.end());
  for (const char byte : calls) ASSERT_TRUE(client.send(std::string(1, byte)));
  ASSERT_TRUE(eventually(
      [&] { return client.received().find("URL not available") != std::string::npos || !client.fill(); }));
  EXPECT_NE(client.received().find("URL not available"), std::string::npos);
  EXPECT_TRUE(logged("Session 12345 has no correlated sessions"));
}

TEST_F(BadInput, AClientKilledInTheMiddleLosesNothingThatTheDaemonTook) {
  const TemporaryFolder folder;
  const std::string script = folder.write(
      "script",
      "{\"do\":\"open\",\"sessionInfo\":{\"SessionID\":9,\"ClientType\":8,\"BatchEvent\":true,\"RequireUserInfo\":true},"
      "\"userInfo\":{\"ClientName\":\"victim\"}}\n{\"do\":\"configure\"}\n"
      "{\"do\":\"send\",\"category\":50,\"type\":1,\"payload\":{\"k\":1},\"reply\":true}\n"
      "{\"do\":\"send\",\"category\":51,\"type\":1,\"payload\":{\"k\":1},\"repeat\":100000000}\n");
  tools::ChildProcess::Options how;
  how.outputFile = folder / "output";
  auto victim =
      tools::ChildProcess::start(stage_->program("kytctl"), {"session", "--socket", socket(), script}, how);
  ASSERT_TRUE(victim);
  // Its batch is full now and then, so events arrive while it sends.
  EXPECT_TRUE(arrive("client=victim&method=51", 1)) << folder.read("output") << daemonLog();
  ASSERT_TRUE(victim->isRunning());
  victim->signal(SIGKILL);
  EXPECT_EQ(victim->wait(kTestDeadline).value_or(-1), 128 + SIGKILL);
  EXPECT_TRUE(arrive("client=victim&method=50", 1));
  EXPECT_TRUE(arrive("client=victim&method=0&status=1", 1)) << "its session ended like any other";
}

TEST_F(BadInput, ARefusedClientIsToldNothingAndAChangedGrantCountsForTheNext) {
  writeGrant("4294967000");
  {
    PlainClient client(socket());
    client.send(ClientHandshake::opening(::getuid()));
    EXPECT_FALSE(client.fill());
    EXPECT_TRUE(client.received().empty());
  }
  ASSERT_TRUE(steady_->goesOn()) << "who is connected stays";
  writeGrant(std::to_string(::geteuid()));
  expectService();
}

TEST_F(BadInput, ThousandsOfConnectionsComeAndGo) {
  for (int i = 0; i < 3000; ++i) {
    const PlainClient client(socket());
    ASSERT_TRUE(client.connected());
  }
  std::vector<std::unique_ptr<PlainClient>> silent;
  for (int i = 0; i < 400; ++i) {
    silent.push_back(std::make_unique<PlainClient>(socket()));
    ASSERT_TRUE(silent.back()->connected());
    if (i % 2 == 0) silent.back()->send(ClientHandshake::opening(::getuid()));
  }
  expectService();
}

}  // namespace
}  // namespace kyt
