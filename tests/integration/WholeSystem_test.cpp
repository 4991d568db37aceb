// The main job with everything real: client processes, the daemon, the development server.
#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/integration/StageFixture.h"
#include "tools/demo/Http.h"

namespace kyt {
namespace {

constexpr int kCadmor = 20, kDulvek = 8;

class WholeSystem : public StageTest {};

TEST_F(WholeSystem, ShowsItselfInTheDemonstration) {
  const ProgramRun demonstration = runProgram(std::string(KYT_PROGRAMS) + "/kytdemo",
                                              {"--programs", KYT_PROGRAMS, "--share", KYT_SHARE, "--once"});
  EXPECT_EQ(demonstration.status, 0) << demonstration.text;
  EXPECT_NE(demonstration.text.find("ok     nothing else arrived: 20 events in all"), std::string::npos);
  EXPECT_NE(demonstration.text.find("ok     the daemon is confined"), std::string::npos);
  if (geteuid() != 0) return;
  EXPECT_NE(demonstration.text.find("ok     the daemon runs as its own user, without capabilities"),
            std::string::npos)
      << "root's demonstration gives the daemon and its clients users of their own";
}

// The page's figures, asked for as a browser does.
long eventsAt(const std::string& page) {
  const auto answer = tools::httpGet(page + "api/totals");
  const size_t at = answer ? answer->body.find("\"events\":") : std::string::npos;
  return at != std::string::npos ? std::strtol(answer->body.c_str() + at + 9, nullptr, 10) : -1;
}

TEST_F(WholeSystem, GoesOnReportingUntilTheDemonstrationIsInterrupted) {
  const TemporaryFolder folder;
  tools::ChildProcess::Options how;
  how.outputFile = folder / "output";
  auto demonstration = tools::ChildProcess::start(std::string(KYT_PROGRAMS) + "/kytdemo",
                                                  {"--programs", KYT_PROGRAMS, "--share", KYT_SHARE}, how);
  ASSERT_TRUE(demonstration);
  const auto said = [&] { return contents(how.outputFile); };
  ASSERT_TRUE(tools::waitUntil(std::chrono::seconds(120), [&] {
    return said().find(" owner show\n") != std::string::npos || !demonstration->isRunning();
  }));
  const std::string text = said();
  const size_t at = text.find("See them come in at ");
  ASSERT_NE(at, std::string::npos) << text;
  const std::string page = text.substr(at + 20, text.find(' ', at + 20) - at - 20);
  // Each session's start message comes with its first flush, so what is more are events of the trickle.
  EXPECT_TRUE(tools::waitUntil(std::chrono::seconds(120), [&] { return eventsAt(page) >= 30; })) << said();
  demonstration->signal(SIGINT);
  EXPECT_EQ(demonstration->wait(std::chrono::seconds(60)), 0) << said();
  EXPECT_NE(said().find("ok     the daemon ended with status 0 after SIGTERM"), std::string::npos) << said();
  EXPECT_EQ(said().find("WRONG"), std::string::npos) << said();
}

TEST_F(WholeSystem, CarriesTheEventsOfTheExamples) {
  lay();
  putBag("cadmor", {entry("example")});
  startDaemon();
  for (const char* program : {KYT_EXAMPLE_CPP, KYT_EXAMPLE_C}) {
    const ProgramRun example = runProgram(program, {socket()});
    EXPECT_EQ(example.status, 0) << program << ": " << example.text;
    EXPECT_NE(example.text.find("live: httppost"), std::string::npos) << example.text;
    EXPECT_NE(example.text.find("lost 0"), std::string::npos) << example.text;
  }
  // Each sends three batched events between its start and its stop message, the first a realtime one too.
  EXPECT_TRUE(arrive("client=example", 11)) << daemonLog();
  EXPECT_EQ(arrived("client=example&service=demo&method=10&status=1"), 6);
  EXPECT_EQ(arrived("client=example&service=demo&method=20&status=2"), 1);
  EXPECT_EQ(arrived("client=example&method=0&status=1"), 2) << "stop messages";
  EXPECT_EQ(total("bad"), 0);
}

TEST_F(WholeSystem, LetsTheExamplesSayWhatIsWrongAndEnd) {
  for (const char* program : {KYT_EXAMPLE_CPP, KYT_EXAMPLE_C}) {
    const ProgramRun example = runProgram(program, {"/nonexistent"});
    EXPECT_EQ(example.status, 1) << program;
    EXPECT_NE(example.text.find("no-daemon: /nonexistent: No such file or directory\n"), std::string::npos)
        << example.text;
  }
  lay();
  putBag("cadmor", {entry("somebody else")});
  startDaemon();
  for (const char* program : {KYT_EXAMPLE_CPP, KYT_EXAMPLE_C}) {
    const ProgramRun example = runProgram(program, {socket()});
    EXPECT_EQ(example.status, 1) << program;
    EXPECT_NE(example.text.find("no-live-back-end: no entry of the storebag is switched on for ClientName "
                                "\"example\", ServiceName \"demo\""),
              std::string::npos)
        << example.text;
  }
}

TEST_F(WholeSystem, PostsNothingOfAnOwnerWhoWithdrewConsentUnlessTheBagOverrides) {
  lay();
  Dictionary overriding = entry("overriding");
  overriding.set("override_dnu", 1);
  putBag("cadmor", {entry("respecting"), overriding});
  startDaemon();
  ASSERT_EQ(kytctl({"consent", "withdraw"}).status, 0);
  {
    TestClient respecting(socket(), kCadmor, "respecting");
    EXPECT_EQ(respecting.configure(), "live:") << "state 1 is not live";
    EXPECT_TRUE(respecting.send(3, 4, Dictionary{{"k", 1}}));
    EXPECT_TRUE(respecting.send(3, 5, Dictionary{{"k", 2}}, 1));
    EXPECT_EQ(respecting.flush(), "error: Nothing to flush");
    EXPECT_TRUE(respecting.finish());
  }
  {
    TestClient other(socket(), kCadmor, "overriding");
    EXPECT_EQ(other.configure(), "live: httppost");
    EXPECT_TRUE(other.send(3, 4, Dictionary{{"k", 1}}));
    EXPECT_TRUE(other.finish());
  }
  EXPECT_TRUE(arrive("client=overriding", 3)) << daemonLog();
  EXPECT_EQ(arrived("client=respecting"), 0);

  ASSERT_EQ(kytctl({"consent", "grant"}).status, 0);
  TestClient respecting(socket(), kCadmor, "respecting");
  EXPECT_EQ(respecting.configure(), "live: httppost") << "consent is asked for each session";
  EXPECT_TRUE(respecting.send(3, 4, Dictionary{{"k", 1}}));
  EXPECT_TRUE(respecting.finish());
  EXPECT_TRUE(arrive("client=respecting", 3)) << daemonLog();
  EXPECT_EQ(arrived("client=respecting"), 3);
}

TEST_F(WholeSystem, TakesAnotherEnvironmentAndAnotherAddressFromUserDefaults) {
  lay();
  const Dictionary bag{{"version", "1"},
                       {"release", section({entry("switching", "/events/release")})},
                       {"development", section({entry("switching", "/events/development")})}};
  ASSERT_FALSE(stage_->putStorebag("cadmor", bag));
  // The environment is looked at when a bag is fetched, and is not for a bag that is answered as unchanged.
  ASSERT_FALSE(
      tools::writeFile(stage_->folder() + "/bags/cadmor.toml", "max_age = 0\nlast_modified = false\n", 0644));
  startDaemon();
  const auto postsTo = [this](const std::string& path) {
    long count = 0;
    const Value answer = stage_->query("/api/posts?limit=1000");
    const Value* posts = answer.dictionary() != nullptr ? answer.dictionary()->find("posts") : nullptr;
    if (posts == nullptr || posts->array() == nullptr) return -1L;
    for (const Value& post : *posts->array())
      count += *post.dictionary()->find("path") == Value(path) ? 1 : 0;
    return count;
  };
  long events = 0;
  const auto runSession = [&] {
    TestClient client(socket(), kCadmor, "switching");
    EXPECT_EQ(client.configure(), "live: httppost") << daemonLog();
    EXPECT_TRUE(client.finish());
    events += 2;
    EXPECT_TRUE(arrive("client=switching", events)) << daemonLog();
  };
  runSession();
  EXPECT_EQ(postsTo("/events/release"), 1);

  ASSERT_EQ(
      kytctl({"defaults", "write", "com.vantu.kytreporting", "environmentType", "1", "--type", "integer"})
          .status,
      0);
  runSession();
  EXPECT_EQ(postsTo("/events/development"), 1);
  EXPECT_TRUE(logged("userDefaultsEnvironment: Environment type 1"));

  ASSERT_EQ(kytctl({"defaults", "write", "com.vantu.kytreporting", "httpsPostURL",
                    stage_->httpsBase() + "/events/mine"})
                .status,
            0);
  runSession();
  EXPECT_EQ(postsTo("/events/mine"), 1) << "the user default is stronger than the bag";
  ASSERT_EQ(
      kytctl({"defaults", "write", "com.vantu.kytreporting", "environmentType", "4", "--type", "integer"})
          .status,
      0);
  runSession();
  EXPECT_EQ(postsTo("/events/mine"), 2) << "in every environment";

  ASSERT_EQ(kytctl({"defaults", "delete", "com.vantu.kytreporting", "httpsPostURL"}).status, 0);
  runSession();
  EXPECT_EQ(postsTo("/events/release"), 2);
  EXPECT_EQ(postsTo("/events/development"), 1);
}

TEST_F(WholeSystem, SendsEverySessionsStopMessageAndBatchWhenItIsTerminated) {
  lay();
  putBag("dulvek", {entry("ending")});
  startDaemon();
  constexpr int kSessions = 20;
  std::vector<std::unique_ptr<TestClient>> clients;
  for (int i = 0; i < kSessions; ++i) {
    clients.push_back(std::make_unique<TestClient>(socket(), kDulvek, "ending", 1000 + i));
    ASSERT_EQ(clients.back()->configure(), "live: httppost");
    EXPECT_TRUE(clients.back()->send(9, 1, Dictionary{{"number", i}}));
    // Answered after what was sent before it.
    EXPECT_EQ(clients.back()->displayURL(), "https://display.example.org/");
  }
  EXPECT_EQ(arrived("client=ending"), 0) << "nothing has been flushed so far";
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0) << daemonLog();
  EXPECT_EQ(arrived("client=ending&method=9"), kSessions);
  EXPECT_EQ(arrived("client=ending&method=0&status=0"), kSessions);
  EXPECT_EQ(arrived("client=ending&method=0&status=1"), kSessions);
}

}  // namespace
}  // namespace kyt
