// What tests and the page use: told replies, queries, waiting, the stream of events, and who may ask.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <future>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

using std::chrono::milliseconds;

class ControlsTest : public testing::Test {
 protected:
  ControlsTest() {
    bags_.write("cadmor.plist", "<plist/>");
    server_ = std::make_unique<ServerProcess>(
        state_.path(), std::vector<std::string>{"--bags", bags_.path().string(), "--http-events"});
  }
  void SetUp() override { ASSERT_TRUE(server_->isReady()) << server_->errors(); }

  [[nodiscard]] Response tell(const std::string& rule) const {
    Call call;
    call.method = "PUT";
    call.body = rule;
    return server_->http("/control/reply", call);
  }
  [[nodiscard]] Response postOne(milliseconds timeout = milliseconds(20000)) const {
    Call call;
    call.method = "POST";
    call.body = message(R"({"_method":1,"_status":2})");
    call.timeout = timeout;
    call.headers = {"X-KYT-Client-Name: cam"};
    return server_->https("/events", call);
  }

  TemporaryFolder state_, bags_;
  std::unique_ptr<ServerProcess> server_;
};

TEST_F(ControlsTest, AToldReplyIsGivenSoManyTimesAndThePostIsKept) {
  EXPECT_EQ(
      tell(R"({"path":"/events","status":503,"times":2,"body":"busy","headers":{"Retry-After":"9"}})").status,
      200);
  for (int i = 0; i < 2; ++i) {
    const Response response = postOne();
    EXPECT_EQ(response.status, 503);
    EXPECT_EQ(response.body, "busy");
    EXPECT_EQ(response.header("retry-after"), "9");
  }
  EXPECT_EQ(postOne().status, 200);
  const auto posts = server_->get("/api/posts?since=0");
  ASSERT_EQ(posts["posts"].Size(), 3U);
  EXPECT_EQ(posts["posts"][0]["answered"].GetInt(), 503);
  EXPECT_TRUE(posts["posts"][0]["good"].GetBool());
  EXPECT_EQ(posts["posts"][2]["answered"].GetInt(), 200);
}

TEST_F(ControlsTest, ARuleIsForItsPathAndBelow) {
  EXPECT_EQ(tell(R"({"path":"/events/a","status":600,"times":0})").status, 200);
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(server_->post("/events/ab", message("")).status, 200);
  EXPECT_EQ(server_->post("/events/a", message("")).status, 600);
  EXPECT_EQ(server_->post("/events/a/b", message("")).status, 600);
  EXPECT_EQ(server_->get("/control/reply")["rules"].Size(), 1U);
  Call call;
  call.method = "DELETE";
  EXPECT_EQ(server_->http("/control/reply", call).status, 200);
  EXPECT_EQ(server_->post("/events/a", message("")).status, 200);
}

TEST_F(ControlsTest, ARuleMayDelayWhatWouldBeAnsweredAnyway) {
  EXPECT_EQ(tell(R"({"path":"/events","delayMs":300})").status, 200);
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_EQ(postOne().body, "{}");
  EXPECT_GE(std::chrono::steady_clock::now() - begin, milliseconds(300));
}

TEST_F(ControlsTest, ARuleAppliesToStorebagsToo) {
  EXPECT_EQ(tell(R"({"path":"/bags/tolvar/cadmor","status":500,"body":""})").status, 200);
  EXPECT_EQ(server_->https("/bags/tolvar/cadmor").status, 500);
  EXPECT_EQ(server_->https("/bags/tolvar/cadmor").status, 200);
  EXPECT_EQ(server_->get("/api/storebags?since=0")["fetches"][0]["status"].GetInt(), 500);
}

TEST_F(ControlsTest, AHangingRequestEndsWithTheRulesAndBlocksNobody) {
  EXPECT_EQ(tell(R"({"path":"/events","hang":true,"times":20})").status, 200);
  std::vector<std::future<Response>> hanging;
  for (int i = 0; i < 20; ++i) hanging.push_back(std::async(std::launch::async, [&] { return postOne(); }));
  EXPECT_TRUE(server_->get("/api/wait?posts=20")["reached"].GetBool());
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(server_->http("/control/reset").status, 200);
  for (auto& response : hanging) EXPECT_EQ(response.get().error, CURLE_GOT_NOTHING);
}

TEST_F(ControlsTest, ARuleMayCloseTheConnection) {
  EXPECT_EQ(tell(R"({"path":"/events","close":true})").status, 200);
  EXPECT_EQ(postOne().error, CURLE_GOT_NOTHING);
  EXPECT_EQ(server_->get("/api/posts")["posts"][0]["answered"].GetInt(), 0);
}

TEST_F(ControlsTest, ARuleThatMakesNoSenseIsRefused) {
  for (const char* rule :
       {"", "[]", "{}", R"({"path":"events"})", R"({"path":"/events","status":42})",
        R"({"path":"/events","unknown":1})", R"({"path":"/events","headers":{"a":"b\r\nc: d"}})"}) {
    const Response response = tell(rule);
    EXPECT_EQ(response.status, 400) << rule;
    EXPECT_FALSE(response.body.empty());
  }
  EXPECT_EQ(server_->get("/control/reply")["rules"].Size(), 0U);
}

TEST_F(ControlsTest, ClearingForgetsEverything) {
  EXPECT_EQ(postOne().status, 200);
  Call call;
  call.method = "PUT";
  EXPECT_EQ(server_->http("/control/clear", call).status, 200);
  EXPECT_EQ(server_->get("/api/totals")["posts"].GetInt(), 0);
  EXPECT_EQ(server_->get("/api/events")["total"].GetInt(), 0);
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(server_->get("/api/totals")["events"].GetInt(), 1);
}

TEST_F(ControlsTest, WaitAnswersWhenTheEventsAreThere) {
  auto waiting =
      std::async(std::launch::async, [&] { return server_->get("/api/wait?events=2&client=cam"); });
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(postOne().status, 200);
  const auto answer = waiting.get();
  EXPECT_TRUE(answer["reached"].GetBool());
  EXPECT_EQ(answer["events"].GetInt(), 2);
  const auto other = server_->get("/api/wait?events=1&client=other&timeout=0");
  EXPECT_FALSE(other["reached"].GetBool());
}

TEST_F(ControlsTest, HundredsOfWaitingConnectionsAreNoBurden) {
  std::vector<std::unique_ptr<Connection>> waiting;
  for (int i = 0; i < 400; ++i) {
    waiting.push_back(std::make_unique<Connection>(server_->httpPort()));
    waiting.back()->send("GET /api/wait?events=1&timeout=60 HTTP/1.1\r\nHost: localhost\r\n\r\n");
  }
  EXPECT_EQ(server_->http("/api/totals").status, 200);
  EXPECT_EQ(postOne().status, 200);
  for (const auto& connection : waiting) {
    EXPECT_NE(connection->receiveUntil("\"reached\":true").find("\"reached\":true"), std::string::npos);
  }
}

TEST_F(ControlsTest, TheStreamTellsEachPostAndFetchAsItComes) {
  Connection stream(server_->httpPort());
  stream.send("GET /api/stream HTTP/1.1\r\nHost: localhost\r\n\r\n");
  EXPECT_NE(stream.receiveUntil(": kytdevserver").find("text/event-stream"), std::string::npos);
  EXPECT_EQ(postOne().status, 200);
  const std::string first = stream.receiveUntil("\"fetches\":[]}");
  EXPECT_NE(first.find("event: commit\ndata: {"), std::string::npos) << first;
  EXPECT_NE(first.find(R"("record":{"_method":1,"_status":2})"), std::string::npos) << first;
  EXPECT_EQ(server_->https("/bags/tolvar/cadmor").status, 200);
  EXPECT_NE(stream.receiveUntil(R"("name":"cadmor")").find(R"("name":"cadmor")"), std::string::npos);
}

TEST_F(ControlsTest, CountsAreByClientByMethodAndByMinute) {
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(postOne().status, 200);
  EXPECT_EQ(server_->post("/events", message(R"({"_method":5})")).status, 200);
  const auto counts = server_->get("/api/counts");
  ASSERT_EQ(counts["byClient"].Size(), 2U);
  EXPECT_STREQ(counts["byClient"][0]["client"].GetString(), "cam");
  EXPECT_EQ(counts["byClient"][0]["events"].GetInt(), 2);
  ASSERT_EQ(counts["byMethod"].Size(), 2U);
  EXPECT_EQ(counts["byMethod"][0]["method"].GetInt(), 1);
  EXPECT_TRUE(counts["byMethod"][1]["status"].IsNull());
  int perMinute = 0;
  for (const auto& row : counts["perMinute"].GetArray()) {
    perMinute += row["events"].GetInt();
    EXPECT_EQ(row["minute"].GetInt64() % 60, 0);
  }
  EXPECT_EQ(perMinute, 3);
}

TEST_F(ControlsTest, QueriesThatMakeNoSenseAreRefused) {
  EXPECT_EQ(server_->http("/api/posts?since=x").status, 400);
  EXPECT_EQ(server_->http("/api/events?limit=-1").status, 400);
  EXPECT_EQ(server_->http("/api/events?method=1%20OR%201").status, 400);
  EXPECT_EQ(server_->http("/api/events?client='%20OR%201--").json()["total"].GetInt(), 0);
  EXPECT_EQ(server_->http("/api/wait?events=many").status, 400);
  EXPECT_EQ(server_->http("/api/posts/99").status, 404);
  EXPECT_EQ(server_->http("/api/posts/x").status, 404);
  EXPECT_EQ(server_->http("/api/nothing").status, 404);
  EXPECT_EQ(server_->http("/nothing").status, 404);
}

TEST_F(ControlsTest, OtherSitesMayNotAsk) {
  const auto statusWith = [&](const char* path, const std::string& header) {
    Call call;
    call.headers = {header};
    return server_->http(path, call).status;
  };
  const std::string port = std::to_string(server_->httpPort());
  EXPECT_EQ(statusWith("/api/posts", "Host: rebound.example:" + port), 403);
  EXPECT_EQ(statusWith("/api/posts", "Host: localhost:" + port), 200);
  EXPECT_EQ(statusWith("/api/posts", "Host: [::1]:" + port), 200);
  EXPECT_EQ(statusWith("/control/reset", "Sec-Fetch-Site: cross-site"), 403);
  EXPECT_EQ(statusWith("/control/reset", "Origin: http://evil.example"), 403);
  EXPECT_EQ(statusWith("/control/reset", "Origin: http://127.0.0.1:" + port), 200);
  EXPECT_EQ(statusWith("/", "Sec-Fetch-Site: none"), 200);
}

TEST_F(ControlsTest, TheDevicesPortHasNeitherPageNorQueries) {
  for (const char* path : {"/", "/api/posts", "/api/stream", "/control/reply"}) {
    EXPECT_EQ(server_->https(path).status, 404) << path;
  }
}

TEST_F(ControlsTest, TheServerEndsAtOnceWhileConnectionsWait) {
  Connection stream(server_->httpPort()), wait(server_->httpPort()), idle(server_->httpPort());
  stream.send("GET /api/stream HTTP/1.1\r\nHost: localhost\r\n\r\n");
  EXPECT_NE(stream.receiveUntil(": kytdevserver"), "");
  wait.send("GET /api/wait?events=9&timeout=600 HTTP/1.1\r\nHost: localhost\r\n\r\n");
  EXPECT_EQ(tell(R"({"path":"/events","hang":true})").status, 200);
  auto hanging = std::async(std::launch::async, [&] { return postOne(); });
  EXPECT_TRUE(server_->get("/api/wait?posts=1")["reached"].GetBool());
  EXPECT_EQ(server_->stop(), 0) << server_->errors();
  EXPECT_NE(hanging.get().error, CURLE_OPERATION_TIMEDOUT);
  stream.receiveUntil("the end");
  EXPECT_TRUE(stream.closedByPeer());
}

}  // namespace
}  // namespace kyt::devserver::test
