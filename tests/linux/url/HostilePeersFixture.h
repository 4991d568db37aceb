// What the tests of hostile servers share: sessions that post texts of their own, and somebody who posts to a good server
// meanwhile.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TestCertificates.h"

namespace kyt {

// Posts to a good server, one after the other, until it is told to end.
class Bystander {
 public:
  Bystander(std::unique_ptr<URLSession> session, std::string url)
      : session_(std::move(session)), url_(std::move(url)), thread_([this] { run(); }) {}
  ~Bystander() { end(); }
  Bystander(const Bystander&) = delete;
  Bystander& operator=(const Bystander&) = delete;
  void end() {
    ending_ = true;
    if (thread_.joinable()) thread_.join();
  }
  void expectNoHarm() {
    end();
    EXPECT_EQ(lost_, 0);
    EXPECT_GT(posted_, 10);
    EXPECT_LT(latest_, std::chrono::seconds(kSanitized ? 40 : 10));
  }

 private:
  void run() {
    while (!ending_ || posted_ <= 10) {
      URLRequest request;
      request.method = "POST";
      request.url = url_;
      request.body = Data(std::string_view("good"));
      Outcome outcome;
      const auto start = std::chrono::steady_clock::now();
      session_->start(std::move(request), outcome.completion());
      if (!outcome.wait() || outcome.status() != 200) ++lost_;
      latest_ = std::max<Duration>(latest_, std::chrono::steady_clock::now() - start);
      ++posted_;
      // Often enough to notice what holds it up; what it takes of the processor, others that run beside it lack.
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
  std::unique_ptr<URLSession> session_;
  const std::string url_;
  std::atomic<bool> ending_{false};
  int lost_ = 0, posted_ = 0;
  Duration latest_{};
  std::thread thread_;
};

class HostilePeers : public CurlURLSessionFixture {
 protected:
  HostilePeers() { options_.certificateFile = authority_.file(); }
  void SetUp() override { options_.noProgressTimeout = std::chrono::seconds(kSanitized ? 5 : 3); }

  // What befell a session's posts, all of which have other texts.
  struct Visit {
    std::unique_ptr<URLSession> session;
    std::vector<std::string> texts;
    std::vector<Outcome> outcomes;
  };
  void begin(Visit& visit, const std::string& url) {
    visit.texts.push_back("<" + std::to_string(++texts_) + ">\n");
    visit.outcomes.emplace_back();
    visit.session->start(post(url, visit.texts.back()), visit.outcomes.back().completion());
  }
  void waitFor(const Visit& visit) {
    for (const Outcome& outcome : visit.outcomes) {
      ASSERT_TRUE(outcome.wait(std::chrono::seconds(60)));
      EXPECT_EQ(outcome.calls(), 1);
      failed_ += outcome.errorCode() != 0 ? 1 : 0;
    }
  }
  TestCertificateAuthority authority_;
  int texts_ = 0;
  uint64_t failed_ = 0;
};

}  // namespace kyt
