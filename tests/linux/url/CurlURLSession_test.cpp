#include <curl/curl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <set>
#include <system_error>

#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/base/UserBudget.h"
#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Behaviour = TestHTTPServer::Behaviour;

class CurlURLSession : public CurlURLSessionFixture {
 protected:
  TestHTTPServer server_;
};

TestHTTPServer::Reply reply(Behaviour behaviour, std::string body = {}) {
  TestHTTPServer::Reply made;
  made.behaviour = behaviour;
  made.body = std::move(body);
  return made;
}

TEST_F(CurlURLSession, DeliversStatusHeadersAndBody) {
  server_.setReply({.status = 203, .headers = {{"X-One", "1"}, {"x-two", " 2 "}}, .body = "hello"});
  auto urls = session();
  const Outcome outcome = perform(*urls, get(server_.url("/bag?version=8.0")));
  EXPECT_EQ(outcome.status(), 203);
  EXPECT_EQ(outcome.body(), "hello");
  EXPECT_EQ(outcome.response()->header("x-one"), "1");
  EXPECT_EQ(outcome.response()->header("X-Two"), "2");
  EXPECT_FALSE(outcome.error());
  EXPECT_EQ(server_.requests()[0].method, "GET");
  EXPECT_EQ(server_.requests()[0].target, "/bag?version=8.0");
  const URLFigures figures = factory().figures();
  EXPECT_EQ(figures.started, 1u);
  EXPECT_EQ(figures.completed, 1u);
  EXPECT_EQ(figures.failed, 0u);
}

TEST_F(CurlURLSession, WithoutItsLibraryEveryRequestFailsAndTheLogSaysWhyOnce) {
  options_.library = "libkytnosuch.so.4";
  auto urls = session();
  for (int i = 0; i < 2; ++i) {
    const Outcome outcome = perform(*urls, get(server_.url("/")));
    EXPECT_EQ(outcome.errorCode(), CURLE_FAILED_INIT);
    EXPECT_EQ(outcome.errorText(), "The HTTP library cannot be loaded");
  }
  EXPECT_EQ(factory().figures().failed, 2u);
  EXPECT_EQ(server_.requests().size(), 0u);
  factory_.reset();
  EXPECT_EQ(sink_.count("libkytnosuch.so.4"), 1u);
}

TEST_F(CurlURLSession, SendsTheHeadersGivenInTheirOrderAndNoOthersOfItsOwn) {
  auto urls = session();
  URLRequest request = post(server_.url("/events"), "{\"a\":1}");
  request.headers = {{"X-KYT-Client-Name", "n"},     {"User-Agent", "KYTReporting/8.0 (x; y)"},
                     {"Accept", "application/json"}, {"Content-Type", "application/json"},
                     {"Content-Length", "7"},        {"X-Empty", ""}};
  EXPECT_EQ(perform(*urls, std::move(request)).status(), 200);
  EXPECT_EQ(
      server_.requests()[0].raw,
      "POST /events HTTP/1.1\r\nHost: 127.0.0.1:" + std::to_string(server_.port()) +
          "\r\nX-KYT-Client-Name: n\r\nUser-Agent: KYTReporting/8.0 (x; y)\r\nAccept: application/json\r\n"
          "Content-Type: application/json\r\nContent-Length: 7\r\nX-Empty:\r\n"
          "X-KYT-Source-Application: com.vantu.system.diagnostics\r\n\r\n{\"a\":1}");
}

TEST_F(CurlURLSession, SendsNoSourceApplicationWhenNoneIsConfiguredAndCountsTheBodyItself) {
  auto urls = session(false, "");
  EXPECT_EQ(perform(*urls, post(server_.url("/"), "abc")).status(), 200);
  EXPECT_EQ(server_.requests()[0].raw,
            "POST / HTTP/1.1\r\nHost: 127.0.0.1:" + std::to_string(server_.port()) +
                "\r\nContent-Length: 3\r\n\r\nabc");
}

TEST_F(CurlURLSession, RemovesControlCharactersFromHeaders) {
  auto urls = session(false, "");
  URLRequest request = get(server_.url("/"));
  request.headers = {{"X-A\r\nX-B", "one\r\nX-C: two\x7f\tthree"}};
  EXPECT_EQ(perform(*urls, std::move(request)).status(), 200);
  EXPECT_EQ(server_.requests()[0].header("X-AX-B"), "oneX-C: twothree");
  EXPECT_EQ(server_.requests()[0].headers.size(), 2u);  // Host and this
}

TEST_F(CurlURLSession, PostsLargeBodiesWithoutAskingFirst) {
  auto urls = session();
  const std::string body(3u << 20, 'b');
  EXPECT_EQ(perform(*urls, post(server_.url("/"), body)).status(), 200);
  EXPECT_EQ(server_.requests()[0].body, body);
  EXPECT_EQ(server_.requests()[0].headerCount("Expect"), 0u);
  EXPECT_EQ(server_.requests()[0].headerCount("Content-Length"), 1u);
}

TEST_F(CurlURLSession, ReusesTheConnectionOfASession) {
  auto urls = session();
  for (int i = 0; i < 20; ++i) EXPECT_EQ(perform(*urls, post(server_.url("/"), "x")).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 1u);
}

TEST_F(CurlURLSession, SharesNoConnectionBetweenSessions) {
  auto one = session(), two = session();
  EXPECT_EQ(perform(*one, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(perform(*two, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 2u);
}

TEST_F(CurlURLSession, SharesNoConnectionBetweenRequestsThatMayUseCellularInterfacesAndThoseThatMayNot) {
  auto urls = session();
  URLRequest wifiOnly = get(server_.url("/"));
  wifiOnly.allowsCellularAccess = false;
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(perform(*urls, wifiOnly).status(), 200);
  EXPECT_EQ(perform(*urls, wifiOnly).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 2u);
}

TEST_F(CurlURLSession, ReplacesAConnectionThatTheServerClosed) {
  auto urls = session();
  EXPECT_EQ(perform(*urls, post(server_.url("/"), "x")).status(), 200);
  server_.closeConnections();
  ASSERT_TRUE(server_.waitForConnectionsOpen(0));
  EXPECT_EQ(perform(*urls, post(server_.url("/"), "y")).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 2u);
}

TEST_F(CurlURLSession, ClosesIdleConnections) {
  options_.idleConnectionTime = 200ms;
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_TRUE(server_.waitForConnectionsOpen(0));
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 2u);
}

TEST_F(CurlURLSession, ClosesTheLongestIdleConnectionsWhenTooManySessionsHaveSome) {
  options_.maxIdleConnections = 2;
  auto one = session(), two = session(), three = session();
  for (URLSession* urls : {one.get(), two.get(), three.get()})
    EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_TRUE(server_.waitForConnectionsOpen(2));
  EXPECT_EQ(server_.connectionsAccepted(), 3u);
  EXPECT_EQ(perform(*three, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(perform(*two, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 3u);
  EXPECT_EQ(perform(*one, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(server_.connectionsAccepted(), 4u);
  EXPECT_TRUE(server_.waitForConnectionsOpen(2));
}

TEST_F(CurlURLSession, ClosesAllSurplusConnectionsOfABurst) {
  options_.maxIdleConnections = 3;
  server_.setReply(reply(Behaviour::hold));
  std::vector<std::unique_ptr<URLSession>> many(20);
  for (auto& one : many) {
    one = session();
    one->start(get(server_.url("/")), nullptr);
  }
  ASSERT_TRUE(server_.waitForRequests(20));
  server_.release();
  EXPECT_TRUE(server_.waitForConnectionsOpen(3));
}

TEST_F(CurlURLSession, WithoutTLSItsRequestsWaitForNoConnectionUntilThereAreEight) {
  options_.connectionPatience = std::chrono::hours(1);  // what others wait before they make more
  server_.setReply(reply(Behaviour::hold));
  auto urls = session();
  std::vector<Outcome> outcomes(10);
  for (Outcome& outcome : outcomes) urls->start(post(server_.url("/"), "x"), outcome.completion());
  EXPECT_TRUE(server_.waitForRequests(8));
  EXPECT_EQ(server_.connectionsAccepted(), 8u);
  server_.release();
  for (Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200);
  }
  EXPECT_EQ(server_.connectionsAccepted(), 8u);
}

TEST_F(CurlURLSession, ClosesItsConnectionsWhenItIsInvalidated) {
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(server_.connectionsOpen(), 1u);
  urls->finishTasksAndInvalidate();
  EXPECT_TRUE(server_.waitForConnectionsOpen(0));
}

TEST_F(CurlURLSession, RunsCompletionsOnWorkersOfItsOwnOneAfterTheOther) {
  auto urls = session();
  std::mutex mutex;
  int running = 0, most = 0, done = 0;
  for (int i = 0; i < 50; ++i) {
    urls->start(get(server_.url("/")), [&](auto, auto, auto) {
      char name[16];
      pthread_getname_np(pthread_self(), name, sizeof name);
      EXPECT_EQ(std::string(name).substr(0, 7), "kyt-url");
      {
        std::lock_guard lock(mutex);
        most = std::max(most, ++running);
      }
      std::this_thread::yield();
      std::lock_guard lock(mutex);
      --running;
      ++done;
    });
  }
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
  EXPECT_EQ(most, 1);
  EXPECT_EQ(done, 50);
}

TEST_F(CurlURLSession, CountsRefusedRequestsAndSaysSoOnce) {
  server_.setReply(reply(Behaviour::hold));
  auto urls = session();
  const std::string half(Limits::maxOutstandingBytes / 2, 'x');
  Outcome kept[2], refused[2];
  for (Outcome& outcome : kept) urls->start(post(server_.url("/"), half), outcome.completion());
  for (Outcome& outcome : refused) {
    urls->start(post(server_.url("/"), "x"), outcome.completion());
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.errorCode(), kURLErrorOutstandingTooMuch);
  }
  EXPECT_EQ(counters_.value(Reason::outstandingBytesExceeded), 2u);
  EXPECT_EQ(sink_.count("CurlURLSession(start): more than 67108864 bytes of requests are outstanding"), 1u);
  EXPECT_EQ(factory().figures().failed, 2u);
  for (const Outcome& outcome : kept) EXPECT_FALSE(outcome.isDone());
}

// A server chooses the length of its replies, and a client may choose the server.
TEST_F(CurlURLSession, CountsARepliesBodyForItsUserUntilTheCompletionHasRun) {
  constexpr size_t kReply = 3u << 20;
  Limits limits;
  limits.maxBytesPerUser = 2 * kReply;
  UserBudget budget(UserShares::of(limits, 0, 0));
  TestHTTPServer::Reply large;
  large.body = std::string(kReply, 'r');
  server_.setReply(large);
  auto urls = session();
  const auto start = [&](uint32_t user, URLCompletion completion) {
    URLRequest request = post(server_.url("/"), "x");
    request.account = budget.account(user);
    urls->start(std::move(request), std::move(completion));
  };
  const auto account = budget.account(1);
  std::atomic<uint64_t> held{0};
  Outcome whole, brokenOff, ofAnother;
  start(1, [&, done = whole.completion()](std::optional<Data> data, std::optional<URLResponse> response,
                                          std::optional<Error> error) mutable {
    held = account->holds(Share::bytes);
    done(std::move(data), std::move(response), std::move(error));
  });
  ASSERT_TRUE(whole.wait());
  EXPECT_EQ(whole.body().size(), kReply) << whole.errorText();
  EXPECT_GE(held, kReply - Limits::freeBytes);
  EXPECT_TRUE(eventually([&] { return account->holdsNothing(); }));

  account->takeAnyway(Share::bytes, kReply);
  start(1, brokenOff.completion());
  start(2, ofAnother.completion());
  ASSERT_TRUE(brokenOff.wait() && ofAnother.wait());
  EXPECT_EQ(brokenOff.status(), 200) << "what the server has decided on counts";
  EXPECT_EQ(brokenOff.errorCode(), CURLE_FILESIZE_EXCEEDED);
  EXPECT_EQ(ofAnother.body().size(), kReply) << ofAnother.errorText();
  EXPECT_EQ(counters_.value(Reason::outstandingBytesExceeded), 1u);
  EXPECT_EQ(sink_.count("CurlURLSession(receiveBody): no room for a reply"), 1u);
  EXPECT_TRUE(eventually([&] { return account->holds(Share::bytes) == kReply; }));
}

// The signals that a thread of this process blocks, by its name; nothing when there is no such thread.
std::optional<uint64_t> signalsBlockedBy(const std::string& threadName) {
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream status(task.path() / "status");
    std::string name, blocked;
    for (std::string line; std::getline(status, line);) {
      if (line.starts_with("Name:\t")) name = line.substr(6);
      if (line.starts_with("SigBlk:\t")) blocked = line.substr(8);
    }
    if (name == threadName) return std::stoull(blocked, nullptr, 16);
  }
  return std::nullopt;
}

TEST_F(CurlURLSession, ItsThreadsLeaveSignalsToTheOthersButForFaults) {
  auto urls = session();
  const Outcome outcome = perform(*urls, get(server_.url("/")));
  for (const std::string& name : {std::string("kyt-network"), outcome.threadName()}) {
    SCOPED_TRACE(name);
    const std::optional<uint64_t> blocked = signalsBlockedBy(name);
    ASSERT_TRUE(blocked);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGUSR1, SIGCHLD, SIGPIPE})
      EXPECT_NE(*blocked & (uint64_t{1} << (signal - 1)), 0u) << signal;
    for (const int fault : {SIGSEGV, SIGBUS, SIGABRT})
      EXPECT_EQ(*blocked & (uint64_t{1} << (fault - 1)), 0u) << fault;
  }
}

TEST_F(CurlURLSession, TakesRequestsFromManyThreads) {
  factory();
  std::vector<std::thread> threads;
  std::atomic<int> good{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      auto urls = session();
      std::vector<Outcome> outcomes(50);
      for (Outcome& outcome : outcomes) urls->start(post(server_.url("/"), "x"), outcome.completion());
      for (Outcome& outcome : outcomes) good += outcome.wait() && outcome.status() == 200 ? 1 : 0;
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(good.load(), 200);
  EXPECT_LE(server_.connectionsAccepted(), 32u);
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
}

TEST_F(CurlURLSession, SendsARequestWithoutACompletion) {
  auto urls = session();
  urls->start(post(server_.url("/"), "fire"), nullptr);
  EXPECT_TRUE(server_.waitForRequests(1));
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
  EXPECT_EQ(factory().figures().completed, 1u);
}

// A system that refuses a thread for a while. Nobody else starts a request, so nobody else would try again.
TEST_F(CurlURLSession, ARequestThatFoundNoThreadIsSentAsSoonAsThereIsOne) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer takes more address space than any limit";
  auto urls = session();
  rlimit before{};
  ASSERT_EQ(getrlimit(RLIMIT_AS, &before), 0);
  std::thread relief([&] {
    EXPECT_TRUE(eventually([&] { return sink_.count("cannot start the network thread") > 0; }));
    setrlimit(RLIMIT_AS, &before);
  });
  URLRequest request = get(server_.url("/"));
  Outcome outcome;
  Semaphore over;
  std::vector<std::thread> others;  // take what stacks the library has kept
  others.reserve(64);
  size_t pages = 0;
  std::ifstream("/proc/self/statm") >> pages;
  rlimit tight = before;
  tight.rlim_cur = pages * static_cast<size_t>(getpagesize()) + (6u << 20);  // less than a thread's stack
  ASSERT_EQ(setrlimit(RLIMIT_AS, &tight), 0);
  try {
    while (others.size() < 64) others.emplace_back([&] { over.wait(); });
  } catch (const std::system_error&) {
  }
  urls->start(std::move(request), outcome.completion());
  relief.join();
  EXPECT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  for (size_t i = 0; i < others.size(); ++i) over.signal();
  for (std::thread& other : others) other.join();
}

TEST_F(CurlURLSession, RequestsOverTheMostAtOnceWaitInLine) {
  options_.maxActiveRequests = 2;
  server_.setReply(reply(Behaviour::hold));
  std::vector<std::unique_ptr<URLSession>> sessions(6);
  std::vector<std::shared_ptr<URLTask>> tasks;
  std::vector<Outcome> outcomes(6);
  for (size_t i = 0; i < 5; ++i) {
    sessions[i] = session();
    tasks.push_back(sessions[i]->start(get(server_.url("/" + std::to_string(i))), outcomes[i].completion()));
  }
  ASSERT_TRUE(server_.waitForRequests(2));
  tasks[2]->cancel();
  ASSERT_TRUE(outcomes[2].wait());
  EXPECT_EQ(outcomes[2].errorCode(), kURLErrorCancelled);
  // One that must end in time does not wait.
  sessions[5] = session();
  URLRequest urgent = get(server_.url("/urgent"));
  urgent.timeout = 60s;
  sessions[5]->start(std::move(urgent), outcomes[5].completion());
  ASSERT_TRUE(server_.waitForRequests(3));
  EXPECT_EQ(server_.requests()[2].target, "/urgent");
  EXPECT_TRUE(
      eventually([&] { return factory().outstanding() == 5; }));  // the cancelled one's completion is over
  server_.release();
  for (const size_t i : {0, 1, 3, 4, 5}) {
    ASSERT_TRUE(outcomes[i].wait()) << i;
    EXPECT_EQ(outcomes[i].status(), 200) << i;
  }
  EXPECT_EQ(server_.requestCount(), 5u);
}

TEST_F(CurlURLSession, AServerThatDoesNotAnswerLeavesRoomForTheOthers) {
  options_.maxActiveRequests = 3;
  options_.maxActiveRequestsToOneServer = 2;
  server_.setReply(reply(Behaviour::hold));
  TestHTTPServer other, third;
  third.setReply(reply(Behaviour::hold));
  std::vector<std::unique_ptr<URLSession>> sessions(9);
  for (auto& one : sessions) one = session();
  std::vector<Outcome> outcomes(9);
  for (size_t i = 0; i < 5; ++i) sessions[i]->start(get(server_.url("/")), outcomes[i].completion());
  ASSERT_TRUE(server_.waitForRequests(2));
  sessions[5]->start(get(other.url("/")), outcomes[5].completion());
  ASSERT_TRUE(outcomes[5].wait());
  EXPECT_EQ(outcomes[5].status(), 200);
  // All are taken; when one gets free, it is the turn of the server that has none.
  sessions[6]->start(get(third.url("/")), outcomes[6].completion());
  ASSERT_TRUE(third.waitForRequests(1));
  sessions[7]->start(get(third.url("/")), outcomes[7].completion());
  sessions[8]->start(get(other.url("/")), outcomes[8].completion());
  third.release();
  ASSERT_TRUE(outcomes[8].wait());
  EXPECT_EQ(outcomes[8].status(), 200);
  EXPECT_EQ(server_.requestCount(), 2u);
  server_.release();
  for (const size_t i : {0, 1, 2, 3, 4, 6, 7}) {
    ASSERT_TRUE(outcomes[i].wait()) << i;
    EXPECT_EQ(outcomes[i].status(), 200) << i;
  }
}

TEST_F(CurlURLSession, WhatWaitsInLineEndsWithTheShutDown) {
  options_.maxActiveRequests = 1;
  server_.setReply(reply(Behaviour::hold));
  auto one = session(), two = session();
  Outcome a, b;
  one->start(get(server_.url("/")), a.completion());
  ASSERT_TRUE(server_.waitForRequests(1));
  two->start(get(server_.url("/")), b.completion());
  two.reset();
  factory().cancelAll();
  ASSERT_TRUE(a.wait() && b.wait());
  EXPECT_EQ(b.errorCode(), kURLErrorCancelled);
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
}

TEST_F(CurlURLSession, CompletesARequestInFlightAfterItsSessionIsReleased) {
  server_.setReply(reply(Behaviour::hold, "late"));
  auto urls = session();
  Outcome outcome;
  urls->start(get(server_.url("/")), outcome.completion());
  ASSERT_TRUE(server_.waitForRequests(1));
  urls.reset();
  server_.release();
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.body(), "late");
  EXPECT_TRUE(server_.waitForConnectionsOpen(0));
}

TEST_F(CurlURLSession, RefusesRequestsAfterItsInvalidation) {
  auto urls = session();
  urls->finishTasksAndInvalidate();
  const Outcome outcome = perform(*urls, get(server_.url("/")));
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(outcome.error()->domain, "KYTURLErrorDomain");
  EXPECT_EQ(server_.requestCount(), 0u);
}

TEST_F(CurlURLSession, RefusesAddressesThatDoNotNameTheirScheme) {
  auto urls = session();
  const std::string address = "127.0.0.1:" + std::to_string(server_.port());
  for (const std::string& url :
       {address, "http:/" + address, "//" + address, "ftp://" + address, std::string()}) {
    const Outcome outcome = perform(*urls, get(url));
    EXPECT_EQ(outcome.errorCode(), CURLE_UNSUPPORTED_PROTOCOL) << url;
    EXPECT_EQ(outcome.errorText(), "The address begins neither with https:// nor with http://") << url;
  }
  EXPECT_EQ(perform(*urls, get("HTTP://" + address)).status(), 200);
  EXPECT_EQ(server_.requestCount(), 1u);
}

TEST_F(CurlURLSession, CancelsOneRequest) {
  server_.setReply(reply(Behaviour::hold));
  auto urls = session();
  Outcome outcome;
  const auto task = urls->start(get(server_.url("/")), outcome.completion());
  ASSERT_TRUE(server_.waitForRequests(1));
  task->cancel();
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  task->cancel();
  server_.setReply({});
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_EQ(outcome.calls(), 1);
}

TEST_F(CurlURLSession, CancelsEverythingAtShutDownAndStartsNothingAnyMore) {
  server_.setReply(reply(Behaviour::hold));
  auto one = session(), two = session();
  Outcome a, b;
  one->start(get(server_.url("/")), a.completion());
  two->start(get(server_.url("/")), b.completion());
  ASSERT_TRUE(server_.waitForRequests(2));
  factory().cancelAll();
  ASSERT_TRUE(a.wait() && b.wait());
  EXPECT_EQ(a.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(b.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(perform(*one, get(server_.url("/"))).errorCode(), kURLErrorCancelled);
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
  EXPECT_EQ(server_.requestCount(), 2u);
}

TEST_F(CurlURLSession, DeliversWhatIsOutstandingBeforeTheFactoryIsGone) {
  server_.setReply(reply(Behaviour::hold));
  auto urls = session();
  Outcome outcome;
  urls->start(get(server_.url("/")), outcome.completion());
  ASSERT_TRUE(server_.waitForRequests(1));
  factory_.reset();
  EXPECT_TRUE(outcome.isDone());
  EXPECT_EQ(outcome.errorCode(), kURLErrorCancelled);
  EXPECT_NE(urls->start(get(server_.url("/")), nullptr), nullptr);  // outlives it, starts nothing
  EXPECT_EQ(server_.requestCount(), 1u);
}

TEST_F(CurlURLSession, GivesUpARequestThatMakesNoProgress) {
  options_.noProgressTimeout = 300ms;
  server_.setReply(reply(Behaviour::hold));
  auto urls = session();
  const Outcome outcome = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(outcome.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(outcome.errorText(), "The request made no progress");
}

TEST_F(CurlURLSession, WaitsForASlowReplyThatMakesProgress) {
  options_.noProgressTimeout = 3s;
  server_.setReply({.body = "0123456789abcdef", .behaviour = Behaviour::drip, .interval = 220ms});
  auto urls = session();
  const auto before = std::chrono::steady_clock::now();
  const Outcome outcome = perform(*urls, get(server_.url("/")));
  EXPECT_EQ(outcome.body(), "0123456789abcdef") << outcome.errorText();
  EXPECT_GT(std::chrono::steady_clock::now() - before, options_.noProgressTimeout);
}

TEST_F(CurlURLSession, EndsARequestThatAServerDripsAtForTooLong) {
  options_.requestTime = 400ms;
  server_.setReply({.body = std::string(1000, 'x'), .behaviour = Behaviour::drip, .interval = 20ms});
  auto urls = session(true);
  const auto before = std::chrono::steady_clock::now();
  URLRequest request = post(server_.url("/"), "upload");
  request.isAwaited = true;
  const Outcome outcome = perform(*urls, std::move(request));
  EXPECT_EQ(outcome.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(outcome.errorText(), "The request took too long");
  EXPECT_GE(std::chrono::steady_clock::now() - before, 400ms);
  EXPECT_EQ(server_.requestCount(), 1u);
}

TEST_F(CurlURLSession, GivesALargeBodyMoreTime) {
  options_.requestTime = 400ms;
  server_.setReply({.body = std::string(40, 'x'), .behaviour = Behaviour::drip, .interval = 25ms});
  auto urls = session(true);
  const std::string body(60 * Limits::leastBodyBytesPerSecond, 'u');
  EXPECT_EQ(perform(*urls, post(server_.url("/"), body)).status(), 200);
}

TEST_F(CurlURLSession, EndsARequestAtItsTimeOutProgressOrNot) {
  server_.setReply({.body = std::string(1000, 'x'), .behaviour = Behaviour::drip, .interval = 20ms});
  auto urls = session();
  URLRequest request = get(server_.url("/"));
  request.timeout = 400ms;
  const auto before = std::chrono::steady_clock::now();
  const Outcome outcome = perform(*urls, std::move(request));
  EXPECT_EQ(outcome.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(outcome.errorText(), "The request timed out");
  EXPECT_GE(std::chrono::steady_clock::now() - before, 400ms);
  EXPECT_FALSE(outcome.data());
  EXPECT_EQ(outcome.status(), 200);
}

TEST_F(CurlURLSession, TakesAReplyOfTheGreatestSizeAndRefusesALargerOne) {
  auto urls = session();
  const std::string largest(Limits::maxHTTPReplyBytes, 'r');
  server_.setReply({.body = largest});
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).body(), largest);
  server_.setReply({.body = std::string(5u << 20, 'r')});
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).errorCode(), CURLE_FILESIZE_EXCEEDED);
  // … also when its size is not announced.
  std::string unannounced = "HTTP/1.1 200 OK\r\n\r\n";
  unannounced.append(5u << 20, 'r');
  server_.setReply(reply(Behaviour::raw, unannounced));
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).errorCode(), CURLE_FILESIZE_EXCEEDED);
}

TEST_F(CurlURLSession, RefusesEndlessHeaders) {
  std::string head = "HTTP/1.1 200 OK\r\n";
  for (int i = 0; i < 300; ++i) head += "X-" + std::to_string(i) + ": " + std::string(1000, 'h') + "\r\n";
  server_.setReply(reply(Behaviour::raw, head + "Content-Length: 0\r\n\r\n"));
  auto urls = session();
  EXPECT_NE(perform(*urls, get(server_.url("/"))).errorCode(), 0);
}

TEST_F(CurlURLSession, ReportsRepliesThatBreakOff) {
  auto urls = session();
  server_.setReply(reply(Behaviour::stopMidBody, std::string(1000, 'x')));
  const Outcome partial = perform(*urls, get(server_.url("/")));
  EXPECT_EQ(partial.errorCode(), CURLE_PARTIAL_FILE);
  EXPECT_FALSE(partial.data());
  EXPECT_EQ(partial.status(), 200);
  server_.setReply(reply(Behaviour::close));
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).errorCode(), CURLE_GOT_NOTHING);
  EXPECT_EQ(factory().figures().failed, 2u);
}

TEST_F(CurlURLSession, TellsTheStatusOfAReplyThatIsCutOrStallsOrIsTooLarge) {
  options_.noProgressTimeout = 300ms;
  auto urls = session();
  const std::string head = "HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 503 Busy\r\nRetry-After: 9\r\n";
  server_.setReply(reply(Behaviour::raw, head + "Content-Length: 9\r\n\r\ncut"));
  const Outcome cut = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(cut.errorCode(), CURLE_PARTIAL_FILE);
  EXPECT_EQ(cut.status(), 503);
  EXPECT_EQ(cut.response()->header("Retry-After"), "9");
  EXPECT_FALSE(cut.data());
  server_.setReply({.status = 502, .body = "stalls", .behaviour = Behaviour::drip, .interval = 1h});
  const Outcome stalled = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(stalled.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(stalled.status(), 502);
  server_.setReply({.status = 500, .headers = {{"Content-Length", "99999999"}}});
  const Outcome large = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(large.errorCode(), CURLE_FILESIZE_EXCEEDED);
  EXPECT_EQ(large.status(), 500);
  // A preliminary status decides nothing.
  server_.setReply(reply(Behaviour::raw, "HTTP/1.1 100 Continue\r\n\r\n"));
  EXPECT_FALSE(perform(*urls, post(server_.url("/"), "x")).response());
}

TEST_F(CurlURLSession, HeaderLinesOfOneNameAreOne) {
  server_.setReply(
      {.headers = {{"Cache-Control", "public"}, {"X-Other", "1"}, {"cache-control", "max-age=60"}}});
  const Outcome outcome = perform(*session(), get(server_.url("/")));
  EXPECT_EQ(outcome.response()->header("Cache-Control"), "public, max-age=60");
  EXPECT_EQ(outcome.response()->header("X-Other"), "1");
  EXPECT_FALSE(outcome.response()->header("X-None"));
}

TEST_F(CurlURLSession, ReportsGarbage) {
  server_.setReply(reply(Behaviour::raw, "\x01\x02garbage\r\n\r\nmore garbage"));
  auto urls = session();
  EXPECT_NE(perform(*urls, get(server_.url("/"))).errorCode(), 0);
}

TEST_F(CurlURLSession, ReportsARefusedConnectionAtOnceEvenIfItWaitsForConnectivity) {
  const std::string url = server_.url("/");
  server_.stop();
  auto urls = session(true);
  const Outcome outcome = perform(*urls, get(url));
  EXPECT_EQ(outcome.errorCode(), CURLE_COULDNT_CONNECT);
  EXPECT_FALSE(outcome.errorText().empty());
  EXPECT_EQ(factory().figures().waiting, 0u);
}

// A completion that has begun and goes on when it is told to. What completions use may be gone before the factory is.
class CurlURLSessionEnd : public CurlURLSession {
 protected:
  void SetUp() override {
    urls_ = session();
    static_cast<void>(urls_->start(get(server_.url("/")), [this](auto&&...) {
      running_.signal();
      EXPECT_TRUE(goOn_.waitFor(kTestDeadline));
      over_ = true;
    }));
    ASSERT_TRUE(running_.waitFor(kTestDeadline));
  }
  Semaphore running_, goOn_;
  std::atomic<bool> over_ = false;
  std::unique_ptr<URLSession> urls_;
};

TEST_F(CurlURLSessionEnd, SaysWhetherCompletionsStillRun) {
  EXPECT_FALSE(factory().shutDownWithin(50ms));
  goOn_.signal();
  factory_.reset();
  EXPECT_TRUE(over_);
}

TEST_F(CurlURLSessionEnd, WaitsForCompletionsThatStillRun) {
  std::thread later([this] { goOn_.signal(); });
  EXPECT_TRUE(factory().shutDownWithin(kTestDeadline));
  EXPECT_TRUE(over_);
  later.join();
}

TEST_F(CurlURLSession, SpeaksHTTPAlone) {
  auto urls = session();
  EXPECT_EQ(perform(*urls, get("file:///etc/hostname")).errorCode(), CURLE_UNSUPPORTED_PROTOCOL);
  EXPECT_EQ(perform(*urls, get("ftp://127.0.0.1/")).errorCode(), CURLE_UNSUPPORTED_PROTOCOL);
  EXPECT_NE(perform(*urls, get("")).errorCode(), 0);
  EXPECT_NE(perform(*urls, get("http://127.0.0.1:99999/")).errorCode(), 0);
  EXPECT_NE(perform(*urls, get("http://a b\r\nX: y/")).errorCode(), 0);
}

TEST_F(CurlURLSession, FollowsNoRedirectOfAPost) {
  server_.setReply({.status = 302, .headers = {{"Location", server_.url("/other")}}});
  auto urls = session();
  const Outcome outcome = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(outcome.status(), 302);
  EXPECT_EQ(server_.requestCount(), 1u);
}

TEST_F(CurlURLSession, IgnoresProxiesOfTheEnvironment) {
  setenv("http_proxy", "http://127.0.0.1:1", 1);
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  unsetenv("http_proxy");
}

TEST_F(CurlURLSession, KeepsNoCookies) {
  server_.setReply({.headers = {{"Set-Cookie", "a=b"}}});
  auto urls = session();
  perform(*urls, get(server_.url("/")));
  perform(*urls, get(server_.url("/")));
  EXPECT_EQ(server_.requests()[1].headerCount("Cookie"), 0u);
}

TEST_F(CurlURLSession, AnswersWithoutABody) {
  server_.setReply({.status = 304, .headers = {{"Last-Modified", "then"}}});
  auto urls = session();
  URLRequest request = get(server_.url("/"));
  request.headers = {{"If-Modified-Since", "then"}};
  const Outcome outcome = perform(*urls, std::move(request));
  EXPECT_EQ(outcome.status(), 304);
  ASSERT_TRUE(outcome.data());
  EXPECT_TRUE(outcome.data()->empty());
  EXPECT_EQ(outcome.response()->header("last-modified"), "then");
}

TEST_F(CurlURLSession, ForgetsTheMethodAndBodyOfTheRequestBefore) {
  auto urls = session();
  perform(*urls, post(server_.url("/"), "abc"));
  perform(*urls, get(server_.url("/")));
  URLRequest put = post(server_.url("/"), "put");
  put.method = "PUT";
  perform(*urls, std::move(put));
  perform(*urls, post(server_.url("/"), ""));
  const auto requests = server_.requests();
  ASSERT_EQ(requests.size(), 4u);
  EXPECT_EQ(requests[1].method + requests[1].body, "GET");
  EXPECT_EQ(requests[1].headerCount("Content-Length"), 0u);
  EXPECT_EQ(requests[2].method + requests[2].body, "PUTput");
  EXPECT_EQ(requests[3].method + requests[3].body, "POST");
  EXPECT_EQ(requests[3].header("Content-Length"), "0");
}

TEST_F(CurlURLSession, CarriesManyIdleSessions) {
  std::vector<std::unique_ptr<URLSession>> many(10000);
  for (auto& one : many) one = session(true);
  EXPECT_EQ(perform(*many[5000], get(server_.url("/"))).status(), 200);
  many.clear();
  EXPECT_TRUE(server_.waitForConnectionsOpen(0));
}

// Memory goes back then: replies may end long after the daemon's other work.
TEST_F(CurlURLSession, SaysThatItIsQuietAfterItsCompletionsAndAfterItsConnections) {
  static std::atomic<int> timesQuiet{0};
  timesQuiet = 0;
  options_.quietTime = std::chrono::milliseconds(20);
  options_.whenQuiet = [] { ++timesQuiet; };
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_TRUE(eventually([&] { return timesQuiet == 1; })) << "its connection is kept";
  EXPECT_EQ(perform(*urls, get(server_.url("/"))).status(), 200);
  EXPECT_TRUE(eventually([&] { return timesQuiet == 2; }));
  urls.reset();
  EXPECT_TRUE(eventually([&] { return timesQuiet == 3; }));
  factory_.reset();
  EXPECT_EQ(timesQuiet, 3);
}

}  // namespace
}  // namespace kyt
