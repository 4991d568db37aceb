// Event posts, good and bad, and what the server remembers of them.
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/sha.h>
#include <sqlite3.h>

#include <cstdio>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

constexpr char kRecord[] =
    R"({"_sender":"QH","_sessionID":"s-1","_eventNumber":7,"_method":3,"_status":65535,"_clientTS":1769860800.125,)"
    R"("text":"a","big":9007199254740993,"small":0.1,"flag":true})";

// The header's form, written apart from the server's own code.
std::string digestOf(const std::string& key, const std::string& body) {
  unsigned char digest[20];
  unsigned size = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()),
       reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest, &size);
  char text[64];
  char* at = text;
  *at++ = '<';
  for (int i = 0; i < 20; ++i) at += std::snprintf(at, 4, i % 4 == 0 && i > 0 ? " %02x" : "%02x", digest[i]);
  *at++ = '>';
  return {text, at};
}

std::string sha256(const std::string& bytes) {
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(), digest);
  std::string text;
  for (const unsigned char byte : digest) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", byte);
    text += digits;
  }
  return text;
}

class PostsTest : public testing::Test {
 protected:
  void start(std::vector<std::string> options = {}) {
    server_ = std::make_unique<ServerProcess>(state_.path(), std::move(options));
    ASSERT_TRUE(server_->isReady()) << server_->errors();
  }
  // The newest post, whole.
  [[nodiscard]] rapidjson::Document newest() const {
    const auto posts = server_->get("/api/posts?limit=1");
    const int64_t id = posts["posts"].Empty() ? 0 : posts["posts"][0]["id"].GetInt64();
    return server_->get("/api/posts/" + std::to_string(id));
  }
  void expectBad(const Response& response, long status, const std::string& reason) const {
    EXPECT_EQ(response.status, status);
    EXPECT_NE(response.body.find(reason), std::string::npos) << response.body;
    const auto post = newest();
    ASSERT_TRUE(post.HasMember("good"));
    EXPECT_FALSE(post["good"].GetBool());
    EXPECT_EQ(post["answered"].GetInt(), status);
    EXPECT_NE(std::string(post["reason"].GetString()).find(reason), std::string::npos)
        << post["reason"].GetString();
  }

  // As a server of before left its database.
  void removeNamesOfBodies() const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open((state_.path() / "devserver.sqlite").c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database,
                           "DROP INDEX posts_sha256; ALTER TABLE posts DROP COLUMN repeats;"
                           "ALTER TABLE posts DROP COLUMN sha256",
                           nullptr, nullptr, nullptr),
              SQLITE_OK)
        << sqlite3_errmsg(database);
    sqlite3_close(database);
  }

  TemporaryFolder state_;
  std::unique_ptr<ServerProcess> server_;
};

TEST_F(PostsTest, AGoodPostIsAnsweredAndKeptWithItsEvents) {
  start();
  const Response response =
      server_->post("/events/batch", message(kRecord), {"X-KYT-Client-Name: cam", "X-KYT-Service-Name: svc"});
  EXPECT_EQ(response.status, 200);
  EXPECT_EQ(response.body, "{}");
  const auto post = newest();
  EXPECT_TRUE(post["good"].GetBool());
  EXPECT_TRUE(post["secure"].GetBool());
  EXPECT_STREQ(post["path"].GetString(), "/events/batch");
  EXPECT_STREQ(post["clientId"].GetString(), "device");
  EXPECT_EQ(post["postTime"].GetDouble(), 1769860800.25);
  EXPECT_EQ(post["body"].GetString(), message(kRecord));
  EXPECT_EQ(post["json"]["events"][0]["big"].GetInt64(), 9007199254740993);
  const auto events = server_->get("/api/events?client=cam&method=3");
  ASSERT_EQ(events["total"].GetInt(), 1);
  const auto& event = events["events"][0];
  EXPECT_STREQ(event["service"].GetString(), "svc");
  EXPECT_STREQ(event["sender"].GetString(), "QH");
  EXPECT_STREQ(event["session"].GetString(), "s-1");
  EXPECT_EQ(event["status"].GetInt(), 65535);
  EXPECT_EQ(event["number"].GetInt(), 7);
  EXPECT_EQ(event["time"].GetDouble(), 1769860800.125);
  EXPECT_EQ(event["record"]["big"].GetInt64(), 9007199254740993);
  EXPECT_EQ(event["record"]["small"].GetDouble(), 0.1);
  EXPECT_EQ(server_->get("/api/events?client=other")["total"].GetInt(), 0);
}

TEST_F(PostsTest, AGzipBodyIsUndoneAndKeptAsSent) {
  start();
  const std::string sent = gzip(message(kRecord));
  EXPECT_EQ(server_->post("/events", sent, {"Content-Encoding: gzip"}).status, 200);
  const auto post = newest();
  EXPECT_TRUE(post["good"].GetBool());
  EXPECT_EQ(post["size"].GetUint64(), sent.size());
  EXPECT_EQ(post["body"].GetString(), message(kRecord));
  const Response raw = server_->http("/api/posts/" + std::to_string(post["id"].GetInt64()) + "/body");
  EXPECT_EQ(raw.body, sent);
  EXPECT_EQ(raw.header("content-type"), "application/octet-stream");
}

TEST_F(PostsTest, ADamagedOrEndlessGzipBodyIsBad) {
  start({"--max-inflated", "100000"});
  const std::string sent = gzip(message(kRecord));
  const std::vector<std::string> encoded = {"Content-Encoding: gzip"};
  expectBad(server_->post("/events", message(kRecord), encoded), 400, "the body is no gzip");
  expectBad(server_->post("/events", sent.substr(0, sent.size() / 2), encoded), 400,
            "the gzip body ends early");
  expectBad(server_->post("/events", sent + "x", encoded), 400, "bytes follow the end of the gzip body");
  expectBad(server_->post("/events", gzip(std::string(5000000, ' ')), encoded), 400,
            "inflates to more than 100000");
  expectBad(server_->post("/events", sent, {"Content-Encoding: br"}), 400,
            "Content-Encoding \"br\" is not gzip");
  expectBad(server_->post("/events", "", encoded), 400, "the gzip body ends early");
}

TEST_F(PostsTest, AMessageOfTheWrongShapeIsBadAndTheReasonNamesThePlace) {
  start();
  const std::pair<std::string, const char*> cases[] = {
      {"", "the JSON is malformed at byte 0"},
      {R"({"postTime":1,"clientId":"x")", "the JSON is malformed at byte 28"},
      {message("") + "{}", "the JSON is malformed"},
      {"[]", "the message is an array, not an object"},
      {"{}", "\"postTime\" is missing"},
      {R"({"postTime":"1","clientId":"x","events":[]})", "\"postTime\" is a string, not a number"},
      {R"({"postTime":1,"events":[]})", "\"clientId\" is missing"},
      {R"({"postTime":1,"clientId":5,"events":[]})", "\"clientId\" is a number, not a string"},
      {R"({"postTime":1,"clientId":"x","events":{}})", "\"events\" is an object, not an array"},
      {message(R"({},5)"), "events[1] is a number, not an object"},
      {message(R"({"a":[1]})"), "events[0]: \"a\" is an array"},
      {message(R"({"a":null})"), "events[0]: \"a\" is null"},
      {message("{\"a\":\"\xff\"}"), "the JSON is malformed"},
      {std::string(100000, '['), "nested deeper than 32"},
  };
  for (const auto& [body, reason] : cases) {
    SCOPED_TRACE(body.substr(0, 60));
    expectBad(server_->post("/events", body), 400, reason);
  }
  EXPECT_EQ(server_->get("/api/totals")["bad"].GetUint64(), std::size(cases));
  EXPECT_EQ(server_->get("/api/totals")["events"].GetInt(), 0);
  EXPECT_EQ(server_->get("/api/posts?bad=1")["posts"].Size(), std::size(cases));
}

TEST_F(PostsTest, WithAKeyTheDigestMustFitTheBodyAsSent) {
  start({"--digest-key", "00ff10"});
  const std::string key("\x00\xff\x10", 3), sent = gzip(message(kRecord));
  const std::string encoding = "Content-Encoding: gzip";
  EXPECT_EQ(server_->post("/events", sent, {encoding, "X-KYT-DIGEST: " + digestOf(key, sent)}).status, 200);
  EXPECT_STREQ(newest()["digest"].GetString(), "good");
  expectBad(server_->post("/events", sent, {encoding, "X-KYT-DIGEST: " + digestOf(key, message(kRecord))}),
            400, "X-KYT-DIGEST does not fit");
  EXPECT_STREQ(newest()["digest"].GetString(), "bad");
  expectBad(server_->post("/events", sent, {encoding, "X-KYT-DIGEST: " + digestOf("other", sent)}), 400,
            "X-KYT-DIGEST does not fit");
  expectBad(server_->post("/events", sent, {encoding}), 400, "X-KYT-DIGEST is missing");
  EXPECT_STREQ(newest()["digest"].GetString(), "missing");
}

TEST_F(PostsTest, AKeyOfAClientIsForThatClientAlone) {
  start({"--digest-key", "cam=aa", "--digest-key", "cam=bb"});
  const std::string body = message(kRecord), name = "X-KYT-Client-Name: cam";
  EXPECT_EQ(server_->post("/events", body, {name, "X-KYT-DIGEST: " + digestOf("\xaa", body)}).status, 200);
  EXPECT_EQ(server_->post("/events", body, {name, "X-KYT-DIGEST: " + digestOf("\xbb", body)}).status, 200);
  expectBad(server_->post("/events", body, {name}), 400, "X-KYT-DIGEST is missing");
  EXPECT_EQ(server_->post("/events", body, {"X-KYT-Client-Name: other"}).status, 200);
  EXPECT_STREQ(newest()["digest"].GetString(), "unchecked");
}

TEST_F(PostsTest, ABodyOverTheLimitIsRefused) {
  start({"--max-body", "1000"});
  expectBad(server_->post("/events", std::string(1001, ' ')), 413, "over the limit of 1000 bytes");
  expectBad(server_->post("/events", std::string(8 << 20, ' '), {"Expect: 100-continue"}), 413,
            "over the limit");
  EXPECT_EQ(newest()["size"].GetInt(), 0);
  EXPECT_EQ(server_->post("/events", message(std::string(1000 - message("{}").size(), ' ') + "{}")).status,
            200);
}

TEST_F(PostsTest, ALengthMustBeGiven) {
  start();
  expectBad(server_->post("/events", message(kRecord), {"Transfer-Encoding: chunked"}), 411,
            "Content-Length is missing");
}

TEST_F(PostsTest, ABodyThatNeverEndsIsCutOffAndKept) {
  start({"--http-events", "--request-timeout", "1"});
  Connection connection(server_->httpPort());
  connection.send("POST /events HTTP/1.1\r\nHost: localhost\r\nContent-Length: 1000\r\n\r\n{\"postTime\":");
  connection.receiveUntil("no answer comes");
  EXPECT_TRUE(connection.closedByPeer());
  EXPECT_TRUE(server_->get("/api/wait?bad=1&timeout=20")["reached"].GetBool());
  const auto post = newest();
  EXPECT_STREQ(post["reason"].GetString(), "the body was not whole in time, 12 bytes came");
  EXPECT_STREQ(post["body"].GetString(), "{\"postTime\":");
  EXPECT_EQ(post["answered"].GetInt(), 0);
}

TEST_F(PostsTest, AConnectionThatBreaksInTheBodyIsKept) {
  start({"--http-events"});
  Connection connection(server_->httpPort());
  connection.send("POST /events HTTP/1.1\r\nHost: localhost\r\nContent-Length: 1000\r\n\r\n{\"postTime\":");
  connection.close();
  EXPECT_TRUE(server_->get("/api/wait?bad=1&timeout=20")["reached"].GetBool());
  EXPECT_STREQ(newest()["reason"].GetString(),
               "the connection ended before the body was whole, 12 bytes came");
}

TEST_F(PostsTest, ThePlainPortTakesPostsOnlyWhenTold) {
  start();
  Call call;
  call.method = "POST";
  call.body = message(kRecord);
  EXPECT_EQ(server_->http("/events", call).status, 405);
  EXPECT_EQ(server_->get("/api/totals")["posts"].GetInt(), 0);
  server_->stop();
  start({"--http-events"});
  EXPECT_EQ(server_->http("/events", call).status, 200);
  EXPECT_FALSE(newest()["secure"].GetBool());
  EXPECT_EQ(server_->https("/events").status, 405);
  EXPECT_EQ(server_->post("/eventsmore", message(kRecord)).status, 404);
}

TEST_F(PostsTest, SurviveARestart) {
  start();
  EXPECT_EQ(server_->post("/events", message(kRecord)).status, 200);
  EXPECT_EQ(server_->stop(), 0) << server_->errors();
  start();
  EXPECT_EQ(server_->get("/api/totals")["events"].GetInt(), 1);
  EXPECT_EQ(newest()["body"].GetString(), message(kRecord));
}

TEST_F(PostsTest, ABodyThatCameBeforeIsShownAsARepeatOfTheFirst) {
  start();
  const std::string sent = gzip(message(kRecord));
  EXPECT_EQ(server_->post("/events", sent, {"Content-Encoding: gzip"}).status, 200);
  const auto first = newest();
  EXPECT_TRUE(first["repeats"].IsNull());
  EXPECT_EQ(std::string(first["sha256"].GetString()), sha256(sent));
  EXPECT_EQ(server_->post("/events", message(kRecord)).status, 200);
  EXPECT_TRUE(newest()["repeats"].IsNull()) << "other bytes";
  EXPECT_EQ(server_->stop(), 0) << server_->errors();
  start();
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(server_->post("/events", sent, {"Content-Encoding: gzip"}).status, 200);
    const auto repeat = newest();
    EXPECT_GT(repeat["id"].GetInt64(), first["id"].GetInt64());
    EXPECT_EQ(repeat["repeats"].GetInt64(), first["id"].GetInt64());
  }
  for (int i = 0; i < 2; ++i) EXPECT_EQ(server_->post("/events", "").status, 400);
  EXPECT_TRUE(newest()["repeats"].IsNull()) << "an empty body names nothing";
}

TEST_F(PostsTest, ADatabaseWithoutNamesOfBodiesIsTakenOver) {
  start();
  EXPECT_EQ(server_->post("/events", message(kRecord)).status, 200);
  EXPECT_EQ(server_->stop(), 0) << server_->errors();
  removeNamesOfBodies();
  start();
  EXPECT_TRUE(newest()["repeats"].IsNull());
  EXPECT_EQ(server_->post("/events", message(kRecord)).status, 200);
  const auto second = newest();
  EXPECT_TRUE(second["repeats"].IsNull()) << "of the first nobody knows";
  EXPECT_EQ(server_->post("/events", message(kRecord)).status, 200);
  EXPECT_EQ(newest()["repeats"].GetInt64(), second["id"].GetInt64());
}

TEST_F(PostsTest, TheOldestGoWhenThereAreMoreThanAreToBeKept) {
  start({"--keep-posts", "3"});
  for (int i = 1; i <= 5; ++i) {
    EXPECT_EQ(server_->post("/events", message(R"({"_method":)" + std::to_string(i) + "}")).status, 200);
  }
  const auto posts = server_->get("/api/posts?since=0");
  ASSERT_EQ(posts["posts"].Size(), 3U);
  EXPECT_EQ(posts["posts"][0]["id"].GetInt(), 3);
  EXPECT_EQ(server_->get("/api/events")["total"].GetInt(), 3);
  EXPECT_EQ(server_->get("/api/totals")["events"].GetInt(), 5);
}

TEST_F(PostsTest, TheOldestGoWhenTheirBytesAreTooMany) {
  start({"--keep-bytes", "100000"});
  const std::string body = message(R"({"a":")" + std::string(20000, 'x') + "\"}");
  for (int i = 0; i < 6; ++i) EXPECT_EQ(server_->post("/events", body).status, 200);
  const auto posts = server_->get("/api/posts?since=0");
  ASSERT_EQ(posts["posts"].Size(), 2U);  // of 40 kilobytes each, sent and text
  EXPECT_EQ(posts["posts"][1]["id"].GetInt(), 6);
}

TEST_F(PostsTest, HostileTextComesBackAsDataAndNeverAsMarkup) {
  start();
  const std::string evil = R"(</script><img src=x onerror=alert(1)>)";
  const std::string body = message(R"({"_sessionID":")" + evil + R"(","text":"\u0000\u001b[31m\u202e"})");
  EXPECT_EQ(
      server_->post("/events", body, {"X-KYT-Client-Name: " + evil, "X-KYT-Sender: a\xff\x1b[2Jz"}).status,
      200);
  const auto events = server_->get("/api/events");
  ASSERT_EQ(events["total"].GetInt(), 1);
  EXPECT_EQ(events["events"][0]["client"].GetString(), evil);
  EXPECT_EQ(events["events"][0]["session"].GetString(), evil);
  EXPECT_STREQ(events["events"][0]["sender"].GetString(), "a\\xff\x1b[2Jz");
  EXPECT_EQ(events["events"][0]["record"]["text"].GetStringLength(), 9U);
  const Response response = server_->http("/api/events");
  EXPECT_EQ(response.header("content-type"), "application/json");
  EXPECT_EQ(response.header("x-content-type-options"), "nosniff");
  EXPECT_EQ(response.body.find('\x1b'), std::string::npos);
  EXPECT_STREQ(server_->get("/api/sessions")["sessions"][0]["session"].GetString(), evil.c_str());
}

TEST_F(PostsTest, ABodyThatIsNoTextIsShownEscaped) {
  start();
  expectBad(server_->post("/events", std::string("\xff\x00z", 3)), 400, "the JSON is malformed");
  const auto post = newest();
  EXPECT_FALSE(post["bodyIsText"].GetBool());
  EXPECT_EQ(std::string(post["body"].GetString(), post["body"].GetStringLength()),
            std::string("\\xff\0z", 6));
  EXPECT_TRUE(post["json"].IsNull());
  EXPECT_TRUE(post["pretty"].IsNull());
}

}  // namespace
}  // namespace kyt::devserver::test
