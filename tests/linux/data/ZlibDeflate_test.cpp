#include "platform/linux/data/ZlibDeflate.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include <functional>
#include <string>
#include <vector>

#include "platform/fake/FaultyDeflate.h"

namespace kyt {
namespace {

constexpr int kGzip = 15 + 16;

std::string text() {
  std::string result;
  for (int i = 0; i < 500; ++i) result += "event " + std::to_string(i % 17) + ";";
  return result;
}

std::string inflated(std::span<const std::byte> bytes) {
  z_stream stream{};
  EXPECT_EQ(inflateInit2(&stream, 15 + 32), Z_OK);
  std::string result(100000, '\0');
  stream.next_in = const_cast<Bytef*>(reinterpret_cast<const Bytef*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  stream.next_out = reinterpret_cast<Bytef*>(result.data());
  stream.avail_out = static_cast<uInt>(result.size());
  EXPECT_EQ(inflate(&stream, Z_FINISH), Z_STREAM_END);
  result.resize(stream.total_out);
  inflateEnd(&stream);
  return result;
}

TEST(ZlibDeflate, GoesOnWhereTheOutputWasFull) {
  ZlibDeflate deflate;
  const auto stream = deflate.newStream();
  ASSERT_EQ(stream->initialize(9, 15, 9), Z_OK);
  const std::string source = text();
  std::span<const std::byte> input = std::as_bytes(std::span(source));
  std::vector<std::byte> target;
  int result = Z_OK;
  int calls = 0;
  while (result == Z_OK && ++calls < 10000) {
    std::byte piece[10];
    std::span<std::byte> output(piece);
    result = stream->finish(input, output);
    target.insert(target.end(), piece, piece + (sizeof piece - output.size()));
  }
  EXPECT_EQ(result, Z_STREAM_END);
  EXPECT_GT(calls, 2);
  EXPECT_EQ(inflated(target), source);
}

TEST(FaultyDeflate, CopiesWithoutARealOneBehindIt) {
  FaultyDeflate deflate;
  const auto stream = deflate.newStream();
  EXPECT_EQ(stream->initialize(6, kGzip, 8), Z_OK);
  std::byte source[3] = {std::byte{1}, std::byte{2}, std::byte{3}};
  std::byte target[2] = {};
  std::span<const std::byte> input(source);
  std::span<std::byte> output(target);
  EXPECT_EQ(stream->finish(input, output), Z_OK);
  EXPECT_EQ(input.size(), 1U);
  EXPECT_EQ(target[1], std::byte{2});
}

// Compresses `source` with a new stream and returns what came out, decompressed.
std::string roundTrip(ZlibDeflate& deflate, const std::string& source, int level = -1, int memoryLevel = 8) {
  const auto stream = deflate.newStream();
  EXPECT_EQ(stream->initialize(level, kGzip, memoryLevel), Z_OK);
  std::vector<std::byte> target(stream->bound(source.size()));
  std::span<const std::byte> input = std::as_bytes(std::span(source));
  std::span<std::byte> output(target);
  EXPECT_EQ(stream->finish(input, output), Z_STREAM_END);
  target.resize(target.size() - output.size());
  return inflated(target);
}

TEST(ZlibDeflate, UsesTheWorkspaceOfAnEndedStreamAgain) {
  ZlibDeflate deflate;
  EXPECT_EQ(deflate.kept(), 0u);
  const std::string first = text();
  EXPECT_EQ(roundTrip(deflate, first), first);
  EXPECT_EQ(deflate.kept(), 1u);
  const std::string second(50000, 'x');  // another text, over what the first left behind
  EXPECT_EQ(roundTrip(deflate, second), second);
  EXPECT_EQ(roundTrip(deflate, first), first);
  EXPECT_EQ(deflate.kept(), 1u);
}

TEST(ZlibDeflate, KeepsFewWorkspaces) {
  ZlibDeflate deflate;
  std::vector<std::unique_ptr<DeflateStream>> streams;
  for (size_t i = 0; i < 2 * ZlibDeflate::kMostKept; ++i) {
    streams.push_back(deflate.newStream());
    ASSERT_EQ(streams.back()->initialize(-1, kGzip, 8), Z_OK);
  }
  streams.clear();
  EXPECT_EQ(deflate.kept(), ZlibDeflate::kMostKept);
}

TEST(ZlibDeflate, TakesFromTheHeapWhatALargerSettingNeeds) {
  ZlibDeflate deflate;
  const std::string source = text();
  EXPECT_EQ(roundTrip(deflate, source, 9, 9), source);
  EXPECT_EQ(roundTrip(deflate, source), source);
}

TEST(ZlibDeflate, GivesTheWorkspaceBackWhenItsSettingsAreRefused) {
  ZlibDeflate deflate;
  const auto stream = deflate.newStream();
  EXPECT_EQ(stream->initialize(77, kGzip, 8), Z_STREAM_ERROR);
  EXPECT_EQ(deflate.kept(), 1u);
  EXPECT_EQ(stream->initialize(-1, kGzip, 8), Z_OK);
  EXPECT_EQ(deflate.kept(), 0u);
}

}  // namespace
}  // namespace kyt
