// Mistakes that keep an event from arriving, or from arriving as it was meant, and who names the cause: mostly `kytctl
// explain`, which needs neither a daemon nor its log; `kytctl status` for what servers answered; otherwise the library or
// the command that the mistake is made with. The table "Mistakes, and who names them" of the programmers' guide is made of
// these rows: the last test compares the two and prints what the guide should have.
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <functional>
#include <future>

#include "tests/integration/StageFixture.h"
#include "tests/tools/ManualText.h"

#ifndef __has_feature
#define __has_feature(feature) 0
#endif

namespace kyt {
namespace {

const std::string kEvent = R"({"Category":3,"Type":4,"Payload":{"step":1}})";

// A stage with one client entry for "person", and what one asks it.
class Place : public StageTest {
 public:
  void TestBody() override {}
  using StageTest::TearDown;
  ~Place() override { TearDown(); }

  // The entry is changed, or lacks something. The daemon is started by those who need it.
  void prepare(const Dictionary& changes = {}, const std::string& without = {},
               tools::Stage::Options options = {}) {
    layWithPerson(changes, std::move(options), without);
  }
  [[nodiscard]] std::string path(const std::string& below) const { return stage_->folder() + "/" + below; }
  [[nodiscard]] std::string explain(std::vector<std::string> further = {}, const std::string& event = kEvent,
                                    const std::string& name = "person") const {
    std::vector<std::string> arguments = {"explain", event, "--require-user-info"};
    if (!name.empty()) arguments.insert(arguments.end(), {"--client", name});
    if (std::find(further.begin(), further.end(), "--client-type") == further.end())
      arguments.insert(arguments.end(), {"--client-type", "20"});
    arguments.insert(arguments.end(), further.begin(), further.end());
    return unwrapped(kytctl(std::move(arguments)).text);
  }
  // With the session's information as the program sends it.
  [[nodiscard]] std::string explainSession(const std::string& sessionInfo) const {
    return unwrapped(kytctl({"explain", kEvent, "--client", "person", "--session-info", sessionInfo}).text);
  }
  [[nodiscard]] std::string send() const {
    return kytctl({"send", "--client-type", "20", "--category", "3", "--type", "4"}).text;
  }
  [[nodiscard]] std::string script(const std::string& steps) const {
    return kytctl({"session", "-"},
                  R"({"do":"open","sessionInfo":{"SessionID":1,"ClientType":20,"RequireUserInfo":true},)"
                  R"("userInfo":{"ClientName":"person"}})"
                  "\n" +
                      steps)
        .text;
  }
  void startDaemonNow() { startDaemon(); }
  [[nodiscard]] std::string socketNow() const { return socket(); }
  [[nodiscard]] static std::string textOf(const std::string& file) { return contents(file); }
  using StageTest::kytctl;
  void answerEventsWith(int status) const {
    EXPECT_TRUE(stage_->control(
        "/control/reply", R"({"path":"/events","status":)" + std::to_string(status) + R"(,"times":1})"));
  }
  [[nodiscard]] int sendAsPerson() const {
    return kytctl({"send", "--client-type", "20", "--category", "3", "--type", "4", "--require-user-info",
                   "--user-info", R"({"ClientName":"person"})"})
        .status;
  }
  // Once it says so.
  [[nodiscard]] std::string statusUntil(const std::string& text) const {
    std::string told;
    static_cast<void>(eventually([&] {
      told = kytctl({"status"}).text;
      return told.find(text) != std::string::npos;
    }));
    return told;
  }

 private:
  // Lines that were folded for people are one again, and columns are a blank apart.
  static std::string unwrapped(const std::string& text) {
    return std::regex_replace(std::regex_replace(text, std::regex("\n {5,}"), " "), std::regex(" +"), " ");
  }
};

struct Mistake {
  const char* name;  // of the test
  const char* mistake;
  const char* who;
  std::string says;
  std::function<std::string(Place&)> make;  // what one is told
};

const char* const kExplain = "`kytctl explain`";
const char* const kStatus = "`kytctl status`";

std::string childsReason(Place& place) {
  place.prepare();
  place.startDaemonNow();
  TestClient client(place.socketNow(), 20, "person");
  if (client.configure() != "live: httppost") return "not configured";
  int ends[2] = {};
  if (pipe(ends) != 0) return "no pipe";
  const pid_t child = fork();
  if (child == 0) {
    static_cast<void>(client.send(9, 9, {}));
    const std::string reason = client->stateReason();
    _exit(write(ends[1], reason.data(), reason.size()) == static_cast<ssize_t>(reason.size()) ? 0 : 1);
  }
  close(ends[1]);
  char text[256];
  const ssize_t count = read(ends[0], text, sizeof text);
  close(ends[0]);
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(client.finish());
  return count > 0 ? std::string(text, static_cast<size_t>(count)) : std::string();
}

std::string tooLargePayload(Place& place) {
  place.prepare();
  place.startDaemonNow();
  TestClient client(place.socketNow(), 20, "person");
  if (client.configure() != "live: httppost") return "not configured";
  auto answer = std::make_shared<std::promise<std::string>>();
  client->sendMessage(3, 4, {{"text", std::string(1 << 20, 'x')}}, 0,
                      [answer](const Value&, std::optional<Error> error) {
                        answer->set_value(error ? error->localizedDescription : "");
                      });
  const std::string told = TestClient::waitFor(answer);
  EXPECT_TRUE(client.finish());
  return told;
}

std::vector<Mistake> mistakes() {
  std::vector<Mistake> all;
  const auto add = [&all](const char* name, const char* mistake, const char* who, std::string says,
                          std::function<std::string(Place&)> make) {
    all.push_back({name, mistake, who, std::move(says), std::move(make)});
  };
  // An event that the client entry, so changed, keeps.
  const auto kept = [](Dictionary changes, std::string without = {}) {
    return [changes = std::move(changes), without = std::move(without)](Place& place) {
      place.prepare(changes, without);
      return place.explain();
    };
  };

  add("NoEntitlement", "the program's user has no grant", kExplain,
      "the event does not leave: unentitled-connection", [](Place& place) {
        place.prepare();
        std::filesystem::remove(place.path("etc/kytreportingd/entitlements.d/stage.toml"));
        return place.explain();
      });
  add("NoDaemon", "the daemon does not run, or the path of its socket is another", "`kytctl send`",
      "no daemon listens at ", [](Place& place) {
        place.prepare();
        return place.send();
      });
  add("NotConfigured", "the session is not configured", "`kytctl session`",
      "the daemon drops what comes before the session is configured", [](Place& place) {
        place.prepare();
        place.startDaemonNow();
        return place.script("{\"do\":\"send\",\"category\":3,\"type\":4}\n");
      });
  add("ClientType", "a client type without storebag (0 to 4, over 23)", kExplain,
      "storebag none: types 5 to 23 have one", [](Place& place) {
        place.prepare();
        EXPECT_NE(place.explain({"--client-type", "24"}).find("storebag none"), std::string::npos);
        return place.explain({"--client-type", "3"});
      });
  add("ClientTypeMisspelt", "`ClientType` misspelt", kExplain,
      "has an entry ClientTyp that means nothing here", [](Place& place) {
        place.prepare();
        return place.explainSession(R"({"SessionID":1,"ClientTyp":20})");
      });
  add("StorebagNotThere", "the server has no such storebag", kExplain, "answered with status 404",
      [](Place& place) {
        place.prepare();
        return place.explain({"--client-type", "8"});
      });
  add("PublicKey", "the device's public key is not the signer's", kExplain, "Signature can not be verified",
      [](Place& place) {
        place.prepare();
        EXPECT_EQ(place.kytctl({"keys", "make", place.path("other")}).status, 0);
        std::filesystem::copy_file(place.path("other/publicKey.der"),
                                   place.path("usr/share/kytreporting/KYTReporting.bundle/publicKey.der"),
                                   std::filesystem::copy_options::overwrite_existing);
        return place.explain();
      });
  add("Authority", "the server's certificate authority is not trusted", kExplain, "certificate",
      [](Place& place) {
        place.prepare();
        const std::string settings = place.path("etc/kytreportingd/kytreportingd.toml");
        const std::string text = place.textOf(settings);
        EXPECT_FALSE(
            tools::writeFile(settings, std::regex_replace(text, std::regex("ca_file[^\n]+\n"), ""), 0644));
        return place.explain();
      });
  add("UserInformation", "user information promised (`RequireUserInfo`), and missing or empty", kExplain,
      "user-information FAILS missing", [](Place& place) {
        place.prepare();
        return place.explain({}, kEvent, "");
      });
  add("Consent", "the owner has not given consent", kExplain, "the event does not leave: consent-missing",
      [](Place& place) {
        tools::Stage::Options options;
        options.consent = false;
        place.prepare({}, {}, std::move(options));
        return place.explain();
      });
  add("Country", "the storebag does not list the country", kExplain, "country FAILS US (storebag: [\"DE\"])",
      [](Place& place) {
        tools::Stage::Options options;
        options.country = "US";
        place.prepare({}, {}, std::move(options));
        return place.explain();
      });
  add("Client", "client and service fit no entry of the storebag", kExplain,
      "client FAILS persn (entries: person)", [](Place& place) {
        place.prepare();
        return place.explain({}, kEvent, "persn");
      });
  add("Filters", "the entry has no filters", kExplain, "filters FAILS missing", kept({}, "filters"));
  add("Threshold", "the entry has no `sampling_threshold`", kExplain,
      "the event does not leave: sampling-threshold-missing", kept({}, "sampling_threshold"));
  add("Sampling", "the session is not drawn", kExplain,
      "it depends on the session's sampling draw: the event leaves at 31 of 101",
      kept({{"sampling_threshold", 0.3}}));
  add("Lists", "the category is not white-listed, or black-listed", kExplain, "event-lists FAILS 3",
      kept({{"event_blacklist", Array{3}}}));
  add("SingleMessage", "a single message for an entry with `expedite` 0", kExplain,
      "a single message was batched, since its client entry has \"expedite\" 0", [](Place& place) {
        place.prepare({{"expedite", 0}});
        return place.explain({"--single"});
      });
  add("ServerRefuses", "the server answers 404", kStatus, ": 404 at ", [](Place& place) {
    place.prepare();
    place.startDaemonNow();
    place.answerEventsWith(404);
    EXPECT_EQ(place.sendAsPerson(), 0);
    const std::string told =
        place.statusUntil("post-refused");  // the answer is shown before the events are booked
    EXPECT_NE(told.find(": 404 at "), std::string::npos) << told;
    return told;
  });
  add("ServerFails", "the server answers 503", kStatus, ": 503 at ", [](Place& place) {
    place.prepare();
    place.startDaemonNow();
    place.answerEventsWith(503);
    EXPECT_EQ(place.sendAsPerson(), 0);
    const std::string told = place.statusUntil("post-refused");
    EXPECT_NE(told.find(": 503 at "), std::string::npos) << told;
    return told;
  });
  add("NobodyListens", "nobody listens at the `post_url`", kStatus, "https://127.0.0.1:1: never answered",
      [](Place& place) {
        place.prepare({{"post_url", "https://127.0.0.1:1/events"}});
        place.startDaemonNow();
        EXPECT_EQ(place.sendAsPerson(), 0);
        const std::string told = place.statusUntil("post-failed");
        EXPECT_NE(told.find("last error at "), std::string::npos) << told;
        return told;
      });
  add("NoPostURL", "the entry has no `post_url`", kExplain, "post-url FAILS missing", kept({}, "post_url"));
  add("Nested", "an array, an object or a number that is not finite in the payload", kExplain,
      "not posted deep = [1]", [](Place& place) {
        place.prepare();
        return place.explain({}, R"({"Category":3,"Type":4,"Payload":{"deep":[1],"flat":2}})");
      });
  add("NotUTF8", "text that is no UTF-8", kExplain, "the event: Invalid encoding in string",
      [](Place& place) {
        place.prepare();
        const ProgramRun run = place.kytctl({"explain", "-", "--client-type", "20"},
                                            "{\"Category\":3,\"Type\":4,\"Payload\":{\"text\":\"caf\xE9\"}}");
        EXPECT_EQ(run.status, 2);
        EXPECT_NE(run.text.find("encoding"), std::string::npos) << run.text;
        return run.text;
      });
  add("TooLarge", "a payload over a megabyte", "the message's answer, from the library",
      "too large, or nested too deeply", tooLargePayload);
  add("LargeCategory", "a category over 65535", kExplain, "70000 and 4 are read as 4464 and 4",
      [](Place& place) {
        place.prepare();
        return place.explain({}, R"({"Category":70000,"Type":4})");
      });
  add("TextAsCategory", "a category that is text", kExplain, "three and 4 are read as 0 and 4",
      [](Place& place) {
        place.prepare();
        return place.explain({}, R"({"Category":"three","Type":4})");
      });
  add("NoCategory", "`Category` or `Type` missing, or in lower case", kExplain,
      "the event does not leave: category-or-type-missing", [](Place& place) {
        place.prepare();
        EXPECT_NE(place.explain({}, R"({"Category":3})").find("category-or-type-missing"), std::string::npos);
        return place.explain({}, R"({"category":3,"type":4})");
      });
  add("CategoryZero", "category 0", kExplain, "Category 0 is the daemon's own", [](Place& place) {
    place.prepare();
    return place.explain({}, R"({"Category":0,"Type":0})");
  });
  add("RequireUserinfo", "`RequireUserInfo` misspelt: consent and all rules are passed over", kExplain,
      "has an entry RequireUserinfo that means nothing here", [](Place& place) {
        place.prepare();
        return place.explainSession(R"({"SessionID":1,"ClientType":20,"RequireUserinfo":true})");
      });
  add("On", "`\"on\"` where yes or no is meant", kExplain, "has an entry RequireUserInfo of a wrong type",
      [](Place& place) {
        place.prepare();
        return place.explainSession(R"({"SessionID":1,"ClientType":20,"RequireUserInfo":"on"})");
      });
  add("PayloadKey", "a payload entry named like user information, or like a key of the record", kExplain,
      "replaced ClientName = person", [](Place& place) {
        place.prepare();
        return place.explain({}, R"({"Category":3,"Type":4,"Payload":{"ClientName":"other"}})");
      });
  add("NoFinish", "the session is closed without `finish`", "`kytctl session`",
      "the script ends without \"finish\"", [](Place& place) {
        place.prepare();
        place.startDaemonNow();
        return place.script("{\"do\":\"configure\"}\n{\"do\":\"send\",\"category\":3,\"type\":4}\n");
      });
  add("Fork", "a session that was opened before a fork", "`stateReason()`",
      "the session belongs to the parent of this process", childsReason);
  add("NeverFlushed", "a session that batches and never flushes", kExplain,
      "batched, and posted with the next flush or at the session's end", [](Place& place) {
        place.prepare();
        return place.explain({"--batch"});
      });
  return all;
}

void PrintTo(const Mistake& mistake, std::ostream* out) {
  *out << mistake.mistake;
}

class NamedCause : public ::testing::TestWithParam<Mistake> {};

TEST_P(NamedCause, IsTold) {
  if (__has_feature(thread_sanitizer) && std::string(GetParam().name) == "Fork")
    GTEST_SKIP() << "a forked child of a process with threads is nothing that the thread sanitizer follows";
  Place place;
  const std::string told = GetParam().make(place);
  EXPECT_NE(told.find(GetParam().says), std::string::npos) << GetParam().says << "\n" << told;
}

INSTANTIATE_TEST_SUITE_P(Mistakes, NamedCause, ::testing::ValuesIn(mistakes()),
                         [](const auto& test) { return std::string(test.param.name); });

TEST(TableOfMistakes, IsMadeOfTheRowsThatAreTested) {
  std::string table = "| mistake | who names the cause | says |\n|---|---|---|\n";
  for (const Mistake& mistake : mistakes())
    table += std::string("| ") + mistake.mistake + " | " + mistake.who + " | “" + mistake.says + "” |\n";
  const std::string guide = textOf("docs/PROGRAMS.md");
  const size_t at = guide.find("\n## Mistakes, and who names them\n");
  ASSERT_NE(at, std::string::npos);
  const size_t begin = guide.find("| mistake |", at);
  ASSERT_NE(begin, std::string::npos);
  std::string written;
  for (size_t line = begin; line < guide.size() && guide[line] == '|';) {
    const size_t end = guide.find('\n', line);
    written += guide.substr(line, end + 1 - line);
    line = end + 1;
  }
  EXPECT_EQ(written, table) << "the guide should have:\n" << table;
}

}  // namespace
}  // namespace kyt
