// What a fleet's receiving end makes of outages, with the real servers of `./kyt fleet` and posts by TLS through nginx: no
// post that was answered with 200 is missing from the table, none is there twice, and nobody waits for long. For
// `./kyt fleet --check`; it prints what it measured.
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <chrono>
#include <cstdio>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/data/OpenSSLCryptography.h"
#include "tools/fleet/Fleet.h"

namespace kyt::tools {
namespace {

using Seconds = std::chrono::duration<double>;

// A post that no other is.
std::string bodyOf(int thread, int number) {
  return R"({"postTime":1769860800.25,"clientId":"load-)" + std::to_string(thread) +
         R"(","events":[{"device":)" + std::to_string(thread) + R"(,"_eventNumber":)" +
         std::to_string(number) + R"(,"filler":")" + std::string(2000, 'x') + "\"}]}";
}

std::string idOf(const std::string& body) {
  static OpenSSLCryptography cryptography;
  std::string id;
  for (const std::byte byte : cryptography.sha256(std::as_bytes(std::span(body)))) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", std::to_integer<unsigned>(byte));
    id += digits;
  }
  return id;
}

size_t ignore(char*, size_t size, size_t count, void*) {
  return size * count;
}

// Devices that post one after another, each on a connection of its own.
class Load {
 public:
  Load(std::string url, std::string authority, int threads, std::chrono::milliseconds pause)
      : url_(std::move(url)),
        authority_(std::move(authority)),
        pause_(pause),
        results_(static_cast<size_t>(threads)) {
    for (int i = 0; i < threads; ++i) threads_.emplace_back([this, i] { run(i); });
  }
  ~Load() { end(); }
  void end() {
    isEnding_ = true;
    for (std::thread& thread : threads_)
      if (thread.joinable()) thread.join();
  }
  // Until now; the others are known once it has ended.
  [[nodiscard]] int refusedSoFar() const { return refusedSoFar_; }
  [[nodiscard]] std::set<std::string> answered() const {
    std::set<std::string> all;
    for (const Result& result : results_) all.insert(result.answered.begin(), result.answered.end());
    return all;
  }
  [[nodiscard]] int refused() const {
    int all = 0;
    for (const Result& result : results_) all += result.refused;
    return all;
  }
  [[nodiscard]] int serverErrors() const {
    int all = 0;
    for (const Result& result : results_) all += result.serverErrors;
    return all;
  }
  // Of the refused, those without an answer.
  [[nodiscard]] int broken() const {
    int all = 0;
    for (const Result& result : results_) all += result.broken;
    return all;
  }
  [[nodiscard]] double longest() const {
    double longest = 0;
    for (const Result& result : results_)
      for (const double time : result.times) longest = std::max(longest, time);
    return longest;
  }
  [[nodiscard]] double median() const {
    std::vector<double> all;
    for (const Result& result : results_) all.insert(all.end(), result.times.begin(), result.times.end());
    if (all.empty()) return 0;
    std::nth_element(all.begin(), all.begin() + static_cast<long>(all.size() / 2), all.end());
    return all[all.size() / 2];
  }

 private:
  struct Result {
    std::vector<std::string> answered;  // with 200: their IDs
    std::vector<double> times;          // of all that were answered, seconds
    int refused = 0, serverErrors = 0, broken = 0;
  };

  void run(int thread) {
    Result& result = results_[static_cast<size_t>(thread)];
    CURL* curl = curl_easy_init();
    curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
    headers = curl_slist_append(headers, "X-KYT-Client-Name: load");
    headers = curl_slist_append(headers, "X-KYT-Sender: QJ");
    headers = curl_slist_append(headers, "Expect:");
    curl_easy_setopt(curl, CURLOPT_URL, url_.c_str());
    curl_easy_setopt(curl, CURLOPT_CAINFO, authority_.c_str());
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, ignore);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, 30L);
    for (int number = 0; !isEnding_; ++number) {
      const std::string body = bodyOf(thread, number);
      curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
      curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
      const auto began = std::chrono::steady_clock::now();
      const CURLcode code = curl_easy_perform(curl);
      const double took = Seconds(std::chrono::steady_clock::now() - began).count();
      long status = 0;
      curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
      if (code != CURLE_OK) status = 0;
      if (status != 0) result.times.push_back(took);
      if (status == 200)
        result.answered.push_back(idOf(body));
      else
        ++result.refused, ++refusedSoFar_;
      if (status >= 500) ++result.serverErrors;
      if (status == 0) ++result.broken;
      std::this_thread::sleep_for(pause_);  // how often a device posts, not a wait for anything
    }
    curl_slist_free_all(headers);
    curl_easy_cleanup(curl);
  }

  const std::string url_, authority_;
  const std::chrono::milliseconds pause_;
  std::atomic<bool> isEnding_{false};
  std::atomic<int> refusedSoFar_{0};
  std::vector<Result> results_;  // each thread's own
  std::vector<std::thread> threads_;
};

class FleetCheck : public ::testing::Test {
 protected:
  void SetUp() override {
    FleetOptions options;
    options.stage.programs = KYT_PROGRAMS;
    options.stage.share = KYT_SHARE;
    options.site = KYT_FLEET_FILES "/nginx-site.conf";
    auto started = Fleet::start(std::move(options));
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<Fleet>>(started))
        << std::get<Error>(started).localizedDescription;
    fleet_ = std::get<std::unique_ptr<Fleet>>(std::move(started));
  }
  void startLoad(int threads = 8, std::chrono::milliseconds pause = std::chrono::milliseconds(5)) {
    load_ = std::make_unique<Load>(fleet_->front().base() + kFleetPath, fleet_->folder() + "/server/ca.pem",
                                   threads, pause);
  }
  [[nodiscard]] size_t stored() const {
    const std::string count = fleet_->postgres().query("SELECT count(*) FROM kyt_posts");
    // No number until the reader has made the table.
    return std::isdigit(static_cast<unsigned char>(count.c_str()[0])) != 0 ? std::stoul(count) : 0;
  }
  // Until so many more posts stand in the table.
  void waitForMore(size_t posts) {
    const size_t before = stored();
    EXPECT_TRUE(waitUntil(std::chrono::seconds(60), [&] { return stored() >= before + posts; })) << stored();
  }
  [[nodiscard]] std::set<std::string> missing() const {
    std::set<std::string> left = load_->answered();
    std::istringstream there(fleet_->postgres().query("SELECT id FROM kyt_posts"));
    for (std::string id; std::getline(there, id);) left.erase(id);
    return left;
  }
  // All that was answered is in the table, each once, and no receiver keeps anything.
  void expectWhole(const char* what) {
    load_->end();
    EXPECT_TRUE(waitUntil(std::chrono::seconds(90), [this] { return missing().empty(); }))
        << missing().size() << " are missing";
    EXPECT_TRUE(waitUntil(std::chrono::seconds(60), [this] { return fleet_->sum("kyt_spool_posts") == 0; }))
        << fleet_->sum("kyt_spool_posts");
    EXPECT_EQ(fleet_->postgres().query("SELECT count(*) = count(DISTINCT record) FROM kyt_events"), "t\n");
    EXPECT_EQ(fleet_->postgres().query("SELECT count(*) FROM kyt_unreadable"), "0\n");
    EXPECT_EQ(load_->serverErrors(), 0) << "these switch devices off";
    std::printf("%s: %zu posts answered with 200, %d others, none missing; median %.1f ms, longest %.2f s\n",
                what, load_->answered().size(), load_->refused(), load_->median() * 1000, load_->longest());
  }

  std::unique_ptr<Fleet> fleet_;
  std::unique_ptr<Load> load_;
};

TEST_F(FleetCheck, KillingTheLeaderUnderLoadLosesNothingAndLetsNobodyWait) {
  startLoad();
  waitForMore(500);
  const std::optional<size_t> leader = fleet_->leader();
  ASSERT_TRUE(leader);
  fleet_->killNode(*leader);
  EXPECT_TRUE(waitUntil(std::chrono::seconds(60), [&] {
    const auto now = fleet_->leader();
    return now && *now != *leader;
  }));
  waitForMore(500);
  const auto problem = fleet_->startNode(*leader);
  EXPECT_FALSE(problem) << problem->localizedDescription;
  waitForMore(500);
  expectWhole("leader killed");
  EXPECT_LE(load_->longest(), 2.5);
  EXPECT_EQ(load_->refused(), 0);
}

TEST_F(FleetCheck, TwoOfThreeNodesAwayForHalfAMinuteFillSpoolsThatThenDrain) {
  startLoad(4, std::chrono::milliseconds(20));
  waitForMore(100);
  fleet_->killNode(0);
  fleet_->killNode(1);
  std::this_thread::sleep_for(std::chrono::seconds(30));  // the outage itself
  const double spooled = fleet_->sum("kyt_spool_posts");
  EXPECT_GT(spooled, 50);
  for (const size_t node : {0, 1}) {
    const auto problem = fleet_->startNode(node);
    EXPECT_FALSE(problem) << problem->localizedDescription;
  }
  const auto back = std::chrono::steady_clock::now();
  EXPECT_TRUE(waitUntil(std::chrono::seconds(90), [this] { return fleet_->sum("kyt_spool_posts") == 0; }));
  std::printf("two of three away for 30 s: %.0f posts in the spools, empty %.1f s after\n", spooled,
              Seconds(std::chrono::steady_clock::now() - back).count());
  expectWhole("two of three away");
  EXPECT_LE(load_->longest(), 2.5);
  EXPECT_EQ(load_->refused(), 0);
}

TEST_F(FleetCheck, AReceiverThatIsKilledLosesNoPostThatItAnswered) {
  startLoad();
  for (int round = 0; round < 3; ++round) {
    waitForMore(200);
    fleet_->killReceiver(0);
    waitForMore(200);
    const auto problem = fleet_->startReceiver(0);
    EXPECT_FALSE(problem) << problem->localizedDescription;
  }
  expectWhole("receiver killed three times");
  EXPECT_EQ(load_->refused(), 0) << "the front turns to the other";
}

TEST_F(FleetCheck, AReceiverThatIsEndedUnderLoadLosesNoPost) {
  startLoad();
  for (int round = 0; round < 3; ++round) {
    waitForMore(200);
    EXPECT_EQ(fleet_->endReceiver(1), 0);
    waitForMore(200);
    const auto problem = fleet_->startReceiver(1);
    EXPECT_FALSE(problem) << problem->localizedDescription;
  }
  expectWhole("receiver ended three times");
  EXPECT_EQ(load_->refused(), 0);
}

TEST_F(FleetCheck, WithoutReceiversDevicesAreToldToComeAgain) {
  startLoad(2);
  waitForMore(50);
  fleet_->killReceiver(0);
  fleet_->killReceiver(1);
  EXPECT_TRUE(waitUntil(std::chrono::seconds(30), [&] { return load_->refusedSoFar() > 0; }));
  for (const size_t receiver : {0, 1}) {
    const auto problem = fleet_->startReceiver(receiver);
    EXPECT_FALSE(problem) << problem->localizedDescription;
  }
  expectWhole("no receiver");
  EXPECT_GT(load_->refused(), 0);
  EXPECT_EQ(load_->broken(), 0) << "the front itself answers";
}

}  // namespace
}  // namespace kyt::tools
