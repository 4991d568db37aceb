// The message and its request by themselves, without a back end, and on a thread that is nobody's queue.
#include "backends/https/PostRequest.h"

#include <gtest/gtest.h>

#include <thread>

#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class PostRequestTest : public testing::Test {
 protected:
  PostRequestTest() {
    SessionFacts session;
    session.compType = 6;
    session.clientVersion = 3;
    session.hardwareType = String("Phone9,1");
    session.setSelfVersion("8.1.2");
    facts_.session = std::make_shared<SessionFacts>(session);
    facts_.clientID = String("an identifier");
    platform_.clock.setTimeOfDay({1000000130, 250000});
  }
  PostRequest post() { return {platform_.configuration, facts_}; }
  PostRequest::Message message(Array records) { return post().message(std::move(records)); }
  URLRequest request(std::string json = "{}", const std::optional<EventMap>& eventMap = std::nullopt) {
    return post().request("https://post.example.org/events?k", std::move(json), eventMap);
  }
  static std::optional<std::string> header(const URLRequest& request, std::string_view name) {
    for (const auto& [key, value] : request.headers)
      if (key == name) return value;
    return std::nullopt;
  }

  TestPlatform platform_;
  PostFacts facts_;
};

TEST_F(PostRequestTest, AMessageHasItsTimeItsClientAndItsRecords) {
  const PostRequest::Message made = message(Array{Dictionary{{"k", 1}}, Dictionary{{"k", 2}}});
  EXPECT_EQ(made.json, R"({"postTime":1000000130.25,"clientId":"an identifier","events":[{"k":1},{"k":2}]})");
  EXPECT_EQ(made.events, 2u);
}

// So that no TLS ticket links what its message does not.
TEST_F(PostRequestTest, ARequestHasTheIdentityThatItsMessageNames) {
  EXPECT_EQ(request().identity, "an identifier");
  facts_.clientID = String("another");
  EXPECT_EQ(request().identity, "another");
  facts_.clientID = std::nullopt;
  EXPECT_EQ(request().identity, "");
}

TEST_F(PostRequestTest, WithoutAClientIDTheMessageCarriesNoRecords) {
  facts_.clientID = std::nullopt;
  const PostRequest::Message made = message(Array{Dictionary{{"k", 1}}, Dictionary{{"k", 2}}});
  EXPECT_EQ(made.json, R"({"postTime":1000000130.25})");
  EXPECT_EQ(made.events, 0u);
}

TEST_F(PostRequestTest, WhatCannotBePostedLeavesTheRecord) {
  const Array records{Dictionary{{"list", Array{1}}, {"date", Date{5.5}}, {"k", 1}}};
  EXPECT_NE(message(records).json.find(R"([{"date":5.5,"k":1}])"), std::string::npos);
  EXPECT_EQ(platform_.counters.value(Reason::valueNotPostable), 1u);
  EXPECT_TRUE(records[0].dictionary()->contains("list")) << "the caller's own are left alone";
}

TEST_F(PostRequestTest, AMessageMayBeShownByConsentAndByASettingInSomeEnvironments) {
  EXPECT_FALSE(post().mayBeShown());
  facts_.settingShowsText = true;  // in environments that are no user's
  EXPECT_FALSE(post().mayBeShown());
  facts_.consentShowsText = true;
  EXPECT_TRUE(post().mayBeShown());
}

TEST_F(PostRequestTest, ThePrettyTextIsThatOfTheWriter) {
  const PostRequest::Message made =
      message(Array{Dictionary{{"text", "a\n\"b\" \\ {[,:"}, {"number", -1.5}, {"empty", ""}}, Dictionary()});
  std::string pretty;
  platform_.json.writePretty(std::get<Value>(platform_.json.parse(made.json)), pretty);
  EXPECT_EQ(PostRequest::prettyText(made.json), Value(pretty));
}

TEST_F(PostRequestTest, AMessageKnowsTheSizeOfItsPrettyText) {
  for (const Array& records : {Array{}, Array{Dictionary()}, Array{Dictionary{{"k", 1}}, Dictionary()},
                               Array{Dictionary{{"list", Array{1}}, {"date", Date{5.5}}, {"text", "a\n\"{,"}},
                                     Dictionary{{"a", true}, {"b", -1.5}}}}) {
    facts_.clientID = String("an identifier");
    const PostRequest::Message made = message(records);
    EXPECT_EQ(made.prettySize, PostRequest::prettyText(made.json).string()->size()) << made.json;
    facts_.clientID = std::nullopt;
    const PostRequest::Message empty = message(records);
    EXPECT_EQ(empty.prettySize, PostRequest::prettyText(empty.json).string()->size()) << empty.json;
  }
}

TEST_F(PostRequestTest, TheHeadersSayWhoSends) {
  facts_.clientName = String("a");
  facts_.serviceName = String("b");
  facts_.digestKey = Data(std::string_view("key"));
  const URLRequest made = request("{}", EventMap{5, 2});
  EXPECT_EQ(made.method, "POST");
  EXPECT_EQ(made.url, "https://post.example.org/events?k");
  EXPECT_EQ(header(made, "X-KYT-Client-Name"), "a");
  EXPECT_EQ(header(made, "X-KYT-Service-Name"), "b");
  EXPECT_EQ(header(made, "X-KYT-Client-Version"), "3");
  EXPECT_EQ(header(made, "X-KYT-Sender"), "QG");
  EXPECT_EQ(header(made, "X-KYT-Event-Map"), "5 2");
  EXPECT_EQ(header(made, "User-Agent"), "KYTReporting/8.1.2 (Phone9,1; (null))");
  EXPECT_TRUE(header(made, "X-KYT-DIGEST"));
  facts_.digestAlgorithm = 1;
  EXPECT_FALSE(header(request(), "X-KYT-DIGEST"));
  EXPECT_FALSE(header(request(), "X-KYT-Event-Map"));
}

TEST_F(PostRequestTest, ABodyIsCompressedWhereThatIsShorter) {
  const URLRequest shorter = request(std::string(1000, 'x'));
  EXPECT_EQ(header(shorter, "Content-Encoding"), "gzip");
  EXPECT_LT(shorter.body.size(), 1000u);
  const URLRequest longer = request("{}");
  EXPECT_FALSE(header(longer, "Content-Encoding"));
  EXPECT_EQ(longer.body.view(), "{}");
}

TEST_F(PostRequestTest, UserDevicesPostOverHTTPSAlone) {
  EXPECT_EQ(post().request("http://h/x", "{}", std::nullopt).url, "https://h/x");
  TestPlatform internal;
  internal.deviceProperties.setProperty("ReleaseType", "Internal");
  EXPECT_EQ(PostRequest(internal.configuration, facts_).request("http://h/x", "{}", std::nullopt).url,
            "http://h/x");
}

TEST_F(PostRequestTest, CellularAccessAndAccountAreOfTheFacts) {
  EXPECT_TRUE(request().allowsCellularAccess);
  facts_.shouldUseWiFiOnly = true;
  facts_.account = platform_.budget.account(1000);
  EXPECT_FALSE(request().allowsCellularAccess);
  EXPECT_EQ(request().account, facts_.account);
}

// Nothing is shared with whoever asked: the facts and the records are the request's own.
TEST_F(PostRequestTest, IsMadeOnAnyThreadAfterItsBackEndHasGone) {
  auto request = std::make_unique<PostRequest>(post());
  Array records{Dictionary{{"k", 1}}};
  facts_ = {};
  std::string json;
  std::thread other([&, request = std::move(request), records = std::move(records)]() mutable {
    json = request->message(std::move(records)).json;
  });
  other.join();
  EXPECT_NE(json.find(R"("clientId":"an identifier","events":[{"k":1}])"), std::string::npos);
}

}  // namespace
}  // namespace kyt
