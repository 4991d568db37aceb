// What administrators and the owner see of the outbox of the built daemon, and what they do with it.
#include <unistd.h>

#include <algorithm>
#include <ctime>
#include <sstream>

#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/OutboxDaemonFixture.h"
#include "tests/support/Programs.h"

namespace kyt {
namespace {

class OutboxWindow : public OutboxOfTheDaemon {
 protected:
  [[nodiscard]] ProgramRun kytctl(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"--root", daemon_.root().path()});
    return runProgram(std::string(KYT_PROGRAMS) + "/kytctl", arguments);
  }
  [[nodiscard]] Dictionary json(std::vector<std::string> arguments) const {
    arguments.emplace_back("--json");
    const ProgramRun run = kytctl(arguments);
    EXPECT_EQ(run.status, 0) << run.text;
    auto parsed = RapidJSON().parse(run.text);
    const auto* value = std::get_if<Value>(&parsed);
    if (value == nullptr || value->dictionary() == nullptr) {
      ADD_FAILURE() << "no JSON object: " << run.text;
      return {};
    }
    return *value->dictionary();
  }
  [[nodiscard]] std::string columns(const std::vector<std::string>& arguments) const {
    const ProgramRun run = kytctl(arguments);
    EXPECT_EQ(run.status, 0) << run.text;
    std::istringstream lines(run.text);
    for (std::string line; std::getline(lines, line);) EXPECT_LE(line.size(), 100U) << line;
    return run.text;
  }
  // So many posts fail and are kept. The session stays, so that its end posts nothing.
  void keep(int posts) {
    clients_.push_back(std::make_unique<TestClient>(daemon_.socketPath(), kTorvel, "plain"));
    TestClient& client = *clients_.back();
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    for (int i = 0; i < posts; ++i) {
      EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}));
      EXPECT_EQ(client.flush(), "flushed") << daemon_.log();
    }
  }
  [[nodiscard]] std::string server() const { return server_.url(""); }
  [[nodiscard]] int64_t waiting() const {
    const Dictionary shown = json({"outbox", "list"});
    const Array* servers = shown.array("servers");
    int64_t posts = 0;
    for (size_t i = 0; servers != nullptr && i < servers->size(); ++i)
      posts += (servers->begin() + i)->dictionary()->integer("posts");
    return posts;
  }

  std::vector<std::unique_ptr<TestClient>> clients_;
};

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

TEST_F(OutboxWindow, ShowsWhatWaitsForWhichServerAndOfWhom) {
  settings(kOn);
  start();
  EXPECT_TRUE(has(columns({"outbox", "list"}), "Nothing waits in the outbox\n"));
  keep(3);
  const Dictionary list = json({"outbox", "list"});
  EXPECT_TRUE(list.boolean("enabled"));
  ASSERT_EQ(list.array("servers")->size(), 1U);
  const Dictionary& row = *list.array("servers")->begin()->dictionary();
  EXPECT_EQ(row.string("server")->str(), server());
  EXPECT_GE(row.integer("posts"), 3);
  EXPECT_GT(row.integer("bytes"), 300);
  const std::string shown = columns({"outbox", "list"});
  EXPECT_TRUE(has(shown, "SERVER")) << shown;
  EXPECT_TRUE(has(shown, server())) << shown;
  const Dictionary one = json({"outbox", "show", server()});
  EXPECT_EQ(one.integer("lastStatus"), 503);
  ASSERT_EQ(one.array("users")->size(), 1U);
  EXPECT_EQ(one.array("users")->begin()->dictionary()->integer("user"), static_cast<int64_t>(::getuid()));
  const std::string text = columns({"outbox", "show", server()});
  EXPECT_TRUE(has(text, "last answer    503")) << text;
  EXPECT_TRUE(has(text, "user " + std::to_string(::getuid()))) << text;
  const ProgramRun other = kytctl({"outbox", "show", "https://other.example.org"});
  EXPECT_EQ(other.status, 1);
  EXPECT_TRUE(has(other.text, "Nothing waits for https://other.example.org")) << other.text;
}

TEST_F(OutboxWindow, SendsWhenItIsAsked) {
  settings(kOn);
  // The server says that it wants to be left alone.
  retryAfter("3600");
  start();
  keep(2);
  const int64_t before = waiting();
  ASSERT_GE(before, 2);
  retryAfter("");
  take(100);
  EXPECT_EQ(json({"outbox", "flush"}).integer("posts"), before);
  EXPECT_TRUE(eventually([&] { return waiting() == 0; })) << daemon_.log();
  EXPECT_GE(taken().size(), static_cast<size_t>(before));
  EXPECT_TRUE(has(columns({"outbox", "flush"}), "0 posts, to 0 servers"));
}

TEST_F(OutboxWindow, LeavesAServerAloneForAsLongAsItAskedThoughTheDaemonIsKilled) {
  settings(kOn);
  retryAfter("7200");
  start();
  keep(2);
  const int64_t before = json({"outbox", "show", server()}).integer("nextTry");
  EXPECT_GT(before, std::time(nullptr) + 7100);
  kill();
  clients_.clear();
  retryAfter("");
  take(100);
  start();
  const int64_t after = json({"outbox", "show", server()}).integer("nextTry");
  EXPECT_GE(after, before - 1);
  EXPECT_LE(after, before + 62);
  EXPECT_TRUE(taken().empty());
}

TEST_F(OutboxWindow, DropsWhatItIsTold) {
  settings(kOn);
  retryAfter("3600");
  start();
  keep(2);
  const int64_t before = waiting();
  EXPECT_EQ(kytctl({"outbox", "drop"}).status, 1) << "nobody said what";
  EXPECT_EQ(json({"outbox", "drop", "--server", "https://other.example.org"}).integer("dropped"), 0);
  EXPECT_EQ(json({"outbox", "drop", "--user", "4000000"}).integer("dropped"), 0);
  EXPECT_EQ(waiting(), before);
  EXPECT_EQ(json({"outbox", "drop", "--user", std::to_string(::getuid())}).integer("dropped"), before);
  EXPECT_EQ(waiting(), 0);
  const std::string books = columns({"books"});
  EXPECT_TRUE(has(books, "outbox-dropped")) << books;
  keep(1);
  EXPECT_TRUE(has(columns({"outbox", "drop", "--all"}), "Dropped: ")) << "all of it";
  EXPECT_EQ(waiting(), 0);
}

// Least of all does what a script left empty mean everything.
TEST_F(OutboxWindow, DropsNothingByWhatCannotBeMeant) {
  settings(kOn);
  retryAfter("3600");
  start();
  keep(2);
  const int64_t before = waiting();
  const std::vector<std::vector<std::string>> wrong = {
      {"drop", "--user", "-1"},
      {"drop", "--user", "4294967296"},
      {"drop", "--user", "99999999999999999999999"},
      {"drop", "--user", "0x0"},
      {"drop", "--user", " " + std::to_string(::getuid())},
      {"drop", "--user", ""},
      {"drop", "--server", ""},
      {"drop", "--server", "", "--user", std::to_string(::getuid())},
      {"drop", "--server", server(), "--user", ""},
      {"drop", "--all", "--server", ""},
      {"drop", "--all", "--user", ""},
      {"drop", server()},
      {"show"},
      {"show", ""},
      {"list", "more"},
      {"flush", "more"},
      {"empty"},
      {}};
  for (std::vector<std::string> arguments : wrong) {
    arguments.insert(arguments.begin(), "outbox");
    const ProgramRun run = kytctl(arguments);
    EXPECT_GT(run.status, 0) << run.text;
    EXPECT_LE(run.status, 2) << run.text;
    EXPECT_EQ(waiting(), before) << run.text;
  }
  for (const std::string& none : {server() + "/events", server() + "\n", std::string("\x1b[2J\xff")}) {
    EXPECT_EQ(json({"outbox", "drop", "--all", "--server", none}).integer("dropped"), 0);
    const ProgramRun run = kytctl({"outbox", "show", none});
    EXPECT_EQ(run.status, 1);
    EXPECT_EQ(run.text.find('\x1b'), std::string::npos) << run.text;
  }
  EXPECT_EQ(waiting(), before);
}

TEST_F(OutboxWindow, SaysThatThereIsNone) {
  settings("");
  start();
  EXPECT_TRUE(has(columns({"outbox", "list"}), "There is no outbox: outbox.enabled"));
  EXPECT_FALSE(json({"outbox", "list"}).boolean("enabled"));
  for (const std::vector<std::string>& command :
       {std::vector<std::string>{"outbox", "flush"}, {"outbox", "drop", "--all"}}) {
    const ProgramRun run = kytctl(command);
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(has(run.text, "There is no outbox")) << run.text;
  }
}

TEST_F(OutboxWindow, SaysThatNoDaemonRuns) {
  settings(kOn);
  for (const std::vector<std::string>& command :
       {std::vector<std::string>{"list"}, {"show", "https://x"}, {"flush"}, {"drop", "--all"}}) {
    std::vector<std::string> all{"outbox"};
    all.insert(all.end(), command.begin(), command.end());
    const ProgramRun run = kytctl(all);
    EXPECT_EQ(run.status, 3) << command[0];
    EXPECT_TRUE(has(run.text, "the daemon does not run")) << run.text;
  }
}

TEST_F(OutboxWindow, TellsTheOwnerWhatWaitsAndErasesIt) {
  settings(kOn);
  retryAfter("3600");
  start();
  keep(2);
  const int64_t before = waiting();
  const auto told = [&] {
    const Dictionary all = json({"owner", "show"});
    const Dictionary* outbox = all.dictionary("waiting")->dictionary("outbox");
    return outbox != nullptr ? outbox->integer("posts") : -1;
  };
  EXPECT_EQ(told(), before) << "beside the daemon";
  const auto line = [](int64_t posts) {
    return "Waiting in the outbox: " + std::to_string(posts) + (posts == 1 ? " post, " : " posts, ");
  };
  EXPECT_TRUE(has(kytctl({"owner", "show"}).text, line(before)));
  end();
  EXPECT_GE(told(), before) << "without it, with what the end of the session posted";
  EXPECT_TRUE(has(kytctl({"owner", "show"}).text, line(told())));
  const ProgramRun exported = kytctl({"owner", "export", "-"});
  EXPECT_EQ(exported.status, 0) << exported.text;
  EXPECT_TRUE(has(exported.text, server() + "/events")) << exported.text;
  const ProgramRun erased = kytctl({"owner", "erase"});
  EXPECT_EQ(erased.status, 0) << erased.text;
  EXPECT_TRUE(has(erased.text, "Erased: what could not be sent\n")) << erased.text;
  EXPECT_EQ(told(), 0);
  EXPECT_TRUE(std::filesystem::is_empty(folder()));
  take(100);
  retryAfter("");
  start();
  EXPECT_EQ(waiting(), 0);
  EXPECT_TRUE(taken().empty());
}

TEST_F(OutboxWindow, ErasesWhatTheRunningDaemonHasInIt) {
  settings(kOn);
  retryAfter("3600");
  start();
  keep(1);
  EXPECT_EQ(kytctl({"owner", "erase"}).status, 0);
  started_ = false;
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(std::filesystem::is_empty(folder()));
}

}  // namespace
}  // namespace kyt
