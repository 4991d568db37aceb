// kytreader between a real NATS and a real PostgreSQL: each post once in the table, whatever comes twice, breaks or cannot be
// read.
#include <gtest/gtest.h>
#include <nats/nats.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tools/demo/Ports.h"
#include "tools/fleet/Postgres.h"

namespace kyt {
namespace {

using receiver::gzipped;

// So many events, of a device.
std::string message(int number, int events = 2) {
  std::string text =
      R"({"postTime":1769860800.25,"clientId":"device-)" + std::to_string(number) + R"(","events":[)";
  for (int i = 0; i < events; ++i)
    text += std::string(i == 0 ? "" : ",") + R"({"_eventNumber":)" + std::to_string(i) + R"(,"_method":10})";
  return text + "]}";
}

// As a post is known by: 64 hexadecimal digits, here from a short name.
std::string idOf(const std::string& name) {
  std::string id;
  for (const char c : name) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(c));
    id += digits;
  }
  return id + std::string(64 - id.size(), '0');
}

class Reader : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!isInstalled("nats-server")) GTEST_SKIP() << "nats-server is not installed";
    if (!tools::Postgres::isHere()) GTEST_SKIP() << "postgresql is not installed";
    auto started = tools::Postgres::start();
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<tools::Postgres>>(started))
        << std::get<Error>(started).localizedDescription;
    postgres_ = std::get<std::unique_ptr<tools::Postgres>>(std::move(started));
    startLog();
  }
  void startLog() {
    port_ = tools::freePort();
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "nats.log";
    const std::string settings = folder_.write(
        "nats.conf", "listen: \"127.0.0.1:" + std::to_string(port_) +
                         "\"\nmax_payload: 20MB\njetstream { store_dir: \"" + folder_.path() + "/nats\" }\n");
    auto started = tools::ChildProcess::start("/usr/sbin/nats-server", {"-c", settings}, how);
    ASSERT_TRUE(started);
    log_ = std::move(*started);
    ASSERT_TRUE(eventually([this] { return tools::takesConnections(port_); })) << folder_.read("nats.log");
    ASSERT_EQ(natsConnection_ConnectTo(&connection_, url().c_str()), NATS_OK);
    ASSERT_EQ(natsConnection_JetStream(&context_, connection_, nullptr), NATS_OK);
    makeStream();
  }
  // The stream knows repeats for that long; 0: the server's default.
  void makeStream(std::chrono::nanoseconds knowsRepeats = {}) {
    jsStreamConfig stream;
    jsStreamConfig_Init(&stream);
    const char* subjects[] = {"kyt.events.*"};
    stream.Name = "kyt-events";
    stream.Subjects = subjects;
    stream.SubjectsLen = 1;
    stream.Duplicates = knowsRepeats.count();
    const auto make = knowsRepeats.count() > 0 ? js_UpdateStream : js_AddStream;
    ASSERT_TRUE(eventually([&] { return make(nullptr, context_, &stream, nullptr, nullptr) == NATS_OK; }));
  }
  void TearDown() override {
    if (reader_.pid() > 0) {
      EXPECT_EQ(end(), 0) << said();
    }
    jsCtx_Destroy(context_);
    natsConnection_Destroy(connection_);
  }
  [[nodiscard]] std::string url() const { return "nats://127.0.0.1:" + std::to_string(port_); }
  void startReader(std::vector<std::string> further = {}, const std::string& database = "",
                   std::vector<std::pair<std::string, std::string>> environment = {}) {
    std::vector<std::string> arguments = {"--server", url(), "--database",
                                          database.empty() ? postgres_->database() : database};
    arguments.insert(arguments.end(), further.begin(), further.end());
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "reader.log";
    how.environment = std::move(environment);
    auto started = tools::ChildProcess::start(KYT_READER, arguments, how);
    ASSERT_TRUE(started);
    reader_ = std::move(*started);
  }
  std::optional<int> end() {
    reader_.signal(SIGTERM);
    const auto status = reader_.wait(std::chrono::seconds(30));
    reader_ = tools::ChildProcess();
    return status;
  }
  // What the reader has used.
  [[nodiscard]] double processorSeconds() const {
    std::ifstream file("/proc/" + std::to_string(reader_.pid()) + "/stat");
    std::string word;
    double ticks = 0;
    for (int place = 1; place <= 15 && file >> word; ++place)
      if (place >= 14) ticks += std::stod(word);
    return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
  }
  [[nodiscard]] std::string said() const { return folder_.read("reader.log"); }

  // As the receiver publishes it.
  void put(const std::string& name, const std::string& body, const std::string& encoding = "gzip",
           const std::string& sender = "QPW") {
    natsMsg* message = nullptr;
    ASSERT_EQ(natsMsg_Create(&message, "kyt.events.0", nullptr, body.data(), static_cast<int>(body.size())),
              NATS_OK);
    for (const auto& [header, value] :
         std::vector<std::pair<const char*, std::string>>{{"Kyt-Id", name.empty() ? "" : idOf(name)},
                                                          {"Kyt-Received", "1769860800123"},
                                                          {"Kyt-Path", "/v1/events"},
                                                          {"Kyt-Sender", sender},
                                                          {"Kyt-Client", "person"},
                                                          {"Kyt-Encoding", encoding},
                                                          {"Kyt-Digest", "valid"}})
      natsMsgHeader_Set(message, header, value.c_str());
    EXPECT_EQ(js_PublishMsg(nullptr, context_, message, nullptr, nullptr), NATS_OK);
    natsMsg_Destroy(message);
  }
  [[nodiscard]] bool holds(const std::string& sql, const std::string& answer) const {
    std::string last;
    const bool isSo = eventually([&] { return (last = postgres_->query(sql)) == answer + "\n"; });
    EXPECT_TRUE(isSo) << sql << ": " << last << said();
    return isSo;
  }
  // The database refuses what it is to store: posts of that device, or all where there is none.
  void refuse(const std::string& code, const std::string& device = "") {
    ASSERT_TRUE(holds("SELECT count(*) FROM kyt_posts", "0"));
    const std::string body = "BEGIN RAISE EXCEPTION USING ERRCODE = '" + code + "'; END";
    const std::string when = device.empty() ? "" : "WHEN (NEW.client_id = '" + device + "') ";
    const std::string name = "refuse_" + code;
    const std::string said = postgres_->query("CREATE FUNCTION " + name + "() RETURNS trigger AS $$ " + body +
                                              " $$ LANGUAGE plpgsql; CREATE TRIGGER " + name +
                                              " BEFORE INSERT ON kyt_posts FOR EACH ROW " + when +
                                              "EXECUTE FUNCTION " + name + "()");
    ASSERT_EQ(said.find("ERROR"), std::string::npos) << said;
  }
  // What the consumer has not acknowledged, or not been given.
  [[nodiscard]] uint64_t unread() const {
    jsConsumerInfo* info = nullptr;
    if (js_GetConsumerInfo(&info, context_, "kyt-events", "kytreader", nullptr, nullptr) != NATS_OK) return 1;
    const uint64_t count = info->NumPending + static_cast<uint64_t>(info->NumAckPending);
    jsConsumerInfo_Destroy(info);
    return count;
  }

  TemporaryFolder folder_;
  std::unique_ptr<tools::Postgres> postgres_;
  uint16_t port_ = 0;
  tools::ChildProcess log_, reader_;
  natsConnection* connection_ = nullptr;
  jsCtx* context_ = nullptr;
};

TEST_F(Reader, StoresEachPostWithItsFactsAndItsEventsAsRows) {
  startReader();
  put("aa", gzipped(message(1)));
  put("bb", message(2, 3), "identity");
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_events", "5"));
  EXPECT_EQ(postgres_->query(
                "SELECT received AT TIME ZONE 'UTC', path, sender, client, service, digest, client_id FROM "
                "kyt_posts WHERE id = '" +
                idOf("aa") + "'"),
            "2026-01-31 12:00:00.123|/v1/events|QPW|person||valid|device-1\n");
  EXPECT_EQ(postgres_->query("SELECT number, record FROM kyt_events WHERE post = '" + idOf("aa") +
                             "' ORDER BY number"),
            "1|{\"_method\": 10, \"_eventNumber\": 0}\n2|{\"_method\": 10, \"_eventNumber\": 1}\n");
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
}

// So no password has to stand in a command line, which every user of the machine can read.
TEST_F(Reader, FindsTheDatabaseInAServiceFile) {
  std::string entries = postgres_->database();
  std::replace(entries.begin(), entries.end(), ' ', '\n');
  const std::string file = folder_.write("services.conf", "[fleet]\n" + entries + "\n");
  startReader({}, "service=fleet", {{"PGSERVICEFILE", file}});
  put("a", gzipped(message(1)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "1"));
}

TEST_F(Reader, LeavesRepeatsOutByTheirID) {
  startReader();
  for (int i = 0; i < 3; ++i) put("aa", gzipped(message(1)));
  put("bb", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "2"));
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
  EXPECT_EQ(postgres_->query("SELECT count(*) FROM kyt_events"), "4\n");
  EXPECT_EQ(end(), 0);
  EXPECT_NE(said().find("2 posts stored, 2 repeats left out"), std::string::npos) << said();
}

// As where a post's acknowledgement was lost and the spool gives it to the log much later, or a device's outbox repeats it.
TEST_F(Reader, HasAPostOnceThatTheLogHasTwiceSinceItHadForgottenTheFirst) {
  makeStream(std::chrono::milliseconds(100));  // of the one that is there
  receiver::ReceiverProcess::Options options;
  options.servers = "[\"" + url() + "\"]";
  receiver::ReceiverProcess receiver(options);
  ASSERT_TRUE(receiver.becomesReady()) << receiver.output();
  receiver::StreamView stream(url());
  EXPECT_EQ(receiver.post(receiver::postText(1)).status, 200);
  EXPECT_EQ(receiver.post(receiver::postText(1)).status, 200);
  EXPECT_EQ(stream.messages(), 1U) << "known yet";
  EXPECT_TRUE(eventually([&] {
    EXPECT_EQ(receiver.post(receiver::postText(1)).status, 200);
    return stream.messages() == 2U;
  }));
  EXPECT_EQ(stream.ids().size(), 1U);
  startReader();
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
  EXPECT_EQ(postgres_->query("SELECT count(*) FROM kyt_posts"), "1\n");
  EXPECT_EQ(postgres_->query("SELECT count(*) = count(DISTINCT record) FROM kyt_events"), "t\n");
  EXPECT_EQ(end(), 0);
  EXPECT_NE(said().find("1 posts stored, 1 repeats left out"), std::string::npos) << said();
}

TEST_F(Reader, SetsAsideWhatCannotBeReadAndGoesOn) {
  startReader({"--batch", "10"});
  put("no-gzip", "no gzip");
  put("good-1", gzipped(message(1)));
  put("no-json", gzipped("{\"events\":["));
  put("no-array", gzipped("{\"events\":7}"));
  put("zero", gzipped(R"({"events":[{"a":"\u0000"}]})"));
  put("bytes", gzipped("{\"events\":[{\"a\":\"\xff\"}]}"));
  put("other", "text", "br");
  put("large", gzipped(R"({"events":[]})" + std::string(64 << 20, ' ')));
  put("", "who wrote this?");  // the library cannot read headers of which one is empty
  put("good-2", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_unreadable", "8"));
  EXPECT_TRUE(
      holds("SELECT string_agg(id, ' ' ORDER BY id) FROM kyt_posts", idOf("good-1") + " " + idOf("good-2")));
  EXPECT_EQ(postgres_->query("SELECT reason, body FROM kyt_unreadable WHERE id = '" + idOf("other") + "'"),
            "unknown encoding \"br\"|\\x74657874\n");
  EXPECT_EQ(
      postgres_->query("SELECT reason, body FROM kyt_unreadable WHERE id LIKE 'message % of kyt-events'"),
      "no Kyt-Id, or headers that cannot be read|\\x77686f2077726f746520746869733f\n");
  EXPECT_TRUE(eventually([this] { return unread() == 0; })) << "nothing comes again for ever";
}

TEST_F(Reader, CountsWhatItSetAsideOnce) {
  startReader();
  for (int i = 0; i < 3; ++i) put("no-gzip", "no gzip");
  put("good", gzipped(message(1)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "1"));
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
  EXPECT_EQ(postgres_->query("SELECT count(*) FROM kyt_unreadable"), "1\n");
  EXPECT_EQ(end(), 0);
  EXPECT_NE(said().find("1 posts stored, 2 repeats left out, 1 that"), std::string::npos) << said();
}

TEST_F(Reader, SetsAsideWhatIsTooMuchForTheDatabaseAndGoesOn) {
  startReader();
  refuse("53200", "device-1");
  refuse("XX000", "device-3");
  put("deep", gzipped("{\"events\":" + std::string(200'000, '[') + std::string(200'000, ']') + "}"));
  // As of an array of 17 million numbers: more than PostgreSQL asks for at a time.
  put("many", gzipped(message(3)));
  put("memory", gzipped(message(1)));
  put("good", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT string_agg(id, ' ' ORDER BY id) FROM kyt_posts", idOf("good")));
  EXPECT_TRUE(holds("SELECT string_agg(id, ' ' ORDER BY id) FROM kyt_unreadable",
                    idOf("deep") + " " + idOf("many") + " " + idOf("memory")));
  EXPECT_EQ(postgres_->query("SELECT reason FROM kyt_unreadable WHERE id = '" + idOf("deep") + "'"),
            "stack depth limit exceeded\n");
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
  EXPECT_EQ(end(), 0);
  EXPECT_NE(said().find("1 posts stored, 0 repeats left out, 3 that"), std::string::npos) << said();
}

TEST_F(Reader, SetsAsideAPostWhoseFactsAreNoUTF8) {
  startReader();
  put("facts", gzipped(message(1)), "gzip", "Q\xffW");
  put("all", "text", "\xfe", "Q\xffW");
  put("good", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT string_agg(id, ' ' ORDER BY id) FROM kyt_posts", idOf("good")));
  EXPECT_TRUE(holds("SELECT string_agg(id || ' ' || sender, ' ' ORDER BY id) FROM kyt_unreadable",
                    idOf("all") + " Q\\xffW " + idOf("facts") + " Q\\xffW"));
  EXPECT_EQ(postgres_->query("SELECT encoding, reason FROM kyt_unreadable WHERE id = '" + idOf("all") + "'"),
            "\\xfe|unknown encoding \"\\xfe\"\n");
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
}

TEST_F(Reader, WaitsForADatabaseThatCannotStoreAndSetsNothingAside) {
  startReader();
  refuse("53100");  // its disk is full
  put("good", gzipped(message(1)));
  put("no-gzip", "no gzip");
  EXPECT_TRUE(eventually([this] { return said().find("53100") != std::string::npos; })) << said();
  EXPECT_EQ(postgres_->query("SELECT count(*) FROM kyt_unreadable"), "0\n");
  EXPECT_EQ(unread(), 2U);
  static_cast<void>(postgres_->query("DROP TRIGGER refuse_53100 ON kyt_posts"));
  EXPECT_TRUE(holds("SELECT string_agg(id, ' ') FROM kyt_posts", idOf("good")));
  EXPECT_TRUE(holds("SELECT string_agg(id, ' ') FROM kyt_unreadable", idOf("no-gzip")));
}

TEST_F(Reader, StoresALargePostWhateverTimeTheDatabaseGivesAStatement) {
  ASSERT_EQ(postgres_->query("ALTER ROLE CURRENT_USER SET statement_timeout = '100ms'").find("ERROR"),
            std::string::npos);
  startReader();
  put("large", gzipped(message(1, 200'000)));
  put("good", gzipped(message(2)));
  EXPECT_TRUE(
      holds("SELECT string_agg(id, ' ' ORDER BY id) FROM kyt_posts", idOf("good") + " " + idOf("large")));
  EXPECT_EQ(said().find("statement timeout"), std::string::npos) << said();
}

TEST_F(Reader, GivesUpADatabaseThatSaysNothingAndEndsWhenItIsTold) {
  const int silent = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  ASSERT_EQ(::bind(silent, reinterpret_cast<sockaddr*>(&address), size), 0);
  ASSERT_EQ(::listen(silent, 8), 0);
  ASSERT_EQ(::getsockname(silent, reinterpret_cast<sockaddr*>(&address), &size), 0);
  startReader({}, "host=127.0.0.1 dbname=kyt port=" + std::to_string(ntohs(address.sin_port)));
  const int taken = ::accept4(silent, nullptr, nullptr, SOCK_CLOEXEC);
  ASSERT_GE(taken, 0);
  EXPECT_EQ(end(), 0) << said();
  EXPECT_NE(said().find("timeout expired"), std::string::npos) << said();
  ::close(taken);
  ::close(silent);
}

TEST_F(Reader, LetsTheUserSayHowLongADatabaseMaySayNothing) {
  startReader({}, "host=127.0.0.1 connect_timeout=none");
  EXPECT_TRUE(eventually([this] { return said().find("\"none\"") != std::string::npos; })) << said();
}

TEST_F(Reader, LosesAndDoublesNothingWhereItDiesOrTheDatabaseDoes) {
  startReader({"--batch", "7", "--acknowledge-within", "2"});
  constexpr int kPosts = 400;
  for (int i = 0; i < kPosts; ++i) {
    put("id-" + std::to_string(i), gzipped(message(i)));
    if (i == 100 || i == 250) {
      EXPECT_TRUE(
          eventually([this] { return postgres_->query("SELECT count(*) > 20 FROM kyt_posts") == "t\n"; }));
      reader_.signal(SIGKILL);
      static_cast<void>(reader_.wait(std::chrono::seconds(30)));
      startReader({"--batch", "7", "--acknowledge-within", "2"});
    }
    if (i == 180) {
      const auto problem = postgres_->restart();
      ASSERT_FALSE(problem) << problem->localizedDescription;
    }
  }
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", std::to_string(kPosts)));
  EXPECT_EQ(postgres_->query("SELECT count(*), count(DISTINCT post) FROM kyt_events"), "800|400\n");
}

TEST_F(Reader, MakesItsConsumerAgainWhereItIsGone) {
  startReader();
  put("aa", gzipped(message(1)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "1"));
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
  ASSERT_EQ(js_DeleteConsumer(context_, "kyt-events", "kytreader", nullptr, nullptr), NATS_OK);
  put("bb", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "2"));
  EXPECT_TRUE(eventually([this] { return unread() == 0; }));
}

TEST_F(Reader, RestsBetweenItsAttemptsWhileTheStreamIsAway) {
  startReader();
  put("aa", gzipped(message(1)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "1"));
  ASSERT_EQ(js_DeleteStream(context_, "kyt-events", nullptr, nullptr), NATS_OK);
  const size_t before = said().size();
  EXPECT_TRUE(eventually([&] { return said().size() > before; })) << said();
  // Without a rest it takes a processor: a second of each second.
  const auto begin = std::chrono::steady_clock::now();
  const double used = processorSeconds();
  EXPECT_TRUE(eventually([&] { return std::chrono::steady_clock::now() - begin > std::chrono::seconds(3); }));
  EXPECT_LT(processorSeconds() - used, 0.5);
  makeStream();
  put("bb", gzipped(message(2)));
  EXPECT_TRUE(holds("SELECT count(*) FROM kyt_posts", "2"));
}

}  // namespace
}  // namespace kyt
