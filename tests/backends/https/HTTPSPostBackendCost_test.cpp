// What one batched event costs the back end in heap blocks and in memory. Counts every allocation of this
// thread between two points; under the sanitizers, which bring an allocator of their own, it is skipped.
#include <malloc.h>

#include "tests/backends/https/HTTPSFixture.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define KYT_COUNTS_ALLOCATIONS 0
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define KYT_COUNTS_ALLOCATIONS 0
#endif
#endif
#ifndef KYT_COUNTS_ALLOCATIONS
#define KYT_COUNTS_ALLOCATIONS 1
#endif

namespace {
thread_local bool counting = false;
thread_local long blocks = 0;
thread_local long bytes = 0;
}  // namespace

#if KYT_COUNTS_ALLOCATIONS
extern "C" {
void* __libc_malloc(size_t size);
void __libc_free(void* block);

void* malloc(size_t size) {
  void* block = __libc_malloc(size);
  if (counting && block != nullptr) {
    ++blocks;
    bytes += static_cast<long>(malloc_usable_size(block) + sizeof(size_t));
  }
  return block;
}

void free(void* block) {
  if (counting && block != nullptr) bytes -= static_cast<long>(malloc_usable_size(block) + sizeof(size_t));
  __libc_free(block);
}
}
#endif

namespace kyt {
namespace {

constexpr int kEvents = 1000;

class HTTPSPostBackendCost : public HTTPSFixture {
 protected:
  // As it comes from the decoder: nothing of a call is shared with the one before.
  static Dictionary envelope(int i) {
    return {{kKYTReportingMessageBlobClientData, Dictionary{{"event", "call-ended"},
                                                            {"reason", "remote hung up, no retry"},
                                                            {"duration", 12.5 + i},
                                                            {"bytesSent", 123456 + i},
                                                            {"bytesReceived", 654321},
                                                            {"codec", "h265"},
                                                            {"network", "wifi"},
                                                            {"lossRate", 0.0125},
                                                            {"peer", "b1946ac92492d2347c6235b4d2611184"},
                                                            {"attempt", 3}}}};
  }
  void SetUp() override {
    if (!KYT_COUNTS_ALLOCATIONS) GTEST_SKIP() << "a sanitizer's allocator is in use";
    entry_.set("event_threshold", 1 << 30);
    entry_.set("filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}},
                                Dictionary{{"key", "email"}, {"action", "sha256"}},
                                Dictionary{{"key", "codecs"}, {"action", "remove"}, {"method", 5}}});
    platform_.log.setLevel(LogLevel::normal);
    decided();
    for (int i = 0; i < 10; ++i) send(5);  // what is made once
    blocks = bytes = 0;
  }
  void sendOne(const Dictionary& message) {
    backend().sendMessage(message, TimeValue{1000000025, 500000}, 5, 2, MessageFlag{0});
  }
  double perEvent(const char* what, long total) {
    const double figure = static_cast<double>(total) / kEvents;
    RecordProperty(what, std::to_string(figure));
    return figure;
  }
};

TEST_F(HTTPSPostBackendCost, OneBatchedEventIsOneBlockOfItsOwn) {
  std::vector<Dictionary> messages;
  for (int i = 0; i < kEvents; ++i) messages.push_back(envelope(i));
  Turn turn;
  counting = true;
  for (const Dictionary& message : messages) sendOne(message);
  turn.runDeferred();
  counting = false;
  EXPECT_LT(perEvent("blocksPerEvent", blocks), 1.1);  // the batch itself grows now and then
}

TEST_F(HTTPSPostBackendCost, OneBatchedEventHoldsAtMost1536Bytes) {
  Turn turn;
  counting = true;
  for (int i = 0; i < kEvents; ++i) sendOne(envelope(i));
  turn.runDeferred();
  counting = false;
  EXPECT_LT(perEvent("bytesPerEvent", bytes), 1536);
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(events(0).size(), static_cast<size_t>(kEvents + 10));
}

}  // namespace
}  // namespace kyt
