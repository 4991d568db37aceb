// A client that runs into every limit there is, and another user's sessions beside it, of which no event may
// be missing.
#include <unistd.h>

#include <filesystem>

#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

constexpr uid_t kNobody = 65534;

class LimitsOfAUser : public HierarchyTest {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "a client of another user needs root";
    tools::Stage::Options options;
    options.extraSettings =
        "[limits]\nmax_message_bytes = 65536\nmax_connections_per_user = 12\nmax_batch_bytes = 60000\n"
        "max_hierarchy_tokens_per_user = 2\nmax_shared_data_bytes_per_user = 20000\n";
    lay(std::move(options));
    ASSERT_FALSE(tools::writeFile(
        stage_->folder() + "/etc/kytreportingd/entitlements.d/nobody.toml",
        "[[grant]]\nuser = " + std::to_string(kNobody) + "\n\"com.vantu.private.kytreportingd\" = true\n",
        0644));
    putBag("cadmor", {entry("hostile"), entry("steady"), entry("steadychild")});
    startDaemon();
    // Where the other user may run it and reach the socket.
    std::filesystem::permissions(stage_->folder(), std::filesystem::perms(0755));
    std::filesystem::copy(stage_->program("kytctl"), stage_->folder() + "/kytctl");
  }
  Process openAsNobody(const std::string& name, int level) {
    auto client = std::make_unique<ScriptedClient>(stage_->folder() + "/kytctl",
                                                   std::vector<std::string>{"--socket", socket()}, kNobody);
    client->step(opening(name, level, 100 + level, false, 20, "steady"));
    EXPECT_EQ(client->ask(R"({"do":"configure"})"), "live: httppost") << daemonLog();
    return client;
  }
  static std::string text(size_t bytes) { return "\"" + std::string(bytes, 'x') + "\""; }
};

TEST_F(LimitsOfAUser, HoldAndLeaveAnotherUsersEventsAsTheyWere) {
  const Process steady = openAsNobody("steady", 0), child = openAsNobody("steadychild", 1);
  steady->step(R"({"do":"sharedData","entries":{"call":"c-1"}})");
  int sent = 0;
  const auto goOn = [&] {
    for (const Process* client : {&steady, &child}) sendAndSettle(**client, 10, R"({"k":1})");
    ++sent;
  };
  goOn();

  // Hierarchy tokens.
  std::vector<Process> hostile;
  for (int i = 0; i < 4; ++i) {
    hostile.push_back(process());
    hostile.back()->step(opening("hostile", 1, i, false, 20, "token" + std::to_string(i)));
    EXPECT_EQ(hostile.back()->ask(R"({"do":"configure"})"), "live: httppost");
  }
  EXPECT_TRUE(logged("updateCorrelatedSessions: User 0 has 2 hierarchy tokens, the most allowed"));
  goOn();

  // Shared data.
  hostile[0]->step("{\"do\":\"sharedData\",\"entries\":{\"a\":" + text(15000) + "}}");
  hostile[1]->step("{\"do\":\"sharedData\",\"entries\":{\"b\":" + text(15000) + "}}");
  hostile[0]->step("{\"do\":\"sharedData\",\"entries\":{\"c\":" + text(15000) + "}}");
  for (int i = 0; i < 2; ++i) hostile[i]->ask(R"({"do":"displayURL"})");
  EXPECT_TRUE(logged("updateSharedDataForSession: User 0 shares "));
  goOn();

  // Batches. A session without shared data.
  hostile[3]->step(
      "{\"do\":\"send\",\"category\":9,\"type\":1,\"repeat\":100,\"payload\":{\"t\":" + text(2000) + "}}");
  hostile[3]->ask(R"({"do":"displayURL"})");
  EXPECT_TRUE(logged("HTTPSPostBackend(batchEvent): the batch of backend httppost is full (60000 bytes)"));
  goOn();

  // Messages.
  const Process large = process();
  large->step(opening("hostile", -1, 7));
  EXPECT_EQ(large->ask(R"({"do":"configure"})"), "live: httppost");
  large->step("{\"do\":\"send\",\"category\":9,\"type\":1,\"payload\":{\"t\":" + text(70000) + "}}");
  goOn();

  // Connections.
  std::vector<std::unique_ptr<KYTReporting>> many;
  for (int i = 0; i < 40; ++i) {
    KYTReporting::Options options;
    options.socketPath = socket();
    options.sessionInfo =
        Dictionary{{kKYTReportingSessionInfoSessionID, i}, {kKYTReportingSessionInfoClientType, 20}};
    many.push_back(KYTReporting::open(std::move(options)));
    many.back()->startConfiguration();
  }
  EXPECT_TRUE(eventually([this] { return logged("DBusServer(accept): connection of user 0 refused: "); }));
  goOn();
  const Process late = openAsNobody("steady", -1);
  finish(*late);
  many.clear();

  finish(*steady);
  finish(*child);
  ASSERT_TRUE(arrive("client=steady&method=10", sent)) << daemonLog();
  ASSERT_TRUE(arrive("client=steadychild&method=10", sent));
  const std::string parent = textOf(records("steady", 10).at(0), "_sessionID");
  for (const Dictionary& record : records("steadychild", 10)) {
    EXPECT_EQ(textOf(record, "call"), "c-1");
    EXPECT_EQ(textOf(record, "_sessionID").substr(0, parent.size() + 1), parent + ".");
  }
  for (const Process& client : hostile) client->kill();
  large->kill();
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  for (const char* reason : {"hierarchy-token-refused: 2", "shared-data-refused: 2",
                             "batch-full: ", "message-too-long: ", "too-many-connections-of-user: "})
    EXPECT_TRUE(logged(std::string("shutDown: ") + reason)) << reason << "\n" << daemonLog();
  EXPECT_LT(arrived("client=hostile&method=9"), 60) << "no more than the batch holds";
}

}  // namespace
}  // namespace kyt
