// What `kytctl explain` tells of an event: without a daemon, on a stage whose server has the storebags; and that the
// daemon then does the same.
#include <filesystem>
#include <sstream>
#include <variant>

#include "platform/base/TextEscape.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

const std::string kEvent = R"({"Category":3,"Type":4,"Payload":{"step":1}})";

class KytctlExplain : public StageTest {
 protected:
  [[nodiscard]] ProgramRun run(std::vector<std::string> further = {}, const std::string& event = kEvent,
                               const std::string& input = {}) const {
    std::vector<std::string> arguments = {"explain",  event,    "--client-type",      "20",
                                          "--client", "person", "--require-user-info"};
    arguments.insert(arguments.end(), further.begin(), further.end());
    return kytctl(std::move(arguments), input);
  }
  // The JSON report, and the exit status in `status`.
  Dictionary report(std::vector<std::string> further = {}, const std::string& event = kEvent) {
    further.emplace_back("--json");
    const ProgramRun run = this->run(std::move(further), event);
    status_ = run.status;
    RapidJSON json;
    const auto parsed = json.parse(run.text);
    const Value* value = std::get_if<Value>(&parsed);
    if (value == nullptr || !value->isDictionary()) {
      ADD_FAILURE() << run.text;
      return {};
    }
    return *value->dictionary();
  }
  static std::string joined(const Dictionary& report, const char* key) {
    std::string text;
    if (const Array* list = report.array(key))
      for (const Value& element : *list) text += (text.empty() ? "" : " ") + description(element);
    return text;
  }
  static Dictionary first(const Dictionary& report, const char* key) {
    const Array* list = report.array(key);
    return list != nullptr && !list->empty() && (*list)[0].isDictionary() ? *(*list)[0].dictionary()
                                                                          : Dictionary();
  }
  static Dictionary firstRecord(const Dictionary& report) {
    const Dictionary post = first(report, "posts");
    const Dictionary* message = post.dictionary("message");
    return message != nullptr ? first(*message, "events") : Dictionary();
  }
  // "passes" or "fails" and what it looked at, of the rule of the only back end.
  static std::string ruleIn(const Dictionary& report, const std::string& name) {
    if (const Array* rules = report.array("rules"))
      for (const Value& row : *rules)
        if (*row.dictionary()->string("rule") == name)
          return (row.dictionary()->boolean("passes") ? "passes " : "fails ") +
                 description(*row.dictionary()->find("value"));
    return "not judged";
  }
  void expectLost(const Dictionary& report, const std::string& reason) const {
    EXPECT_EQ(status_, 1);
    EXPECT_EQ(description(*report.find("verdict")), "does-not-leave");
    EXPECT_TRUE(joined(report, "reasons").starts_with(reason)) << joined(report, "reasons");
  }

  int status_ = -1;
};

TEST_F(KytctlExplain, ShowsTheRecordThatTheDaemonThenSends) {
  layWithPerson({{"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}},
                                   Dictionary{{"key", "email"}, {"action", "sha256"}}}}});
  const std::string payload = R"({"step":1,"secret":"x","email":"a@b","ClientName":"other","deep":[1]})";
  const Dictionary told = report({}, R"({"Category":3,"Type":4,"Payload":)" + payload + "}");
  EXPECT_EQ(status_, 0);
  EXPECT_EQ(description(*told.find("verdict")), "leaves");
  EXPECT_EQ(description(*told.find("fate")), "posted at once");
  const Dictionary change = first(told, "records");
  EXPECT_EQ(joined(change, "removed"), "secret");
  EXPECT_EQ(joined(change, "hashed"), "email");
  EXPECT_EQ(joined(change, "replaced"), "ClientName");
  EXPECT_EQ(joined(change, "notPosted"), "deep");

  startDaemon();
  ASSERT_EQ(kytctl({"session", "-"},
                   R"({"do":"open","sessionInfo":{"SessionID":1,"ClientType":20,"ClientVersion":1,)"
                   R"("RequireUserInfo":true},"userInfo":{"ClientName":"person"}})"
                   "\n{\"do\":\"configure\"}\n"
                   R"({"do":"send","category":3,"type":4,"payload":)" +
                       payload + "}\n{\"do\":\"finish\"}\n")
                .status,
            0);
  ASSERT_TRUE(arrive("client=person&method=3", 1));
  const Value events = stage_->query("/api/events?method=3");
  const Dictionary arrived =
      *(*events.dictionary()->find("events")->array())[0].dictionary()->find("record")->dictionary();
  const Dictionary shown = firstRecord(told);
  const auto changes = [](std::string_view key) {  // from one session to the next
    return key == "_startTS" || key == "_clientTS" || key == "eventTime" || key == "_sessionID";
  };
  EXPECT_EQ(shown.size(), arrived.size());
  for (const DictionaryEntry& entry : arrived) {
    const Value* value = shown.find(entry.key.view());
    ASSERT_NE(value, nullptr) << entry.key.c_str();
    if (changes(entry.key.view())) continue;
    EXPECT_EQ(*value, entry.value) << entry.key.c_str();
  }
}

TEST_F(KytctlExplain, ShowsAddressHeadersAndTheRulesWithWhatTheyLookedAt) {
  layWithPerson();
  const Dictionary told = report();
  EXPECT_EQ(status_, 0);
  const Dictionary post = first(told, "posts");
  EXPECT_EQ(description(*post.find("url")), stage_->httpsBase() + "/events");
  EXPECT_NE(
      joined(post, "headers").find("X-KYT-Client-Name: person User-Agent: KYTReporting/8.0 (Board7,1; 12.1)"),
      std::string::npos);
  EXPECT_NE(joined(post, "headers").find("X-KYT-Sender: QPW"), std::string::npos);
  EXPECT_EQ(ruleIn(told, "client"), "passes person");
  EXPECT_EQ(ruleIn(told, "consent"), "passes 1");
  EXPECT_EQ(ruleIn(told, "country"), "passes DE");
  EXPECT_EQ(ruleIn(told, "filters"), "passes []");
  EXPECT_EQ(ruleIn(told, "sampling"), "passes 0");
  EXPECT_EQ(ruleIn(told, "event-lists"), "passes 3");
  EXPECT_EQ(description(*told.dictionary("storebag")->find("version")), "1");
  EXPECT_EQ(description(*told.dictionary("entitlement")->find("verdict")), "granted");
}

TEST_F(KytctlExplain, StoresNothing) {
  layWithPerson({{"custom_clientId", true}});
  EXPECT_EQ(run().status, 0);
  EXPECT_FALSE(std::filesystem::exists(stage_->folder() +
                                       "/var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml"));
  EXPECT_EQ(arrived("client=person"), 0) << "and posts nothing";
}

TEST_F(KytctlExplain, ShowsTheDevicesIdentifierAndSaysWhereThereIsNone) {
  layWithPerson();
  const auto identifier = [](const Dictionary& told) {
    return description(*first(told, "posts").dictionary("message")->find("clientId"));
  };
  const std::string isNew = "The device has no such identifier (clientId) yet";
  EXPECT_NE(joined(report(), "notes").find(isNew), std::string::npos);
  ASSERT_EQ(kytctl({"defaults", "write", "com.vantu.kytreporting", "uuidRespectDnu", "own"}).status, 0);
  const Dictionary told = report();
  EXPECT_EQ(identifier(told), "own");
  EXPECT_EQ(joined(told, "notes").find(isNew), std::string::npos);
}

TEST_F(KytctlExplain, NamesTheRuleThatKeepsAnEvent) {
  tools::Stage::Options options;
  options.consent = false;
  layWithPerson({}, std::move(options));
  const Dictionary told = report();
  expectLost(told, "consent-missing");
  EXPECT_EQ(ruleIn(told, "consent"), "fails 0");
  EXPECT_EQ(description(*told.find("fate")), "dropped");
}

TEST_F(KytctlExplain, TriesAllDrawsOfSamplingUnlessOneIsGiven) {
  layWithPerson({{"sampling_threshold", 0.3}});
  const Dictionary told = report();
  EXPECT_EQ(status_, 2);
  EXPECT_EQ(description(*told.find("verdict")), "cannot-be-told");
  EXPECT_EQ(told.dictionary("sampling")->integer("leavesAt"), 31);
  EXPECT_EQ(told.dictionary("sampling")->integer("drawsTried"), 101);
  EXPECT_EQ(run({"--draw", "0.30"}).status, 0);
  expectLost(report({"--draw", "0.31"}), "sampled-out");
}

TEST_F(KytctlExplain, AnExpediteFlagSendsWhatSamplingHolds) {
  layWithPerson({{"sampling_threshold", 0.3}});
  EXPECT_EQ(run({"--draw", "0.5"}, R"({"Category":3,"Type":4,"Flag":2})").status, 0);
}

TEST_F(KytctlExplain, WhatCannotBeReadLeadsToCannotBeTold) {
  layWithPerson();
  const std::string consent = stage_->folder() + "/var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml";
  ASSERT_FALSE(tools::writeFile(consent, "consent = perhaps\n", 0644));
  const Dictionary told = report();
  EXPECT_EQ(status_, 2);
  EXPECT_NE(joined(told, "doubts").find(consent), std::string::npos) << joined(told, "doubts");
  EXPECT_NE(run().text.find("doubt: "), std::string::npos);
}

TEST_F(KytctlExplain, AServerThatDoesNotAnswerLeadsToCannotBeTold) {
  layWithPerson();
  const std::string settings = stage_->folder() + "/etc/kytreportingd/kytreportingd.toml";
  ASSERT_FALSE(tools::writeFile(settings,
                                "[storebag]\ninternal_host = \"https://127.0.0.1:1\"\n"
                                "public_host = \"https://127.0.0.1:1\"\n",
                                0644));
  const Dictionary told = report();
  EXPECT_EQ(status_, 2);
  EXPECT_NE(joined(told, "doubts").find("the storebag's server gave no answer: "), std::string::npos)
      << joined(told, "doubts");
}

TEST_F(KytctlExplain, TakesABagThatNobodyHasSigned) {
  layWithPerson();
  const std::string bag = stage_->folder() + "/draft.toml";
  ASSERT_FALSE(tools::writeFile(bag,
                                "version = \"draft\"\n[[release.httppost.clients]]\nclient = \"person\"\n"
                                "locale_whitelist = [\"DE\"]\nfilters = []\nsampling_threshold = 1.0\n"
                                "post_url = \"https://draft.example.org/x\"\n",
                                0644));
  const Dictionary told = report({"--storebag", bag});
  EXPECT_EQ(status_, 0);
  EXPECT_EQ(description(*told.dictionary("storebag")->find("version")), "draft");
  EXPECT_EQ(description(*told.dictionary("storebag")->find("signature")), "not checked");
  EXPECT_EQ(description(*first(told, "posts").find("url")), "https://draft.example.org/x");
}

TEST_F(KytctlExplain, ChecksTheSignatureOfADocument) {
  layWithPerson();
  const std::string document = stage_->folder() + "/bags/cadmor.plist";
  EXPECT_EQ(run({"--storebag", document}).status, 0);
  ASSERT_EQ(kytctl({"keys", "make", stage_->folder() + "/other"}).status, 0);
  std::filesystem::copy_file(stage_->folder() + "/other/publicKey.der",
                             stage_->folder() + "/usr/share/kytreporting/KYTReporting.bundle/publicKey.der",
                             std::filesystem::copy_options::overwrite_existing);
  const Dictionary told = report({"--storebag", document});
  expectLost(told, "no-storebag");
  EXPECT_NE(joined(told, "notes").find("Signature can not be verified"), std::string::npos);
}

TEST_F(KytctlExplain, ASingleMessageThatIsBatchedIsLost) {
  layWithPerson({{"expedite", 0}});
  expectLost(report({"--single"}), "batch-discarded");
  EXPECT_EQ(run().status, 0) << "a session flushes";
}

TEST_F(KytctlExplain, ReadsTheEventFromStandardInput) {
  layWithPerson();
  EXPECT_EQ(run({}, "-", kEvent).status, 0);
  EXPECT_EQ(run({}, "-", "{").status, 2);
  EXPECT_EQ(run({}, "[1]").status, 2);
}

TEST_F(KytctlExplain, WritesLinesOfAtMostAHundredColumns) {
  layWithPerson();
  const ProgramRun told =
      run({"--service", std::string(300, 's')},
          R"({"Category":3,"Type":4,"Payload":{"long":")" + std::string(500, 'x') + R"("}})");
  EXPECT_EQ(told.status, 0) << told.text;
  EXPECT_TRUE(told.text.ends_with("the event leaves\n")) << told.text;
  size_t begin = 0;
  for (size_t end = 0; (end = told.text.find('\n', begin)) != std::string::npos; begin = end + 1)
    EXPECT_LE(end - begin, 100U) << told.text.substr(begin, end - begin);
}

TEST_F(KytctlExplain, WritesJSONThatCanBeReadAndThatNoTerminalObeys) {
  layWithPerson();
  const ProgramRun told = run({"--service", "s\xff\u009b31m\u202e", "--json"});
  const auto parsed = RapidJSON().parse(told.text);
  EXPECT_TRUE(std::holds_alternative<Value>(parsed)) << escapedText(told.text);
  std::istringstream lines(told.text);
  for (std::string line; std::getline(lines, line);) EXPECT_TRUE(isPlainText(line)) << escapedText(line);
}

TEST_F(KytctlExplain, LooksForTheProgramsEntitlement) {
  layWithPerson();
  std::filesystem::remove(stage_->folder() + "/etc/kytreportingd/entitlements.d/stage.toml");
  expectLost(report(), "unentitled-connection");
  EXPECT_EQ(run({"--user", "nobody-of-that-name"}).status, 2);
}

TEST_F(KytctlExplain, TakesTheBagThatTheRunningDaemonHas) {
  layWithPerson();
  startDaemon();
  const auto from = [](const Dictionary& told) {
    return description(*told.dictionary("storebag")->find("from"));
  };
  EXPECT_TRUE(from(report()).starts_with("https://")) << "the daemon has fetched none yet";
  {
    TestClient client(socket(), 20, "person");
    ASSERT_EQ(client.configure(), "live: httppost");
  }
  // What the server has now, the daemon does not know.
  Dictionary changed = entry("person");
  changed.set("event_blacklist", Array{3});
  putBag("cadmor", {changed});
  const Dictionary told = report();
  EXPECT_EQ(status_, 0);
  EXPECT_TRUE(from(told).starts_with("the running daemon, which asked https://")) << from(told);
  EXPECT_EQ(description(*told.dictionary("storebag")->find("signature")), "checked by the daemon");
  EXPECT_EQ(description(*told.dictionary("storebag")->find("version")), "1");
  const Dictionary fetched = report({"--fetch"});
  expectLost(fetched, "event-filtered");
  EXPECT_TRUE(from(fetched).starts_with("https://")) << from(fetched);
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  expectLost(report(), "event-filtered");
  EXPECT_NE(run({"--fetch", "--storebag", "x"}).status, 0);
}

TEST_F(KytctlExplain, AsksTheServerWhereTheDaemonWillDoSoForTheNextSession) {
  tools::Stage::Options options;
  options.serverArguments = {"--max-age", "1"};
  layWithPerson({}, std::move(options));
  startDaemon();
  {
    TestClient client(socket(), 20, "person");
    ASSERT_EQ(client.configure(), "live: httppost");
  }
  EXPECT_TRUE(eventually(
      [&] { return description(*report().dictionary("storebag")->find("from")).starts_with("https://"); }));
}

TEST_F(KytctlExplain, LooksForTheEntitlementOfAProgramFile) {
  if (!kernelTellsPeerProcess()) GTEST_SKIP() << "this kernel does not tell which process is connected";
  layWithPerson();
  const std::string client = stage_->program("kytctl");
  ASSERT_FALSE(tools::writeFile(
      stage_->folder() + "/etc/kytreportingd/entitlements.d/stage.toml",
      "[[grant]]\nexecutable = \"" + client + "\"\n\"com.vantu.private.kytreportingd\" = true\n", 0644));
  EXPECT_EQ(run().status, 2) << "it depends on the program";
  const ProgramRun granted = run({"--program", client});
  EXPECT_EQ(granted.status, 0) << granted.text;
  expectLost(report({"--program", "/bin/true"}), "unentitled-connection");
  EXPECT_EQ(run({"--program", "/no/such/program"}).status, 2);
  EXPECT_EQ(run({"--program", "/bin"}).status, 2);
  EXPECT_NE(run({"--program", client, "--pid", "1"}).status, 0);
}

}  // namespace
}  // namespace kyt
