// Servers that answer anything at any moment, beside a good one: whatever they do, each request completes once, none is
// read twice by its server, each loss is counted, and nobody else's posts are lost or late.
#include <string>
#include <tuple>
#include <vector>

#include "tests/linux/url/HostilePeersFixture.h"
#include "tests/linux/url/RudeServer.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

std::string repeated(const std::string& text, size_t count) {
  std::string all;
  for (size_t i = 0; i < count; ++i) all += text;
  return all;
}

std::vector<std::string> rudeAnswers(const std::string& elsewhere) {
  const std::string ok = "HTTP/1.1 200 OK\r\n", chunked = ok + "Transfer-Encoding: chunked\r\n\r\n";
  std::vector<std::string> all{
      "",
      "H",
      "HTTP/1.1",
      "HTTP/1.1 ",
      "HTTP/1.1 2",
      ok,
      ok + "Content-Le",
      ok + "Content-Length: 2\r\n",
      ok + "Content-Length: 5\r\n\r\nab",
      ok + "Content-Length: 2\r\n\r\nokmore than was said",
      ok + "Content-Length: 2\r\n\r\nok" + ok + "Content-Length: 0\r\n\r\n",
      ok + "Content-Length: 0\r\n\r\nHTTP/1.1 503 No\r\nContent-Length: 0\r\n\r\n",
      ok + "Content-Length: 2\r\nContent-Length: 3\r\n\r\nok",
      ok + "Content-Length: -1\r\n\r\nok",
      ok + "Content-Length: 99999999999999999999999\r\n\r\nok",
      ok + "Content-Length: x\r\n\r\nok",
      ok + "Content-Length: 9223372036854775807\r\n\r\nok",
      ok + "Content-Length: 2\r\nTransfer-Encoding: chunked\r\n\r\n2\r\nok\r\n0\r\n\r\n",
      chunked + "zz\r\nok\r\n0\r\n\r\n",
      chunked + "FFFFFFFFFFFFFFFFFF\r\nok",
      chunked + "-1\r\nok\r\n",
      chunked + "2\r\nokay\r\n0\r\n\r\n",
      chunked + "2\r\nok\r\n",
      chunked + "7fffffffffffffff\r\nok",
      chunked + "2;" + std::string(100000, 'x') + "\r\nok\r\n0\r\n\r\n",
      chunked + "0\r\n" + repeated("X-Trailer: x\r\n", 50000) + "\r\n",
      ok + "Transfer-Encoding: gzip, chunked\r\n\r\nnonsense",
      ok + "Content-Encoding: gzip\r\n\r\nnonsense",
      "HTTP/1.1 100 Continue\r\n\r\n",
      repeated("HTTP/1.1 100 Continue\r\n\r\n", 50000),
      "HTTP/1.1 100 Continue\r\n\r\n" + ok + "Content-Length: 0\r\n\r\n",
      repeated("HTTP/1.1 103 Early Hints\r\nLink: x\r\n\r\n", 3000) + ok + "Content-Length: 0\r\n\r\n",
      "HTTP/1.1 101 Switching Protocols\r\nUpgrade: h2c\r\nConnection: Upgrade\r\n\r\nnonsense",
      "HTTP/1.1 199 \r\n\r\n",
      ok + "X: " + std::string(300000, 'x') + "\r\n\r\n",
      ok + repeated("X: y\r\n", 100000),
      ok + std::string("X: a\0b\r\nContent-Length: 0\r\n\r\n", 30),
      ok + "no colon\r\n: no name\r\n folded\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 200 OK\n\n",
      "\r\n\r\n\r\n",
      "HTTP/1.1 99999 x\r\n\r\n",
      "HTTP/9.9 200 OK\r\n\r\n",
      "HTTP/1.1 -1 x\r\n\r\n",
      "HTTP/1.1 000 x\r\n\r\n",
      "HTTP/2 200\r\n\r\n",
      "HTTP/1.0 200 OK\r\n\r\nuntil the end",
      "ICY 200 OK\r\n\r\n",
      "nonsense\r\n\r\n",
      std::string(70000, '\0'),
      "PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n",
      "\x15\x03\x01\x00\x02\x02\x28",
      "HTTP/1.1 408 Request Timeout\r\nConnection: close\r\n\r\n",
      "HTTP/1.1 417 Expectation Failed\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 421 Misdirected Request\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 425 Too Early\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 401 No\r\nWWW-Authenticate: Negotiate\r\nWWW-Authenticate: NTLM\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 407 No\r\nProxy-Authenticate: Basic\r\nContent-Length: 0\r\n\r\n",
      ok + "Connection: close\r\nContent-Length: 0\r\n\r\n",
      ok + "Keep-Alive: timeout=0\r\nContent-Length: 0\r\n\r\n",
      ok + "Alt-Svc: h2=\"" + elsewhere.substr(7) + "\"\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 503 No\r\nRetry-After: 0\r\nContent-Length: 0\r\n\r\n",
      "HTTP/1.1 503 No\r\nContent-Length: 9\r\n\r\nab"};
  for (const char* status : {"300", "301", "302", "303", "305", "307", "308", "399"})
    all.push_back("HTTP/1.1 " + std::string(status) + " Go\r\nLocation: " + elsewhere +
                  "\r\nContent-Length: 0\r\n\r\n");
  return all;
}

class HostileAnswers : public HostilePeers,
                       public testing::WithParamInterface<std::tuple<RudeServer::When, bool>> {
 protected:
  struct Attack {
    std::string name;
    std::unique_ptr<RudeServer> server;
    Visit visit;
  };
  Attack prepare(size_t number, RudeServer::Manner manner) {
    Attack attack;
    attack.name =
        "answer " + std::to_string(number) + ", then " + std::to_string(static_cast<int>(manner.then));
    attack.server = std::make_unique<RudeServer>(std::move(manner));
    attack.visit.session = session(true);
    return attack;
  }
  void perform(std::vector<Attack>& attacks) {
    for (int round = 0; round < 2; ++round) {
      for (Attack& one : attacks) begin(one.visit, one.server->url());
      for (Attack& one : attacks) {
        SCOPED_TRACE(one.name);
        ASSERT_TRUE(one.visit.outcomes.back().wait(60s));
      }
    }
    for (Attack& one : attacks) {
      SCOPED_TRACE(one.name);
      waitFor(one.visit);
      for (const std::string& text : one.visit.texts) EXPECT_LE(one.server->times(text), 1u) << text;
    }
  }
};

INSTANTIATE_TEST_SUITE_P(Moments, HostileAnswers,
                         testing::Combine(testing::Values(RudeServer::When::atOnce,
                                                          RudeServer::When::afterSome,
                                                          RudeServer::When::afterAll),
                                          testing::Bool()));

// With the second of the parameters the first request of each connection is answered well.
TEST_P(HostileAnswers, WhateverTheyAreNothingIsReadTwiceAndNobodyElseIsHurt) {
  using Then = RudeServer::Then;
  TestHTTPServer good, elsewhere;
  Bystander bystander(session(true), good.url("/"));
  const std::vector<std::string> answers = rudeAnswers(elsewhere.url("/"));
  const auto [when, firstIsGood] = GetParam();
  std::vector<Attack> attacks;
  for (const Then then : {Then::close, Then::reset, Then::stay, Then::begAgain})
    for (size_t i = 0; i < answers.size(); ++i)
      attacks.push_back(prepare(i, {when, then, answers[i], firstIsGood}));
  perform(attacks);
  bystander.expectNoHarm();
  EXPECT_EQ(elsewhere.connectionsAccepted(), 0u);
  EXPECT_EQ(factory().figures().failed, failed_);
}

TEST_F(HostilePeers, AHandshakeThatGoesWrongInAnyWayCostsItsOwnPostsAlone) {
  TestHTTPServer good;
  Bystander bystander(session(true), good.url("/"));
  std::vector<std::unique_ptr<RudeServer>> servers;
  std::vector<std::unique_ptr<Visit>> visits;
  const std::string record("\x16\x03\x03\x00\x7a\x02\x00\x00\x76\x03\x03", 11);
  for (const std::string& says :
       {std::string(), std::string("\x16"), record, record + std::string(111, 'x'),
        std::string("\x15\x03\x03\0\2\2\x28", 7), std::string("\x15\x03\x03\0\2\1\0", 7),
        repeated(std::string("\x15\x03\x03\0\2\1\x5a", 7), 1000), std::string("HTTP/1.1 400 No TLS\r\n\r\n"),
        std::string(100000, '\x17'), repeated(std::string("\x14\x03\x03\0\1\1", 6), 1000)})
    for (const auto when : {RudeServer::When::atOnce, RudeServer::When::afterSome})
      for (const auto then : {RudeServer::Then::close, RudeServer::Then::reset, RudeServer::Then::stay,
                              RudeServer::Then::begAgain}) {
        servers.push_back(std::make_unique<RudeServer>(RudeServer::Manner{when, then, says}));
        visits.push_back(std::make_unique<Visit>());
        visits.back()->session = session(true);
        for (int i = 0; i < 3; ++i) begin(*visits.back(), servers.back()->url("https"));
      }
  for (const auto& visit : visits) {
    waitFor(*visit);
    for (const Outcome& outcome : visit->outcomes) EXPECT_NE(outcome.errorCode(), 0);
  }
  bystander.expectNoHarm();
  EXPECT_EQ(factory().figures().failed, failed_);
}

}  // namespace
}  // namespace kyt
