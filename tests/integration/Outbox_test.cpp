// The built daemon with an outbox: its server fails, the daemon ends or is killed, and what it had kept arrives.
#include <algorithm>
#include <cstdlib>
#include <set>
#include <thread>

#include "tests/integration/OutboxDaemonFixture.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

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

TEST_F(OutboxOfTheDaemon, WithoutTheSettingMakesNoCallOfTheSystemForIt) {
  if (kSanitized) GTEST_SKIP() << "the leak sanitizer cannot run where another traces";
  if (runProgram("strace", {"-D", "-f", "-o", "/dev/null", "true"}).status != 0)
    GTEST_SKIP() << "no strace here";
  const std::string calls = daemon_.root() / "calls";
  const auto callsThatNameIt = [&](const char* setting) {
    settings(setting);
    daemon_.setLauncher({"strace", "-D", "-f", "-s", "64", "-o", calls});
    start();
    TestClient client(daemon_.socketPath(), kTorvel, "plain");
    EXPECT_EQ(client.configure(), "live: httppost") << daemon_.log();
    EXPECT_TRUE(client.send(9, 1, Dictionary{}));
    static_cast<void>(client.flush());
    end();
    std::string found;
    std::ifstream lines(calls);
    for (std::string line; std::getline(lines, line);) {
      const bool names = line.find("sqlite") != std::string::npos ||
                         line.find("kyt-outbox") != std::string::npos ||
                         line.find("kytreportingd/outbox") != std::string::npos;
      if (names) found += line + "\n";
    }
    return found;
  };
  EXPECT_EQ(callsThatNameIt(""), "");
  EXPECT_NE(callsThatNameIt(kOn), "");
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

TEST_F(OutboxOfTheDaemon, DeletesAtOnceWhatWasCollectedByAConsentThatIsWithdrawn) {
  settings(kOn);
  retryAfter("86400");
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{}));
  EXPECT_EQ(client.flush(), "flushed") << daemon_.log();
  ASSERT_TRUE(std::filesystem::exists(folder() + "/outbox.sqlite"));
  consent(false);
  EXPECT_TRUE(eventually([&] { return daemon_.logged("The consent is withdrawn"); })) << daemon_.log();
  EXPECT_TRUE(eventually([&] { return std::filesystem::is_empty(folder()); })) << daemon_.log();
}

// A few kills here; as many as KYT_OUTBOX_KILLS says by hand. Each falls at a random moment: while the daemon starts and reads
// what is left, while posts fail and are kept, while they are sent again, while one is on its way.
TEST_F(OutboxOfTheDaemon, LosesNothingThatItHadKeptHoweverOftenItIsKilled) {
  const char* wanted = std::getenv("KYT_OUTBOX_KILLS");
  const int kills = wanted != nullptr ? std::atoi(wanted) : 8;
  settings(kOn);
  std::set<std::string> kept, unsure;  // what was on its way when the daemon was killed may be kept or not
  std::mt19937 random(7);
  const auto waitShortly = [&random](unsigned most) {
    std::this_thread::sleep_for(std::chrono::microseconds(random() % most));
  };
  for (int i = 0; i < kills; ++i) {
    take(i % 3 == 2 ? 60 : 0);
    if (i % 4 == 3) {
      nextLife();
      daemon_.start();
      waitShortly(150000);
      kill();
      continue;
    }
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
    waitShortly(20000);
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
  end();
  // One daemon sends nothing twice that was taken; the next one at most what was on its way when the first was killed.
  std::map<int, int> repeats;
  for (const auto& [body, lives] : takenIn())
    for (size_t i = 1; i < lives.size(); ++i) {
      EXPECT_NE(lives[i], lives[i - 1]);
      ++repeats[lives[i - 1]];
    }
  int twice = 0;
  for (const auto& [life, bodies] : repeats) {
    EXPECT_LE(bodies, 4) << "life " << life;
    twice += bodies;
  }
  std::printf("%d kills, %zu posts kept, %zu taken, %d taken twice\n", kills, kept.size(), taken().size(),
              twice);
}

}  // namespace
}  // namespace kyt
