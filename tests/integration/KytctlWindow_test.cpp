// kytctl status, sessions, books, storebags, metrics and log-level against the built daemon: the columns for people and the
// JSON for programs, of the same daemon.
#include <gtest/gtest.h>

#include <filesystem>
#include <regex>
#include <sstream>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/PlainClient.h"

namespace kyt {
namespace {

std::vector<std::string> linesOf(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

size_t characters(const std::string& line) {
  size_t count = 0;
  for (const char c : line) count += (static_cast<unsigned char>(c) & 0xC0) != 0x80 ? 1 : 0;
  return count;
}

class KytctlWindow : public StageTest {
 protected:
  // One object on one line, which holds nothing that steers a terminal.
  Dictionary json(std::vector<std::string> command) const {
    command.emplace_back("--json");
    const ProgramRun run = kytctl(command);
    EXPECT_EQ(run.status, 0) << run.text;
    EXPECT_EQ(linesOf(run.text).size(), 1U) << run.text;
    for (const std::string& line : linesOf(run.text)) EXPECT_TRUE(isPlainText(line)) << escapedText(line);
    auto parsed = RapidJSON().parse(run.text);
    const auto* value = std::get_if<Value>(&parsed);
    if (value == nullptr || value->dictionary() == nullptr) {
      ADD_FAILURE() << "no JSON object: " << run.text;
      return {};
    }
    return *value->dictionary();
  }
  // Lines that fit 100 characters and hold nothing that steers a terminal.
  std::string columns(const std::vector<std::string>& command) const {
    const ProgramRun run = kytctl(command);
    EXPECT_EQ(run.status, 0) << run.text;
    for (const std::string& line : linesOf(run.text)) {
      EXPECT_LE(characters(line), 100U) << line;
      for (const char c : line) EXPECT_FALSE(static_cast<unsigned char>(c) < 0x20 || c == 0x7F) << line;
    }
    return run.text;
  }
  static std::vector<Dictionary> rows(const Dictionary& answer, const char* key) {
    std::vector<Dictionary> rows;
    const Array* array = answer.array(key);
    for (size_t i = 0; array != nullptr && i < array->size(); ++i)
      rows.push_back(*(array->begin() + i)->dictionary());
    return rows;
  }
  static std::string text(const Dictionary& row, const char* key) {
    const String* text = row.string(key);
    return text != nullptr ? text->str() : "(none)";
  }
  // One event of another user's program.
  void reportAsNobody() {
    constexpr char kNobody[] = "65534";
    ASSERT_FALSE(tools::writeFile(
        stage_->folder() + "/etc/kytreportingd/entitlements.d/nobody.toml",
        std::string("[[grant]]\nuser = ") + kNobody + "\n\"com.vantu.private.kytreportingd\" = true\n",
        0644));
    std::filesystem::permissions(stage_->folder(), std::filesystem::perms(0755));
    std::filesystem::copy(stage_->program("kytctl"), stage_->folder() + "/kytctl");
    const ProgramRun sent =
        runProgram("setpriv", {std::string("--reuid=") + kNobody, std::string("--regid=") + kNobody,
                               "--clear-groups", stage_->folder() + "/kytctl", "send", "--socket", socket(),
                               "--client-type", "7", "--category", "5", "--type", "1", "--require-user-info",
                               "--user-info", R"({"ClientName":"a","ServiceName":"s"})"});
    EXPECT_EQ(sent.text, "finished\n");
  }
  // Two delivered events, the session's start among them, and one batched.
  void report(TestClient& client) {
    EXPECT_EQ(client.configure(), "live: httppost") << daemonLog();
    EXPECT_TRUE(client.send(5, 1, Dictionary{{"a", 1}}));
    EXPECT_EQ(client.flush(), "flushed") << daemonLog();
    EXPECT_TRUE(client.send(6, 1, Dictionary{{"a", 1}}));
    EXPECT_EQ(client.displayURL(), "https://display.example.org/");  // what was sent before has been handled
  }
};

TEST_F(KytctlWindow, TellsHowTheDaemonStandsInBothForms) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  TestClient client(socket(), 7, "a");
  report(client);

  const Dictionary status = json({"status"});
  EXPECT_EQ(status.integer("sessions"), 1);
  EXPECT_EQ(status.integer("delivered"), 1);
  EXPECT_EQ(status.integer("pending"), 1);
  EXPECT_EQ(status.integer("taken"), 2);
  EXPECT_EQ(status.integer("dropped"), 0);
  EXPECT_EQ(status.dictionary("lastHour")->integer("delivered"), 1);
  EXPECT_GT(status.integer("threads"), 1);
  EXPECT_GT(status.integer("memoryBytes"), 1 << 20);
  const std::vector<Dictionary> servers = rows(status, "servers");
  ASSERT_FALSE(servers.empty());
  EXPECT_EQ(servers.back().integer("lastStatus"), 200);
  const std::vector<Dictionary> inForce = rows(status, "storebags");
  ASSERT_EQ(inForce.size(), 1U);
  EXPECT_EQ(text(inForce[0], "version"), "1");

  const std::string shown = columns({"status"});
  for (const char* line :
       {"\nclients        1 session, 1 connection\n", "\nworking        yes, 1 left in the last hour\n",
        "\nlast hour      1 delivered, 0 dropped (0.0 %)\n",
        "\nall            1 delivered, 0 dropped (0.0 %), 1 pending of 2 taken\n",
        "\nback ends      QH httppost enabled, in 1 session\n", "storebags      cadmor version 1 in force"})
    EXPECT_NE(shown.find(line), std::string::npos) << shown;

  const std::vector<Dictionary> sessions = rows(json({"sessions"}), "sessions");
  ASSERT_EQ(sessions.size(), 1U);
  EXPECT_EQ(sessions[0].integer("pid"), ::getpid());
  EXPECT_EQ(text(sessions[0], "client"), "a");
  EXPECT_NE(text(sessions[0], "program").find("kyt_tests_integration"), std::string::npos);
  const Dictionary backEnd = rows(sessions[0], "backEnds").at(0);
  EXPECT_EQ(text(backEnd, "state"), "enabled");
  EXPECT_EQ(backEnd.integer("batchedEvents"), 1);
  EXPECT_EQ(backEnd.integer("inFlight"), 0);
  EXPECT_EQ(backEnd.integer("lastStatus"), 200);
  const std::string listed = columns({"sessions"});
  EXPECT_NE(listed.find("a:test"), std::string::npos) << listed;
  EXPECT_NE(listed.find("      httppost enabled, 1 events in the batch, 0 in flight, last post "),
            std::string::npos)
      << listed;

  const std::vector<Dictionary> books = rows(json({"books"}), "rows");
  ASSERT_EQ(books.size(), 2U);  // the program's, and the daemon's own
  for (const Dictionary& row : books) {
    const int all = row.integer("queued") + row.integer("batched") + row.integer("inFlight") +
                    row.integer("waiting") + row.integer("outbox") + row.integer("delivered") +
                    row.integer("dropped");
    EXPECT_EQ(row.integer("taken"), all);
  }
  EXPECT_NE(columns({"books"}).find("(start and stop)"), std::string::npos);

  const std::vector<Dictionary> bags = rows(json({"storebags"}), "storebags");
  ASSERT_EQ(bags.size(), 1U);
  EXPECT_EQ(text(bags[0], "state"), "good");
  EXPECT_NE(columns({"storebags"}).find("cadmor  1 "), std::string::npos) << columns({"storebags"});

  EXPECT_EQ(text(json({"log-level", "error"}), "logLevel"), "error");
  EXPECT_EQ(columns({"log-level"}), "error\n");
  EXPECT_EQ(text(json({"metrics"}), "openmetrics").substr(0, 7), "# HELP ");
}

TEST_F(KytctlWindow, TellsThatNothingWasToBeSentAndThatEventsWait) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  EXPECT_NE(columns({"status"}).find("\nworking        nothing was to be sent in the last hour\n"),
            std::string::npos);
  TestClient client(socket(), 7, "a");
  ASSERT_EQ(client.configure(), "live: httppost") << daemonLog();
  EXPECT_TRUE(client.send(6, 1, Dictionary{{"a", 1}}));
  EXPECT_EQ(client.displayURL(), "https://display.example.org/");
  EXPECT_NE(columns({"status"}).find("\nworking        nothing left in the last hour, 1 pending\n"),
            std::string::npos)
      << columns({"status"});
}

TEST_F(KytctlWindow, TellsWhatIsLostAndWhichRuleKeepsABackEndOff) {
  lay();
  putBag("cadmor", {entry("a"), entry("broken", "/no-such-path")});
  startDaemon();
  TestClient unlisted(socket(), 7, "unlisted");
  EXPECT_EQ(unlisted.configure(), "live:");
  EXPECT_TRUE(unlisted.send(5, 1, {}));
  EXPECT_EQ(unlisted.displayURL(), "https://display.example.org/");
  TestClient broken(socket(), 7, "broken");
  EXPECT_EQ(broken.configure(), "live: httppost");
  EXPECT_TRUE(broken.send(5, 1, {}));
  EXPECT_EQ(broken.flush(), "flushed");
  const std::string shown = columns({"status"});
  EXPECT_NE(shown.find("\nworking        no, nothing left in the last hour, and 2 did not: most for "),
            std::string::npos)
      << shown;
  EXPECT_NE(shown.find("QH httppost disabled by client, in 1 session"), std::string::npos) << shown;
  EXPECT_NE(shown.find(" 1 event-dropped-by-state\n"), std::string::npos) << shown;
  EXPECT_NE(shown.find(" 1 post-refused\n"), std::string::npos) << shown;
  EXPECT_NE(shown.find("last error at "), std::string::npos) << shown;
  EXPECT_NE(shown.find(": status 404\n"), std::string::npos) << shown;
}

TEST_F(KytctlWindow, IsNotConfusedByNamesOfAnyKind) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  const std::string garbage =
      "\x1b[2J\"},{\\\n# EOF\n\t\xff\xfe\u202e\u009b31m{}=\"1\" " + std::string(300, 'w');
  TestClient client(socket(), 7, garbage);
  EXPECT_EQ(client.configure(), "live:");
  EXPECT_TRUE(client.send(5, 1, {}));
  EXPECT_EQ(client.displayURL(), "https://display.example.org/");
  for (const char* command : {"status", "sessions", "books", "storebags"}) {
    static_cast<void>(columns({command}));
    static_cast<void>(json({command}));
  }
  const std::string metrics = text(json({"metrics"}), "openmetrics");
  EXPECT_EQ(metrics.find("# EOF\n"), metrics.size() - 6);
}

TEST_F(KytctlWindow, WritesNoTwoProgramsAlike) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  const std::string beginning = "com.vantu.programs.that.begin.alike.";
  for (const std::string& name : {std::string("a\n"), std::string("a\\n"), std::string("a:test"),
                                  beginning + "one", beginning + "another"}) {
    TestClient client(socket(), 7, name);
    EXPECT_EQ(client.configure(), "live:");
    EXPECT_TRUE(client.send(5, 1, {}));
    EXPECT_EQ(client.displayURL(), "https://display.example.org/");
  }
  const std::string books = columns({"books"});
  for (const char* wanted : {" a\\n:test ", " a\\x5cn:test ", " a\\x3atest:test ",
                             "\n      com.vantu.programs.that.begin.alike.one:test\n",
                             "\n      com.vantu.programs.that.begin.alike.another:test\n"})
    EXPECT_NE(books.find(wanted), std::string::npos) << wanted << "\n" << books;
}

TEST_F(KytctlWindow, TellsInTheColumnsOfTheBooksWhereEventsWait) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  TestClient client(socket(), 7, "a");
  report(client);
  EXPECT_NE(columns({"books"}).find("\n      pending: batched 1\n"), std::string::npos) << columns({"books"});
}

// A program may call itself anything in each message: that makes no more rows than a user may have, and none of another
// user's program goes.
TEST_F(KytctlWindow, ShowsBooksThatNoUserMakesGrowWithoutEnd) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  constexpr int kNames = 1500;
  test::PlainClient hostile(socket());
  ASSERT_TRUE(hostile.shakeHands());
  for (int i = 0; i < kNames; ++i)
    hostile.call(
        "SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}",
        [&](MessageWriter& out) {
          out.writeDictionary({{kKYTReportingSessionInfoSessionID, 77},
                               {kKYTReportingSessionInfoClientType, 7},
                               {kKYTReportingSessionInfoRequireUserInfo, true}});
          out.writeOptionalDictionary(
              Dictionary{{"ClientName", std::to_string(i) + std::string(5000, 'n')}, {"ServiceName", "s"}});
          out.writeUInt16(5);
          out.writeUInt16(1);
          out.writeOptionalDictionary(std::nullopt);
        },
        i == kNames - 1);
  ASSERT_TRUE(hostile.receive());
  const bool isRoot = ::geteuid() == 0;
  if (isRoot) reportAsNobody();

  const std::vector<Dictionary> books = rows(json({"books"}), "rows");
  int64_t taken = 0, merged = 0;
  size_t own = 0, others = 0;
  for (const Dictionary& row : books) {
    EXPECT_LE(text(row, "client").size(), Limits::maxBookNameBytes);
    if (row.unsignedInteger("user") != ::geteuid()) {
      ++others;
      EXPECT_EQ(text(row, "client"), "a");
      continue;
    }
    ++own;
    taken += row.integer("taken");
    merged += row.integer("programsMerged");
  }
  EXPECT_EQ(own, Limits::maxBookRowsOfUser + 1) << "and the one that the others share";
  EXPECT_EQ(merged, kNames - static_cast<int64_t>(Limits::maxBookRowsOfUser));
  EXPECT_EQ(taken, kNames);
  EXPECT_TRUE(others > 0 || !isRoot);
  const std::string shown = columns({"books"});
  EXPECT_NE(shown.find(" (other programs) "), std::string::npos) << shown;
  EXPECT_NE(
      shown.find("\n      of " + std::to_string(merged) + " programs, or more, without rows of their own\n"),
      std::string::npos)
      << shown;
}

// Where little may wait for one client, the answers tell less, and the sums stay.
TEST_F(KytctlWindow, AnswersWhateverOneClientCallsItselfAndHoweverLittleMayWait) {
  tools::Stage::Options options;
  options.extraSettings = "[limits]\nmax_queued_bytes = 65536\n";
  lay(std::move(options));
  putBag("cadmor", {entry("a")});
  startDaemon();
  constexpr int kNames = 500;
  test::PlainClient hostile(socket());
  ASSERT_TRUE(hostile.shakeHands());
  for (int i = 0; i < kNames; ++i)
    hostile.call(
        "SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}",
        [&](MessageWriter& out) {
          out.writeDictionary({{kKYTReportingSessionInfoSessionID, 77},
                               {kKYTReportingSessionInfoClientType, 7},
                               {kKYTReportingSessionInfoRequireUserInfo, true}});
          out.writeOptionalDictionary(
              Dictionary{{"ClientName", std::to_string(i) + std::string(Limits::maxBookNameBytes, '\x01')},
                         {"ServiceName", std::string(Limits::maxBookNameBytes, '\x01')}});
          out.writeUInt16(5);
          out.writeUInt16(1);
          out.writeOptionalDictionary(std::nullopt);
        },
        i == kNames - 1);
  ASSERT_TRUE(hostile.receive());
  const std::vector<Dictionary> books = rows(json({"books"}), "rows");
  ASSERT_EQ(books.size(), 1U);
  EXPECT_EQ(books[0].integer("programsMerged"), kNames);
  EXPECT_EQ(books[0].integer("taken"), kNames);
  EXPECT_EQ(text(books[0], "client"), "other");
  const std::string metrics = text(json({"metrics"}), "openmetrics");
  EXPECT_NE(metrics.find("client=\"other\",service=\"\",back_end=\"other\",origin=\"program\"} 500\n"),
            std::string::npos)
      << metrics.substr(0, 5000);
  EXPECT_EQ(json({"status"}).integer("taken"), kNames);
}

TEST_F(KytctlWindow, ShowsSomeOfTheSessionsWhereThereIsNoRoomForAll) {
  tools::Stage::Options options;
  options.extraSettings = "[limits]\nmax_queued_bytes = 32768\n";
  lay(std::move(options));
  putBag("cadmor", {entry("a")});
  startDaemon();
  std::vector<std::unique_ptr<TestClient>> clients;
  for (int i = 0; i < 200; ++i) {
    clients.push_back(std::make_unique<TestClient>(socket(), 7, "a"));
    ASSERT_NE(clients.back()->configure(), "none");
  }
  const Dictionary answer = json({"sessions"});
  EXPECT_EQ(answer.integer("all"), 200);
  EXPECT_EQ(rows(answer, "sessions").size(), 32U);
  EXPECT_NE(columns({"sessions"}).find("\nand 168 more\n"), std::string::npos);
}

TEST_F(KytctlWindow, SaysThatAnAnswerHasNoRoomAndGoesOn) {
  tools::Stage::Options options;
  options.extraSettings = "[limits]\nmax_queued_bytes = 2000\n";
  lay(std::move(options));
  startDaemon();
  const ProgramRun run = kytctl({"metrics"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.text,
            "kytctl: The answer is larger than what may wait for one client (limits.max_queued_bytes, "
            "limits.max_bytes_per_user)\n");
  EXPECT_EQ(kytctl({"books"}).status, 0);
}

TEST_F(KytctlWindow, SaysThatTheDaemonDoesNotRunAndWhetherASocketWaits) {
  DaemonProcess daemon("http://127.0.0.1:9");
  const std::string program = std::string(KYT_PROGRAMS) + "/kytctl";
  for (const char* command : {"status", "sessions", "books", "storebags", "metrics", "log-level"}) {
    const ProgramRun run = runProgram(program, {"--root", daemon.root().path(), command});
    EXPECT_EQ(run.status, 3) << command;
    EXPECT_NE(run.text.find("kytctl: the daemon does not run, and no socket waits for clients at "),
              std::string::npos)
        << run.text;
  }
  daemon.activateBySocket();
  const ProgramRun run = runProgram(program, {"--root", daemon.root().path(), "status", "--json"});
  EXPECT_EQ(run.status, 3);
  EXPECT_EQ(run.text, "kytctl: the daemon does not run; its socket waits for the first client\n");
}

TEST_F(KytctlWindow, SaysThatTheDaemonRunsWithoutItsAdministrationSocket) {
  DaemonProcess daemon("http://127.0.0.1:9");
  ASSERT_TRUE(daemon.startAndWait()) << daemon.log();
  std::filesystem::remove(daemon.root() / "run/kytreportingd/admin");
  const ProgramRun run =
      runProgram(std::string(KYT_PROGRAMS) + "/kytctl", {"--root", daemon.root().path(), "status"});
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.text.find("the daemon runs, as process " + std::to_string(daemon.process()) +
                          ", and has no administration socket"),
            std::string::npos)
      << run.text;
}

TEST_F(KytctlWindow, FoldsTheLinesOfAReloadAndLosesNothing) {
  lay();
  startDaemon();
  const std::string settings = stage_->folder() + "/etc/kytreportingd/kytreportingd.toml";
  // Words, a path without a blank that takes lines, and letters of two bytes.
  const std::string path = stage_->folder() + "/server/" + std::string(120, 'x') + " \u00fc\u00fc " +
                           std::string(50, 'y') + "/ca.pem";
  ASSERT_FALSE(tools::writeFile(settings,
                                std::regex_replace(contents(settings), std::regex("ca_file = \"[^\"]+\""),
                                                   "ca_file = \"" + path + "\""),
                                0644));
  const Dictionary answer = json({"reload"});
  const Array* lines = answer.array("settings");
  ASSERT_TRUE(lines != nullptr && lines->size() == 1);
  const std::string line = (*lines)[0].string()->str();
  ASSERT_NE(line.find(path), std::string::npos) << line;
  const std::string folded = columns({"reload"});
  EXPECT_GT(linesOf(folded).size(), 2U) << folded;
  std::string joined;
  for (const std::string& part : linesOf(folded)) {
    EXPECT_EQ(part.starts_with("      "), !joined.empty()) << folded;
    joined += part;
  }
  const auto withoutBlanks = [](const std::string& text) {
    return std::regex_replace(text, std::regex("[ \n]"), "");
  };
  EXPECT_EQ(withoutBlanks(joined), withoutBlanks(line));
}

// A collector's file that a full disk has cut would stand in place of a whole one.
TEST_F(KytctlWindow, EndsWithAnErrorWhenItCannotWrite) {
  lay();
  startDaemon();
  const std::string program =
      "timeout 30 '" + stage_->program("kytctl") + "' --root '" + stage_->folder() + "' ";
  for (const char* command : {"status", "sessions", "books", "storebags", "metrics", "metrics --json",
                              "log-level", "reload --json", "watch", "owner show"}) {
    const ProgramRun run = runProgram("sh", {"-c", program + command + " >/dev/full"});
    EXPECT_EQ(run.status, 1) << command;
    EXPECT_TRUE(run.text.starts_with("kytctl: can't write the output")) << command << ": " << run.text;
  }
}

}  // namespace
}  // namespace kyt
