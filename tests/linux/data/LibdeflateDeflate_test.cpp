#include "platform/linux/data/LibdeflateDeflate.h"

#include <gtest/gtest.h>

#include <string>
#include <variant>
#include <vector>

#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/data/MakeDeflate.h"
#include "platform/linux/data/ZlibDeflate.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr int kGzip = 31;

std::unique_ptr<LibdeflateDeflate> loaded(int level = 6) {
  auto result = LibdeflateDeflate::load(level);
  if (const auto* problem = std::get_if<std::string>(&result)) ADD_FAILURE() << *problem;
  return std::move(std::get<std::unique_ptr<LibdeflateDeflate>>(result));
}

TEST(LibdeflateDeflate, UsesTheCompressorOfAnEndedStreamAgain) {
  const auto deflate = loaded();
  EXPECT_EQ(deflate->kept(), 0u);
  for (int round = 0; round < 3; ++round) {
    const auto stream = deflate->newStream();
    ASSERT_EQ(stream->initialize(kDeflateDefaultLevel, kGzip, 8), DeflateCode::ok);
    EXPECT_EQ(deflate->kept(), 0u) << "in use";
    stream->end();
    EXPECT_EQ(deflate->kept(), 1u);
  }
}

TEST(LibdeflateDeflate, KeepsFewCompressors) {
  const auto deflate = loaded();
  std::vector<std::unique_ptr<DeflateStream>> streams;
  for (size_t i = 0; i < 2 * LibdeflateDeflate::kMostKept; ++i) {
    streams.push_back(deflate->newStream());
    ASSERT_EQ(streams.back()->initialize(kDeflateDefaultLevel, kGzip, 8), DeflateCode::ok);
  }
  streams.clear();
  EXPECT_EQ(deflate->kept(), LibdeflateDeflate::kMostKept);
}

TEST(LibdeflateDeflate, KeepsNoCompressorOfAnotherLevelThanItsOwn) {
  const auto deflate = loaded(6);
  const auto stream = deflate->newStream();
  ASSERT_EQ(stream->initialize(1, kGzip, 8), DeflateCode::ok);
  stream->end();
  EXPECT_EQ(deflate->kept(), 0u);
}

TEST(LibdeflateDeflate, SaysWhatIsWrongWithALibraryThatCannotBeUsed) {
  const auto missing = LibdeflateDeflate::load(6, "libkytnosuch.so.7");
  ASSERT_TRUE(std::holds_alternative<std::string>(missing));
  EXPECT_NE(std::get<std::string>(missing).find("libkytnosuch.so.7"), std::string::npos);
  const auto another = LibdeflateDeflate::load(6, "libz.so.1");
  ASSERT_TRUE(std::holds_alternative<std::string>(another));
  EXPECT_NE(std::get<std::string>(another).find("libdeflate_alloc_compressor"), std::string::npos);
}

class ChosenDeflate : public testing::Test {
 protected:
  bool isZlib(const Deflate* deflate) { return dynamic_cast<const ZlibDeflate*>(deflate) != nullptr; }
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
};

TEST_F(ChosenDeflate, IsZlibUnlessTheSettingsSayOtherwise) {
  EXPECT_TRUE(isZlib(makeDeflate(CompressionSettings(), log_).get()));
  EXPECT_FALSE(isZlib(makeDeflate({CompressionLibrary::libdeflate, 6}, log_).get()));
  EXPECT_TRUE(sink_.lines().empty());
}

TEST_F(ChosenDeflate, IsZlibWithOneLineInTheLogWhereLibdeflateIsMissing) {
  const auto deflate = makeDeflate({CompressionLibrary::libdeflate, 6}, log_, "libkytnosuch.so.7");
  EXPECT_TRUE(isZlib(deflate.get()));
  ASSERT_EQ(sink_.lines().size(), 1u);
  EXPECT_EQ(sink_.lines()[0].level, LogLevel::normal);
  EXPECT_TRUE(sink_.contains("main: Compressing with zlib instead of libdeflate: libkytnosuch.so.7"));
}

}  // namespace
}  // namespace kyt
