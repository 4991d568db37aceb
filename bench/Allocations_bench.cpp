// How many blocks one batched event takes from the allocator, from the bytes of its call to its place in the
// batch: framing, decoding, dispatch, the session, the HTTPS back end with the benchmarks' storebag. Every
// call of malloc, calloc and realloc in the process is counted, so nothing may run beside it. Prints the
// figure and ends with 1 when it is over the limit; runs as a test too.
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <span>
#include <string>
#include <vector>

#include "backends/BackendTable.h"
#include "bench/Corpus.h"
#include "platform/SerialQueue.h"
#include "platform/ipc/ClientSessionDispatcher.h"
#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/MessageReader.h"
#include "tests/session/SessionFixture.h"

namespace {

constexpr double kLimit = 12;
std::atomic<size_t> allocations{0};

}  // namespace

extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* block, size_t size);

void* malloc(size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_malloc(size);
}
void* calloc(size_t count, size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_calloc(count, size);
}
void* realloc(void* block, size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_realloc(block, size);
}
}

namespace kyt::bench {
namespace {

constexpr size_t kEvents = 48;  // of one batch, which none of them flushes
constexpr int kBatches = 20;

class Pipeline {
 public:
  Pipeline() {
    test_.log.setLevel(LogLevel::error);
    test_.deviceProperties.setCountryCode("DE");
    const Dictionary bag = benchBag("https://post.example.org/", 49);
    delegate_.storebag = *bag.find("vantu_internal")->dictionary();
    delegate_.storebagVersion = String("bench");
    session_->setSessionInfo(
        {{kKYTReportingSessionInfoSessionID, 1},
         {kKYTReportingSessionInfoClientType, 8},
         {kKYTReportingSessionInfoBatchEvent, true},
         {kKYTReportingSessionInfoRequireUserInfo, true}},
        Dictionary{{kKYTReportingUserInfoClientName, "bench"}, {kKYTReportingUserInfoServiceName, "bench"}},
        nullptr, false);
    session_->startConfigWithCompletionHandler(
        [this](const std::optional<Array>& states) { live_ = states && !states->empty(); });
    for (const Dictionary& payload : corpusPayloads(kEvents))
      appendEventCall(calls_.emplace_back(), 1000, 7, payload);
    flush();
  }
  ~Pipeline() { session_->dealloc(); }
  Pipeline(const Pipeline&) = delete;
  Pipeline& operator=(const Pipeline&) = delete;

  [[nodiscard]] bool isLive() const { return live_; }

  // A turn of a connection with one batch's events, as they lie in its buffer. The blocks it took, or nothing
  // when a call was refused.
  [[nodiscard]] std::optional<size_t> fillBatch() {
    const size_t before = allocations.load();
    {
      Turn turn;
      for (const std::string& call : calls_) {
        Message message;
        const Frame frame = readMessage(std::as_bytes(std::span(call)), 1048576, message);
        if (frame.status != FrameStatus::complete) return std::nullopt;
        if (dispatcher_.handle(message, {*session_, output_, {}, 1}) != nullptr) return std::nullopt;
      }
    }
    return allocations.load() - before;
  }
  // The events that were in the batch, by what their flush would report.
  void flush() {
    session_->flushMessagesWithCompletion(nullptr);
    test_.executor.runAll();
  }
  [[nodiscard]] uint64_t batchedBytes() const { return session_->batchedEventsSize(); }

 private:
  TestPlatform test_;
  DefaultBackendFactory factory_{test_.configuration, backendTable(test_.configuration)};
  RecordingMessageLog messageLog_;
  ReportingdSessionClass class_{test_.configuration, factory_, messageLog_};
  FakeSessionDelegate delegate_;
  std::shared_ptr<FakeConnection> connection_ =
      std::make_shared<FakeConnection>(SerialQueue::create("bench", test_.executor), 1000);
  std::shared_ptr<ReportingdSession> session_ =
      ReportingdSession::initWithSessionDelegate(delegate_, connection_, class_);
  ClientSessionDispatcher dispatcher_{test_.counters, {}};
  std::shared_ptr<ConnectionOutput> output_;  // no call expects a reply
  std::vector<std::string> calls_;
  bool live_ = false;
};

int run() {
  Pipeline pipeline;
  if (!pipeline.isLive()) {
    std::fprintf(stderr, "no back end is live\n");
    return 1;
  }
  size_t taken = 0;
  for (int batch = 0; batch < kBatches; ++batch) {
    const auto blocks = pipeline.fillBatch();
    if (!blocks || pipeline.batchedBytes() < kEvents * 100) {
      std::fprintf(stderr, "the events did not reach the batch\n");
      return 1;
    }
    if (batch > 0) taken += *blocks;  // the first one fills caches that stay
    pipeline.flush();
  }
  const double each = static_cast<double>(taken) / (kEvents * (kBatches - 1));
  std::printf("%-58s | %-26s | %-34s | %-18s | %s\n", "heap allocations for one batched event",
              std::to_string(each).substr(0, 5).c_str(), "", "at most 12",
              each <= kLimit ? "reached" : "MISSED");
  return each <= kLimit ? 0 : 1;
}

}  // namespace
}  // namespace kyt::bench

int main() {
  return kyt::bench::run();
}
