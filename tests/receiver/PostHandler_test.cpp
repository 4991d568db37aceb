#include "receiver/PostHandler.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "platform/fake/FakePostStore.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "tests/receiver/FakeLog.h"

namespace kyt::receiver {
namespace {

// A log that must be left alone from some time on.
class LogThatEnds final : public EventLog {
 public:
  void start(LogListener& listener) override { listener_ = &listener; }
  void publish(uint64_t token, std::shared_ptr<const LogMessage> /*message*/) override {
    if (isOver_) wasUsedThen_ = true;
    listener_->logAnswered(token, {LogVerdict::stored, {}});
  }
  void publishDeadLetter(std::shared_ptr<const LogMessage> /*message*/) override {}
  [[nodiscard]] std::optional<uint64_t> maxBodyBytes() const override { return 1 << 20; }
  void stop() override {}
  void isOver() { isOver_ = true; }
  [[nodiscard]] bool wasUsedThen() const { return wasUsedThen_; }

 private:
  LogListener* listener_ = nullptr;
  std::atomic<bool> isOver_{false}, wasUsedThen_{false};
};

// A handler, and what it stands on, for one end.
struct Stage {
  Stage() {
    log.start(delivery);
    delivery.logIsUp(true);
  }
  static Settings settingsOfOnePath() {
    Settings settings;
    settings.paths.emplace_back().urlPath = "/v1/events";
    return settings;
  }
  static http::Request post() {
    http::Request request;
    request.method = "POST";
    request.path = "/v1/events";
    request.contentLength = 2;
    request.body = "{}";
    request.bodySize = 2;
    return request;
  }

  const Settings settings = settingsOfOnePath();
  ManualClock clock;
  Figures figures;
  MemoryLogSink sink;
  Log lines{sink};
  LogThatEnds log;
  FakePostStore store{std::make_shared<FakePostStore::Disk>()};
  Spool spool{store, 10000, clock, figures, lines};
  Delivery delivery{log, spool, clock, figures, lines, std::chrono::seconds(2)};
  DeadLetters deadLetters{log, clock, figures};
  PostHandler handler{settings, {}, delivery, log, deadLetters, clock, figures};
};

TEST(PostHandlerTest, ThatIsClosedAndWaitsForNothingGivesTheLogNoPost) {
  constexpr int kEnds = 5000;
  constexpr int kPosts = 20;
  std::atomic<Stage*> at{nullptr};
  std::atomic<int> answered{0};
  std::thread server([&] {
    Stage* last = nullptr;
    for (int end = 0; end < kEnds; ++end) {
      Stage* stage = nullptr;
      while ((stage = at) == last) std::this_thread::yield();
      last = stage;
      for (int i = 0; i < kPosts; ++i) {
        http::Request post = Stage::post();
        static_cast<void>(stage->handler.answer(post));
      }
      ++answered;
    }
  });
  size_t stored = 0, tooLate = 0;
  std::unique_ptr<Stage> before;
  for (int end = 0; end < kEnds; ++end) {
    auto stage = std::make_unique<Stage>();
    at = stage.get();
    while (stage->figures.stored == 0) std::this_thread::yield();
    // Another moment each time.
    for (std::atomic<int> i = 0; i < end % 1000; ++i) {
    }
    stage->handler.close();
    while (stage->handler.waiting() != 0) {
    }
    stage->log.isOver();
    while (answered != end + 1) std::this_thread::yield();
    stored += stage->figures.stored;
    tooLate += stage->log.wasUsedThen() ? 1 : 0;
    before = std::move(stage);  // another address than the next one's
  }
  server.join();
  EXPECT_EQ(tooLate, 0U);
  EXPECT_GT(stored, 0U);
}

}  // namespace
}  // namespace kyt::receiver
