// The built daemon with an outbox: its server fails, the daemon ends or is killed, and what it had kept arrives.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <random>
#include <set>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;

class OutboxOfTheDaemon : public ::testing::Test {
 protected:
  OutboxOfTheDaemon() : daemon_(server_.url("")) {
    const Dictionary entry{{"locale_whitelist", Array{"DE"}},
                           {"filters", Array{}},
                           {"sampling_threshold", 1.0},
                           {"event_threshold", 1000},
                           {"post_url", server_.url("/events")}};
    const Dictionary section{{"httppost", Dictionary{{"clients", Array{entry}}}}};
    server_.setHandler([this, document = signedBag(Dictionary{{"version", "1"}, {"vantu_internal", section}},
                                                   propertyLists_)](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      if (request.method == "GET") {
        reply.body = document;
        return reply;
      }
      const std::lock_guard lock(mutex_);
      reply.status = percentTaken_ > static_cast<int>(random_() % 100) ? 200 : 503;
      if (holds_) reply.behaviour = TestHTTPServer::Behaviour::hold;
      ++(reply.status == 200 && !holds_ ? taken_ : failed_)[request.body];
      return reply;
    });
    daemon_.root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
    consent(true);
  }
  void TearDown() override {
    if (!started_) return;
    server_.release();
    end();
  }
  void settings(const std::string& more) {
    daemon_.writeSettings("[storebag]\ninternal_host = \"" + server_.url("") + "\"\npublic_host = \"" +
                          server_.url("") + "\"\n[log]\ntarget = \"stderr\"\n" + more);
  }
  void consent(bool isGiven) {
    daemon_.root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml",
                         std::string("consent = ") + (isGiven ? "true\n" : "false\n"));
  }
  void start() {
    started_ = daemon_.startAndWait();
    ASSERT_TRUE(started_) << daemon_.log();
  }
  void end() {
    started_ = false;
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  void kill() {
    started_ = false;
    daemon_.terminate(SIGKILL);
    EXPECT_EQ(daemon_.exitStatus(), -1);
  }
  void take(int percent) {
    const std::lock_guard lock(mutex_);
    percentTaken_ = percent;
  }
  void hold(bool holds) {
    const std::lock_guard lock(mutex_);
    holds_ = holds;
  }
  [[nodiscard]] std::map<std::string, int> taken() const {
    const std::lock_guard lock(mutex_);
    return taken_;
  }
  [[nodiscard]] std::map<std::string, int> failed() const {
    const std::lock_guard lock(mutex_);
    return failed_;
  }
  [[nodiscard]] std::string folder() const { return daemon_.root() / "var/lib/kytreportingd/outbox"; }
  [[nodiscard]] std::string ofProcess(const std::string& name) const {
    std::ifstream file("/proc/" + std::to_string(daemon_.process()) + "/" + name);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  [[nodiscard]] bool hasThread(const std::string& name) const {
    const std::string tasks = "/proc/" + std::to_string(daemon_.process()) + "/task";
    for (const auto& task : std::filesystem::directory_iterator(tasks)) {
      std::ifstream file(task.path() / "comm");
      std::string thread;
      if (std::getline(file, thread) && thread.starts_with(name)) return true;
    }
    return false;
  }

  mutable std::mutex mutex_;
  std::mt19937 random_{1};
  int percentTaken_ = 0;
  bool holds_ = false, started_ = false;
  std::map<std::string, int> taken_, failed_;  // bodies
  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_;
};

constexpr char kOn[] = "[outbox]\nenabled = true\n";

TEST_F(OutboxOfTheDaemon, DeliversAfterARestartWhatItsServerHadRefused) {
  settings(kOn);
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}));
    EXPECT_EQ(client.flush(), "flushed") << daemon_.log();
  }
  struct stat status {};
  ASSERT_EQ(::stat((folder() + "/outbox.sqlite").c_str(), &status), 0) << daemon_.log();
  EXPECT_EQ(status.st_mode & 07777, 0600U);
  ASSERT_EQ(::stat(folder().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
  end();
  const auto kept = failed();
  take(100);
  start();
  ASSERT_TRUE(eventually([&] { return taken().size() >= kept.size(); })) << daemon_.log();
  for (const auto& [body, times] : kept) EXPECT_EQ(taken()[body], 1);
  const auto requests = server_.requests();
  const auto ofBody = [&](const std::string& body, bool last) {
    TestHTTPServer::Request found;
    for (const auto& request : requests)
      if (request.method == "POST" && request.body == body && (last || found.body.empty())) found = request;
    return found;
  };
  for (const auto& [body, times] : kept)
    EXPECT_EQ(ofBody(body, false).raw, ofBody(body, true).raw) << "byte for byte";
}

TEST_F(OutboxOfTheDaemon, WithoutTheSettingIsNeitherFileNorThreadNorLibrary) {
  settings("");
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{}));
  EXPECT_NE(client.flush(), "flushed");
  EXPECT_FALSE(std::filesystem::exists(folder()));
  EXPECT_FALSE(hasThread("kyt-outbox"));
  EXPECT_EQ(ofProcess("maps").find("sqlite"), std::string::npos);
}

TEST_F(OutboxOfTheDaemon, LoadsNothingWhileAllPostsArrive) {
  settings(kOn);
  take(100);
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{}));
  EXPECT_EQ(client.flush(), "flushed");
  EXPECT_TRUE(std::filesystem::is_empty(folder()));
  EXPECT_EQ(ofProcess("maps").find("sqlite"), std::string::npos);
}

TEST_F(OutboxOfTheDaemon, KeepsWhatItsEndCutsOff) {
  settings(std::string(kOn) + "[service]\nshutdown_grace_seconds = 0.5\n");
  hold(true);
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{}));
  const auto answer = client.startFlush();
  ASSERT_TRUE(eventually([&] { return !failed().empty(); }));
  end();
  hold(false);
  take(100);
  start();
  const std::string body = failed().begin()->first;
  EXPECT_TRUE(eventually([&] { return taken().contains(body); })) << daemon_.log();
}

TEST_F(OutboxOfTheDaemon, DeletesAtItsStartWhatWasCollectedByAConsentThatIsGone) {
  settings(kOn);
  start();
  {
    TestClient client(daemon_.socketPath(), kTorvel, "plain");
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    EXPECT_TRUE(client.send(9, 1, Dictionary{}));
    EXPECT_EQ(client.flush(), "flushed");
  }
  end();
  const auto before = failed();
  consent(false);
  take(100);
  start();
  ASSERT_TRUE(eventually([&] { return daemon_.logged("The consent is withdrawn"); })) << daemon_.log();
  end();
  for (const auto& [body, times] : before) EXPECT_FALSE(taken().contains(body));
}

// A small number of kills here; as many as KYT_OUTBOX_KILLS says by hand.
TEST_F(OutboxOfTheDaemon, LosesNothingThatItHadKeptHoweverOftenItIsKilled) {
  const char* wanted = std::getenv("KYT_OUTBOX_KILLS");
  const int kills = wanted != nullptr ? std::atoi(wanted) : 6;
  settings(kOn);
  std::set<std::string> kept, unsure;  // what was on its way when the daemon was killed may be kept or not
  std::mt19937 random(7);
  for (int i = 0; i < kills; ++i) {
    take(i % 3 == 2 ? 60 : 0);
    start();
    TestClient client(daemon_.socketPath(), kTorvel, "plain");
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    const unsigned posts = 1 + random() % 4;
    for (unsigned post = 0; post < posts; ++post) {
      EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", static_cast<int>(random())}}));
      ASSERT_EQ(client.flush(), "flushed") << daemon_.log();
      for (const auto& [body, times] : failed())
        if (!unsure.contains(body)) kept.insert(body);
    }
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", "in flight"}}));
    static_cast<void>(client.startFlush());
    std::this_thread::sleep_for(std::chrono::microseconds(random() % 20000));
    kill();
    ASSERT_TRUE(server_.waitForConnectionsOpen(0));
    for (const auto& [body, times] : failed())
      if (!kept.contains(body)) unsure.insert(body);
  }
  take(100);
  start();
  const auto arrived = [&] {
    const auto now = taken();
    return std::all_of(kept.begin(), kept.end(), [&](const std::string& body) { return now.contains(body); });
  };
  EXPECT_TRUE(eventually(arrived)) << daemon_.log();
  int twice = 0;
  for (const auto& [body, times] : taken()) twice += times - 1;
  EXPECT_LE(twice, 4 * kills) << "only what was on its way";
  std::printf("%d kills, %zu posts kept, %d taken twice\n", kills, kept.size(), twice);
}

}  // namespace
}  // namespace kyt
