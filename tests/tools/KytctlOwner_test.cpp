// What the owner of the device sees, takes along and erases, beside a real daemon and without one.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <utility>

#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/device/DepartureFile.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

class KytctlOwner : public StageTest {
 protected:
  void start() {
    if (stage_ == nullptr) lay();
    putBag("dulvek", {entry("person"), entry("other")});
    ASSERT_EQ(kytctl({"consent", "grant"}).status, 0);
    startDaemon();
  }
  // A daemon that ends writes what it knows.
  void end() { EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog(); }
  void report(const std::string& name, int events) {
    TestClient client(socket(), 8, name);
    ASSERT_EQ(client.configure(), "live: httppost");
    for (int i = 0; i < events; ++i) ASSERT_TRUE(client.send(3, 1, {{"step", i}}));
    ASSERT_TRUE(client.finish());
    ASSERT_TRUE(arrive("client=" + name + "&method=3", events));
  }
  Dictionary shown() {
    const ProgramRun run = kytctl({"owner", "show", "--json"});
    EXPECT_EQ(run.status, 0) << run.text;
    return object(run.text);
  }
  static Dictionary object(const std::string& text) {
    RapidJSON json;
    const auto parsed = json.parse(text);
    const auto* value = std::get_if<Value>(&parsed);
    EXPECT_TRUE(value != nullptr && value->isDictionary()) << text;
    return value != nullptr && value->isDictionary() ? *value->dictionary() : Dictionary();
  }
  static Array list(const Dictionary& object, const char* key) {
    const Value* value = object.find(key);
    EXPECT_TRUE(value != nullptr && value->array() != nullptr) << key;
    return value != nullptr && value->array() != nullptr ? *value->array() : Array();
  }
  static std::string identifierIn(const Dictionary& object) {
    for (const Value& one : list(object, "identifiers"))
      if (*one.dictionary()->string("name") == "uuidRespectDnu")
        return one.dictionary()->string("value")->str();
    return "";
  }
  std::string state(const std::string& file) const {
    return stage_->folder() + "/var/lib/kytreportingd/defaults/" + file;
  }
  size_t messageLogs() const {
    std::error_code none;
    size_t files = 0;
    for (const auto& entry : std::filesystem::directory_iterator(
             stage_->folder() + "/var/mobile/Library/Logs/Faultbin/Retired", none))
      files += entry.is_regular_file() ? 1 : 0;
    return files;
  }
};

TEST_F(KytctlOwner, SeesNothingOnADeviceThatReportedNothing) {
  tools::Stage::Options options;
  options.consent = false;
  lay(std::move(options));
  const ProgramRun run = kytctl({"owner", "show"});
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_TRUE(has(run.text, "Nothing left the device since records are kept\n")) << run.text;
  EXPECT_TRUE(has(run.text, "Identifiers: none\n")) << run.text;
  EXPECT_TRUE(has(run.text, "upload: not given\n")) << run.text;
  EXPECT_TRUE(has(run.text, "Waiting: nothing in memory, the daemon does not run\n")) << run.text;
  EXPECT_TRUE(has(run.text, "Message log: none\n")) << run.text;
}

TEST_F(KytctlOwner, SeesWhatLeftByProgramAndServerAndTheIdentifiers) {
  start();
  report("person", 3);
  report("other", 2);
  Dictionary running = shown();
  const Value* daemon = running.find("waiting")->dictionary()->find("daemon");
  EXPECT_EQ(daemon->longLongValue(), stage_->daemon()->pid());
  end();
  const Dictionary all = shown();
  EXPECT_TRUE(all.find("consent")->boolValue());
  EXPECT_TRUE(all.find("waiting")->dictionary()->find("daemon")->isNull());
  std::map<std::string, int64_t> events;
  for (const Value& value : list(all, "left")) {
    const Dictionary& row = *value.dictionary();
    EXPECT_EQ(*row.string("server"), stage_->httpsBase());
    EXPECT_EQ(row.find("user")->longLongValue(), static_cast<int64_t>(getuid()));
    EXPECT_EQ(row.find("clientType")->longLongValue(), 8);
    EXPECT_EQ(*row.string("kind"), "events");
    EXPECT_EQ(row.find("unanswered")->longLongValue(), 0);
    EXPECT_GT(row.find("bytes")->longLongValue(), 0);
    events[row.string("client")->str()] += row.find("events")->longLongValue();
  }
  // With the start and the stop message of each.
  EXPECT_EQ(events, (std::map<std::string, int64_t>{{"other", 4}, {"person", 5}}));
  EXPECT_NE(identifierIn(all), "");
  for (const Value& one : list(all, "identifiers"))
    EXPECT_GT(one.dictionary()->find("made")->doubleValue(), 1e9);
  EXPECT_EQ(list(all, "logs").size(), 1U) << "with consent what was posted stands there";
}

TEST_F(KytctlOwner, SeesWhatWaitsByProgramAndPlace) {
  start();
  TestClient client(socket(), 8, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  ASSERT_EQ(client.flush(), "flushed");  // the start of the session
  EXPECT_TRUE(has(kytctl({"owner", "show"}).text, "Waiting: nothing, of the daemon that runs (process "));
  for (int i = 0; i < 7; ++i) ASSERT_TRUE(client.send(5, 1, {}));
  ASSERT_EQ(client.displayURL(), "https://display.example.org/") << "the daemon has them";
  const Dictionary waiting = *shown().dictionary("waiting");
  EXPECT_EQ(waiting.find("daemon")->longLongValue(), stage_->daemon()->pid());
  EXPECT_EQ(waiting.find("problem"), nullptr);
  const Array rows = list(waiting, "rows");
  ASSERT_EQ(rows.size(), 1U) << description(waiting);
  const Dictionary& row = *rows.begin()->dictionary();
  EXPECT_EQ(*row.string("client"), "person");
  EXPECT_EQ(*row.string("backEnd"), "httppost");
  EXPECT_EQ(row.integer("user"), static_cast<int>(getuid()));
  EXPECT_EQ(row.integer("batched"), 7);
  for (const char* elsewhere : {"queued", "inFlight", "waiting", "outbox"})
    EXPECT_EQ(row.integer(elsewhere), 0) << elsewhere;
  const std::string text = kytctl({"owner", "show"}).text;
  EXPECT_TRUE(has(text, "Waiting, of the daemon that runs (process ")) << text;
  EXPECT_TRUE(has(text, "  7 in the batch\n")) << text;
  client.close();
  end();
  const Dictionary after = *shown().dictionary("waiting");
  EXPECT_TRUE(after.find("daemon")->isNull());
  EXPECT_TRUE(list(after, "rows").empty());
}

TEST_F(KytctlOwner, IsToldThatADaemonDoesNotSayWhatWaits) {
  start();
  // It opens a moment after the other one.
  const std::string window = stage_->folder() + "/run/kytreportingd/admin";
  ASSERT_TRUE(eventually([&window] { return std::filesystem::remove(window); }));
  ASSERT_TRUE(eventually([&] { return DaemonLock::holder(state("")) > 0; })) << "it is seen to run";
  const Dictionary waiting = *shown().dictionary("waiting");
  ASSERT_NE(waiting.string("problem"), nullptr) << description(waiting);
  EXPECT_TRUE(has(waiting.string("problem")->str(), "has no administration socket")) << description(waiting);
  const ProgramRun run = kytctl({"owner", "show"});
  EXPECT_TRUE(has(run.text, "has it in memory; how much it is cannot be told: ")) << run.text;
}

TEST_F(KytctlOwner, ReadsLinesOfAHundredCharacters) {
  start();
  report("person", 3);
  end();
  const ProgramRun run = kytctl({"owner", "show"});
  EXPECT_EQ(run.status, 0);
  std::istringstream lines(run.text);
  bool found = false;
  for (std::string line; std::getline(lines, line);) {
    if (!line.starts_with("Message log: ")) {
      EXPECT_LE(line.size(), 100U) << line;
    }
    std::istringstream words(line);
    std::string client, service, type, user, server, events;
    words >> client >> service >> type >> user >> server >> events;
    if (client != "person") continue;
    found = true;
    EXPECT_EQ(service, "test");
    EXPECT_EQ(type, "8");
    EXPECT_EQ(user, std::to_string(getuid()));
    EXPECT_EQ(server, stage_->httpsBase());
    EXPECT_EQ(events, "5");
  }
  EXPECT_TRUE(found) << run.text;
  EXPECT_TRUE(has(run.text, "uuidRespectDnu ")) << run.text;
}

TEST_F(KytctlOwner, SeesNothingOfWhatNobodyListenedFor) {
  start();
  TestClient client(socket(), 8, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  ASSERT_TRUE(client.send(3, 1, {}));
  stage_->server()->signal(SIGKILL);
  EXPECT_TRUE(
      eventually([&] { return client.flush() != "no answer" && logged("postJsonMessage): post error: "); }));
  end();
  EXPECT_TRUE(list(shown(), "left").empty());
}

TEST_F(KytctlOwner, SeesWhatWasCutOffAsWhatMayHaveLeft) {
  tools::Stage::Options options;
  options.extraSettings = "[service]\nshutdown_grace_seconds = 0.5\n";
  lay(std::move(options));
  start();
  TestClient client(socket(), 8, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  ASSERT_TRUE(client.send(3, 1, {}));
  ASSERT_EQ(client.displayURL(), "https://display.example.org/") << "the daemon has it";
  stage_->server()->signal(SIGSTOP);
  ASSERT_TRUE(eventually([&] { return standsStill(stage_->server()->pid()); }));
  end();
  stage_->server()->signal(SIGCONT);
  int64_t unanswered = 0;
  for (const Value& row : list(shown(), "left"))
    unanswered += row.dictionary()->find("unanswered")->longLongValue();
  EXPECT_GT(unanswered, 0);
  const ProgramRun run = kytctl({"owner", "show"});
  EXPECT_TRUE(has(run.text, " posts were not answered: they may have arrived or not\n")) << run.text;
}

TEST_F(KytctlOwner, TakesAllAlongInAFileOfHisOwn) {
  start();
  report("person", 3);
  end();
  const std::string file = stage_->folder() + "/mine.json";
  ASSERT_EQ(kytctl({"owner", "export", file}).status, 0);
  struct stat status = {};
  ASSERT_EQ(stat(file.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
  const Dictionary all = object(contents(file));
  EXPECT_EQ(identifierIn(all), identifierIn(shown()));
  const Array logs = list(all, "logs");
  ASSERT_EQ(logs.size(), 1U);
  EXPECT_TRUE(has(logs.begin()->dictionary()->string("text")->str(), "\"step\": 2")) << "what was posted";
  EXPECT_FALSE(list(*all.find("leftByHour")->dictionary(), "rows").empty());
  EXPECT_EQ(object(kytctl({"owner", "export", "-"}).text).size(), all.size());
  EXPECT_EQ(object(kytctl({"owner", "export", "/dev/fd/1"}).text).size(), all.size());
  const ProgramRun nowhere = kytctl({"owner", "export", stage_->folder() + "/missing/file"});
  EXPECT_EQ(nowhere.status, 1);
  EXPECT_TRUE(has(nowhere.text, "missing/file: No such file or directory")) << nowhere.text;
}

TEST_F(KytctlOwner, ErasesWithoutADaemon) {
  start();
  report("person", 3);
  end();
  const std::string before = identifierIn(shown());
  ASSERT_EQ(messageLogs(), 1U);
  const std::string outbox = stage_->folder() + "/var/lib/kytreportingd/outbox/outbox.sqlite";
  std::filesystem::create_directories(std::filesystem::path(outbox).parent_path());
  for (const char* ending : {"", "-wal", ".damaged"}) std::ofstream(outbox + ending) << "a post";
  const ProgramRun run = kytctl({"owner", "erase"});
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_TRUE(has(run.text, "Erased: what could not be sent\n")) << run.text;
  EXPECT_TRUE(std::filesystem::is_empty(std::filesystem::path(outbox).parent_path()));
  EXPECT_TRUE(has(run.text, ", 1 message logs, the record of what left\n")) << run.text;
  EXPECT_TRUE(has(run.text, "  server     " + stage_->httpsBase() + "\n")) << run.text;
  EXPECT_TRUE(has(run.text, "  identifier " + before + "\n")) << run.text;
  const Dictionary after = shown();
  EXPECT_TRUE(list(after, "left").empty());
  EXPECT_TRUE(list(after, "identifiers").empty());
  EXPECT_TRUE(after.find("consent")->boolValue()) << "the consent is no trace";
  EXPECT_EQ(messageLogs(), 0U);
  EXPECT_NE(access(state("erase").c_str(), F_OK), 0) << "the next daemon sends again";
  EXPECT_FALSE(has(contents(state("com.vantu.kytreporting.toml")), "uuid"));
}

TEST_F(KytctlOwner, ErasesBesideADaemonWhichSendsNothingMoreAndWritesNothingBack) {
  start();
  report("person", 3);
  const std::string before = identifierIn(shown());
  TestClient waiting(socket(), 8, "other");
  ASSERT_EQ(waiting.configure(), "live: httppost");
  for (int i = 0; i < 50; ++i) ASSERT_TRUE(waiting.send(5, 1, {}));
  ASSERT_EQ(waiting.displayURL(), "https://display.example.org/") << "the daemon has them";
  const ProgramRun run = kytctl({"owner", "erase"});
  EXPECT_EQ(run.status, 0) << run.text << daemonLog();
  EXPECT_TRUE(has(run.text, "what waited in its memory was not sent")) << run.text;
  EXPECT_TRUE(has(run.text, "  server     " + stage_->httpsBase() + "\n"))
      << "also of the last moments, which the daemon had not written down\n"
      << run.text;
  EXPECT_TRUE(logged("main: The owner erases what is known: what waits is not sent"));
  EXPECT_EQ(arrived("client=other&method=5"), 0);
  for (const char* file : {"departures.json", "erase"})
    EXPECT_NE(access(state(file).c_str(), F_OK), 0) << file;
  waiting.close();
  end();
  startDaemon();
  report("person", 1);
  EXPECT_EQ(arrived("client=other&method=5"), 0);
  const std::string after = identifierIn(shown());
  EXPECT_NE(after, "");
  EXPECT_NE(after, before);
}

TEST_F(KytctlOwner, NamesTheServerOfAPostThatWasOnItsWayWhenItErased) {
  start();
  TestClient client(socket(), 8, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/events","hang":true,"times":0})"))
      << "nothing is answered";
  ASSERT_TRUE(client.send(3, 1, {}));
  ASSERT_TRUE(client.finish());
  ASSERT_TRUE(eventually([&] {
    return has(kytctl({"books", "--json"}).text, "\"inFlight\":1");
  })) << kytctl({"books"}).text;
  const ProgramRun run = kytctl({"owner", "erase"});
  EXPECT_EQ(run.status, 0) << run.text << daemonLog();
  EXPECT_TRUE(has(run.text, "  server     " + stage_->httpsBase() + "\n")) << run.text;
  client.close();
  end();
}

// A process that stands for an eraser or a daemon, until it is killed.
class StandIn {
 public:
  explicit StandIn(const std::function<bool()>& begin) {
    int ready[2];
    EXPECT_EQ(pipe(ready), 0);
    process_ = fork();
    if (process_ == 0) {
      const char byte = begin() ? 'y' : 'n';
      if (write(ready[1], &byte, 1) != 1) _exit(1);
      for (;;) pause();
    }
    char byte = 0;
    EXPECT_EQ(read(ready[0], &byte, 1), 1);
    EXPECT_EQ(byte, 'y');
    close(ready[0]);
    close(ready[1]);
  }
  ~StandIn() { end(); }
  void end() {
    if (process_ == 0) return;
    kill(process_, SIGKILL);
    waitpid(std::exchange(process_, 0), nullptr, 0);
  }

 private:
  pid_t process_ = 0;
};

TEST_F(KytctlOwner, KeepsADaemonFromStartingWhileItErases) {
  start();
  end();
  StandIn eraser([this] {
    static ErasureMark mark(state(""));
    return mark.set();
  });
  startDaemon();
  EXPECT_EQ(stage_->daemon()->wait(std::chrono::seconds(30)).value_or(-1), 1) << daemonLog();
  EXPECT_TRUE(logged("main: The owner still erases what is known: not starting")) << daemonLog();
  EXPECT_EQ(access(state("erase").c_str(), F_OK), 0) << "the eraser's mark";
  startDaemon();
  eraser.end();
  report("person", 1);
  EXPECT_NE(access(state("erase").c_str(), F_OK), 0) << "it was left behind";
}

TEST_F(KytctlOwner, LetsADaemonEndThatWaitsForIt) {
  start();
  end();
  StandIn eraser([this] {
    static ErasureMark mark(state(""));
    return mark.set();
  });
  startDaemon();
  ASSERT_TRUE(eventually([&] {
    return logged("main: The owner erases what is known: waiting until that is done");
  })) << daemonLog();
  stage_->daemon()->signal(SIGHUP);
  stage_->daemon()->signal(SIGTERM);
  EXPECT_EQ(stage_->daemon()->wait(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog();
  EXPECT_FALSE(logged("not starting")) << daemonLog();
  EXPECT_EQ(access(state("erase").c_str(), F_OK), 0) << "the eraser's mark";
}

TEST_F(KytctlOwner, ErasesAMessageLogThatTheDaemonBeganMeanwhile) {
  start();
  end();
  StandIn daemon([this] {
    signal(SIGTERM, SIG_IGN);
    static std::optional<DaemonLock> lock;
    std::string problem;
    lock = DaemonLock::take(state(""), std::chrono::seconds(10), problem);
    return lock.has_value();
  });
  ASSERT_EQ(messageLogs(), 0U);
  tools::ChildProcess::Options how;
  how.outputFile = stage_->folder() + "/erased";
  auto erasing = tools::ChildProcess::start(stage_->program("kytctl"),
                                            {"--root", stage_->folder(), "owner", "erase"}, how);
  ASSERT_TRUE(erasing);
  ASSERT_TRUE(eventually([&] { return access(state("erase").c_str(), F_OK) == 0; }));
  const std::string logs = stage_->folder() + "/var/mobile/Library/Logs/Faultbin/Retired";
  std::filesystem::create_directories(logs);
  std::ofstream(logs + "/kytreportingd_2026-11-22-190000_messageLog.diag") << "what was answered";
  ASSERT_EQ(messageLogs(), 1U);
  daemon.end();
  EXPECT_EQ(erasing->wait(std::chrono::seconds(30)).value_or(-1), 0) << contents(how.outputFile);
  EXPECT_EQ(messageLogs(), 0U);
  EXPECT_TRUE(has(contents(how.outputFile), ", 1 message logs, ")) << contents(how.outputFile);
}

TEST_F(KytctlOwner, SeesProgramsInColumnsWhateverLettersTheirNamesHave) {
  lay();
  putBag("dulvek", {entry("p\u00e9rs\u00f6n"), entry("person")});
  ASSERT_EQ(kytctl({"consent", "grant"}).status, 0);
  startDaemon();
  report("person", 1);
  TestClient client(socket(), 8, "p\u00e9rs\u00f6n");
  ASSERT_EQ(client.configure(), "live: httppost");
  ASSERT_TRUE(client.send(4, 1, {}));
  ASSERT_TRUE(client.finish());
  ASSERT_TRUE(arrive("method=4", 1));
  end();
  const std::string text = kytctl({"owner", "show"}).text;
  // Both columns begin at the same character.
  std::set<size_t> places;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) {
    const size_t server = line.find("https://");
    if (server == line.npos) continue;
    const std::string before = line.substr(0, server);
    places.insert(static_cast<size_t>(std::count_if(before.begin(), before.end(), [](char c) {
      return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
    })));
  }
  EXPECT_EQ(places.size(), 1U) << text;
  EXPECT_TRUE(has(text, "p\u00e9rs\u00f6n ")) << text;
}

TEST_F(KytctlOwner, ErasesNothingWhereItCannotWrite) {
  lay();
  const std::string root = stage_->folder() + "/other";
  std::filesystem::create_directories(root + "/var/lib/kytreportingd");
  EXPECT_EQ(runProgram(stage_->program("kytctl"), {"--root", root, "owner", "erase"}).text,
            "Nothing to erase: no daemon ever ran here\n");
  ASSERT_FALSE(tools::writeFile(root + "/var/lib/kytreportingd/defaults", "no folder", 0600));
  const ProgramRun run = runProgram(stage_->program("kytctl"), {"--root", root, "owner", "erase"});
  EXPECT_EQ(run.status, 1);
  EXPECT_TRUE(has(run.text, "/erase: Not a directory")) << run.text;
}

}  // namespace
}  // namespace kyt
