// Clients of one user that take all they can get of the daemon, and another user's events beside them: none is lost,
// and each is answered as if the former were not there.
#include <fcntl.h>
#include <grp.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <functional>
#include <memory>
#include <random>
#include <vector>

#include "tests/integration/HierarchyFixture.h"
#include "tests/integration/UploadFixture.h"
#include "tests/support/MemoryGroup.h"
#include "tests/support/PlainClient.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using test::PlainClient;

constexpr uid_t kNobody = 65534;
constexpr uid_t kStranger = 65533;  // without a grant
constexpr int kTorvel = 5;

// A process of another user that does its worst, says so, and does it again and again until it is killed.
class Attacker {
 public:
  Attacker(const std::string& socket, const std::function<void(const std::string& socket)>& work,
           uid_t user = kNobody) {
    int ends[2];
    if (::pipe(ends) != 0) return;
    pid_ = ::fork();
    if (pid_ == 0) {
      if (::setgroups(0, nullptr) != 0 || ::setgid(user) != 0 || ::setuid(user) != 0) ::_exit(126);
      ::prctl(PR_SET_PDEATHSIG, SIGKILL);
      ::fcntl(ends[1], F_SETFL, O_NONBLOCK);
      for (;;) {
        work(socket);
        static_cast<void>(::write(ends[1], "x", 1));
      }
    }
    ::close(ends[1]);
    done_ = ends[0];
  }
  ~Attacker() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      static_cast<void>(::waitpid(pid_, nullptr, 0));
    }
    ::close(done_);
  }
  Attacker(const Attacker&) = delete;
  Attacker& operator=(const Attacker&) = delete;
  // Whether all of the attack has been made once.
  [[nodiscard]] bool isDone(std::chrono::milliseconds patience = std::chrono::seconds(0)) const {
    pollfd waiting{done_, POLLIN, 0};
    return ::poll(&waiting, 1, static_cast<int>(patience.count())) == 1;
  }

 private:
  pid_t pid_ = 0;
  int done_ = -1;
};

// Connections that the daemon may end at any time, kept until the next round.
using Connections = std::vector<std::unique_ptr<PlainClient>>;

std::string manyIntrospections(size_t bytes) {
  std::string calls;
  MessageWriter writer(calls);
  for (uint32_t serial = 1; calls.size() < bytes; ++serial) {
    writer.beginCall(serial, {.path = "/com/vantu/kytreportingd",
                              .interface = "org.freedesktop.DBus.Introspectable",
                              .member = "Introspect"});
    static_cast<void>(writer.end());
  }
  return calls;
}

// What a client says about itself, most of it a text of that length.
std::string callWithText(size_t bytes, uint32_t serial) {
  std::string call;
  MessageWriter writer(call);
  writer.beginCall(serial, {.path = "/com/vantu/kytreportingd",
                            .member = "SetSessionInfo",
                            .signature = "a{sv}aa{sv}avb",
                            .expectsReply = false});
  writer.writeDictionary(Dictionary{
      {kKYTReportingSessionInfoSessionID, 77},
      {kKYTReportingSessionInfoClientType, 20},
      {kKYTReportingSessionInfoHierarchyToken,
       Dictionary{{kKYTReportingHierarchyTokenTokenID, "shared"}, {kKYTReportingHierarchyTokenLevel, 1}}}});
  writer.writeOptionalDictionary(Dictionary{{"ClientName", "x"}, {"text", std::string(bytes, 'x')}});
  writer.writeOptionalValue(nullptr);
  writer.writeBoolean(false);
  static_cast<void>(writer.end());
  return call;
}

// Reads nothing, and stops sending when the daemon stops reading.
void sendWhatIsTaken(const PlainClient& client, std::string_view bytes) {
  while (!bytes.empty()) {
    pollfd waiting{client.descriptor(), POLLOUT, 0};
    if (::poll(&waiting, 1, 100) <= 0) return;
    const ssize_t sent = ::send(client.descriptor(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent <= 0) return;
    bytes.remove_prefix(static_cast<size_t>(sent));
  }
}

void raiseDescriptorLimit() {
  rlimit limit = {};
  ::getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = limit.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

class AttackedDaemon : public HierarchyTest {
 protected:
  static constexpr int kCategory = 10;
  struct Latency {
    double median, p99, worst;  // milliseconds
  };

  void start(const std::string& limits) {
    if (::geteuid() != 0) GTEST_SKIP() << "a client of another user needs root";
    tools::Stage::Options options;
    options.extraSettings = limits;
    lay(std::move(options));
    ASSERT_FALSE(tools::writeFile(
        stage_->folder() + "/etc/kytreportingd/entitlements.d/nobody.toml",
        "[[grant]]\nuser = " + std::to_string(kNobody) + "\n\"com.vantu.private.kytreportingd\" = true\n",
        0644));
    putBags();
    startDaemon();
    std::filesystem::permissions(stage_->folder(), std::filesystem::perms(0755));
    victim_ = open("victim", -1, 1, false, live_);
  }
  virtual void putBags() { putBag("cadmor", {entry("victim"), entry("hostile")}); }
  // The events of three phases, each event taken by the daemon before the next. Of the phases the quietest counts: what
  // else this machine does comes and goes, what the attack costs is there in each.
  Latency eventsOfTheVictim(const char* when) {
    Latency quietest = eventsOfOnePhase(when);
    for (int phase = 1; phase < 3; ++phase) {
      const Latency latency = eventsOfOnePhase(when);
      if (latency.p99 < quietest.p99) quietest = latency;
    }
    return quietest;
  }
  Latency eventsOfOnePhase(const char* when) {
    constexpr int kEvents = 100;
    std::vector<double> milliseconds;
    for (int i = 0; i < kEvents; ++i) {
      const auto begin = std::chrono::steady_clock::now();
      sendAndSettle(*victim_, kCategory, R"({"k":1})");
      milliseconds.push_back(
          std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - begin).count());
    }
    sent_ += kEvents;
    std::sort(milliseconds.begin(), milliseconds.end());
    const auto at = [&](double part) {
      return milliseconds[static_cast<size_t>(part * static_cast<double>(milliseconds.size() - 1))];
    };
    const Latency latency{at(0.5), at(0.99), milliseconds.back()};
    std::printf("%s: median %.2f ms, 99 of 100 within %.2f ms, worst %.2f ms\n", when, latency.median,
                latency.p99, latency.worst);
    return latency;
  }
  // Nothing of the victim's is missing, and its connection has never ended.
  void expectNothingLost() {
    finish(*victim_);
    EXPECT_TRUE(arrive("client=victim&method=" + std::to_string(kCategory), sent_)) << daemonLog();
    EXPECT_EQ(arrived("client=victim&method=" + std::to_string(kCategory)), sent_);
  }
  [[nodiscard]] long anonymousKiB() const {
    std::ifstream status("/proc/" + std::to_string(stage_->daemon()->pid()) + "/status");
    for (std::string line; std::getline(status, line);)
      if (line.starts_with("RssAnon:")) return std::stol(line.substr(8));
    return 0;
  }
  [[nodiscard]] size_t descriptors() const {
    size_t count = 0;
    const std::string folder = "/proc/" + std::to_string(stage_->daemon()->pid()) + "/fd";
    for (const auto& each : std::filesystem::directory_iterator(folder)) count += each.exists() ? 1 : 1;
    return count;
  }
  [[nodiscard]] size_t workers() const {
    size_t count = 0;
    const std::string folder = "/proc/" + std::to_string(stage_->daemon()->pid()) + "/task";
    for (const auto& thread : std::filesystem::directory_iterator(folder))
      if (contents(thread.path().string() + "/comm").starts_with("kyt-worker")) ++count;
    return count;
  }
  // At most twice what it was, and what the scheduler may take of a daemon that has work beside other tests.
  static void expectBearable(const Latency& before, const Latency& during) {
    EXPECT_LT(during.p99, 2 * before.p99 + (kSanitized ? 200 : 40));
  }

  std::string live_ = "live: httppost";  // what a session's configuration prints
  Process victim_;
  int sent_ = 0;
};

TEST_F(AttackedDaemon, KeepsItsMemoryFromClientsThatReadNoReplies) {
  start("[limits]\nmax_bytes_per_user = 16777216\n");
  if (IsSkipped()) return;
  const Latency before = eventsOfTheVictim("alone");
  const Attacker attacker(socket(), [](const std::string& path) {
    raiseDescriptorLimit();
    const std::string calls = manyIntrospections(140000);
    Connections kept;
    for (int i = 0; i < 300; ++i) {
      auto client = std::make_unique<PlainClient>(path);
      if (client->connected() && client->shakeHands()) sendWhatIsTaken(*client, calls);
      kept.push_back(std::move(client));
    }
  });
  long most = 0;
  const Latency during = eventsOfTheVictim("attacked");
  for (int round = 0; round < 600 && !attacker.isDone(std::chrono::milliseconds(100)); ++round)
    most = std::max(most, anonymousKiB());
  EXPECT_TRUE(attacker.isDone());
  most = std::max(most, anonymousKiB());
  expectBearable(before, during);
  std::printf("the daemon: %ld KiB at most\n", most);
  EXPECT_TRUE(kSanitized || most < 96 * 1024) << most;
  EXPECT_TRUE(logged("ends, it reads nothing")) << daemonLog();
  expectNothingLost();
}

TEST_F(AttackedDaemon, KeepsItsDescriptorsFromClientsThatDoNotFinishTheirMessages) {
  start("[limits]\nmax_descriptors_per_user = 1000\n");
  if (IsSkipped()) return;
  const Latency before = eventsOfTheVictim("alone");
  const size_t descriptorsBefore = descriptors();
  const Attacker attacker(socket(), [](const std::string& path) {
    raiseDescriptorLimit();
    std::string half = manyIntrospections(1);
    half.resize(half.size() - 10);
    Connections kept;
    for (int i = 0; i < 200; ++i) {
      auto client = std::make_unique<PlainClient>(path);
      if (client->connected() && client->shakeHands()) client->send(half, std::vector<int>(16, 0));
      kept.push_back(std::move(client));
    }
  });
  const Latency during = eventsOfTheVictim("attacked");
  size_t most = 0;
  EXPECT_TRUE(eventually([&] {
    most = std::max(most, descriptors());
    return most > descriptorsBefore + 500;
  })) << "the attack took place";
  for (int round = 0; round < 100 && !attacker.isDone(std::chrono::milliseconds(100)); ++round)
    most = std::max(most, descriptors());
  EXPECT_TRUE(attacker.isDone());
  std::printf("the daemon: %zu descriptors, %zu before\n", most, descriptorsBefore);
  EXPECT_LT(most, descriptorsBefore + 1000 + 50);
  EXPECT_TRUE(logged("its user's clients hold too many descriptors")) << daemonLog();
  expectBearable(before, during);
  expectNothingLost();
}

TEST_F(AttackedDaemon, KeepsItsMemoryFromEventsThatNobodyTakes) {
  start("[limits]\nmax_bytes_per_user = 16777216\n");
  if (IsSkipped()) return;
  std::filesystem::copy(stage_->program("kytctl"), stage_->folder() + "/kytctl");
  const Latency before = eventsOfTheVictim("alone");
  std::vector<Process> hostile;
  for (int i = 0; i < 10; ++i) {
    hostile.push_back(std::make_unique<ScriptedClient>(
        stage_->folder() + "/kytctl", std::vector<std::string>{"--socket", socket()}, kNobody));
    hostile.back()->step(opening("hostile", -1, 100 + i));
    EXPECT_EQ(hostile.back()->ask(R"({"do":"configure"})"), "live: httppost");
  }
  Latency during{};
  for (int round = 0; round < 20; ++round) {
    for (const Process& client : hostile)
      client->step("{\"do\":\"send\",\"category\":9,\"type\":1,\"repeat\":50,\"payload\":{\"t\":\"" +
                   std::string(4000, 'x') + "\"}}");
    if (round == 19) during = eventsOfTheVictim("attacked");
    for (const Process& client : hostile)
      EXPECT_EQ(client->ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  }
  const long most = anonymousKiB();
  std::printf("the daemon: %ld KiB\n", most);
  EXPECT_TRUE(kSanitized || most < 32 * 1024) << most;
  EXPECT_TRUE(logged("HTTPSPostBackend(batchEvent): user 65534 holds ")) << daemonLog();
  expectBearable(before, during);
  for (const Process& client : hostile) client->kill();
  expectNothingLost();
}

// A session that configures itself, then shares as much as is taken with others of its token, in a hundred pieces.
void shareMuch(PlainClient& client, int number) {
  if (!client.connected() || !client.shakeHands()) return;
  client.call(
      "SetSessionInfo", "a{sv}aa{sv}avb",
      [&](MessageWriter& out) {
        out.writeDictionary(
            Dictionary{{kKYTReportingSessionInfoSessionID, number},
                       {kKYTReportingSessionInfoClientType, 20},
                       {kKYTReportingSessionInfoHierarchyToken,
                        Dictionary{{kKYTReportingHierarchyTokenTokenID, "shares " + std::to_string(number)},
                                   {kKYTReportingHierarchyTokenLevel, 0}}}});
        out.writeOptionalDictionary(std::nullopt);
        out.writeOptionalValue(nullptr);
        out.writeBoolean(false);
      },
      false);
  const std::string text(200000, 'x');
  for (int i = 0; i < 100; ++i)
    client.call(
        "UpdateSharedDataWithDictionary", "a{sv}",
        [&](MessageWriter& out) {
          out.writeDictionary(Dictionary{{"key" + std::to_string(i), text}});
        },
        false);
}

// The shares of a device with 512 MiB, where the service may have 128 MiB (UserShares_test has the numbers). All at once:
// replies that nobody reads and with them the buffers of sockets, descriptors, the beginnings of messages, what sessions
// say about themselves, tokens and what is shared, batches, and files whose upload is not answered.
class SmallDevice : public AttackedDaemon {
 protected:
  static constexpr uint64_t kService = uint64_t{128} << 20;

  // A bag with a server that takes files, and gives no answer for a while.
  void putBags() override {
    live_ = "live: httppost uploadserver";
    Dictionary backends = section({entry("victim"), entry("hostile")});
    backends.set("uploadserver", Dictionary{{"post_url", stage_->httpsBase() + "/upload"}});
    const auto problem = stage_->putStorebag("cadmor", Dictionary{{"version", "1"}, {"release", backends}});
    ASSERT_FALSE(problem) << problem->localizedDescription;
    ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/upload","delayMs":10000})"));
  }
  // Connections that send such calls until no more are taken.
  static std::function<void(const std::string&)> sending(int connections, const std::string& calls, int times,
                                                         size_t withDescriptors = 0) {
    return [=](const std::string& path) {
      Connections kept;
      for (int i = 0; i < connections; ++i) {
        auto client = std::make_unique<PlainClient>(path);
        if (client->connected() && client->shakeHands()) {
          client->send(std::string_view(calls).substr(0, withDescriptors),
                       std::vector<int>(withDescriptors != 0 ? 16 : 0, 0));
          for (int time = 0; time < times; ++time)
            sendWhatIsTaken(*client, std::string_view(calls).substr(withDescriptors));
        }
        kept.push_back(std::move(client));
      }
    };
  }
  static void uploading(const std::string& path) {
    const TemporaryFolder folder;
    std::string noise(3 << 20, 'x');  // that gzip cannot make small, so it is held until its answer
    std::mt19937 random(7);
    for (char& byte : noise) byte = static_cast<char>(random());
    const std::string file = folder.write("large", noise);
    std::vector<std::unique_ptr<PlainUploader>> kept;
    for (int i = 0; i < 20; ++i) {
      kept.push_back(std::make_unique<PlainUploader>(path));
      if (!kept.back()->configured()) continue;
      const Descriptor large = ownDescriptor(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
      const Descriptor within = ownDescriptor(::open(folder.path().c_str(), O_PATH | O_CLOEXEC));
      kept.back()->startUpload(file, {large.get(), within.get()});
    }
    static_cast<void>(kept.front()->answer());
  }
  static void sharing(const std::string& path) {
    Connections kept;
    for (int i = 0; i < 20; ++i) {
      kept.push_back(std::make_unique<PlainClient>(path));
      shareMuch(*kept.back(), i);
    }
  }
  const test::MemoryGroup group_{kService};
};

TEST_F(SmallDevice, StaysBelowWhatItsServiceMayHave) {
  start(
      "[limits]\nmax_bytes_per_user = 16777216\nmax_uploading_bytes_per_user = 16777216\n"
      "max_descriptors_per_user = 32768\n");
  if (IsSkipped()) return;
  const bool limited = !kSanitized && group_.limited() && group_.take(stage_->daemon()->pid());
  if (!limited) std::printf("no control group with a limit can be made here\n");
  std::filesystem::copy(stage_->program("kytctl"), stage_->folder() + "/kytctl");
  const std::string half = callWithText(1000000, 1).substr(0, 900000);
  // First what the others would leave no room for.
  const Attacker uploads(socket(), uploading);
  EXPECT_TRUE(eventually([&] {
    return logged("Input file refused, too much of its user is being uploaded");
  })) << daemonLog();
  const Attacker shares(socket(), sharing);
  EXPECT_TRUE(eventually([&] { return logged("User 65534 shares "); })) << daemonLog();
  const Attacker replies(socket(), sending(100, manyIntrospections(140000), 1));
  const Attacker halves(socket(), sending(100, half, 1, 1000));
  const Attacker sessions(socket(), sending(100, callWithText(900000, 1), 20));
  std::vector<Process> hostile;
  for (int i = 0; i < 5; ++i) {
    hostile.push_back(std::make_unique<ScriptedClient>(
        stage_->folder() + "/kytctl", std::vector<std::string>{"--socket", socket()}, kNobody));
    hostile.back()->step(opening("hostile", i, 100 + i, false, 20, "token" + std::to_string(i)));
    hostile.back()->step(R"({"do":"configure"})");
  }
  long most = 0;
  const auto look = [&] { most = std::max(most, anonymousKiB()); };
  for (int round = 0; round < 20; ++round) {
    for (const Process& client : hostile)
      client->step("{\"do\":\"send\",\"category\":9,\"type\":1,\"repeat\":200,\"payload\":{\"t\":\"" +
                   std::string(4000, 'x') + "\"}}");
    look();
    static_cast<void>(eventsOfOnePhase("attacked"));
    look();
  }
  for (const Attacker* attacker : {&replies, &halves, &sessions, &uploads, &shares})
    for (int round = 0; round < 600 && !attacker->isDone(std::chrono::milliseconds(100)); ++round) look();
  look();
  std::printf("the daemon: %ld KiB at most\n", most);
  if (limited)
    std::printf("its control group: %llu KiB at most, %llu killed\n",
                static_cast<unsigned long long>(group_.most() >> 10),
                static_cast<unsigned long long>(group_.kills()));
  // Of the kernel's part, mostly buffers of sockets, the control group knows; where there is none, what the shares say of
  // it is as much as half of the whole again.
  EXPECT_TRUE(kSanitized || most < 80 * 1024) << most;
  EXPECT_EQ(group_.kills(), 0U);
  EXPECT_TRUE(logged("its user's clients hold too many bytes")) << daemonLog();
  for (const Process& client : hostile) client->kill();
  expectNothingLost();
}

TEST_F(AttackedDaemon, KeepsItsLogFromAClientThatFloodsIt) {
  start("");
  if (IsSkipped()) return;
  const Latency before = eventsOfTheVictim("alone");
  const std::string line = "updateCorrelatedSessions: Session 77 has no correlated sessions";
  const Attacker attacker(socket(), [](const std::string& path) {
    PlainClient client(path);
    if (!client.shakeHands()) return;
    for (int i = 0; i < 20000; ++i)
      client.call(
          "SetSessionInfo", "a{sv}aa{sv}avb",
          [](MessageWriter& out) {
            out.writeDictionary(Dictionary{{kKYTReportingSessionInfoSessionID, 77},
                                           {kKYTReportingSessionInfoClientType, 20}});
            out.writeOptionalDictionary(std::nullopt);
            out.writeOptionalValue(nullptr);
            out.writeBoolean(false);
          },
          false);
    client.call("FetchDisplayURL");
    static_cast<void>(client.receiveText());
  });
  const auto begin = std::chrono::steady_clock::now();
  const Latency during = eventsOfTheVictim("attacked");
  ASSERT_TRUE(attacker.isDone(std::chrono::seconds(120)));
  EXPECT_TRUE(eventually([&] { return logged("lines of clients of user 65534 left out"); })) << daemonLog();
  const size_t lines = countLogged(line);
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
  std::printf("%zu lines in %.1f seconds\n", lines, seconds);
  EXPECT_GE(lines, 200u) << "the attack took place";
  EXPECT_LE(static_cast<double>(lines), 200 * (seconds + 2));
  expectBearable(before, during);
  expectNothingLost();
}

// Sessions that configure while a storebag's server does not answer wait for the agent's monitor. Two users' would have
// held all 512 workers.
TEST_F(AttackedDaemon, KeepsItsWorkersFromClientsThatWaitForADownload) {
  start("");
  if (IsSkipped()) return;
  ASSERT_FALSE(tools::writeFile(
      stage_->folder() + "/etc/kytreportingd/entitlements.d/stranger.toml",
      "[[grant]]\nuser = " + std::to_string(kStranger) + "\n\"com.vantu.private.kytreportingd\" = true\n",
      0644));
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/bags/tolvar/torvel","hang":true})"));
  const Latency before = eventsOfTheVictim("alone");
  const auto work = [](const std::string& path) {
    static Connections kept;
    if (!kept.empty()) ::pause();
    raiseDescriptorLimit();
    for (int i = 0; i < 400; ++i) {
      kept.push_back(std::make_unique<PlainClient>(path));
      if (!kept.back()->connected()) continue;
      kept.back()->send(ClientHandshake::opening(::getuid()));
      kept.back()->call(
          "SetSessionInfo", "a{sv}aa{sv}avb",
          [](MessageWriter& out) {
            out.writeDictionary(Dictionary{{kKYTReportingSessionInfoSessionID, 77},
                                           {kKYTReportingSessionInfoClientType, kTorvel}});
            out.writeOptionalDictionary(std::nullopt);
            out.writeOptionalValue(nullptr);
            out.writeBoolean(false);
          },
          false);
      kept.back()->call("StartConfigWithCompletionHandler");
    }
  };
  const Attacker one(socket(), work), other(socket(), work, kStranger);
  EXPECT_TRUE(eventually([&] { return workers() > 150; })) << workers();
  const Latency during = eventsOfTheVictim("attacked");
  const size_t most = workers();
  std::printf("the daemon: %zu workers\n", most);
  EXPECT_LT(most, 220u)
      << "a fifth of all for the first user, of the rest for the second, and those that run";
  EXPECT_TRUE(one.isDone(std::chrono::seconds(10)) && other.isDone(std::chrono::seconds(10)));
  // Eight hundred clients that come at once are felt; a download would be for 15 s.
  EXPECT_LT(during.p99, 2 * before.p99 + 2000);
  expectNothingLost();
}

// Events without end, of a session whose batches are as large as may be.
void floodWithEvents(const std::string& path) {
  PlainClient client(path);
  if (!client.connected() || !client.shakeHands()) return static_cast<void>(::usleep(50000));
  client.call(
      "SetSessionInfo", "a{sv}aa{sv}avb",
      [](MessageWriter& out) {
        out.writeDictionary(Dictionary{{kKYTReportingSessionInfoSessionID, 78},
                                       {kKYTReportingSessionInfoClientType, 20},
                                       {"BatchEvent", true}});
        out.writeOptionalDictionary(Dictionary{{"ClientName", "hostile"}, {"ServiceName", "test"}});
        out.writeOptionalValue(nullptr);
        out.writeBoolean(false);
      },
      false);
  client.call("StartConfigWithCompletionHandler");
  static_cast<void>(client.receive());
  std::string calls;
  MessageWriter writer(calls);
  for (uint32_t serial = 10; calls.size() < 60000; ++serial) {
    writer.beginCall(serial, {.path = "/com/vantu/kytreportingd",
                              .member = "SendMessageWithDictionary",
                              .signature = "a{sv}",
                              .expectsReply = false});
    writer.writeDictionary(Dictionary{{kKYTReportingMessageParametersCategory, 9},
                                      {kKYTReportingMessageParametersType, 1},
                                      {kKYTReportingMessageParametersPayload, Dictionary{{"n", 1}}}});
    static_cast<void>(writer.end());
  }
  for (int i = 0; i < 500 && client.send(calls); ++i) {
  }
}

// What it holds of the flood's events then takes long to be written and compressed.
TEST_F(AttackedDaemon, EndsInTimeUnderAFloodOfEventsAndPostsWhatOthersLeftWithIt) {
  constexpr std::chrono::seconds kGrace(5), kAtTheLatest(8);
  start("");
  if (IsSkipped()) return;
  static_cast<void>(eventsOfTheVictim("alone"));
  std::vector<std::unique_ptr<Attacker>> attackers;
  for (int i = 0; i < 3; ++i) attackers.push_back(std::make_unique<Attacker>(socket(), floodWithEvents));
  ASSERT_TRUE(attackers.front()->isDone(std::chrono::seconds(60)));
  static_cast<void>(eventsOfTheVictim("attacked"));
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(60)).value_or(-1), 0) << daemonLog();
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
  std::printf("it ended in %.2f s\n", seconds);
  // The system takes its memory back for a while after that, the longer the busier it is.
  EXPECT_LT(seconds, std::chrono::duration<double>(kGrace + kAtTheLatest).count() + (kSanitized ? 30 : 10));
  EXPECT_FALSE(logged("Not ended in time")) << daemonLog();
  EXPECT_TRUE(arrive("client=victim&method=" + std::to_string(kCategory), sent_)) << daemonLog();
}

TEST_F(AttackedDaemon, KeepsItsTimeFromProgramsThatMayNotConnect) {
  start("");
  if (IsSkipped()) return;
  const Latency before = eventsOfTheVictim("alone");
  const Attacker attacker(
      socket(),
      [](const std::string& path) {
        for (int i = 0; i < 500; ++i) {
          PlainClient client(path);
          static_cast<void>(client.connected() && client.shakeHands());
        }
      },
      kStranger);
  const Latency during = eventsOfTheVictim("attacked");
  EXPECT_TRUE(attacker.isDone(std::chrono::seconds(60)));
  EXPECT_TRUE(logged("user 65533: no grant")) << daemonLog();
  expectBearable(before, during);
  expectNothingLost();
}

TEST_F(AttackedDaemon, KeepsIdentifiersForTheProgramsOfOthers) {
  start("[limits]\nmax_custom_identifiers_per_user = 5\n");
  if (IsSkipped()) return;
  Array entries{entry("victim")};
  for (int i = 0; i < 20; ++i) {
    Dictionary hostile = entry("hostile" + std::to_string(i));
    hostile.set("custom_clientId", true);
    entries.append(hostile);
  }
  Dictionary late = entry("late");
  late.set("custom_clientId", true);
  entries.append(late);
  putBag("torvel", entries);
  std::filesystem::copy(stage_->program("kytctl"), stage_->folder() + "/kytctl");
  for (int i = 0; i < 20; ++i) {
    ScriptedClient client(stage_->folder() + "/kytctl", {"--socket", socket()}, kNobody);
    client.step(opening("hostile" + std::to_string(i), -1, 100 + i, false, kTorvel));
    EXPECT_EQ(client.ask(R"({"do":"configure"})"), "live: httppost") << daemonLog();
  }
  EXPECT_TRUE(logged("there are 5 custom identifiers of user 65534 already")) << daemonLog();
  const Process program = process();
  program->step(opening("late", -1, 200, false, kTorvel));
  EXPECT_EQ(program->ask(R"({"do":"configure"})"), "live: httppost") << daemonLog();
  const std::string defaults =
      contents(stage_->folder() + "/var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml");
  EXPECT_NE(defaults.find("uuid:late:test"), std::string::npos) << defaults;
  EXPECT_NE(defaults.find("\"uuidOwner:hostile4:test\" = 65534"), std::string::npos) << defaults;
  EXPECT_EQ(defaults.find("uuid:hostile5:test"), std::string::npos) << defaults;
  expectNothingLost();
}

}  // namespace
}  // namespace kyt
