// What administrators see, over sessions with recording back ends: the daemon's own classes behind it are real.
#include "daemon/Administration.h"

#include "platform/base/Watchers.h"
#include "platform/ipc/AdministrationInterface.h"
#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AdministrationTest : public AgentFixture {
 protected:
  AdministrationTest() {
    windows_.setDelegate(administration_);
    windows_.resume();
  }
  std::shared_ptr<FakeConnection> look(uint32_t user, std::vector<uint32_t> groups = {}) {
    auto connection =
        std::make_shared<FakeConnection>(SerialQueue::create("test.window", test_.executor), user);
    connection->setGroups(std::move(groups));
    EXPECT_TRUE(windows_.connect(connection));
    connections_.push_back(connection);
    return connection;
  }
  static const char* refusalOf(const std::shared_ptr<FakeConnection>& connection) {
    return std::dynamic_pointer_cast<AdministrationInterface>(connection->anyExportedObject())->refusal();
  }
  // What one watcher is told; its connection's.
  struct Told {
    std::vector<Dictionary> events;
    bool takes = true;  // the peer reads
  };
  // The refusal, or none.
  static std::optional<AdministrationRefusal> watch(
      const std::shared_ptr<FakeConnection>& connection, const Dictionary& filter,
      const std::shared_ptr<Told>& told = std::make_shared<Told>()) {
    std::optional<AdministrationRefusal> refusal;
    connection->queue()->sync([&] {
      auto window = std::dynamic_pointer_cast<AdministrationInterface>(connection->anyExportedObject());
      refusal = window->watch(filter, [told](const Dictionary& passed) {
        if (told->takes) told->events.push_back(passed);
        return told->takes;
      });
    });
    return refusal;
  }
  void pass(int32_t category, uint32_t user = 1000) {
    PassedEvent event;
    event.program = {user, 7, "a", "s"};
    event.kind = {category, 1};
    test_.books.watchers()->tell(std::move(event));
  }
  void letWatchersLook() {
    test_.timers.advance(Limits::watchPeriod, [this] { test_.executor.runAll(); });
  }
  static std::vector<int> categories(const Told& told) {
    std::vector<int> all;
    for (const Dictionary& event : told.events) all.push_back(event.integer("category"));
    return all;
  }
  static const Dictionary& backEnd(const Dictionary& session, size_t number = 0) {
    return *(session.array("backEnds")->begin() + number)->dictionary();
  }

  ServerRecords servers_;
  const char* dropProblem_ = nullptr;
  Administration administration_{{.platform = test_.platform,
                                  .sessions = class_.standings(),
                                  .storebags = agent_.storebags(),
                                  .servers = servers_,
                                  .version = "8.0.0",
                                  .since = 1000,
                                  .outbox = {.view = [] { return std::vector<Dictionary>(); },
                                             .flush = [] {},
                                             .drop =
                                                 [this](auto, auto) {
                                                   return OutboxOperations::Dropped{3, dropProblem_};
                                                 }},
                                  .connections = [] { return size_t{3}; },
                                  .process =
                                      [] {
                                        return ProcessFigures{42, 9 << 20, 3 << 20, 6};
                                      },
                                  .programOf = [](int32_t) { return std::string("/usr/bin/program"); },
                                  .reload = {}},
                                 {.user = 500, .group = 4, .groupName = "adm"}};
  FakeListener windows_;
};

TEST_F(AdministrationTest, IsForRootTheDaemonsUserAndTheGroupAlone) {
  EXPECT_EQ(refusalOf(look(0)), nullptr);
  EXPECT_EQ(refusalOf(look(500)), nullptr);
  EXPECT_EQ(refusalOf(look(1000, {4})), nullptr);
  EXPECT_EQ(refusalOf(look(1000, {100, 4})), nullptr);
  EXPECT_STREQ(
      refusalOf(look(1000, {100})),
      "Only root, the daemon's own user and members of the group adm may look at the daemon (admin.group in "
      "kytreportingd.toml)");
  EXPECT_NE(refusalOf(look(65534)), nullptr);
}

TEST_F(AdministrationTest, SaysThatWhatIsDroppedMayStillBeOnTheDisk) {
  const auto connection = look(0);
  const auto drop = [&] {
    std::optional<AdministrationRefusal> refusal;
    connection->queue()->sync([&] {
      uint64_t dropped = 0;
      refusal = std::dynamic_pointer_cast<AdministrationInterface>(connection->anyExportedObject())
                    ->dropOutbox({}, dropped);
      EXPECT_EQ(dropped, 3U);
    });
    return refusal;
  };
  EXPECT_EQ(drop(), std::nullopt);
  dropProblem_ = "the disk does not let them go";
  const auto refused = drop();
  ASSERT_NE(refused, std::nullopt);
  EXPECT_EQ(refused->why, AdministrationRefusal::Why::failed);
  EXPECT_EQ(refused->text, "3 posts are dropped, but the disk does not let them go");
}

TEST_F(AdministrationTest, MakesNoSession) {
  const auto connection = look(0);
  EXPECT_EQ(agent_.sessionCount(), 0U);
  EXPECT_FALSE(transaction_.isOpen());
}

TEST_F(AdministrationTest, ShowsWhoReports) {
  Dictionary info = sessionInfoAt(2, "a-token-that-is-long-enough", 77);
  Client client = connect(true, 1234);
  client.connection->call([&](ClientSessionInterface& session) {
    session.setSessionInfo(info, Dictionary{{"ClientName", "video"}, {"ServiceName", "calls"}}, nullptr,
                           false);
  });
  ASSERT_TRUE(configure(client));
  const std::vector<Dictionary> sessions = administration_.sessions();
  ASSERT_EQ(sessions.size(), 1U);
  const Dictionary& session = sessions[0];
  EXPECT_EQ(session.unsignedInteger("user"), 1234U);
  EXPECT_EQ(session.unsignedInteger("sessionID"), 77U);
  EXPECT_EQ(session.integer("clientType"), 7);
  EXPECT_EQ(*session.string("family"), "QH");
  EXPECT_EQ(*session.string("client"), "video");
  EXPECT_EQ(*session.string("service"), "calls");
  EXPECT_EQ(*session.string("token"), "a-token-...");
  EXPECT_EQ(session.integer("level"), 2);
  EXPECT_EQ(*session.string("storebagVersion"), "1.0");
  EXPECT_EQ(*session.string("session"), client.session->sessionIDString());
  EXPECT_EQ(*backEnd(session).string("name"), "httppost");
  EXPECT_EQ(*backEnd(session).string("state"), "enabled");
  client.connection->invalidateNow();
  EXPECT_TRUE(administration_.sessions().empty());
}

TEST_F(AdministrationTest, ShowsWhichRuleDecidedABackEndsState) {
  Client client = clientWith(sessionInfo());
  ASSERT_TRUE(configure(client));
  KYTReportingBackend& backend = *client.session->backendForKey("httppost");
  test_.clock.setTimeOfDay({5000, 0});
  backend.setState(kBackendStateDisabled, StateRule::server, 503);
  test_.clock.setTimeOfDay({6000, 0});
  backend.setState(kBackendStateDisabled, StateRule::server, 503);  // again: since when stays
  static_cast<void>(backend.state());
  const Dictionary shown = backEnd(administration_.sessions()[0]);
  EXPECT_EQ(*shown.string("state"), "disabled");
  EXPECT_EQ(*shown.string("rule"), "5xx");
  EXPECT_EQ(shown.integer("status"), 503);
  EXPECT_EQ(shown.integer("decided"), 5000);
  const Dictionary status = administration_.status();
  const Array* groups = status.array("backEnds");
  ASSERT_EQ(groups->size(), 1U);
  EXPECT_EQ(*groups->begin()->dictionary()->string("rule"), "5xx");
  EXPECT_EQ(groups->begin()->dictionary()->integer("sessions"), 1);
}

TEST_F(AdministrationTest, ShowsStorebagsWhileTheAgentsMonitorIsHeld) {
  Client client = clientWith(sessionInfo());
  ASSERT_TRUE(configure(client));
  MonitorLock held(agent_.monitor());
  const std::vector<Dictionary> bags = administration_.storebags();
  ASSERT_EQ(bags.size(), 1U);
  EXPECT_EQ(*bags[0].string("name"), "cadmor");
  EXPECT_EQ(*bags[0].string("version"), "1.0");
  EXPECT_EQ(*bags[0].string("state"), "good");
  EXPECT_EQ(*bags[0].string("lastError"), "");
  EXPECT_GT(bags[0].integer("expires"), bags[0].integer("fetched"));
}

TEST_F(AdministrationTest, ShowsWhyAStorebagIsNotThere) {
  serveNothing();
  Client client = clientWith(sessionInfo(8));
  EXPECT_FALSE(configure(client));
  const std::vector<Dictionary> bags = administration_.storebags();
  ASSERT_EQ(bags.size(), 1U);
  EXPECT_EQ(*bags[0].string("state"), "failed");
  EXPECT_EQ(administration_.storebag(bags[0].string("name")->view()), std::nullopt) << "none is in force";
  EXPECT_EQ(*bags[0].string("version"), "");
  EXPECT_EQ(*bags[0].string("lastError"), "no such host");
  EXPECT_NE(bags[0].integer("lastErrorAt"), 0);
  EXPECT_EQ(bags[0].integer("expires") - bags[0].integer("fetched"), kStorebagRetrySeconds);
}

TEST_F(AdministrationTest, GivesTheStorebagThatIsInForceByItsName) {
  EXPECT_EQ(administration_.storebag("cadmor"), std::nullopt);
  Client client = clientWith(sessionInfo());
  ASSERT_TRUE(configure(client));
  const std::optional<Dictionary> bag = administration_.storebag("cadmor");
  ASSERT_NE(bag, std::nullopt);
  EXPECT_EQ(*bag->string("version"), "1.0");
  EXPECT_EQ(*bag->string("state"), "good");
  EXPECT_NE(bag->dictionary("section")->find("httppost"), nullptr);
  EXPECT_EQ(administration_.storebag("dulvek"), std::nullopt);
}

TEST_F(AdministrationTest, AddsUpTheBooksOfAllPrograms) {
  Client client = clientWith(sessionInfo());
  client.connection->call([](ClientSessionInterface& session) {
    session.sendMessageWithDictionary(Dictionary{{"Category", 1}, {"Type", 2}}, nullptr);
  });
  const Dictionary status = administration_.status();
  EXPECT_EQ(status.integer("pid"), 42);
  EXPECT_EQ(status.integer("since"), 1000);
  EXPECT_EQ(status.integer("sessions"), 1);
  EXPECT_EQ(status.integer("connections"), 3);
  EXPECT_EQ(status.integer("taken"), 1);
  EXPECT_EQ(status.integer("dropped"), 1);
  EXPECT_EQ(status.dictionary("droppedBy")->integer("not-configured"), 1);
  const std::vector<Dictionary> rows = administration_.books();
  ASSERT_EQ(rows.size(), 1U);
  EXPECT_EQ(*rows[0].string("backEnd"), "-");
  EXPECT_EQ(rows[0].dictionary("droppedBy")->integer("not-configured"), 1);
}

// As many rows as there may be, with the names that become longest, and some losses of each.
TEST_F(AdministrationTest, WritesFiguresOfTheLongestNamesThatOneReplyHolds) {
  std::vector<std::shared_ptr<Tally>> tallies;
  const std::string name(Limits::maxBookNameBytes, '\x01');
  for (uint32_t i = 0; i < Limits::maxBookRows; ++i) {
    const std::string number = std::to_string(i);
    std::string client = name;
    client.replace(0, number.size(), number);
    tallies.push_back(test_.books.open({i % 3, 1000000007, client, name}, name, false));
    for (const Reason fate : {Reason::notConfigured, Reason::noBackEnds, Reason::postFailed}) {
      tallies.back()->take();
      tallies.back()->drop(fate, 1);
    }
  }
  ASSERT_GT(administration_.books().size(), 2 * Limits::maxBookRowsOfUser);
  EXPECT_LT(administration_.metrics().size(), Limits().maxQueuedBytes);
}

TEST_F(AdministrationTest, WritesNoSampleTwiceWhereNamesAreCut) {
  const std::string beginning(64, 'a');
  std::vector<std::shared_ptr<Tally>> tallies;
  for (const char* end : {"", "\\", "\\...", "...", "1 and more", "2 and more", "\n and more"}) {
    tallies.push_back(test_.books.open({1000, 7, beginning + end, "s"}, "-", false));
    tallies.back()->take();
  }
  const std::string text = administration_.metrics();
  std::map<std::string, int> taken;
  int64_t sum = 0;
  for (size_t at = 0; (at = text.find("\nkytreportingd_events_taken_total{", at)) != text.npos; ++at) {
    const std::string line = text.substr(at + 1, text.find('\n', at + 1) - at - 1);
    const size_t space = line.rfind(' ');
    EXPECT_EQ(++taken[line.substr(0, space)], 1) << line;
    sum += std::stoll(line.substr(space + 1));
  }
  EXPECT_EQ(sum, 7);
  EXPECT_EQ(taken.size(), 2U) << "one that is whole, and one of all that are cut";
}

TEST_F(AdministrationTest, TellsInTheFiguresHowManyProgramsShareARow) {
  std::vector<std::shared_ptr<Tally>> tallies;
  for (size_t i = 0; i < Limits::maxBookRowsOfUser + 5; ++i)
    tallies.push_back(test_.books.open({1000, 7, std::to_string(i), "s"}, "-", false));
  EXPECT_NE(
      administration_.metrics().find(
          "\nkytreportingd_programs_merged{user=\"1000\",client_type=\"0\",client=\"other\",service=\"\","
          "back_end=\"other\",origin=\"program\"} 5\n"),
      std::string::npos);
  EXPECT_NE(administration_.metrics(1).find("\nkytreportingd_programs_merged{user=\"1000\",client_type=\"0\","
                                            "client=\"other\",service=\"\",back_end=\"other\",origin="
                                            "\"program\"} 453\n"),
            std::string::npos);
}

TEST_F(AdministrationTest, SetsTheLogLevel) {
  EXPECT_EQ(administration_.setLogLevel("error"), std::nullopt);
  EXPECT_FALSE(test_.log.enabled(LogLevel::normal));
  EXPECT_EQ(*administration_.status().string("logLevel"), "error");
  EXPECT_NE(administration_.setLogLevel("loud"), std::nullopt);
  EXPECT_FALSE(test_.log.enabled(LogLevel::normal));
  EXPECT_EQ(administration_.setLogLevel("debug"), std::nullopt);
  EXPECT_TRUE(test_.log.debugEnabled());
}

TEST_F(AdministrationTest, ShowsBodiesToRootAndTheDaemonsUserAlone) {
  const Dictionary withBodies{{"bodies", true}};
  EXPECT_EQ(watch(look(0), withBodies), std::nullopt);
  EXPECT_EQ(watch(look(500), withBodies), std::nullopt);
  const auto member = look(1000, {4});
  const auto refused = watch(member, withBodies);
  ASSERT_NE(refused, std::nullopt);
  EXPECT_EQ(refused->why, AdministrationRefusal::Why::notAllowed);
  EXPECT_EQ(refused->text, "Only root and the daemon's own user may see what is in events");
  EXPECT_EQ(watch(member, {{"bodies", false}}), std::nullopt);
}

TEST_F(AdministrationTest, KeepsNoBodyWhileThoseWatchWhoMayNotSeeOne) {
  const auto told = std::make_shared<Told>();
  ASSERT_EQ(watch(look(1000, {4}), {}, told), std::nullopt);
  const auto post = std::make_shared<WatchedPost>(test_.books.watchers());
  post->leaves("https://a", "what-is-in-it");
  EXPECT_EQ(post->body(), nullptr);
  // Nor is one told that is kept for somebody else.
  ASSERT_EQ(watch(look(0), {{"bodies", true}}), std::nullopt);
  const auto kept = std::make_shared<WatchedPost>(test_.books.watchers());
  kept->leaves("https://a", "what-is-in-it");
  ASSERT_EQ(kept->body()->text(), "what-is-in-it");
  PassedEvent event;
  event.post = kept;
  ToldBody body{kept->body()};
  test_.books.watchers()->tell(std::move(event), &body);
  letWatchersLook();
  ASSERT_EQ(told->events.size(), 1U);
  EXPECT_EQ(told->events[0].find("body"), nullptr);
  EXPECT_EQ(told->events[0].find("bodyBytes"), nullptr);
  EXPECT_EQ(*told->events[0].string("server"), "https://a");
}

TEST_F(AdministrationTest, LetsRootWatchHoweverManyOfTheGroupDo) {
  std::vector<std::shared_ptr<FakeConnection>> members;
  for (size_t i = 0; i < Limits::maxWatchersOfGroup; ++i) {
    members.push_back(look(1000, {4}));
    EXPECT_EQ(watch(members.back(), {}), std::nullopt);
  }
  const auto refused = watch(look(1001, {4}), {});
  ASSERT_NE(refused, std::nullopt);
  EXPECT_EQ(refused->text, "3 watch already: no more can");
  EXPECT_EQ(watch(look(0), {}), std::nullopt);
  EXPECT_EQ(watch(look(0), {})->text, "4 watch already: no more can");
  members.back()->invalidateNow();
  EXPECT_EQ(watch(look(1001, {4}), {}), std::nullopt);
}

TEST_F(AdministrationTest, RefusesAFilterThatItDoesNotUnderstand) {
  const auto connection = look(0);
  const std::pair<Dictionary, std::string_view> wrong[] = {
      {{{"users", 5}}, "the filter's keys are"},
      {{{"User", 5}}, "the filter's keys are"},
      {{{"", 5}}, "the filter's keys are"},
      {{{"user", "root"}}, "\"user\" must be"},
      {{{"user", -1}}, "\"user\" must be"},
      {{{"user", int64_t{1} << 32}}, "\"user\" must be"},
      {{{"user", 1.0}}, "\"user\" must be"},
      {{{"client", 5}}, "\"client\" must be"},
      {{{"category", 65536}}, "\"category\" must be"},
      {{{"category", "5"}}, "\"category\" must be"},
      {{{"category", true}}, "\"category\" must be"},
      {{{"bodies", 1}}, "\"bodies\" must be"},
      {{{"category", 5}, {"bodies", "true"}}, "\"bodies\" must be"},
  };
  for (const auto& [filter, problem] : wrong) {
    const auto refused = watch(connection, filter);
    ASSERT_NE(refused, std::nullopt) << description(filter);
    EXPECT_EQ(refused->why, AdministrationRefusal::Why::wrongFilter) << description(filter);
    EXPECT_TRUE(refused->text.starts_with(problem)) << refused->text;
  }
  EXPECT_FALSE(test_.books.watchers()->anybody());
  EXPECT_EQ(watch(connection, {{"user", uint64_t{4294967295}}, {"category", 65535}, {"client", ""}}),
            std::nullopt);
}

TEST_F(AdministrationTest, PutsTheFilterOfASecondWatchInPlaceOfTheFirst) {
  const auto connection = look(0);
  const auto first = std::make_shared<Told>(), second = std::make_shared<Told>();
  ASSERT_EQ(watch(connection, {{"category", 5}}, first), std::nullopt);
  pass(5);
  letWatchersLook();
  // More often than there are places for watchers: each call gives its own back.
  for (size_t i = 0; i <= Limits::maxWatchers; ++i)
    ASSERT_EQ(watch(connection, {{"category", 6}}, second), std::nullopt);
  pass(5);
  pass(6);
  letWatchersLook();
  EXPECT_EQ(categories(*first), std::vector<int>{5});
  EXPECT_EQ(categories(*second), std::vector<int>{6});
}

TEST_F(AdministrationTest, LeavesTheFirstFilterWhereASecondIsRefused) {
  const auto connection = look(0);
  const auto told = std::make_shared<Told>();
  ASSERT_EQ(watch(connection, {{"category", 5}}, told), std::nullopt);
  ASSERT_NE(watch(connection, {{"categories", 6}}), std::nullopt);
  pass(5);
  pass(6);
  letWatchersLook();
  EXPECT_EQ(categories(*told), std::vector<int>{5});
}

TEST_F(AdministrationTest, WatchesNoMoreForAConnectionThatHasEnded) {
  const auto connection = look(0);
  ASSERT_EQ(watch(connection, {}), std::nullopt);
  EXPECT_TRUE(test_.books.watchers()->anybody());
  connection->invalidateNow();
  EXPECT_FALSE(test_.books.watchers()->anybody());
}

TEST_F(AdministrationTest, TellsAWatcherThatReadsAgainHowManyItMissedAndOthersAll) {
  const auto deaf = std::make_shared<Told>(), quick = std::make_shared<Told>();
  ASSERT_EQ(watch(look(0), {}, deaf), std::nullopt);
  ASSERT_EQ(watch(look(500), {}, quick), std::nullopt);
  deaf->takes = false;
  const auto most = static_cast<int>(Limits::maxWatchedEvents);
  const int all = 3 * most;
  for (int i = 0; i < all; ++i) {
    pass(i);
    if (i % 100 == 99) letWatchersLook();
  }
  letWatchersLook();
  ASSERT_EQ(quick->events.size(), static_cast<size_t>(all));
  for (const Dictionary& event : quick->events) EXPECT_EQ(event.find("lost"), nullptr);
  EXPECT_TRUE(deaf->events.empty());
  deaf->takes = true;
  letWatchersLook();
  letWatchersLook();
  int64_t lost = 0;
  for (const Dictionary& event : deaf->events)
    if (const Value* number = event.find("lost")) lost += number->longLongValue();
  EXPECT_EQ(static_cast<int64_t>(deaf->events.size()) + lost, all);
  EXPECT_EQ(deaf->events.size(), Limits::maxWatchedEvents + 1);  // one was on its way to the peer
  EXPECT_EQ(deaf->events[0].integer("category"), 0);
}

}  // namespace
}  // namespace kyt
