// The daemon as a process: how it starts, serves real clients, and ends.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "kytreporting/KYTReporting.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr size_t kManySessions = kSanitized ? 1000 : 5000;

class Daemon : public ::testing::Test {
 protected:
  // Serves a storebag that posts to this very server, and takes posts.
  void serve() {
    const Dictionary entry{{"post_url", server_.url("/events")}, {"event_threshold", 1000}};
    const Dictionary bag{{"version", "3.2"},
                         {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}}};
    server_.setHandler([document = signedBag(bag, propertyLists_)](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      if (request.method == "GET") reply.body = document;
      return reply;
    });
  }
  std::unique_ptr<KYTReporting> open(int clientType = 5, const Dictionary& more = {}) {
    KYTReporting::Options options;
    options.socketPath = daemon_.socketPath();
    options.sessionInfo = Dictionary{{kKYTReportingSessionInfoSessionID, 77},
                                     {kKYTReportingSessionInfoClientType, clientType},
                                     {kKYTReportingSessionInfoBatchEvent, true}};
    options.sessionInfo.merge(more);
    return KYTReporting::open(std::move(options));
  }
  static bool answered(const std::atomic<bool>& flag) {
    return eventually([&flag] { return flag.load(); });
  }
  bool configure(KYTReporting& client) {
    std::atomic<bool> done{false};
    std::vector<std::string> names;
    client.startConfiguration([&](std::optional<std::vector<std::string>> states, std::optional<Error>) {
      names = states.value_or(std::vector<std::string>());
      done = true;
    });
    return answered(done) && names == std::vector<std::string>{"httppost"};
  }
  size_t posts() {
    size_t number = 0;
    for (const auto& request : server_.requests()) number += request.method == "POST" ? 1 : 0;
    return number;
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_{server_.url("")};
};

TEST_F(Daemon, StartsInOrderAndEndsOnSIGTERM) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  const std::string log = daemon_.log();
  EXPECT_LT(log.find("<6>startLogging: Daemon starts logging..."),
            log.find("<6>main: Listener resumes with sandbox, start loop."));
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("main: Ending on signal 15"));
  EXPECT_FALSE(std::filesystem::exists(daemon_.socketPath()));
}

TEST_F(Daemon, RaisesItsLimitOfDescriptorsToWhatItMayHave) {
  rlimit limit = {};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit low = {std::min<rlim_t>(limit.rlim_max, 256), limit.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &low), 0);
  const bool started = daemon_.startAndWait();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  ASSERT_TRUE(started) << daemon_.log();
  const auto expected = static_cast<unsigned long long>(std::min<rlim_t>(limit.rlim_max, 1 << 20));
  EXPECT_TRUE(daemon_.logged("main: At most " + std::to_string(expected) + " descriptors")) << daemon_.log();
}

TEST_F(Daemon, MakesItsMissingFolders) {
  ASSERT_TRUE(daemon_.startAndWait());
  const auto mode = [this](const char* folder) {
    return std::filesystem::status(daemon_.root() / folder).permissions() & std::filesystem::perms::all;
  };
  EXPECT_EQ(mode("run/kytreportingd"), std::filesystem::perms{0755});
  EXPECT_EQ(mode("var/lib/kytreportingd/defaults"), std::filesystem::perms{0750});
  EXPECT_EQ(mode("var/mobile/Library/Logs/Faultbin/Retired"), std::filesystem::perms{0750});
}

TEST_F(Daemon, ServesWithoutTheFolderOfTheMessageLog) {
  const std::string folder = daemon_.root() / "var/mobile/Library/Logs/Faultbin/Retired";
  for (const char* inItsPlace : {"Retired", "../Faultbin"}) {
    const std::string place = std::filesystem::path(folder + "/../" + inItsPlace).lexically_normal();
    std::filesystem::remove_all(place);
    std::filesystem::create_directories(std::filesystem::path(place).parent_path());
    std::ofstream(place) << "no folder";
    serve();
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
    EXPECT_TRUE(daemon_.logged("<3>main: No message log: ")) << daemon_.log();
    const auto client = open();
    EXPECT_TRUE(configure(*client));
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
}

TEST_F(Daemon, EndsOnSIGINTToo) {
  ASSERT_TRUE(daemon_.startAndWait());
  daemon_.terminate(SIGINT);
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Daemon, WithoutSettingsDoesNotStart) {
  std::filesystem::remove(daemon_.root() / "etc/kytreportingd/kytreportingd.toml");
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 1);
  EXPECT_TRUE(daemon_.logged("<3>main: ")) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("etc/kytreportingd/kytreportingd.toml")) << daemon_.log();
}

TEST_F(Daemon, TakesItsSettingsFromAnotherFile) {
  const std::string file = daemon_.root() / "other.toml";
  std::filesystem::rename(daemon_.root() / "etc/kytreportingd/kytreportingd.toml", file);
  daemon_.start({"--config", file});
  EXPECT_TRUE(eventually([this] { return daemon_.logged("start loop."); })) << daemon_.log();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Daemon, AWrongSettingIsAStartUpErrorWithItsLine) {
  daemon_.writeSettings("[storebag]\ninternal_hots = \"https://h\"\n");
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 1);
  EXPECT_TRUE(daemon_.logged("kytreportingd.toml:2: ")) << daemon_.log();
}

TEST_F(Daemon, DoesNotStartWithSettingsThatOthersCanWrite) {
  ::chmod((daemon_.root() / "etc/kytreportingd/kytreportingd.toml").c_str(), 0666);
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 1);
  EXPECT_TRUE(
      daemon_.logged("kytreportingd.toml: others than root and the daemon's user can write the file\n"))
      << daemon_.log();
}

TEST_F(Daemon, IsNotConfinedWithoutAProfileAndSoDoesNotRun) {
  std::filesystem::remove(daemon_.root() / "usr/share/kytreporting/com.vantu.kytreportingd.profile");
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 255);
  EXPECT_TRUE(daemon_.logged("<6>startLogging: Daemon starts logging..."));
  EXPECT_TRUE(daemon_.logged("<3>main: confine_init() fails: ")) << daemon_.log();
  EXPECT_FALSE(std::filesystem::exists(daemon_.socketPath()));
}

TEST_F(Daemon, ASocketPathThatIsTooLongIsAStartUpError) {
  const std::string root = daemon_.root() / std::string(80, 'x');
  std::filesystem::create_directories(root);
  for (const char* folder : {"etc", "usr"})
    std::filesystem::copy(daemon_.root() / folder, root + "/" + folder,
                          std::filesystem::copy_options::recursive);
  daemon_.setRoot(root);
  daemon_.start();
  EXPECT_EQ(daemon_.exitStatus(), 1);
  EXPECT_TRUE(daemon_.logged("longer than 107 bytes")) << daemon_.log();
}

TEST_F(Daemon, ASecondOneDoesNotTakeTheFirstOnesPlace) {
  ASSERT_TRUE(daemon_.startAndWait());
  DaemonProcess second(server_.url(""));
  second.setRoot(daemon_.root().path());
  second.start();
  EXPECT_EQ(second.exitStatus(), 1);
  EXPECT_TRUE(second.logged("Another process listens at")) << second.log();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Daemon, PostsWhatASessionHoldsWhenItEnds) {
  serve();
  ASSERT_TRUE(daemon_.startAndWait());
  const auto client = open();
  ASSERT_TRUE(configure(*client)) << daemon_.log();
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(client->sendMessage(9, 200, Dictionary{{"number", i}}));
  EXPECT_TRUE(client->finish());
  EXPECT_TRUE(eventually([this] { return posts() == 1; })) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("finishSessionGracefully: Session 77 has been finished gracefully"));
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Daemon, PostsWhatSessionsHoldOnSIGTERM) {
  serve();
  ASSERT_TRUE(daemon_.startAndWait());
  const auto first = open(), second = open();
  ASSERT_TRUE(configure(*first));
  ASSERT_TRUE(configure(*second));
  std::atomic<bool> answered1{false};
  first->sendMessage(9, 200, Dictionary{{"k", "v"}}, 0,
                     [&](Value, std::optional<Error>) { answered1 = true; });
  ASSERT_TRUE(answered(answered1));
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_EQ(posts(), 2U) << "the batch of each session, start and stop messages included";
  EXPECT_TRUE(daemon_.logged("shutDown: 3 requests started, 3 completed, 0 failed")) << daemon_.log();
}

// Each session's stop message tells what all sessions hold, so the end of all of them together is the most that the
// daemon ever has to do at once.
TEST_F(Daemon, EndsThousandsOfSessionsWithinTheGrace) {
  const rlim_t needed = kManySessions + 1000;
  rlimit limit = {};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
  if (limit.rlim_max < needed) GTEST_SKIP() << "needs " << needed << " descriptors";
  const rlimit raised = {std::max(limit.rlim_cur, needed), limit.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &raised), 0);
  // A back end that posts nothing at the end: what is measured is the daemon's own work.
  const Dictionary profile{{"post_url", server_.url("/upload")}};
  const Dictionary bag{{"version", "1"}, {"vantu_internal", Dictionary{{"uploadserver", profile}}}};
  TestHTTPServer::Reply reply;
  reply.body = signedBag(bag, propertyLists_);
  server_.setReply(reply);
  daemon_.addSettings(
      "[limits]\nmax_connections_per_user = 16384\nmax_descriptors_per_user = 16384\n"
      "max_bytes_per_user = 4294967296\n");
  daemon_.start({});
  ASSERT_TRUE(eventually([this] { return daemon_.logged("start loop."); })) << daemon_.log();
  std::vector<std::unique_ptr<test::PlainClient>> clients;
  const Dictionary info{{kKYTReportingSessionInfoSessionID, 7}, {kKYTReportingSessionInfoClientType, 20}};
  for (size_t i = 0; i < kManySessions; ++i) {
    clients.push_back(std::make_unique<test::PlainClient>(daemon_.socketPath()));
    ASSERT_TRUE(clients.back()->connected() && clients.back()->shakeHands()) << i << daemon_.log();
    clients.back()->call(
        "SetSessionInfo", "a{sv}aa{sv}avb",
        [&](MessageWriter& out) {
          out.writeDictionary(info);
          out.writeOptionalDictionary(std::nullopt);
          out.writeArray({});
          out.writeBoolean(false);
        },
        false);
    clients.back()->call("StartConfigWithCompletionHandler");
  }
  for (const auto& client : clients) ASSERT_TRUE(client->receive()) << daemon_.log();
  const auto begin = std::chrono::steady_clock::now();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  const std::chrono::duration<double> took = std::chrono::steady_clock::now() - begin;
  EXPECT_FALSE(daemon_.logged("shutDown: Sessions have not ended in time")) << took.count() << " s";
  std::printf("%zu sessions ended in %.2f s\n", kManySessions, took.count());
  RecordProperty("Seconds", std::to_string(took.count()));
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
}

TEST_F(Daemon, GivesTheMemoryOfABusyTimeBackWhenItIsQuiet) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's allocator is another";
  serve();
  ASSERT_TRUE(daemon_.startAndWait());
  const auto report = [this](int sessions) {
    std::vector<std::unique_ptr<KYTReporting>> clients;
    for (int i = 0; i < sessions; ++i) {
      clients.push_back(open());
      EXPECT_TRUE(configure(*clients.back()));
      for (int event = 0; event < 400; ++event)
        EXPECT_TRUE(clients.back()->sendMessage(
            10, 1,
            Dictionary{{"text", std::string(1000, 'a')}, {"number", event}, {"list", Array{1, 2, 3}}}));
    }
    for (const auto& client : clients) EXPECT_TRUE(client->finish(std::chrono::seconds(20)));
    return daemon_.anonymousKiB();
  };
  static_cast<void>(report(1));  // what is loaded once
  ASSERT_TRUE(eventually([&] { return posts() > 0; }));
  const long before = daemon_.anonymousKiB();
  const long busy = report(100);
  ASSERT_GT(busy, before + 20000);
  EXPECT_TRUE(eventually([&] { return daemon_.anonymousKiB() < before + 6000; }))
      << daemon_.anonymousKiB() << " KiB after " << busy << ", and " << before << " before";
}

TEST_F(Daemon, ASlowServerIsWaitedForUntilTheDeadline) {
  serve();
  daemon_.writeSettings("[storebag]\ninternal_host = \"" + server_.url("") + "\"\npublic_host = \"" +
                        server_.url("") +
                        "\"\n[log]\ntarget = \"stderr\"\n[service]\nshutdown_grace_seconds = 0.5\n");
  ASSERT_TRUE(daemon_.startAndWait());
  const auto client = open();
  ASSERT_TRUE(configure(*client));
  TestHTTPServer::Reply never;
  never.behaviour = TestHTTPServer::Behaviour::hold;
  server_.setReply(never);
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("shutDown: Cancelling 1 requests that have not been answered in time"))
      << daemon_.log();
}

TEST_F(Daemon, SIGTERMCancelsADownload) {
  TestHTTPServer::Reply never;
  never.behaviour = TestHTTPServer::Behaviour::hold;
  server_.setReply(never);
  ASSERT_TRUE(daemon_.startAndWait());
  const auto client = open();
  client->startConfiguration();
  ASSERT_TRUE(server_.waitForRequests(1));
  const auto begin = std::chrono::steady_clock::now();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(12))
      << "the request's own limit is 15 s";
  EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 5"))
      << daemon_.log();
}

// A download holds up every session that needs a storebag, so one user's sessions come to hold all workers that
// one user may.
TEST_F(Daemon, CountsAndSaysThatAUsersWorkWaitsForWorkers) {
  TestHTTPServer::Reply never;
  never.behaviour = TestHTTPServer::Behaviour::hold;
  server_.setReply(never);
  ASSERT_TRUE(daemon_.startAndWait());
  std::vector<std::unique_ptr<KYTReporting>> clients;
  for (int i = 0; i < 300; ++i) clients.push_back(open());
  for (const auto& client : clients) client->startConfiguration();
  EXPECT_TRUE(eventually([&] { return daemon_.logged("WorkerPool(work): work waits"); }));
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("shutDown: workers-exhausted: "));
}

TEST_F(Daemon, ManyClientsOfOneStorebagFetchItOnce) {
  serve();
  ASSERT_TRUE(daemon_.startAndWait());
  std::vector<std::unique_ptr<KYTReporting>> clients;
  std::atomic<int> configured{0};
  for (int i = 0; i < 20; ++i) {
    clients.push_back(open());
    clients.back()->startConfiguration([&](std::optional<std::vector<std::string>> states,
                                           std::optional<Error>) { configured += states ? 1 : 0; });
  }
  EXPECT_TRUE(eventually([&] { return configured == 20; }));
  EXPECT_EQ(server_.requestCount(), 1U);
  clients.clear();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(Daemon, ActivatedByASocketEndsWhenIdle) {
  serve();
  daemon_.activateBySocket();
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("main: Ending, idle for 0.2 seconds")) << daemon_.log();
  EXPECT_TRUE(std::filesystem::exists(daemon_.socketPath())) << "the socket is the service manager's";
}

TEST_F(Daemon, ActivatedByASocketStaysWhileASessionExists) {
  serve();
  daemon_.activateBySocket();
  auto client = open();
  daemon_.start();
  ASSERT_TRUE(configure(*client)) << daemon_.log();
  std::atomic<bool> flushed{false};
  const auto begin = std::chrono::steady_clock::now();
  // Several idle times pass while the session speaks now and then.
  while (std::chrono::steady_clock::now() - begin < std::chrono::milliseconds(600)) {
    flushed = false;
    client->flush([&](Value, std::optional<Error>) { flushed = true; });
    ASSERT_TRUE(answered(flushed));
  }
  EXPECT_FALSE(daemon_.logged("main: Ending"));
  client.reset();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("main: Ending, idle for 0.2 seconds"));
}

}  // namespace
}  // namespace kyt
