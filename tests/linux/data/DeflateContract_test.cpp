// What holds for each library behind the compression port, against zlib's own inflate.
#include <gtest/gtest.h>
#include <zlib.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/Deflate.h"
#include "platform/fake/FaultyDeflate.h"
#include "tests/support/DeflateLibraries.h"

namespace kyt {
namespace {

constexpr int kGzip = 15 + 16, kZlib = 15;

std::string text(int pieces = 500) {
  std::string result;
  for (int i = 0; i < pieces; ++i) result += "event " + std::to_string(i % 17) + ";";
  return result;
}

std::string noise(size_t size) {
  std::string result(size, '\0');
  uint64_t state = 88172645463325252ULL;
  for (char& c : result) {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    c = static_cast<char>(state >> 32);
  }
  return result;
}

// "(broken)" when it is no complete stream of that kind, or something follows it.
std::string inflated(std::span<const std::byte> bytes, int windowBits) {
  z_stream stream{};
  EXPECT_EQ(inflateInit2(&stream, windowBits), Z_OK);
  std::string result(10000000, '\0');
  stream.next_in = const_cast<Bytef*>(reinterpret_cast<const Bytef*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  stream.next_out = reinterpret_cast<Bytef*>(result.data());
  stream.avail_out = static_cast<uInt>(result.size());
  const int status = inflate(&stream, Z_FINISH);
  result.resize(stream.total_out);
  const bool whole = status == Z_STREAM_END && stream.avail_in == 0;
  inflateEnd(&stream);
  return whole ? result : "(broken)";
}

class DeflateContract : public testing::TestWithParam<DeflateLibrary> {
 protected:
  // What a new stream makes of the text in one call.
  static std::vector<std::byte> compressed(Deflate& deflate, const std::string& source,
                                           int windowBits = kGzip, int level = kDeflateDefaultLevel) {
    const auto stream = deflate.newStream();
    EXPECT_EQ(stream->initialize(level, windowBits, 8), DeflateCode::ok);
    std::vector<std::byte> target(stream->bound(source.size()));
    std::span<const std::byte> input = std::as_bytes(std::span(source));
    std::span<std::byte> output(target);
    EXPECT_EQ(stream->finish(input, output), DeflateCode::streamEnd);
    EXPECT_TRUE(input.empty());
    EXPECT_EQ(stream->message(), nullptr);
    target.resize(target.size() - output.size());
    stream->end();
    return target;
  }
  const std::unique_ptr<Deflate> deflate_ = GetParam().make(6);
};

INSTANTIATE_TEST_SUITE_P(EachLibrary, DeflateContract, testing::ValuesIn(kDeflateLibraries), nameOfLibrary);

TEST_P(DeflateContract, MakesAGzipStreamInOneCallIntoItsBound) {
  const std::vector<std::byte> body = compressed(*deflate_, text());
  EXPECT_LT(body.size(), text().size() / 4);
  EXPECT_EQ(body[0], std::byte{0x1F});
  EXPECT_EQ(body[1], std::byte{0x8B});
  EXPECT_EQ(inflated(body, kGzip), text());
}

TEST_P(DeflateContract, MakesAZlibStreamWithA32KiBWindow) {
  const std::vector<std::byte> body = compressed(*deflate_, text(), kZlib);
  EXPECT_EQ(body[0], std::byte{0x78});
  EXPECT_EQ(inflated(body, kZlib), text());
}

TEST_P(DeflateContract, HasRoomInItsBoundForWhatDoesNotShrink) {
  for (const size_t size : {1U, 2U, 100U, 70000U, 1000000U})
    for (const int windowBits : {kGzip, kZlib})
      EXPECT_EQ(inflated(compressed(*deflate_, noise(size), windowBits), windowBits), noise(size));
}

TEST_P(DeflateContract, TakesLongTexts) {
  const std::string source = text(500000);
  EXPECT_EQ(inflated(compressed(*deflate_, source), kGzip), source);
}

TEST_P(DeflateContract, HasNineLevelsFromTheQuickestToTheSmallest) {
  size_t first = 0;
  size_t last = 0;
  for (int level = 1; level <= 9; ++level) {
    const std::vector<std::byte> body = compressed(*deflate_, text(5000), kGzip, level);
    EXPECT_EQ(inflated(body, kGzip), text(5000)) << level;
    if (level == 1) first = body.size();
    last = body.size();
  }
  EXPECT_LT(last, first);
}

TEST_P(DeflateContract, TakesTheLevelItWasMadeWithForTheDefault) {
  const std::string source = text(5000) + noise(1000);
  for (int level = 1; level <= 9; ++level) {
    const std::unique_ptr<Deflate> made = GetParam().make(level);
    EXPECT_EQ(compressed(*made, source), compressed(*deflate_, source, kGzip, level)) << level;
  }
}

TEST_P(DeflateContract, ReturnsZlibsCodesForWhatIsWrong) {
  const auto stream = deflate_->newStream();
  std::span<const std::byte> input;
  std::span<std::byte> output;
  EXPECT_EQ(stream->finish(input, output), DeflateCode::streamError) << "not initialised";
  EXPECT_EQ(stream->initialize(77, kGzip, 8), DeflateCode::streamError);
  EXPECT_EQ(stream->initialize(6, 99, 8), DeflateCode::streamError);
  EXPECT_EQ(stream->initialize(6, kGzip, 77), DeflateCode::streamError);
  stream->end();
  ASSERT_EQ(stream->initialize(6, kGzip, 8), DeflateCode::ok);
  EXPECT_EQ(stream->finish(input, output), DeflateCode::streamError) << "no room at all";
}

TEST_P(DeflateContract, RunsOutOfRoomThatIsShorterThanTheStream) {
  const auto stream = deflate_->newStream();
  ASSERT_EQ(stream->initialize(6, kGzip, 8), DeflateCode::ok);
  const std::string source = noise(1000);
  std::vector<std::byte> target(500);
  std::span<const std::byte> input = std::as_bytes(std::span(source));
  std::span<std::byte> output(target);
  int code = DeflateCode::ok;
  for (int calls = 0; code == DeflateCode::ok && calls < 3; ++calls) code = stream->finish(input, output);
  EXPECT_TRUE(code == DeflateCode::bufferError || code == DeflateCode::streamError) << code;
}

TEST_P(DeflateContract, BeginsAnotherStreamWhereOneWasGivenUp) {
  const auto stream = deflate_->newStream();
  ASSERT_EQ(stream->initialize(6, kGzip, 8), DeflateCode::ok);
  ASSERT_EQ(stream->initialize(kDeflateDefaultLevel, kZlib, 8), DeflateCode::ok);
  const std::string source = text();
  std::vector<std::byte> target(stream->bound(source.size()));
  std::span<const std::byte> input = std::as_bytes(std::span(source));
  std::span<std::byte> output(target);
  ASSERT_EQ(stream->finish(input, output), DeflateCode::streamEnd);
  stream->end();
  stream->end();
  target.resize(target.size() - output.size());
  EXPECT_EQ(inflated(target, kZlib), source);
}

TEST_P(DeflateContract, MakesTheSameOfATextOverWhatAnotherStreamLeftBehind) {
  const std::vector<std::byte> first = compressed(*deflate_, text());
  EXPECT_EQ(inflated(compressed(*deflate_, noise(50000)), kGzip), noise(50000));
  EXPECT_EQ(compressed(*deflate_, text()), first);
}

TEST_P(DeflateContract, ServesSeveralThreadsAtOnce) {
  const std::vector<std::byte> expected = compressed(*deflate_, text(2000));
  std::atomic<int> wrong{0};
  std::vector<std::jthread> threads;
  for (int i = 0; i < 4; ++i)
    threads.emplace_back([&] {
      for (int round = 0; round < 20; ++round)
        if (compressed(*deflate_, text(2000)) != expected) ++wrong;
    });
  threads.clear();
  EXPECT_EQ(wrong, 0);
}

TEST_P(DeflateContract, FailsAsToldBehindTheFake) {
  FaultyDeflate faulty(deflate_.get());
  faulty.faults.finish = {DeflateCode::bufferError};
  faulty.faults.message = "told to fail";
  const auto stream = faulty.newStream();
  EXPECT_EQ(stream->initialize(6, kGzip, 8), DeflateCode::ok);
  const std::string source = text();
  std::vector<std::byte> target(stream->bound(source.size()));
  std::span<const std::byte> input = std::as_bytes(std::span(source));
  std::span<std::byte> output(target);
  EXPECT_EQ(stream->finish(input, output), DeflateCode::bufferError);
  EXPECT_EQ(input.size(), source.size());
  EXPECT_STREQ(stream->message(), "told to fail");
  EXPECT_EQ(stream->finish(input, output), DeflateCode::streamEnd);
  stream->end();
  EXPECT_EQ(faulty.calls.windowBits, kGzip);
  EXPECT_EQ(faulty.calls.finished, 2);
  EXPECT_EQ(faulty.calls.ended, 1);
  faulty.faults.initialize = DeflateCode::memoryError;
  EXPECT_EQ(faulty.newStream()->initialize(6, kGzip, 8), DeflateCode::memoryError);
}

}  // namespace
}  // namespace kyt
