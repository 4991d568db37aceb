// Administrators look while sessions come, change and go: under the thread sanitizer too, whose findings end the daemon.
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

class WindowInMotion : public StageTest {
 protected:
  static constexpr int kPrograms = 4, kSessions = 12, kLooks = 2;
  std::atomic<int> looks_{0};

  // Sessions of all kinds, one after the other: live ones, such as the storebag does not name, such as change their user
  // information, such as go without a word. They go on until somebody has looked often enough.
  void report(int number) const {
    for (int i = 0; i < kSessions || looks_ < kLooks; ++i) {
      TestClient client(socket(), 7, i % 3 == 0 ? "unlisted" : "a", static_cast<uint32_t>(100 * number + i));
      EXPECT_NE(client.configure(), "no answer");
      for (int event = 0; event < 20; ++event) client.send(5, 1, {{"event", event}});
      EXPECT_NE(client.flush(), "no answer");
      client.send(6, 1, {});
      if (i % 4 == 0)
        client.close();
      else
        EXPECT_TRUE(client.finish());
    }
  }
  // One look of each kind. In every row of the books what was taken is somewhere.
  void look() const {
    for (const char* command : {"status", "sessions", "storebags", "metrics", "books"}) {
      const ProgramRun run = kytctl({command, "--json"});
      ASSERT_EQ(run.status, 0) << run.text;
      auto parsed = RapidJSON().parse(run.text);
      const auto* value = std::get_if<Value>(&parsed);
      ASSERT_TRUE(value != nullptr && value->isDictionary()) << run.text;
      if (const Array* rows = value->dictionary()->array("rows"))
        for (const Value& row : *rows) expectToAddUp(*row.dictionary());
    }
  }
  static void expectToAddUp(const Dictionary& row) {
    int64_t sum = 0;
    for (const char* place : {"queued", "batched", "inFlight", "waiting", "outbox", "delivered", "dropped"}) {
      EXPECT_GE(row.integer(place), 0) << place << " of " << description(row);
      sum += row.integer(place);
    }
    EXPECT_EQ(sum, row.integer("taken")) << description(row);
  }
};

TEST_F(WindowInMotion, ShowsBooksThatAddUpWhileSessionsComeChangeAndGo) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  std::atomic<int> running{kPrograms};
  std::vector<std::thread> threads;
  for (int i = 0; i < kPrograms; ++i)
    threads.emplace_back([this, i, &running] {
      report(i);
      --running;
    });
  threads.emplace_back([this, &running] {
    while (running != 0) look();
  });
  for (; running != 0; ++looks_) look();
  for (std::thread& thread : threads) thread.join();
  look();
}

TEST_F(WindowInMotion, TellsWatchersThatComeAndGoWhileSessionsDo) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  looks_ = kLooks;
  constexpr int kWatchers = 6;
  std::atomic<bool> over{false};
  std::thread program([this, &over] {
    while (!over) report(1);
  });
  for (int i = 0; i < kWatchers; ++i) {
    const TemporaryFolder folder;
    tools::ChildProcess::Options how;
    how.outputFile = folder / "output";
    const auto watch = tools::ChildProcess::start(
        stage_->program("kytctl"), {"--root", stage_->folder(), "watch", "--bodies", "--json"}, how);
    EXPECT_TRUE(watch && eventually([&] { return folder.read("output").ends_with("}\n"); })) << i;
  }
  over = true;
  program.join();
}

}  // namespace
}  // namespace kyt
