#include "bench/Reference.h"

#include <gtest/gtest.h>
#include <libdeflate.h>

namespace kyt::bench {
namespace {

std::string message(int first) {
  std::string json = "{\"postTime\":1.5,\"events\":[";
  for (int i = 0; i < 300; ++i) {
    if (i > 0) json += ',';
    json += "{\"_method\":7,\"number\":" + std::to_string(first + i) + ",\"name\":\"event " +
            std::to_string((first + i) * 7919 % 10007) + "\"}";
  }
  return json + "]}";
}

std::string gzipped(const std::string& text, int level) {
  libdeflate_compressor* compressor = libdeflate_alloc_compressor(level);
  std::string out(libdeflate_gzip_compress_bound(compressor, text.size()), '\0');
  out.resize(libdeflate_gzip_compress(compressor, text.data(), text.size(), out.data(), out.size()));
  libdeflate_free_compressor(compressor);
  return out;
}

std::vector<std::string> bodies(int level) {
  std::vector<std::string> made;
  for (int i = 0; i < 5; ++i) made.push_back(gzipped(message(1000 * i), level));
  return made;
}

TEST(Reference, MakesBodiesAsSmallAsThoseThatArrived) {
  for (const int level : {1, 3, 6}) {
    const ReferenceFigures figures = measureReference(bodies(level), 0.01);
    EXPECT_EQ(figures.records, 1500u);
    EXPECT_EQ(figures.keysPerRecord, 3u);
    EXPECT_GT(figures.secondsPerRecord, 0);
    EXPECT_LE(figures.floorBytesPerRecord, 1.01 * figures.bytesPerRecord) << figures.compressor;
  }
}

TEST(Reference, TakesBodiesThatAreNotCompressed) {
  const ReferenceFigures figures = measureReference({message(1)}, 0.01);
  EXPECT_EQ(figures.records, 300u);
  EXPECT_LT(figures.floorBytesPerRecord, figures.bytesPerRecord);
  EXPECT_NEAR(figures.jsonBytesPerRecord, figures.bytesPerRecord, 1);
}

TEST(Reference, SaysNothingOfBodiesWithoutEvents) {
  EXPECT_EQ(measureReference({"", "{}", "{\"events\":[]}", "no JSON"}).records, 0u);
}

}  // namespace
}  // namespace kyt::bench
