// The same over HTTP/2, where requests share a connection: frames that are forbidden, too many, at the wrong moment or in
// the wrong order.
#include <functional>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "tests/linux/url/HostilePeersFixture.h"
#include "tests/support/TestHTTP2Server.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Connection = TestHTTP2Server::Connection;
using Request = TestHTTP2Server::Request;

using Deed = std::function<void(Connection&, uint32_t stream)>;

std::vector<std::pair<std::string, Deed>> deeds() {
  using S = TestHTTP2Server;
  const auto word = [](uint32_t v) {
    return std::string{char(v >> 24), char(v >> 16), char(v >> 8), char(v)};
  };
  std::vector<std::pair<std::string, Deed>> all{{"nothing", [](Connection&, uint32_t) {}}};
  for (const uint32_t last : {0u, 1u, 3u, 5u, 0x7fffffffu})
    for (const uint32_t code : {0u, 1u, 11u})
      all.push_back({"goaway " + std::to_string(last) + " " + std::to_string(code),
                     [=](Connection& c, uint32_t) { c.goAway(last, code); }});
  for (const uint32_t code : {0u, 1u, 2u, 5u, 7u, 8u, 13u, 0xffffffffu})
    all.push_back(
        {"reset " + std::to_string(code), [=](Connection& c, uint32_t s) { c.resetStream(s, code); }});
  for (const uint32_t code : {7u, 8u}) {
    all.push_back({"reset the one before " + std::to_string(code), [=](Connection& c, uint32_t s) {
                     if (s > 1) c.resetStream(s - 2, code);
                   }});
    all.push_back({"reset the next " + std::to_string(code),
                   [=](Connection& c, uint32_t s) { c.resetStream(s + 2, code); }});
    all.push_back(
        {"reset none " + std::to_string(code), [=](Connection& c, uint32_t) { c.resetStream(0, code); }});
  }
  for (const uint32_t count : {0u, 1u, 0xffffffffu})
    all.push_back(
        {"streams " + std::to_string(count), [=](Connection& c, uint32_t) { c.allowStreams(count); }});
  all.push_back({"no window", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\4", 2) + word(0));
                 }});
  all.push_back({"window too large", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\4", 2) + word(0x80000000));
                 }});
  all.push_back({"tiny frames", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\5", 2) + word(1));
                 }});
  all.push_back({"no table", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\1", 2) + word(0));
                 }});
  all.push_back({"huge table", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\1", 2) + word(0xffffffff));
                 }});
  all.push_back({"push", [=](Connection& c, uint32_t) {
                   c.frame(S::kSettings, 0, 0, std::string("\0\2", 2) + word(1));
                 }});
  all.push_back(
      {"settings of odd size", [=](Connection& c, uint32_t) { c.frame(S::kSettings, 0, 0, "12345"); }});
  all.push_back(
      {"settings of a stream", [=](Connection& c, uint32_t s) { c.frame(S::kSettings, 0, s, ""); }});
  all.push_back({"settings flood", [=](Connection& c, uint32_t) {
                   for (int i = 0; i < 20000; ++i) c.allowStreams(100);
                 }});
  all.push_back({"acknowledgement flood", [=](Connection& c, uint32_t) {
                   for (int i = 0; i < 2000; ++i) c.frame(S::kSettings, 1, 0, "");
                 }});
  all.push_back({"ping flood", [=](Connection& c, uint32_t) {
                   for (int i = 0; i < 20000; ++i) c.frame(S::kPing, 0, 0, "12345678");
                 }});
  all.push_back({"ping of odd size", [=](Connection& c, uint32_t) { c.frame(S::kPing, 0, 0, "123"); }});
  all.push_back({"window overflow", [=](Connection& c, uint32_t) {
                   for (int i = 0; i < 2; ++i) c.frame(S::kWindow, 0, 0, word(0x7fffffff));
                 }});
  all.push_back({"stream window overflow", [=](Connection& c, uint32_t s) {
                   for (int i = 0; i < 2; ++i) c.frame(S::kWindow, 0, s, word(0x7fffffff));
                 }});
  all.push_back(
      {"window of nothing", [=](Connection& c, uint32_t s) { c.frame(S::kWindow, 0, s, word(0)); }});
  all.push_back({"data first", [=](Connection& c, uint32_t s) { c.frame(S::kData, 0, s, "data"); }});
  all.push_back({"data of none", [=](Connection& c, uint32_t) { c.frame(S::kData, 0, 0, "data"); }});
  all.push_back(
      {"data of an idle one", [=](Connection& c, uint32_t s) { c.frame(S::kData, 0, s + 100, "data"); }});
  all.push_back({"data of an even one", [=](Connection& c, uint32_t) { c.frame(S::kData, 0, 2, "data"); }});
  all.push_back({"empty data flood", [=](Connection& c, uint32_t s) {
                   c.headers(s, 200, false);
                   for (int i = 0; i < 20000; ++i) c.frame(S::kData, 0, s, "");
                 }});
  all.push_back({"headers alone", [=](Connection& c, uint32_t s) { c.headers(s, 200, false); }});
  all.push_back({"headers twice", [=](Connection& c, uint32_t s) {
                   c.headers(s, 200, false);
                   c.headers(s, 200, false);
                 }});
  all.push_back({"answer and more", [=](Connection& c, uint32_t s) {
                   c.answer(s);
                   c.frame(S::kData, 1, s, "more");
                   c.answer(s);
                 }});
  all.push_back({"answer and reset", [=](Connection& c, uint32_t s) {
                   c.answer(s);
                   c.resetStream(s, 0);
                 }});
  all.push_back({"half an answer and reset", [=](Connection& c, uint32_t s) {
                   c.headers(s, 200, false);
                   c.frame(S::kData, 0, s, "half");
                   c.resetStream(s, 8);
                 }});
  all.push_back({"503 and reset", [=](Connection& c, uint32_t s) {
                   c.headers(s, 503, false);
                   c.resetStream(s, 7);
                 }});
  all.push_back({"early hints flood", [=](Connection& c, uint32_t s) {
                   for (int i = 0; i < 20000; ++i) c.headers(s, 103, false);
                 }});
  all.push_back({"status 100 that ends", [=](Connection& c, uint32_t s) { c.headers(s, 100, true); }});
  all.push_back({"status 101", [=](Connection& c, uint32_t s) {
                   c.headers(s, 101, false);
                   c.answer(s);
                 }});
  all.push_back({"status 0", [=](Connection& c, uint32_t s) { c.headers(s, 1000, true); }});
  all.push_back({"no status", [=](Connection& c, uint32_t s) { c.frame(S::kHeaders, 5, s, ""); }});
  all.push_back({"garbled headers",
                 [=](Connection& c, uint32_t s) { c.frame(S::kHeaders, 5, s, "\xff\xff\xff\xff\xff\xff"); }});
  all.push_back(
      {"headers of an idle one", [=](Connection& c, uint32_t s) { c.headers(s + 100, 200, true); }});
  all.push_back({"unfinished headers", [=](Connection& c, uint32_t s) {
                   c.frame(S::kHeaders, 0, s, "\x88");
                   c.frame(S::kPing, 0, 0, "12345678");
                 }});
  all.push_back({"headers without end", [=](Connection& c, uint32_t s) {
                   c.frame(S::kHeaders, 0, s, "\x88");
                   for (int i = 0; i < 300; ++i)
                     c.frame(9, 0, s, std::string("\0\1x", 3) + "\x7f\x81\x07" + std::string(256, 'v'));
                 }});
  all.push_back({"two lengths", [=](Connection& c, uint32_t s) {
                   c.frame(S::kHeaders, 4, s, std::string("\x88\x0f\x0d\x01") + "1" + "\x0f\x0d\x01" + "2");
                   c.frame(S::kData, 1, s, "1");
                 }});
  all.push_back({"a length too long", [=](Connection& c, uint32_t s) {
                   c.frame(S::kHeaders, 4, s, std::string("\x88\x0f\x0d\x01") + "9");
                   c.frame(S::kData, 1, s, "1");
                 }});
  all.push_back({"promise", [=](Connection& c, uint32_t s) {
                   c.frame(5, 4, s, word(2) + "\x82\x86\x84");
                   c.headers(2, 200, true);
                 }});
  all.push_back({"unknown frames", [=](Connection& c, uint32_t s) {
                   for (int i = 0; i < 2000; ++i) c.frame(0xee, 0xff, s, "unknown");
                 }});
  all.push_back({"a frame too large",
                 [=](Connection& c, uint32_t s) { c.write(std::string("\xff\xff\xff\0\0", 5) + word(s)); }});
  all.push_back({"half a frame", [=](Connection& c, uint32_t) { c.write(std::string("\0\0", 2)); }});
  all.push_back({"no frames", [=](Connection& c, uint32_t) { c.write("HTTP/1.1 400 Bad\r\n\r\n"); }});
  all.push_back({"priority of itself", [=](Connection& c, uint32_t s) { c.frame(2, 0, s, word(s) + "\1"); }});
  all.push_back({"padding too large", [=](Connection& c, uint32_t s) {
                   c.headers(s, 200, false);
                   c.frame(S::kData, 9, s,
                           "\xff"
                           "data");
                 }});
  return all;
}

enum When { kAtOnce, kAtHeaders, kAtEnd, kAtThird };
enum Then { kAnswer, kEnd, kReset, kAnswerAndEnd, kAnswerOthers };

class HostileHTTP2Peers : public HostilePeers, public testing::WithParamInterface<std::tuple<When, Then>> {
 protected:
  struct Attack {
    std::string name;
    std::unique_ptr<TestHTTP2Server> server;
    Visit visit;
  };
  Attack prepare(const std::string& name, const Deed& deed) {
    const When when = std::get<When>(GetParam());
    const Then then = std::get<Then>(GetParam());
    Attack attack;
    attack.name = name;
    const Deed finish = [=](Connection& connection, uint32_t stream) {
      if ((then == kAnswer || then == kAnswerAndEnd) && stream != 0) connection.answer(stream);
      if (then == kEnd || then == kAnswerAndEnd) connection.end();
      if (then == kReset) connection.reset();
    };
    const auto act = [=](Connection& connection, const Request& request) {
      deed(connection, request.stream);
      finish(connection, request.stream);
    };
    TestHTTP2Server::Options options;
    options.certificate = certificate_;
    if (when == kAtOnce)
      options.greet = [=](Connection& connection) {
        connection.allowStreams(100);
        deed(connection, 1);
        finish(connection, 0);
        return true;
      };
    attack.server = std::make_unique<TestHTTP2Server>(std::move(options));
    if (when == kAtHeaders) attack.server->setHandler([](Connection&, const Request&) {}, act);
    if (when == kAtEnd) attack.server->setHandler(act);
    if (when == kAtThird)
      attack.server->setHandler([=](Connection& connection, const Request& request) {
        if (request.stream == 5) return act(connection, request);
        if (then != kAnswerOthers || request.stream > 5) connection.answer(request.stream);
      });
    attack.visit.session = session(true);
    return attack;
  }
  // Four at once, and one more when those have ended.
  void perform(std::vector<Attack>& attacks) {
    for (int round = 0; round < 2; ++round) {
      for (Attack& one : attacks)
        for (int i = round == 0 ? 4 : 1; i > 0; --i) begin(one.visit, one.server->url());
      for (Attack& one : attacks) {
        SCOPED_TRACE(one.name);
        for (const Outcome& outcome : one.visit.outcomes) ASSERT_TRUE(outcome.wait(60s));
      }
    }
    for (Attack& one : attacks) {
      SCOPED_TRACE(one.name);
      waitFor(one.visit);
      for (const std::string& text : one.visit.texts) EXPECT_LE(one.server->times(text), 1u) << text;
    }
  }
  const TestCertificate certificate_ = authority_.issue();
};

INSTANTIATE_TEST_SUITE_P(Moments, HostileHTTP2Peers,
                         testing::Combine(testing::Values(kAtOnce, kAtHeaders, kAtEnd, kAtThird),
                                          testing::Values(kAnswer, kEnd, kReset, kAnswerAndEnd,
                                                          kAnswerOthers)));

TEST_P(HostileHTTP2Peers, WhateverOneDoesNothingIsReadTwiceAndNobodyElseIsHurt) {
  TestHTTPServer good;
  Bystander bystander(session(true), good.url("/"));
  std::vector<Attack> attacks;
  for (const auto& [name, deed] : deeds()) attacks.push_back(prepare(name, deed));
  perform(attacks);
  if (std::get<Then>(GetParam()) == kAnswer)
    for (const Outcome& outcome : attacks[0].visit.outcomes) {
      EXPECT_EQ(outcome.status(), 200) << outcome.errorText() << ": nothing was done to it";
    }
  bystander.expectNoHarm();
  EXPECT_EQ(factory().figures().failed, failed_);
}

}  // namespace
}  // namespace kyt
