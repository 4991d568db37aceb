// What keeping the books adds to an event, from the bytes of its call into its batch and out of it, and what a watcher adds that
// reads nothing.
#include <gtest/gtest.h>

#include <cstdio>
#include <memory>
#include <optional>

#include "bench/Corpus.h"
#include "bench/Pipeline.h"
#include "tests/bench/Instructions.h"
#include "tests/support/Sanitizers.h"

namespace kyt::bench {
namespace {

constexpr size_t kEvents = 8, kFields = 10;

std::optional<uint64_t> instructionsOfBatch(Pipeline& pipeline) {
  EXPECT_TRUE(pipeline.isLive());
  return instructionsOf([&pipeline] {
    pipeline.fillBatch();
    if (pipeline.batchedBytes() == 0) _exit(1);
    pipeline.discardBatch();
  });
}

TEST(CostOfTheBooks, IsAtMostThreePercentOfABatchedEvent) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's own instructions would count";
  Pipeline booked(ordinaryPayloads(kEvents, kFields)), notBooked(ordinaryPayloads(kEvents, kFields));
  notBooked.stopBooking();
  const auto with = instructionsOfBatch(booked), without = instructionsOfBatch(notBooked);
  if (!with || !without) GTEST_SKIP() << "no process may be traced here";
  std::printf("%llu instructions with the books, %llu without\n", static_cast<unsigned long long>(*with),
              static_cast<unsigned long long>(*without));
  EXPECT_GT(*without, kEvents * 1000) << "nothing can have been counted";
  EXPECT_GT(*with, *without) << "nothing was booked";
  EXPECT_LE(static_cast<double>(*with), 1.03 * static_cast<double>(*without));
}

TEST(CostOfTheBooks, GrowsLittleBesideAWatcherThatReadsNothing) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's own instructions would count";
  Pipeline alone(ordinaryPayloads(kEvents, kFields)), watched(ordinaryPayloads(kEvents, kFields));
  const std::unique_ptr<Watcher> deaf = watched.watch();
  while (deaf->takeLost() == 0) {  // until its ring is full
    watched.fillBatch();
    watched.discardBatch();
  }
  const auto with = instructionsOfBatch(watched), without = instructionsOfBatch(alone);
  if (!with || !without) GTEST_SKIP() << "no process may be traced here";
  std::printf("%llu instructions beside a watcher, %llu without\n", static_cast<unsigned long long>(*with),
              static_cast<unsigned long long>(*without));
  EXPECT_LE(static_cast<double>(*with), 1.05 * static_cast<double>(*without));
}

}  // namespace
}  // namespace kyt::bench
