// The program with a real server of the log.
#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "http/PostDigest.h"
#include "tests/receiver/ReceiverTest.h"

namespace kyt::receiver {
namespace {

constexpr char kKeys[] =
    "digest = \"required\"\ndigest_keys = { \"QPW/videocall\" = [\"6f6c64\", \"6e6577\"] }\n";

TEST_F(ReceiverTest, AnswersOnceTheLogHasThePostWithItsFacts) {
  start();
  const std::string body = gzipped(postText(1));
  EXPECT_EQ(
      receiver_
          ->post(body, {"Content-Encoding: gzip", "X-KYT-Sender: QPW", "X-KYT-Client-Name: video\xc3\xa4",
                        "X-KYT-Service-Name: calls", "X-KYT-Client-Version: 7"})
          .status,
      200);
  ASSERT_EQ(view_->messages(), 1U);
  auto stored = view_->message(1);
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->body, body);
  EXPECT_EQ(stored->subject, "kyt.events.0");
  EXPECT_EQ(stored->headers.at("Nats-Msg-Id"), stored->headers.at("Kyt-Id"));
  EXPECT_EQ(stored->headers.at("Kyt-Id").size(), 64U);
  EXPECT_GT(std::stoll(stored->headers.at("Kyt-Received")), 1700000000000LL);
  stored->headers.erase("Nats-Msg-Id");
  stored->headers.erase("Kyt-Id");
  stored->headers.erase("Kyt-Received");
  EXPECT_EQ(stored->headers, (std::map<std::string, std::string>{{"Kyt-Path", "/v1/events"},
                                                                 {"Kyt-Sender", "QPW"},
                                                                 {"Kyt-Client", "video\xc3\xa4"},
                                                                 {"Kyt-Service", "calls"},
                                                                 {"Kyt-Client-Version", "7"},
                                                                 {"Kyt-Encoding", "gzip"},
                                                                 {"Kyt-Digest", "absent"}}));
}

TEST_F(ReceiverTest, StoresARepeatOnce) {
  start();
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->post(postText(2)).status, 200);
  EXPECT_EQ(view_->messages(), 2U);
  EXPECT_EQ(receiver_->metric("kyt_duplicates_total"), 1);
  EXPECT_EQ(receiver_->metric("kyt_posts_total{result=\"stored\"}"), 3);
}

TEST_F(ReceiverTest, StoresABodyOnceThatComesToTwoPaths) {
  ReceiverProcess::Options options;
  options.path = "[[path]]\nurl_path = \"/v1/other\"\n";
  start(options);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(HttpConnection(receiver_->port()).post("/v1/other", postText(1)).status, 200);
  EXPECT_EQ(view_->messages(), 1U);
  EXPECT_EQ(view_->message(1)->headers.at("Kyt-Path"), "/v1/events");
  EXPECT_EQ(HttpConnection(receiver_->port()).post("/v1/other", postText(2)).status, 200);
  EXPECT_EQ(view_->message(2)->headers.at("Kyt-Path"), "/v1/other");
}

TEST_F(ReceiverTest, SpreadsPostsOverPartitions) {
  ReceiverProcess::Options options;
  options.log = "partitions = 4\n";
  start(options);
  std::map<std::string, int> subjects;
  for (uint64_t i = 1; i <= 40; ++i) {
    ASSERT_EQ(receiver_->post(postText(i)).status, 200);
    ++subjects[view_->message(i)->subject];
  }
  EXPECT_EQ(subjects.size(), 4U);
}

TEST_F(ReceiverTest, ChecksTheDigestUnderEachKeyOfTheSender) {
  ReceiverProcess::Options options;
  options.path = kKeys;
  start(options);
  const std::string body = gzipped(postText(1));
  const auto post = [&](const std::string& digest, const std::string& sender = "QPW") {
    std::vector<std::string> headers = {"Content-Encoding: gzip", "X-KYT-Sender: " + sender,
                                        "X-KYT-Client-Name: videocall"};
    if (!digest.empty()) headers.push_back("X-KYT-DIGEST: " + digest);
    return receiver_->post(body, headers).status;
  };
  EXPECT_EQ(post(http::digestText("new", body)), 200);
  EXPECT_EQ(post(http::digestText("old", body)), 200);
  EXPECT_EQ(view_->message(1)->headers.at("Kyt-Digest"), "valid");
  EXPECT_EQ(post(http::digestText("other", body)), 400);
  EXPECT_EQ(post(http::digestText("new", body + "x")), 400);
  EXPECT_EQ(post(""), 400);
  EXPECT_EQ(post(http::digestText("new", body), "QQQ"), 400);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"digest-wrong\"}"), 2);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"digest-missing\"}"), 1);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"digest-unknown-sender\"}"), 1);
  EXPECT_EQ(receiver_->metric("kyt_digest_total{verdict=\"valid\"}"), 2);
  EXPECT_EQ(view_->messages(), 1U);
}

TEST_F(ReceiverTest, RefusesWhatCanNeverBeTakenAndKeepsACopyOfIt) {
  start();
  EXPECT_EQ(receiver_->post("no gzip", {"Content-Encoding: gzip"}).status, 400);
  EXPECT_EQ(receiver_->post("").status, 400);
  EXPECT_EQ(receiver_->post(postText(1), {"Content-Encoding: br"}).status, 415);
  EXPECT_EQ(receiver_->post(std::string((17 << 20) + 1, 'x')).status, 413);
  HttpConnection chunked(receiver_->port());
  chunked.send(
      "POST /v1/events HTTP/1.1\r\nHost: t\r\nTransfer-Encoding: chunked\r\n\r\n5\r\nhello\r\n0\r\n\r\n");
  EXPECT_EQ(chunked.receive().status, 411);
  HttpConnection lengthless(receiver_->port());
  lengthless.send("POST /v1/events HTTP/1.1\r\nHost: t\r\n\r\n");
  EXPECT_EQ(lengthless.receive().status, 411);
  EXPECT_EQ(HttpConnection(receiver_->port()).post("/elsewhere", "{}").status, 404);
  EXPECT_EQ(HttpConnection(receiver_->port()).get("/v1/events").status, 405);
  EXPECT_EQ(view_->messages(), 0U);
  EXPECT_TRUE(eventually([&] { return view_->messages("kyt-dead-letters") == 6U; }));
  const auto letter = view_->message(1, "kyt-dead-letters");
  ASSERT_TRUE(letter);
  EXPECT_EQ(letter->subject, "kyt.dead");
  EXPECT_EQ(letter->body, "no gzip");
  EXPECT_EQ(letter->headers.at("Kyt-Reason"), "not-gzip");
  EXPECT_EQ(letter->headers.at("Kyt-Bytes"), "7");
  EXPECT_EQ(letter->headers.at("Kyt-Id").size(), 64U);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_dead_letters_total") == 6; }));
  for (const char* reason :
       {"not-gzip", "empty", "wrong-encoding", "too-large", "unknown-path", "wrong-method"})
    EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"" + std::string(reason) + "\"}"), 1) << reason;
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"no-length\"}"), 2);
}

class DeadLettersOfTheReceiver : public ReceiverTest {
 protected:
  [[nodiscard]] StoredMessage letter(uint64_t number) {
    std::optional<StoredMessage> found;
    EXPECT_TRUE(eventually([&] { return (found = view_->message(number, "kyt-dead-letters")).has_value(); }));
    return found.value_or(StoredMessage());
  }
};

TEST_F(DeadLettersOfTheReceiver, HaveTheBeginningOfWhatIsRefusedBeforeItsBody) {
  start();
  const std::string large = "begin" + std::string(17 << 20, 'x'), wrong = postText(1, 100000);
  ASSERT_EQ(receiver_->post(large).status, 413);
  EXPECT_EQ(letter(1).body, large.substr(0, 65536));
  EXPECT_EQ(letter(1).headers.at("Kyt-Bytes"), std::to_string(large.size()));
  EXPECT_EQ(letter(1).headers.count("Kyt-Id"), 0U) << "that would be the name of a part";
  ASSERT_EQ(receiver_->post(wrong, {"Content-Encoding: br"}).status, 415);
  EXPECT_EQ(letter(2).body, wrong.substr(0, 65536));
  EXPECT_EQ(letter(2).headers.at("Kyt-Reason"), "wrong-encoding");
  HttpConnection chunked(receiver_->port());
  chunked.send(
      "POST /v1/events HTTP/1.1\r\nHost: t\r\nTransfer-Encoding: chunked\r\n\r\n5\r\nhello\r\n0\r\n\r\n");
  ASSERT_EQ(chunked.receive().status, 411);
  EXPECT_EQ(letter(3).body, "hello");
  EXPECT_EQ(letter(3).headers.at("Kyt-Id").size(), 64U);
  EXPECT_EQ(receiver_->metric("kyt_bodies_bytes"), 0);
}

TEST_F(DeadLettersOfTheReceiver, HaveWhatTheLogNeverTakes) {
  start();
  ASSERT_TRUE(view_->setMaxMessageBytes(50000));
  const std::string body = postText(1, 100000);
  ASSERT_EQ(receiver_->post(body).status, 413);
  EXPECT_EQ(letter(1).body, body.substr(0, 65536));
  EXPECT_EQ(letter(1).headers.at("Kyt-Reason"), "too-large-for-log");
  EXPECT_EQ(letter(1).headers.at("Kyt-Bytes"), std::to_string(body.size()));
}

// What follows another closely is written by another thread.
TEST_F(DeadLettersOfTheReceiver, OfEmptyPostsReachTheLogHoweverCloselyTheyFollowEachOther) {
  start();
  for (int round = 1; round <= 12; ++round) {
    std::vector<std::thread> devices;
    for (int i = 0; i < 8; ++i) devices.emplace_back([&] { EXPECT_EQ(receiver_->post("").status, 400); });
    for (std::thread& device : devices) device.join();
    ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_dead_letters_total") == round * 8; }));
  }
}

TEST_F(DeadLettersOfTheReceiver, CountAsSuchOnceTheLogHasThem) {
  start();
  ASSERT_EQ(receiver_->post("no gzip", {"Content-Encoding: gzip"}).status, 400);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_dead_letters_total") == 1; }));
  ASSERT_TRUE(view_->remove("kyt-dead-letters"));
  ASSERT_EQ(receiver_->post("no gzip", {"Content-Encoding: gzip"}).status, 400);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_dead_letters_left_out_total") == 1; }));
  servers_.kill(0);
  ASSERT_TRUE(eventually([&] { return receiver_->metric("kyt_log_up") == 0; }));
  ASSERT_EQ(receiver_->post("no gzip", {"Content-Encoding: gzip"}).status, 400);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_dead_letters_left_out_total") == 2; }));
  EXPECT_EQ(receiver_->metric("kyt_dead_letters_total"), 1);
}

TEST_F(ReceiverTest, ReadsWhatItRefusesByItsHeadersSoThatTheFrontLearnsIt) {
  start();
  const std::string body(16 << 20, 'x');
  for (const char* request : {"POST /v1/events HTTP/1.1\r\nContent-Encoding: br", "POST /elsewhere HTTP/1.1",
                              "PUT /v1/events HTTP/1.1"}) {
    HttpConnection front(receiver_->port());
    ASSERT_TRUE(front.send(std::string(request) +
                           "\r\nHost: t\r\nContent-Length: " + std::to_string(body.size()) + "\r\n\r\n"));
    EXPECT_TRUE(front.send(body)) << request;
    EXPECT_GE(front.receive().status, 404) << request;
    EXPECT_EQ(front.post("/v1/events", postText(1)).status, 200) << "the connection stays";
  }
}

TEST_F(ReceiverTest, WaitsForNoBodyThatSaysItIsTooLongToRead) {
  start();
  HttpConnection device(receiver_->port());
  device.send("POST /v1/events HTTP/1.1\r\nHost: t\r\nContent-Length: 100000000000\r\n\r\n");
  const HttpReply reply = device.receive();
  EXPECT_EQ(reply.status, 413);
  EXPECT_LT(reply.took, std::chrono::seconds(20));
  EXPECT_TRUE(device.isClosed());
  // Of one that does not say it, no more is read either.
  HttpConnection endless(receiver_->port());
  endless.send("POST /v1/events HTTP/1.1\r\nHost: t\r\nTransfer-Encoding: chunked\r\n\r\n");
  const std::string chunk = "100000\r\n" + std::string(1 << 20, 'x') + "\r\n";
  int sent = 0;
  while (sent < 200 && endless.send(chunk)) ++sent;
  EXPECT_LT(sent, 100);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_refused_total{reason=\"no-length\"}") == 1; }));
}

TEST_F(ReceiverTest, TakesAPostOfSeventeenMebibytes) {
  start();
  const std::string body((17 << 20) - 1000, 'x');
  EXPECT_EQ(receiver_->post(body).status, 200);
  EXPECT_EQ(view_->message(1)->body.size(), body.size());
}

TEST_F(ReceiverTest, IsAliveAtOnceAndReadyWhenTheLogIsThere) {
  servers_.kill(0);
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  receiver_.emplace(options);
  ASSERT_TRUE(receiver_->isReady()) << receiver_->output();
  EXPECT_EQ(receiver_->get("/livez").status, 200);
  EXPECT_EQ(receiver_->get("/readyz").status, 503);
  EXPECT_EQ(receiver_->get("/elsewhere").status, 404);
  // What comes all the same is kept.
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_posts_total{result=\"spooled\"}"), 1);
  servers_.start(0);
  view_.emplace(servers_.url(0));
  start();
  EXPECT_TRUE(eventually([&] { return view_->messages() == 1U; }));
}

TEST_F(ReceiverTest, KeepsPostsWhileTheLogIsAwayAndStoresEachOnceAfterwards) {
  start();
  ASSERT_EQ(receiver_->post(postText(1)).status, 200);
  servers_.kill(0);
  for (uint64_t i = 2; i <= 20; ++i) {
    const HttpReply reply = receiver_->post(postText(i));
    EXPECT_EQ(reply.status, 200);
    EXPECT_LT(reply.took, std::chrono::milliseconds(2500) * 4);
  }
  EXPECT_EQ(receiver_->get("/readyz").status, 200);
  servers_.start(0);
  view_.emplace(servers_.url(0));
  EXPECT_TRUE(eventually([&] { return view_->messages().value_or(0) == 20U; })) << receiver_->output();
  const auto ids = view_->ids();
  EXPECT_EQ(ids.size(), 20U);
  for (const auto& [id, times] : ids) EXPECT_EQ(times, 1) << id;
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_spool_posts") == 0; }));
}

TEST_F(ReceiverTest, EndsInOrderWithTheStatusZero) {
  start();
  HttpConnection idle(receiver_->port());
  EXPECT_EQ(idle.post("/v1/events", postText(1)).status, 200);
  EXPECT_EQ(receiver_->terminate(), 0) << receiver_->output();
}

TEST_F(ReceiverTest, SaysWhatIsWrongWithItsSettings) {
  const TemporaryFolder folder;
  const std::string file = folder.write("r.toml", "[log]\nkind = \"mqtt\"\n");
  tools::ChildProcess::Options how;
  how.outputFile = folder / "output";
  auto check = tools::ChildProcess::start(KYT_RECEIVER, {"--config", file, "--check-config"}, how);
  ASSERT_TRUE(check);
  EXPECT_EQ(check->wait(kTestDeadline), 1);
  EXPECT_NE(folder.read("output").find(file + ":2: \"log.kind\" must be"), std::string::npos);
  auto wrong = tools::ChildProcess::start(KYT_RECEIVER, {"--refuse-with", "500"}, how);
  ASSERT_TRUE(wrong);
  EXPECT_EQ(wrong->wait(kTestDeadline), 2);
}

}  // namespace
}  // namespace kyt::receiver
