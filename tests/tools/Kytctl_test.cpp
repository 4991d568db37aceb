// kytctl as a person or a script runs it, beside a real daemon where it needs one.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

const std::string kTool = std::string(KYT_PROGRAMS) + "/kytctl";

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

class KytctlOnAStage : public StageTest {
 protected:
  void SetUp() override {
    lay();
    putBag("dulvek", {entry("person")});
    startDaemon();
  }
  [[nodiscard]] static std::string opening(const std::string& sessionInfo) {
    return R"({"do":"open","sessionInfo":)" + sessionInfo + "}\n";
  }
};

TEST_F(KytctlOnAStage, SendsOneEvent) {
  const ProgramRun sent = kytctl({"send", "--client-type", "8", "--session-id", "5", "--category", "3",
                                  "--type", "4", "--payload", R"({"text":"hello","number":7})",
                                  "--require-user-info", "--user-info", R"({"ClientName":"person"})"});
  EXPECT_EQ(sent.status, 0) << sent.text;
  EXPECT_EQ(sent.text, "finished\n");
  EXPECT_TRUE(arrive("client=person&method=3&status=4", 1)) << daemonLog();
}

TEST_F(KytctlOnAStage, SaysWhenAnEventWasNotSent) {
  // No storebag belongs to client type 0.
  const ProgramRun sent =
      kytctl({"send", "--client-type", "0", "--category", "3", "--type", "4", "--payload", "{}"});
  EXPECT_EQ(sent.status, 1);
  EXPECT_NE(sent.text, "");
  EXPECT_FALSE(has(sent.text, "finished\n")) << sent.text;
}

TEST_F(KytctlOnAStage, SendRefusesWhatIsNoJSONObject) {
  for (const char* payload : {"[]", "{", "7"}) {
    const ProgramRun sent =
        kytctl({"send", "--client-type", "8", "--category", "3", "--type", "4", "--payload", payload});
    EXPECT_EQ(sent.status, 1) << payload;
    EXPECT_TRUE(has(sent.text, "kytctl: --payload")) << sent.text;
  }
  const ProgramRun user = kytctl({"send", "--client-type", "8", "--category", "3", "--type", "4", "--payload",
                                  "{}", "--user-info", "[]"});
  EXPECT_EQ(user.status, 1);
  EXPECT_TRUE(has(user.text, "kytctl: --user-info is a JSON object")) << user.text;
}

TEST_F(KytctlOnAStage, RunsAScriptedSessionFromAFileOrFromStandardInput) {
  const std::string script =
      "# a comment, and an empty line\n\n"
      R"({"do":"open","sessionInfo":{"SessionID":6,"ClientType":8,"BatchEvent":true,"RequireUserInfo":true},"userInfo":{"ClientName":"person"}})"
      "\n"
      R"({"do":"configure"})"
      "\n"
      R"({"do":"states","userInfo":{"ClientName":"person"}})"
      "\n"
      R"({"do":"displayURL"})"
      "\n"
      R"({"do":"send","category":3,"type":1,"payload":{"k":1},"repeat":6000})"
      "\n"
      R"({"do":"flush"})"
      "\n"
      R"({"do":"sharedData","entries":{"a":1,"b":null}})"
      "\n"
      R"({"do":"digestKey","hex":"00ff","algorithm":0})"
      "\n"
      R"({"do":"finish"})"
      "\n";
  const ProgramRun run = kytctl({"session", "-"}, script);
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_TRUE(has(run.text, "live: httppost\nlive: httppost\nhttps://display.example.org/\n")) << run.text;
  EXPECT_TRUE(has(run.text, "sent 60")) << run.text;
  EXPECT_TRUE(has(run.text, "lost 0, dropped 0\n")) << run.text;
  EXPECT_TRUE(arrive("client=person&method=3", 6000)) << daemonLog();
  ASSERT_FALSE(tools::writeFile(stage_->folder() + "/script", script, 0644));
  EXPECT_EQ(kytctl({"session", stage_->folder() + "/script"}).status, 0);
  EXPECT_TRUE(arrive("client=person&method=3", 12000));
}

TEST_F(KytctlOnAStage, CountsAMessageThatWasSentWithAReplyAsSent) {
  const ProgramRun run =
      kytctl({"session", "-"}, opening("{\"SessionID\":6,\"ClientType\":8}") +
                                   R"({"do":"configure"})"
                                   "\n"
                                   R"({"do":"send","category":3,"type":1})"
                                   "\n"
                                   R"({"do":"send","category":3,"type":1,"reply":true,"repeat":2})"
                                   "\n"
                                   R"({"do":"finish"})"
                                   "\n");
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_TRUE(has(run.text, "sent 3, lost 0, dropped 0\n")) << run.text;
}

TEST_F(KytctlOnAStage, RefusesToSendBeforeTheSessionIsConfigured) {
  const ProgramRun run = kytctl(
      {"session", "-"}, opening("{\"ClientType\":8}") + "{\"do\":\"send\",\"category\":3,\"type\":1}\n");
  EXPECT_EQ(run.status, 1);
  EXPECT_TRUE(has(run.text, "kytctl: send: the daemon drops what comes before the session is configured"))
      << run.text;
}

// Each would be read as 0, as no, or as nothing.
TEST_F(KytctlOnAStage, RefusesKeysThatAStepDoesNotHave) {
  const std::pair<const char*, const char*> steps[] = {
      {R"("send","category":3,"typ":1)", R"(send: unknown key "typ"; there are category, type, payload)"},
      {R"("send","category":3)", R"(send: "type" is missing)"},
      {R"("send","category":"three","type":1)", R"(send: "category" must be a whole number from 0 to 65535)"},
      {R"("send","category":3,"type":1,"flag":9)", R"(send: "flag" must be a whole number from 0 to 3)"},
      {R"("send","category":70000,"type":1)", R"(send: "category" must be a whole number from 0 to 65535)"},
      {R"("send","category":-1,"type":1)", R"(send: "category" must be a whole number from 0 to 65535)"},
      {R"("send","category":1.5,"type":1)", R"(send: "category" must be a whole number from 0 to 65535)"},
      {R"("send","category":1,"type":1,"payload":[1])", R"(send: "payload" must be an object)"},
      {R"("send","category":1,"type":1,"reply":"yes")", R"(send: "reply" must be true or false)"},
      {R"("send","category":1,"type":1,"repeat":18446744073709551615)", R"(send: "repeat" must be a whole)"},
      {R"("configure","userInfo":{})", R"(configure: unknown key "userInfo"; there are none)"},
      {R"("states","userinfo":{})", R"(states: unknown key "userinfo"; there are userInfo)"},
      {R"("sharedData")", R"(sharedData: "entries" is missing)"},
      {R"("digestKey","hex":"00f")", R"(digestKey: "hex" is no hex)"},
      {R"("digestKey","hex":7)", R"(digestKey: "hex" must be text)"},
      {R"("wait","message":1)", R"(wait: unknown key "message"; there are messages)"}};
  for (const auto& [step, complaint] : steps) {
    const ProgramRun run =
        kytctl({"session", "-"},
               opening("{\"ClientType\":8}") + "{\"do\":\"configure\"}\n" + "{\"do\":" + step + "}\n");
    EXPECT_EQ(run.status, 1) << step;
    EXPECT_TRUE(has(run.text, std::string("kytctl: ") + complaint)) << run.text;
  }
}

TEST_F(KytctlOnAStage, AWrongScriptEndsAtItsLine) {
  const std::pair<const char*, const char*> scripts[] = {
      {"{\"do\":\"configure\"}\n", "the first step is {\"do\":\"open\"}"},
      {"{\"do\":\"dance\"}\n", "unknown step \"dance\""},
      {"{\"what\":1}\n", "a step needs \"do\""},
      {"\n[1]\n", "line 2: a step is a JSON object"},
      {"{\"do\":\n", "line 1: "},
      {"{\"do\":\"open\",\"sessionInfo\":{\"ClientType\":8}}\n{\"do\":\"digestKey\",\"hex\":\"zz\"}\n",
       "is no hex"}};
  for (const auto& [script, complaint] : scripts) {
    const ProgramRun run = kytctl({"session", "-"}, script);
    EXPECT_EQ(run.status, 1) << script;
    EXPECT_TRUE(has(run.text, complaint)) << run.text;
  }
  const ProgramRun missing = kytctl({"session", stage_->folder() + "/no such script"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_TRUE(has(missing.text, "no such script")) << missing.text;
}

// Without a daemon.
class Kytctl : public ::testing::Test {
 protected:
  [[nodiscard]] ProgramRun run(std::vector<std::string> arguments, const std::string& input = {}) const {
    arguments.insert(arguments.begin(), {"--root", folder_.path()});
    return runProgram(kTool, arguments, input);
  }
  void SetUp() override { std::filesystem::create_directories(folder_ / "var/lib/kytreportingd/defaults"); }
  // Keys, and a bag that is fine.
  void makeKeys() {
    ASSERT_EQ(run({"keys", "make", folder_ / "keys"}).status, 0);
    bag_ = folder_.write(
        "bag.json",
        R"({"version":"7","release":{"httppost":{"clients":[{"client":"a","locale_whitelist":["DE"],)"
        R"("filters":[],"sampling_threshold":1.0,"event_threshold":10,"post_url":"https://h/e"}]}}})");
  }
  [[nodiscard]] ProgramRun sign(const std::string& bag, const std::string& output) const {
    return run({"storebag", "sign", bag, "--key", folder_ / "keys/private.pem", "-o", output});
  }

  TemporaryFolder folder_;
  std::string bag_;
};

TEST_F(Kytctl, SaysHowItIsUsed) {
  EXPECT_EQ(run({}).status, 2);
  EXPECT_EQ(run({"no-such-command"}).status, 2);
  EXPECT_EQ(run({"send", "--category", "3"}).status, 2) << "arguments are missing";
  const ProgramRun help = run({"--help"});
  EXPECT_EQ(help.status, 0);
  for (const char* command : {"send", "session", "defaults", "consent", "keys", "storebag"})
    EXPECT_TRUE(has(help.text, command)) << command;
}

TEST_F(Kytctl, GivesUpWithoutADaemon) {
  const ProgramRun sent =
      run({"send", "--timeout", "0.2", "--client-type", "8", "--category", "1", "--type", "1"});
  EXPECT_EQ(sent.status, 1);
  EXPECT_TRUE(has(sent.text, "kytctl: send: ")) << sent.text;
}

// A misspelt promise of user information would take the session out of the consent's reach.
TEST_F(Kytctl, RefusesSessionInformationThatTheDaemonWouldNotUnderstand) {
  const std::pair<const char*, const char*> wrong[] = {
      {R"({"ClientType":8,"RequireUserinfo":true})",
       R"(there is no key "RequireUserinfo"; there are SessionID, ClientType)"},
      {R"({"ClientType":8,"RequireUserInfo":"on"})", R"("RequireUserInfo" is no boolean: on)"},
      {R"({"SessionID":1})", R"("ClientType" is missing)"},
      {R"({"ClientType":24})", R"("ClientType" is no whole number from 0 to 23: 24)"},
      {R"({"ClientType":"8"})", R"("ClientType" is no whole number from 0 to 23: 8)"},
      {R"({"ClientType":8,"SessionID":4294967296})",
       R"("SessionID" is no whole number from 0 to 4294967295)"},
      {R"({"ClientType":8,"HierarchyToken":"t"})", R"("HierarchyToken" is no dictionary: t)"}};
  for (const auto& [sessionInfo, complaint] : wrong) {
    const ProgramRun opened =
        run({"session", "-"}, std::string(R"({"do":"open","sessionInfo":)") + sessionInfo + "}\n");
    EXPECT_EQ(opened.status, 1) << sessionInfo;
    EXPECT_TRUE(has(opened.text, std::string("kytctl: open: session information: ") + complaint))
        << opened.text;
  }
  const ProgramRun token =
      run({"session", "-"}, R"({"do":"open","sessionInfo":{"ClientType":8,"HierarchyToken":{"Token":"t"}}})"
                            "\n");
  EXPECT_TRUE(has(token.text, R"(there is no key "Token"; there are TokenID, Level)")) << token.text;
  EXPECT_TRUE(has(run({"session", "-"}, "{\"do\":\"open\"}\n").text, "open: \"sessionInfo\" is missing"));
  const ProgramRun sent = run({"send", "--client-type", "24", "--category", "1", "--type", "1"});
  EXPECT_EQ(sent.status, 2);
  EXPECT_TRUE(has(sent.text, "--client-type: Value 24 not in range 0 to 23")) << sent.text;
}

TEST_F(Kytctl, NamesTheSocketWhereNoDaemonListensAndWhy) {
  const std::vector<std::string> event = {"send", "--timeout", "20", "--client-type", "8", "--category",
                                          "1",    "--type",    "1"};
  const std::string socket = folder_ / "run/kytreportingd/com.vantu.kytreportingd";
  const ProgramRun sent = run(event);
  EXPECT_EQ(sent.status, 1);
  EXPECT_EQ(sent.text, "kytctl: send: no daemon listens at " + socket + ": No such file or directory\n");
  const ProgramRun configured =
      run({"session", "--timeout", "0.2", "-"},
          "{\"do\":\"open\",\"sessionInfo\":{\"ClientType\":8}}\n{\"do\":\"configure\"}\n");
  EXPECT_EQ(configured.status, 1);
  EXPECT_EQ(configured.text,
            "kytctl: configure: no daemon listens at " + socket + ": No such file or directory\n");
  // One that ended without removing its socket.
  const std::string stale = folder_ / "stale";
  ASSERT_EQ(runProgram("python3",
                       {"-c", "import socket,sys; socket.socket(socket.AF_UNIX).bind(sys.argv[1])", stale})
                .status,
            0);
  std::vector<std::string> elsewhere = event;
  elsewhere.insert(elsewhere.end(), {"--socket", stale});
  EXPECT_EQ(run(elsewhere).text, "kytctl: send: no daemon listens at " + stale + ": Connection refused\n");
  elsewhere.back() = "/" + std::string(200, 'x');
  EXPECT_TRUE(has(run(elsewhere).text, "xxx: File name too long\n"));
}

TEST_F(Kytctl, HelpOfSendSaysWhatFinishedMeans) {
  const std::string help = run({"send", "--help"}).text;
  EXPECT_TRUE(has(help, "\"finished\" means that the daemon had a storebag")) << help;
}

TEST_F(Kytctl, WritesReadsAndDeletesUserDefaults) {
  const std::string domain = "com.vantu.kytreporting";
  const auto write = [&](const std::string& key, const std::string& type, const std::string& value) {
    return run({"defaults", "write", domain, key, "--type", type, "--", value}).status;
  };
  EXPECT_EQ(write("environmentType", "integer", "2"), 0);
  EXPECT_EQ(write("httpsPostURL", "string", "https://h/e"), 0);
  EXPECT_EQ(write("forceEventLogging", "boolean", "true"), 0);
  EXPECT_EQ(write("ratio", "real", "-0.5"), 0);
  EXPECT_EQ(run({"defaults", "read", domain, "environmentType"}).text, "2\n");
  EXPECT_EQ(run({"defaults", "read", domain, "ratio"}).text, "-0.5\n");
  const ProgramRun all = run({"defaults", "read", domain});
  EXPECT_EQ(all.status, 0);
  EXPECT_TRUE(has(all.text, "environmentType = 2 (integer)\n")) << all.text;
  EXPECT_TRUE(has(all.text, "httpsPostURL = https://h/e (string)\n")) << all.text;
  EXPECT_TRUE(has(all.text, "(boolean)\n")) << all.text;
  EXPECT_TRUE(has(all.text, "ratio = -0.5 (real)\n")) << all.text;
  EXPECT_EQ(run({"defaults", "delete", domain, "environmentType"}).status, 0);
  const ProgramRun gone = run({"defaults", "read", domain, "environmentType"});
  EXPECT_EQ(gone.status, 1);
  EXPECT_TRUE(has(gone.text, "has no value for environmentType")) << gone.text;
}

TEST_F(Kytctl, RefusesUserDefaultsThatAreNone) {
  const std::string domain = "com.vantu.kytreporting";
  EXPECT_EQ(run({"defaults", "write", domain, "k", "--type", "integer", "2x"}).status, 1);
  EXPECT_EQ(run({"defaults", "write", domain, "k", "--type", "boolean", "perhaps"}).status, 1);
  EXPECT_EQ(run({"defaults", "write", domain, "k", "--type", "real", ""}).status, 1);
  EXPECT_EQ(run({"defaults", "write", domain, "k", "--type", "colour", "red"}).status, 2);
  EXPECT_EQ(run({"defaults", "write", "../../../etc/x", "k", "v"}).status, 1);
  EXPECT_EQ(run({"defaults", "read", "a/b"}).status, 1);
  EXPECT_EQ(run({"defaults"}).status, 2);
}

TEST_F(Kytctl, ShowsGrantsAndWithdrawsConsent) {
  EXPECT_EQ(run({"consent", "show"}).text, "consent to diagnostics-and-usage upload: not given\n")
      << "no value is no";
  const ProgramRun granted = run({"consent", "grant"});
  EXPECT_EQ(granted.status, 0);
  EXPECT_EQ(granted.text, "consent to diagnostics-and-usage upload: granted\n");
  EXPECT_EQ(run({"consent", "show"}).text, granted.text);
  EXPECT_EQ(run({"consent", "withdraw"}).text, "consent to diagnostics-and-usage upload: not given\n");
  EXPECT_EQ(run({"consent"}).status, 2);
}

// As somebody who is neither root nor the daemon's user meets them: the folder, or a file in it, is not his to read.
TEST_F(Kytctl, SaysThatUserDefaultsCannotBeRead) {
  const std::string root = folder_.path(), state = root + "/var/lib/kytreportingd";
  ASSERT_EQ(run({"consent", "grant"}).status, 0);
  const auto asAnybody = [&](std::vector<std::string> arguments) {
    const TemporaryFolder output;
    tools::ChildProcess::Options how;
    how.outputFile = output / "output";
    if (::geteuid() == 0) how.user = tools::User{"", 54321, 54321};
    arguments.insert(arguments.begin(), {"--root", root});
    auto child = tools::ChildProcess::start(kTool, arguments, how);
    const auto status = child ? child->wait(std::chrono::seconds(60)) : std::nullopt;
    return ProgramRun{status.value_or(-1), output.read("output")};
  };
  ::chmod(root.c_str(), 0755);
  const std::string file = state + "/defaults/com.vantu.diagnostics.toml";
  for (const std::string& closed : {state, file}) {
    ::chmod(closed.c_str(), 0);
    const ProgramRun shown = asAnybody({"consent", "show"});
    EXPECT_EQ(shown.status, 1);
    EXPECT_TRUE(has(shown.text, "consent to diagnostics-and-usage upload: cannot be read\n")) << shown.text;
    EXPECT_TRUE(has(shown.text, "kytctl: userDefaults: " + file + ": Permission denied")) << shown.text;
    for (const bool key : {false, true}) {
      std::vector<std::string> arguments = {"defaults", "read", "com.vantu.diagnostics"};
      if (key) arguments.emplace_back("consent");
      const ProgramRun read = asAnybody(arguments);
      EXPECT_EQ(read.status, 1);
      EXPECT_TRUE(has(read.text, "Permission denied")) << read.text;
    }
    ::chmod(closed.c_str(), closed == state ? 0755 : 0644);
  }
  EXPECT_EQ(asAnybody({"consent", "show"}).text, "consent to diagnostics-and-usage upload: granted\n");
  folder_.write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml", "consent = \n");
  EXPECT_EQ(asAnybody({"consent", "show"}).status, 1) << "a broken file";
}

TEST_F(Kytctl, MakesKeysThatOnlyTheirOwnerReads) {
  const ProgramRun made = run({"keys", "make", folder_ / "keys"});
  EXPECT_EQ(made.status, 0) << made.text;
  EXPECT_EQ(made.text, folder_ / "keys/private.pem" + "\n" + (folder_ / "keys/publicKey.der") + "\n");
  struct stat info {};
  ASSERT_EQ(::stat((folder_ / "keys/private.pem").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777U, 0600U);
  EXPECT_EQ(run({"keys", "make", folder_ / "small", "--bits", "1024"}).status, 1);
  EXPECT_EQ(run({"keys", "make", folder_ / "no/such/folder"}).status, 1);
}

TEST_F(Kytctl, SignsVerifiesAndShowsAStorebag) {
  makeKeys();
  const std::string document = folder_ / "document";
  const ProgramRun signed_ = sign(bag_, document);
  EXPECT_EQ(signed_.status, 0);
  EXPECT_EQ(signed_.text, "") << "nothing in this bag surprises";
  const ProgramRun verified =
      run({"storebag", "verify", document, "--public-key", folder_ / "keys/publicKey.der"});
  EXPECT_EQ(verified.status, 0);
  EXPECT_EQ(verified.text, document + ": the signature holds; version 7\n");
  const ProgramRun shown = run({"storebag", "show", document});
  EXPECT_EQ(shown.status, 0);
  EXPECT_TRUE(has(shown.text, "\"post_url\": \"https://h/e\"")) << shown.text;
  const ProgramRun printed = sign(bag_, "-");
  EXPECT_EQ(printed.text, folder_.read("document")) << "the same signature each time";
}

// A control sequence of 8 bits, one that turns text round, and a name that would be a line of its own.
TEST_F(Kytctl, ABagCannotSteerTheTerminal) {
  makeKeys();
  const std::string bag = folder_.write(
      "hostile.json",
      R"({"version":"7\u009b31m","release":{"qrs\n\u202eforged":{"display_url":"\u2066x\u00e9"}}})");
  ASSERT_EQ(sign(bag, folder_ / "document").status, 0);
  const ProgramRun shown = run({"storebag", "show", folder_ / "document"});
  EXPECT_EQ(shown.status, 0);
  EXPECT_TRUE(has(shown.text, R"("version": "7\u009b31m")")) << shown.text;
  EXPECT_TRUE(has(shown.text, R"("qrs\n\u202eforged": {)")) << shown.text;
  EXPECT_TRUE(has(shown.text, "\"\\u2066x\xc3\xa9\"")) << shown.text;
  const ProgramRun verified =
      run({"storebag", "verify", folder_ / "document", "--public-key", folder_ / "keys/publicKey.der"});
  EXPECT_TRUE(has(verified.text, "version 7\\xc2\\x9b31m\n")) << verified.text;
}

TEST_F(Kytctl, AFileWithoutAnEndIsGivenUp) {
  const ProgramRun shown = run({"storebag", "show", "/dev/zero"});
  EXPECT_EQ(shown.status, 1);
  EXPECT_TRUE(has(shown.text, "File too large")) << shown.text;
}

TEST_F(Kytctl, SignsBagsInEachFormatAlike) {
  makeKeys();
  const std::string toml = folder_.write("bag.toml", "version = \"7\"\n[release.httppost]\n");
  const std::string plist = folder_.write(
      "bag.plist",
      "<plist version=\"1.0\"><dict><key>version</key><string>7</string><key>release</key><dict>"
      "<key>httppost</key><dict/></dict></dict></plist>");
  ASSERT_EQ(sign(toml, folder_ / "a").status, 0);
  ASSERT_EQ(sign(plist, folder_ / "b").status, 0);
  EXPECT_EQ(folder_.read("a"), folder_.read("b"));
  const std::string other = folder_.write("bag.yaml", "version: 7\n");
  const ProgramRun refused = sign(other, folder_ / "c");
  EXPECT_EQ(refused.status, 1);
  EXPECT_TRUE(has(refused.text, "a bag is .json, .toml or .plist")) << refused.text;
}

TEST_F(Kytctl, VerifyFindsEachKindOfForgery) {
  makeKeys();
  const std::string document = folder_ / "document", key = folder_ / "keys/publicKey.der";
  ASSERT_EQ(sign(bag_, document).status, 0);
  ASSERT_EQ(run({"keys", "make", folder_ / "others"}).status, 0);
  const ProgramRun otherKey =
      run({"storebag", "verify", document, "--public-key", folder_ / "others/publicKey.der"});
  EXPECT_EQ(otherKey.status, 1);
  EXPECT_TRUE(has(otherKey.text, "the signature does not match the bag and this key")) << otherKey.text;
  std::string changed = folder_.read("document");
  const size_t at = changed.find("<string>", changed.find("<key>bag</key>")) + 30;
  changed[at] = changed[at] == 'A' ? 'B' : 'A';
  EXPECT_EQ(run({"storebag", "verify", folder_.write("changed", changed), "--public-key", key}).status, 1);
  EXPECT_EQ(run({"storebag", "verify", folder_.write("none", "no document"), "--public-key", key}).status, 1);
  EXPECT_EQ(run({"storebag", "verify", folder_ / "missing", "--public-key", key}).status, 1);
  EXPECT_EQ(run({"storebag", "verify", document, "--public-key", bag_}).status, 1);
  EXPECT_EQ(run({"storebag", "verify", document}).status, 2) << "the key is required";
}

TEST_F(Kytctl, SignRefusesWhatNoDaemonTakes) {
  makeKeys();
  const ProgramRun noVersion = sign(folder_.write("a.json", "{\"release\":{}}"), folder_ / "x");
  EXPECT_EQ(noVersion.status, 1);
  EXPECT_TRUE(has(noVersion.text, "a bag needs a \"version\" text")) << noVersion.text;
  EXPECT_EQ(sign(folder_.write("b.json", "[]"), folder_ / "x").status, 1);
  EXPECT_EQ(sign(folder_.write("c.json", "{"), folder_ / "x").status, 1);
  EXPECT_EQ(run({"storebag", "sign", bag_, "--key", bag_, "-o", folder_ / "x"}).status, 1) << "no key";
  EXPECT_FALSE(std::filesystem::exists(folder_ / "x"));
}

TEST_F(Kytctl, WarnsAboutWhatMaySurprise) {
  makeKeys();
  const std::string bag = folder_.write(
      "surprising.json",
      R"({"version":"1","refresh_cycle":100000,"release":{"httppost":{"clients":[)"
      R"({"filters":[{"key":"k","action":"Remove"},{"action":"remove"},{"key":"k","action":"remove","method":1}]},7]},)"
      R"("qrs":{}}})");
  const ProgramRun signed_ = sign(bag, folder_ / "document");
  EXPECT_EQ(signed_.status, 0) << "warnings forbid nothing";
  const ProgramRun shown = run({"storebag", "show", folder_ / "document"});
  EXPECT_EQ(shown.status, 0);
  for (const ProgramRun* run : {&signed_, &shown}) {
    const std::string& text = run->text;
    EXPECT_TRUE(has(text, "warning: \"refresh_cycle\" is over 86400 seconds")) << text;
    EXPECT_TRUE(has(text, "warning: release/httppost, client 0: no \"locale_whitelist\"")) << text;
    EXPECT_TRUE(has(text, "client 0: no \"sampling_threshold\"")) << text;
    EXPECT_TRUE(has(text, "client 0: no \"post_url\"")) << text;
    EXPECT_TRUE(has(text, "client 0: no \"event_threshold\"")) << text;
    EXPECT_TRUE(has(text, "client 0, filter 0: the action is neither")) << text;
    EXPECT_TRUE(has(text, "client 0, filter 1: no \"key\"")) << text;
    EXPECT_TRUE(has(text, "client 0, filter 2: bound to a method or status")) << text;
    EXPECT_TRUE(has(text, "client 1: not a dictionary")) << text;
    EXPECT_TRUE(has(text, "release/qrs: no \"clients\" array")) << text;
  }
}

TEST_F(Kytctl, WarnsWhereEntriesDifferInWhatStaysInForce) {
  makeKeys();
  const auto shown = [&](const std::string& first, const std::string& second) {
    const std::string bag = folder_.write(
        "bag.json", R"({"version":"1","release":{"qrs":{"clients":[{)" + first + "},{" + second + "}]}}}");
    EXPECT_EQ(sign(bag, folder_ / "document").status, 0);
    return run({"storebag", "show", folder_ / "document"}).text;
  };
  for (const char* key : {"expedite", "custom_clientId", "override_sampling"}) {
    const std::string entry = "\"" + std::string(key) + "\":1",
                      warning = "only some clients have \"" + std::string(key);
    EXPECT_TRUE(has(shown(entry, ""), "warning: release/qrs: " + warning)) << key;
    EXPECT_FALSE(has(shown(entry, entry), warning)) << key;
    EXPECT_FALSE(has(shown("", ""), warning)) << key;
  }
}

}  // namespace
}  // namespace kyt
