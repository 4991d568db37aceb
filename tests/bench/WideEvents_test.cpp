// What an event costs without the compressor, from the bytes of its call to the text of its post, grows no faster than the
// number of its fields. Instructions are counted, one by one, so it is the same on every machine, whatever runs beside.
#include <gtest/gtest.h>
#include <unistd.h>

#include <optional>

#include "bench/Corpus.h"
#include "bench/Pipeline.h"
#include "tests/bench/Instructions.h"
#include "tests/support/Sanitizers.h"

namespace kyt::bench {
namespace {

std::optional<uint64_t> instructionsOfEvent(size_t fields) {
  Pipeline pipeline(ordinaryPayloads(1, fields));
  EXPECT_TRUE(pipeline.isLive());
  size_t bytes = 0;
  pipeline.fillBatch();
  bytes = pipeline.postBatch();
  EXPECT_GT(bytes, fields * 15);
  return instructionsOf([&pipeline] {
    pipeline.fillBatch();
    if (pipeline.postBatch() == 0) _exit(1);
  });
}

TEST(WideEvents, CostNoMoreAFieldTheMoreFieldsTheyHave) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's own instructions would count";
  std::vector<double> counts;
  for (const size_t fields : {125, 250, 500, 1000}) {
    const std::optional<uint64_t> count = instructionsOfEvent(fields);
    if (!count) GTEST_SKIP() << "no process may be traced here";
    std::printf("%zu fields: %llu instructions\n", fields, static_cast<unsigned long long>(*count));
    counts.push_back(static_cast<double>(*count));
  }
  const double eachOfFirst = (counts[1] - counts[0]) / 125;
  EXPECT_GT(eachOfFirst, 100) << "so much less than a field takes that nothing can have been counted";
  EXPECT_LT((counts[2] - counts[1]) / 250, 1.15 * eachOfFirst);
  EXPECT_LT((counts[3] - counts[2]) / 500, 1.15 * eachOfFirst);
}

}  // namespace
}  // namespace kyt::bench
