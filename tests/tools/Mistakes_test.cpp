// The mistakes that keep an event from arriving, each made on a real daemon beside a real server, and what one is told:
// by kytctl, by the library's figures, or by the daemon's log at its default level. The table "Why did my event not
// arrive?" of the programmers' guide is made from these; a last test compares the two.
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>

#include "tests/integration/StageFixture.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

// Of what the guide's table says that one sees.
std::string causeOf(const std::string& sees) {
  for (const std::string& line : linesOf(textOf("docs/PROGRAMS.md")))
    if (line.starts_with("| " + sees + " | ") && line.ends_with(" |"))
      return line.substr(sees.size() + 5, line.size() - sees.size() - 7);
  return "there is no such row";
}

class Mistakes : public StageTest {
 protected:
  // One client entry, changed as the mistake has it.
  void start(const Dictionary& changes = {}, tools::Stage::Options options = {},
             const std::string& without = {}) {
    layWithPerson(changes, std::move(options), without);
    startDaemon();
  }
  [[nodiscard]] ProgramRun send(const std::string& name = "person", const std::string& type = "20") const {
    return kytctl({"send", "--client-type", type, "--category", "3", "--type", "4", "--require-user-info",
                   "--user-info", "{\"ClientName\":\"" + name + "\"}"});
  }
  // Opens a session that batches; `steps` follow.
  [[nodiscard]] ProgramRun session(
      const std::string& steps, const std::string& clientType = "20",
      const std::string& userInfo = R"(,"userInfo":{"ClientName":"person"})") const {
    return kytctl({"session", "-"}, R"({"do":"open","sessionInfo":{"SessionID":1,"ClientType":)" +
                                        clientType + R"(,"BatchEvent":true,"RequireUserInfo":true})" +
                                        userInfo + "}\n{\"do\":\"configure\"}\n" + steps);
  }
  // Of the only event that fits the filter and has arrived.
  [[nodiscard]] Dictionary onlyRecord(const std::string& filter) const {
    const Value answer = stage_->query("/api/events?" + filter);
    const Value* events = answer.dictionary() != nullptr ? answer.dictionary()->find("events") : nullptr;
    if (events == nullptr || events->array() == nullptr || events->array()->size() != 1) return {};
    return *(*events->array())[0].dictionary()->find("record")->dictionary();
  }
  void expectTold(const std::string& text) const {
    EXPECT_TRUE(eventually([&] { return logged(text); })) << text << "\n" << daemonLog();
  }
  void expectCounted(const std::string& reason) {
    EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
    expectTold("shutDown: " + reason + ": ");
  }
};

const std::string kSend = "{\"do\":\"send\",\"category\":3,\"type\":4}\n", kFinish = "{\"do\":\"finish\"}\n";

TEST_F(Mistakes, NoEntitlementIsToldByTheLog) {
  lay();
  std::filesystem::remove(stage_->folder() + "/etc/kytreportingd/entitlements.d/stage.toml");
  startDaemon();
  const ProgramRun refused = send();
  EXPECT_EQ(refused.status, 1);
  EXPECT_NE(
      refused.text.find("the daemon refuses this user and program (kytctl entitlements check says why)"),
      std::string::npos)
      << refused.text;
  // At once, whatever the time-out.
  const ProgramRun session =
      kytctl({"session", "--timeout", "600", "-"},
             "{\"do\":\"open\",\"sessionInfo\":{\"ClientType\":20}}\n{\"do\":\"configure\"}\n");
  EXPECT_EQ(session.status, 1);
  EXPECT_NE(session.text.find("kytctl: configure: " + socket() + ": "), std::string::npos) << session.text;
  EXPECT_NE(
      session.text.find(
          ": the daemon refuses this user and program (kytctl entitlements check says why), or has too many "
          "connections\n"),
      std::string::npos)
      << session.text;
  expectTold("listener: Refused connection ");
  expectTold("no grant gives it the entitlement, see \"kytctl entitlements check --user ");
}

TEST_F(Mistakes, ASessionThatIsNotConfiguredIsToldByTheLog) {
  start();
  TestClient client(socket(), 20, "person");
  EXPECT_TRUE(client.send(3, 4, {}));
  EXPECT_TRUE(client.finish());
  expectTold("Messages of session 77, client type 20, are dropped: it was not configured");
  expectCounted("not-configured");
}

TEST_F(Mistakes, AClientTypeWithoutStorebagIsToldByTheLog) {
  start();
  EXPECT_TRUE(session(kSend, "3").text.starts_with("no storebag\n"));
  expectTold("Messages of session 1, client type 3, are dropped: there is no storebag for this client type");
  const ProgramRun sent = send("person", "4");
  EXPECT_EQ(sent.text, "storebag not available\n");
  EXPECT_EQ(sent.status, 1);
  expectTold("Messages of session 1, client type 4, are dropped: there is no storebag for this client type");
  expectCounted("no-storebag");
}

TEST_F(Mistakes, AStorebagThatNamesNoBackEndIsToldByTheLog) {
  lay();
  ASSERT_FALSE(stage_->putStorebag(
      "cadmor", Dictionary{{"version", "1"}, {"release", Dictionary{{"httpost", Dictionary()}}}}));
  startDaemon();
  EXPECT_TRUE(session(kSend).text.starts_with("no storebag\n")) << "the library cannot tell the two apart";
  expectTold("Messages of session 1, client type 20, are dropped: the storebag names no back end for it");
  expectCounted("no-back-ends");
}

TEST_F(Mistakes, AStorebagThatTheServerDoesNotHaveIsToldByTheLog) {
  start();
  EXPECT_EQ(send("person", "8").text, "storebag not available\n");
  expectTold("/bags/tolvar/dulvek?version=8.0 answered with status 404");
}

TEST_F(Mistakes, AnotherPublicKeyIsToldByTheLog) {
  lay();
  putBag("dulvek", {entry("person")});
  ASSERT_EQ(kytctl({"keys", "make", stage_->folder() + "/other"}).status, 0);
  std::filesystem::copy_file(stage_->folder() + "/other/publicKey.der",
                             stage_->folder() + "/usr/share/kytreporting/KYTReporting.bundle/publicKey.der",
                             std::filesystem::copy_options::overwrite_existing);
  startDaemon();
  EXPECT_EQ(send("person", "8").text, "storebag not available\n");
  expectTold("fetchStorebagWithName: Signature can not be verified");
}

TEST_F(Mistakes, AnUntrustedAuthorityIsToldByTheLog) {
  lay();
  const std::string settings = stage_->folder() + "/etc/kytreportingd/kytreportingd.toml";
  ASSERT_FALSE(tools::writeFile(
      settings, std::regex_replace(contents(settings), std::regex("ca_file[^\n]+\n"), ""), 0644));
  startDaemon();
  EXPECT_EQ(send("person", "8").text, "storebag not available\n");
  expectTold("ertificate");
}

TEST_F(Mistakes, MissingUserInformationIsToldByTheLog) {
  start();
  const ProgramRun run = session(kSend + kFinish, "20", "");
  EXPECT_TRUE(run.text.starts_with("live:\n")) << run.text;
  expectTold("events of client type 20: user information was promised and is missing");
  expectCounted("batch-discarded");
}

TEST_F(Mistakes, MissingConsentIsToldByTheLog) {
  tools::Stage::Options options;
  options.consent = false;
  start({}, std::move(options));
  EXPECT_EQ(send().text, "finished\n");
  expectTold("httppost posts nothing of person:(null), since the user has not given consent");
  expectCounted("event-dropped-by-state");
}

TEST_F(Mistakes, AnotherCountryIsToldByTheLog) {
  tools::Stage::Options options;
  options.country = "US";
  start({}, std::move(options));
  EXPECT_EQ(send().text, "finished\n");
  expectTold("posts nothing of person:(null), since the storebag's entry does not list this country");
}

TEST_F(Mistakes, AClientThatTheStorebagDoesNotNameIsToldByTheLog) {
  start();
  EXPECT_EQ(send("persn").text, "finished\n");
  expectTold("posts nothing of persn:(null), since no entry of the storebag is for this client");
}

TEST_F(Mistakes, AnEntryWithoutFiltersIsToldByTheLog) {
  start({}, {}, "filters");
  EXPECT_EQ(send().text, "finished\n");
  expectTold("HTTPSPostBackend(updateBackendState): filters are required.");
}

TEST_F(Mistakes, AnEntryWithoutSamplingThresholdIsToldByTheLog) {
  start({}, {}, "sampling_threshold");
  EXPECT_EQ(send().text, "finished\n");
  expectTold("posts nothing of person:(null), since the storebag's entry has no sampling_threshold");
}

TEST_F(Mistakes, BeingLeftOutBySamplingIsToldByTheLog) {
  start({{"sampling_threshold", -0.5}});  // below every draw, which may be 0
  EXPECT_EQ(session(kSend + kFinish).status, 0);
  expectTold("posts nothing of person:(null), since this session was not drawn");
}

TEST_F(Mistakes, ACategoryThatTheListsKeepAwayIsToldByTheLog) {
  start({{"event_blacklist", Array{3}}});
  EXPECT_EQ(session(kSend + kFinish).status, 0);
  expectTold(
      "session 1, client type 20, are dropped: the lists of the back end httppost keep category 3 away");
  EXPECT_EQ(send().text, "finished\n");
  expectTold("A message was dropped: the lists of the back end httppost keep category 3 away");
  expectCounted("event-filtered");
}

TEST_F(Mistakes, ASingleMessageThatIsBatchedIsToldByTheLog) {
  start({{"expedite", 0}});
  EXPECT_EQ(send().text, "finished\n");
  expectTold("a single message was batched, since its client entry has \"expedite\" 0");
  expectCounted("batch-discarded");
}

TEST_F(Mistakes, AServerThatRefusesIsToldByTheLog) {
  start();
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/events","status":404,"times":1})"));
  EXPECT_EQ(send().text, "finished\n");
  expectTold("/events answered with status 404, 1 events of backend httppost are lost");
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/events","status":503,"times":1})"));
  EXPECT_EQ(send().text, "finished\n");
  expectTold("postJSONMessage: backend httppost disabled by server 503 return code");
  expectCounted("post-refused");
}

TEST_F(Mistakes, AServerThatIsNotThereIsToldByTheLog) {
  start({{"post_url", "https://127.0.0.1:1/events"}});
  EXPECT_EQ(send().text, "finished\n");
  expectTold("HTTPSPostBackend(postJsonMessage): post error: ");
  expectCounted("post-failed");
}

TEST_F(Mistakes, AnEntryWithoutPostURLIsToldByTheLog) {
  start({}, {}, "post_url");
  EXPECT_EQ(send().text, "finished\n");
  expectTold("The storebag's httppost has no post_url for client type 20: 1 events are lost");
  expectCounted("post-without-url");
}

TEST_F(Mistakes, AValueThatCannotBePostedIsToldByTheLogAndTheRestArrives) {
  start();
  EXPECT_EQ(session(R"({"do":"send","category":3,"type":4,"payload":{"deep":[1],"flat":2}})"
                    "\n" +
                    kFinish)
                .status,
            0);
  expectTold("JSONWriter unable to handle key: deep, value: [1]");
  EXPECT_TRUE(arrive("client=person&method=3", 1));
}

TEST_F(Mistakes, APayloadThatIsTooLargeIsToldByTheLibrarysFigures) {
  start();
  TestClient client(socket(), 20, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  client.send(3, 4, {{"text", std::string(1 << 20, 'x')}});
  EXPECT_TRUE(client.finish());
  EXPECT_EQ(client->statistics().droppedUnsendable, 1U);
}

TEST_F(Mistakes, TextThatIsNoUTF8ArrivesWithReplacements) {
  start();
  TestClient client(socket(), 20, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  EXPECT_TRUE(client.send(3, 4, {{"text", "caf\xE9"}, {"k\xFFy", "whole"}}));
  EXPECT_TRUE(client.finish());
  EXPECT_TRUE(arrive("client=person&method=3", 1));
  const Dictionary record = onlyRecord("method=3");
  EXPECT_EQ(record.find("text") != nullptr ? *record.find("text") : Value(), Value("caf\uFFFD"));
  EXPECT_EQ(record.find("k\uFFFDy") != nullptr ? *record.find("k\uFFFDy") : Value(), Value("whole"));
  EXPECT_EQ(client->statistics().droppedUnsendable, 0U) << "nothing was dropped";
  EXPECT_EQ(causeOf("the record arrives with U+FFFD"), "text that is no UTF-8");
}

// While the daemon stands still, so that it has taken nothing when the session closes.
TEST_F(Mistakes, ASessionThatIsClosedWithoutFinishIsToldByDebugLines) {
  start();
  setenv("KYTREPORTING_DEBUG", "1", 1);
  testing::internal::CaptureStderr();
  {
    TestClient client(socket(), 20, "person");
    EXPECT_EQ(client.configure(), "live: httppost");
    stage_->daemon()->signal(SIGSTOP);
    ASSERT_TRUE(eventually([&] { return standsStill(stage_->daemon()->pid()); }));
    for (int i = 0; i < 10; ++i) EXPECT_TRUE(client.send(3, 4, {}));
    EXPECT_TRUE(eventually([&] { return client->statistics().sent == 10; })) << "written";
  }
  stage_->daemon()->signal(SIGCONT);
  const std::string lines = testing::internal::GetCapturedStderr();
  unsetenv("KYTREPORTING_DEBUG");
  EXPECT_NE(lines.find("libkytreporting: session 77: dropped 10: connection-ended (10 in all)\n"),
            std::string::npos)
      << lines;
  EXPECT_EQ(causeOf("`kytctl session`: “the script ends without ”; a program's debug lines "
                    "(`KYTREPORTING_DEBUG=1`): “connection-ended” or “session-ended”"),
            "the session was closed without `finish`");
}

TEST_F(Mistakes, AScriptThatEndsWithoutFinishIsToldByKytctl) {
  start();
  const ProgramRun run = session(kSend);
  EXPECT_EQ(run.status, 0) << "each step went well";
  EXPECT_EQ(run.text,
            "live: httppost\n"
            "kytctl: session: the script ends without \"finish\": what was sent last may be lost\n");
}

TEST_F(Mistakes, AScriptThatFinishesIsNotToldThatItDoesNot) {
  start();
  const ProgramRun run = session(kSend + kFinish);
  EXPECT_EQ(run.text, "live: httppost\nsent 1, lost 0, dropped 0\n");
  // An answer says that the daemon has taken what came before it.
  EXPECT_EQ(session(kSend + "{\"do\":\"states\"}\n").text, "live: httppost\nlive: httppost\n");
}

#ifndef __has_feature
#define __has_feature(feature) 0
#endif
// A forked child of a process with threads is nothing that the thread sanitizer follows.
#if !__has_feature(thread_sanitizer)
TEST_F(Mistakes, ASessionOpenedBeforeAForkIsToldByItsStateAndFiguresInTheChild) {
  start();
  TestClient client(socket(), 20, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  EXPECT_TRUE(client.send(3, 4, {}));
  const pid_t child = fork();
  if (child == 0) {
    const bool isToldSo = !client.send(9, 9, {}) && !client->finish() &&
                          client->statistics().droppedClosed == 1 &&
                          client->stateReason() == "the session belongs to the parent of this process";
    _exit(isToldSo ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(client.send(3, 4, {}));
  EXPECT_TRUE(client.finish());
  EXPECT_TRUE(arrive("client=person&method=3", 2)) << "the parent's session goes on";
  EXPECT_EQ(client->statistics().droppedClosed, 0U);
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  EXPECT_EQ(arrived("method=9"), 0);
  EXPECT_EQ(causeOf("`statistics()`: `droppedClosed`"),
            "sent after `finish`, or in a child of `fork()` by the parent's session");
}
#endif

TEST_F(Mistakes, UserInformationGoesOverThePayload) {
  start();
  EXPECT_EQ(session(R"({"do":"send","category":3,"type":4,"payload":{"ClientName":"other"}})"
                    "\n" +
                    kFinish)
                .status,
            0);
  EXPECT_TRUE(arrive("client=person&method=3", 1));
  const Value events = stage_->query("/api/events?method=3");
  const Value& first = (*events.dictionary()->find("events")->array())[0];
  EXPECT_EQ(*first.dictionary()->find("record")->dictionary()->find("ClientName"), Value("person"));
}

TEST_F(Mistakes, CategoryZeroArrivesLikeASessionsStart) {
  start();
  EXPECT_EQ(session("{\"do\":\"send\",\"category\":0,\"type\":0}\n" + kFinish).status, 0);
  EXPECT_TRUE(arrive("client=person&method=0&status=0", 2)) << "its own, and the session's start";
}

TEST_F(Mistakes, ASessionThatBatchesSendsAtItsEnd) {
  start();
  TestClient client(socket(), 20, "person");
  ASSERT_EQ(client.configure(), "live: httppost");
  auto answer = std::make_shared<std::promise<std::string>>();
  client->sendMessage(3, 4, {}, 0,
                      [answer](const Value&, std::optional<Error>) { answer->set_value("answered"); });
  ASSERT_EQ(TestClient::waitFor(answer), "answered");
  EXPECT_EQ(arrived("client=person"), 0) << "what is batched has not left";
  EXPECT_TRUE(client.finish());
  EXPECT_TRUE(arrive("client=person&method=3", 1));
}

// What the table quotes from the log or from kytctl stands in the source that writes it.
TEST(WhyDidMyEventNotArrive, QuotesWhatTheProgramsSay) {
  const std::string guide = textOf("docs/PROGRAMS.md");
  const size_t at = guide.find("\n## Why did my event not arrive?\n");
  ASSERT_NE(at, std::string::npos);
  std::string sources;
  for (const char* folder : {"backends/https", "config", "daemon", "session", "tools/kytctl", "client"})
    for (const auto& file : std::filesystem::directory_iterator(std::string(KYT_SOURCE_DIR) + "/" + folder))
      if (file.path().extension() == ".cpp" || file.path().extension() == ".h")
        sources += textOf(std::string(folder) + "/" + file.path().filename().string());
  size_t quotes = 0;
  for (const std::string& quote :
       matchesIn(guide.substr(at, guide.find("\n## ", at + 1) - at), "“([^”]+)”")) {
    EXPECT_NE(sources.find(std::regex_replace(quote, std::regex("\""), "\\\"")), std::string::npos) << quote;
    ++quotes;
  }
  EXPECT_GE(quotes, 18U);
}

}  // namespace
}  // namespace kyt
