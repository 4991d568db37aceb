// What other threads do to a back end while its session sends: other sessions of its hierarchy, the health
// report, and replies. Its findings are the thread sanitizer's; without it, that nothing is lost or done
// twice.
#include <atomic>
#include <deque>
#include <thread>

#include "platform/base/Mutex.h"
#include "platform/queues/WorkerPool.h"
#include "tests/backends/https/HTTPSFixture.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

// Keeps completions for another thread.
class SharedPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest, URLCompletion completion) override {
    MutexLock lock(mutex_);
    completions_.push_back(std::move(completion));
  }
  std::optional<URLCompletion> take() {
    MutexLock lock(mutex_);
    if (completions_.empty()) return std::nullopt;
    URLCompletion completion = std::move(completions_.front());
    completions_.pop_front();
    return completion;
  }

 private:
  Mutex mutex_;
  std::deque<URLCompletion> completions_ GUARDED_BY(mutex_);
};

class HTTPSPostBackendThreads : public HTTPSFixture {};

TEST_F(HTTPSPostBackendThreads, OthersMayReadAndWriteWhatIsTheirs) {
  auto poster = std::make_shared<SharedPoster>();
  entry_.set("event_threshold", 5);
  platform_.log.setLevel(LogLevel::normal);
  decided().setReportingSessionConnectivityDelegate(poster);
  const std::shared_ptr<HTTPSPostBackend> backend = backend_;
  std::atomic<bool> done{false};
  std::atomic<int> answered{0};

  std::thread hierarchy([&] {
    for (int i = 0; !done; ++i) {
      backend->setCorrelatedSessionID(String(std::to_string(i) + ".77"));
      backend->setSamplingThreshold(Value(0.5));
      backend->setState(i % 2 == 0 ? kBackendStateEnabled : kBackendStateHeld);
      std::this_thread::yield();
    }
  });
  std::thread health([&] {
    while (!done) {
      EXPECT_LT(backend->batchedEventsSize(), 1u << 20);
      EXPECT_GE(backend->state(), kBackendStateUndecided);
      EXPECT_FALSE(backend->samplingThreshold().isNull());
      std::this_thread::yield();
    }
  });
  std::thread replies([&] {
    for (bool last = false; !last;) {
      last = done;
      while (std::optional<URLCompletion> completion = poster->take()) {
        URLResponse response;
        response.status = ++answered % 3 == 0 ? 503 : 200;
        (*completion)(Data(), response, std::nullopt);
      }
      platform_.executor.runAll();
      std::this_thread::yield();
    }
  });

  std::atomic<int> completed{0};
  int flushes = 0;
  for (int i = 0; i < 20000; ++i) {
    send(static_cast<uint16_t>(i % 3), {{"k", i}}, i % 50 == 0 ? 3 : 0);
    if (i % 100 == 0) {
      ++flushes;
      backend->flushMessagesWithCompletion([&](const Value&, const std::optional<Error>&) { ++completed; });
    }
    if (i % 10 == 0) backend->updateState();
  }
  done = true;
  hierarchy.join();
  health.join();
  replies.join();
  EXPECT_EQ(completed, flushes);
}

TEST_F(HTTPSPostBackendThreads, ARepliesThreadMayDropTheLastReference) {
  for (int i = 0; i < 200; ++i) {
    auto poster = std::make_shared<SharedPoster>();
    make(Array{entry_}).updateState();
    backend_->setReportingSessionConnectivityDelegate(poster);
    send(5);
    backend_->flushMessagesWithCompletion(nullptr);
    std::optional<URLCompletion> completion = poster->take();
    ASSERT_TRUE(completion);
    std::thread reply([&] {
      URLResponse response;
      response.status = 500;
      (*completion)(Data(), response, std::nullopt);
    });
    backend_.reset();
    reply.join();
    platform_.executor.runAll();
  }
}

// Sessions of which all end at once write and compress no more batches at a time than there are places: each holds its text
// besides its records meanwhile.
TEST_F(HTTPSPostBackendThreads, OfManyLargeBatchesAsManyAreCompressedAtATimeAsThereArePlaces) {
  constexpr int kBackends = 6;
  entry_.set("event_threshold", 10000);
  std::vector<std::shared_ptr<HTTPSPostBackend>> backends;
  for (int i = 0; i < kBackends; ++i) {
    backend_ = nullptr;
    decided();
    for (int k = 0; k < 20; ++k) send(5, {{"text", std::string(50000, 'x')}});
    backends.push_back(backend_);
  }
  std::atomic<int> compressing{0}, most{0}, flushed{0};
  std::atomic<bool> haveAllCome{false};
  WorkerPool pool(WorkerPoolOptions{});
  platform_.deflate.faults.beforeFinish = [&] {
    const int now = ++compressing;
    if (now > most) most = now;
    // All others have had the time to come here too.
    if (!haveAllCome) {
      EXPECT_TRUE(eventually([&] { return pool.figures().blocked == static_cast<size_t>(kBackends - 1); }));
      haveAllCome = true;
    }
    --compressing;
  };
  for (const std::shared_ptr<HTTPSPostBackend>& backend : backends)
    SerialQueue::create("flushes", pool)->async([&flushed, backend] {
      backend->flushMessagesWithCompletion([](const Value&, const std::optional<Error>&) {});
      ++flushed;
    });
  EXPECT_TRUE(eventually([&] { return flushed == kBackends; }));
  pool.shutDown();
  EXPECT_EQ(most, 1) << "the platform of this test has one place";
}

// With two workers that may run, another session's work waits for no batch of a megabyte, however many there are: one is
// compressed, the other stands in line.
TEST_F(HTTPSPostBackendThreads, OthersRunWhileLargeBatchesAreCompressed) {
  std::atomic<bool> otherRan{false};
  std::atomic<int> compressing{0}, flushed{0};
  platform_.deflate.faults.beforeFinish = [&] {
    ++compressing;
    EXPECT_TRUE(eventually([&] { return otherRan.load(); }));
  };
  entry_.set("event_threshold", 10000);
  std::vector<std::shared_ptr<HTTPSPostBackend>> backends;
  for (int i = 0; i < 2; ++i) {
    backend_ = nullptr;
    decided();
    for (int k = 0; k < 20; ++k) send(5, {{"text", std::string(50000, 'x')}});
    backends.push_back(backend_);
  }
  WorkerPoolOptions options;
  options.runnable = 2;
  WorkerPool pool(options);
  for (const std::shared_ptr<HTTPSPostBackend>& backend : backends)
    SerialQueue::create("flushes", pool)->async([&flushed, backend] {
      backend->flushMessagesWithCompletion(nullptr);
      ++flushed;
    });
  ASSERT_TRUE(eventually([&] { return compressing == 1 && pool.figures().blocked == 1; }));
  SerialQueue::create("others", pool)->async([&] { otherRan = true; });
  EXPECT_TRUE(eventually([&] { return flushed == 2; }));
  EXPECT_TRUE(otherRan);
  pool.shutDown();
}

}  // namespace
}  // namespace kyt
