// A server that has an address of IPv6 and one of IPv4, of which one goes away while connections to it are kept.
#include <curl/curl.h>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/support/NetworkNamespace.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Behaviour = TestHTTPServer::Behaviour;

class TwoFamilies : public CurlURLSessionFixture {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    here_.emplace();
    entered_.emplace(*here_);
    TestHTTPServer::Options options;
    options.address = "::1";
    six_ = std::make_unique<TestHTTPServer>(options);
    options.address = "127.0.0.1";
    options.port = six_->port();
    four_ = std::make_unique<TestHTTPServer>(options);
  }
  void TearDown() override {
    factory_.reset();
    six_.reset();
    four_.reset();
    entered_.reset();
  }
  // The address that the resolver prefers, found by a post that arrives there.
  void findPreferred(URLSession& urls) {
    ASSERT_EQ(perform(urls, post(url(), "before")).status(), 200);
    if (six_->requestCount() == 0) std::swap(preferred_, other_);
    ASSERT_EQ((*preferred_)->requestCount(), 1u);
  }
  bool changePreferred(const std::string& how) {
    const bool isSix = preferred_ == &six_;
    return here_->run(isSix ? "ip -6 addr " + how + " ::1/128 dev lo"
                            : "ip addr " + how + " 127.0.0.1/8 dev lo");
  }
  std::string url() { return six_->url("/", "localhost"); }

  std::optional<NetworkNamespace> here_;
  std::optional<NetworkNamespace::Entered> entered_;
  std::unique_ptr<TestHTTPServer> six_, four_;
  std::unique_ptr<TestHTTPServer>*preferred_ = &six_, *other_ = &four_;
};

TEST_F(TwoFamilies, WhenOneIsGonePostsGoOverTheOtherAtOnce) {
  auto urls = session(true);
  ASSERT_NO_FATAL_FAILURE(findPreferred(*urls));
  const auto start = std::chrono::steady_clock::now();
  for (size_t i = 1; i <= 3; ++i) {
    ASSERT_TRUE(changePreferred("del"));
    EXPECT_EQ(perform(*urls, post(url(), "without")).status(), 200);
    EXPECT_EQ((*other_)->requestCount(), i);
    ASSERT_TRUE(changePreferred("add"));
  }
  EXPECT_LT(std::chrono::steady_clock::now() - start, 15s);
  EXPECT_EQ((*preferred_)->requestCount(), 1u);
  EXPECT_EQ(factory().figures().failed, 0u);
}

TEST_F(TwoFamilies, WhatDidNotArriveOverTheOneThatWentArrivesOverTheOther) {
  auto urls = session(true);
  ASSERT_NO_FATAL_FAILURE(findPreferred(*urls));
  (*preferred_)->loseWhatComes();
  Outcome lost;
  urls->start(post(url(), "lost"), lost.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged((*preferred_)->port()); }));
  ASSERT_TRUE(changePreferred("del"));
  ASSERT_TRUE(lost.wait());
  EXPECT_EQ(lost.status(), 200) << lost.errorText();
  EXPECT_EQ((*preferred_)->requestCount(), 1u);
  EXPECT_EQ((*other_)->requestCount(), 1u);
}

TEST_F(TwoFamilies, WhatTheServerHasOverOneIsNotPostedOverTheOther) {
  options_.noProgressTimeout = 3s;
  auto urls = session(true);
  ASSERT_NO_FATAL_FAILURE(findPreferred(*urls));
  (*preferred_)->setReply({.behaviour = Behaviour::hold});
  Outcome held;
  urls->start(post(url(), "held"), held.completion());
  ASSERT_TRUE((*preferred_)->waitForRequests(2));
  ASSERT_TRUE(eventually([&] { return !hasUnacknowledged((*preferred_)->port()); }));
  ASSERT_TRUE(changePreferred("del"));
  EXPECT_EQ(perform(*urls, post(url(), "next")).status(), 200);
  ASSERT_TRUE(held.wait());
  EXPECT_NE(held.errorCode(), 0);
  EXPECT_EQ((*preferred_)->requestCount(), 2u);
  EXPECT_EQ((*other_)->requestCount(), 1u);
  EXPECT_EQ(factory().figures().failed, 1u);
}

}  // namespace
}  // namespace kyt
