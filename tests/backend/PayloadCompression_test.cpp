// Compression of request bodies with each library, against zlib's own inflate, and each failure of it.
#include "backend/PayloadCompression.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include "tests/support/DeflateLibraries.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

Bytes bytesOf(std::string_view text) {
  return std::as_bytes(std::span(text));
}

// Inflates a complete stream; empty when zlib does not accept it.
std::string inflated(const Data& data, int windowBits, size_t expected) {
  std::string out(expected + 1, '\0');
  z_stream stream{};
  if (inflateInit2(&stream, windowBits) != Z_OK) return {};
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<std::byte*>(data.bytes().data()));
  stream.avail_in = static_cast<uInt>(data.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int code = inflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return code == Z_STREAM_END && stream.avail_in == 0 ? out : std::string();
}

class CompressingPlatform {
 protected:
  explicit CompressingPlatform(const DeflateLibrary& library) : library_(library.make(6)) {
    platform_.deflate.standInFrontOf(*library_);
  }
  std::vector<std::string> errors() const {
    std::vector<std::string> texts;
    for (const auto& line : platform_.sink.lines())
      if (line.level == LogLevel::error) texts.push_back(line.line);
    return texts;
  }
  const std::unique_ptr<Deflate> library_;
  TestPlatform platform_;
};

class PayloadCompressionTest : public testing::TestWithParam<DeflateLibrary>, protected CompressingPlatform {
 protected:
  PayloadCompressionTest() : CompressingPlatform(GetParam()) {}
};

INSTANTIATE_TEST_SUITE_P(EachLibrary, PayloadCompressionTest, testing::ValuesIn(kDeflateLibraries),
                         nameOfLibrary);

TEST_P(PayloadCompressionTest, RefusesAnEmptyBuffer) {
  EXPECT_FALSE(gzipDeflate(platform_.platform, {}));
  EXPECT_EQ(errors(), std::vector<std::string>{"compressDataWithZlibOrGzip: Cannot compress empty Bytebuf"});
}

TEST_P(PayloadCompressionTest, MakesAGzipStreamThatZlibReads) {
  const std::string input(10000, 'k');
  const std::optional<Data> output = gzipDeflate(platform_.platform, bytesOf(input));
  ASSERT_TRUE(output);
  EXPECT_EQ(output->view().substr(0, 2), "\x1F\x8B");
  EXPECT_EQ(inflated(*output, 31, input.size()), input);
  EXPECT_TRUE(platform_.sink.contains(
      LogLevel::normal,
      "compressDataWithZlibOrGzip: Compressed file from 10000 to " + std::to_string(output->size())));
  EXPECT_EQ(platform_.deflate.calls.level, -1);
  EXPECT_EQ(platform_.deflate.calls.windowBits, 31);
  EXPECT_EQ(platform_.deflate.calls.memoryLevel, 8);
  EXPECT_EQ(platform_.deflate.calls.ended, 1);
}

TEST_P(PayloadCompressionTest, MakesAZlibStreamWithA32KiBWindow) {
  const std::optional<Data> output =
      compressDataWithZlibOrGzip(platform_.platform, false, bytesOf("telemetry"));
  ASSERT_TRUE(output);
  EXPECT_EQ(output->view().substr(0, 1), "\x78");
  EXPECT_EQ(inflated(*output, 15, 9), "telemetry");
}

TEST_P(PayloadCompressionTest, CompressesWhatDoesNotShrink) {
  const std::optional<Data> output = gzipDeflate(platform_.platform, bytesOf("x"));
  ASSERT_TRUE(output);
  EXPECT_GT(output->size(), 1u);
  EXPECT_EQ(inflated(*output, 31, 1), "x");
}

TEST_P(PayloadCompressionTest, KeepsNoMoreMemoryThanTheOutputTakes) {
  const std::string input(100000, 'k');
  const std::optional<Data> output = gzipDeflate(platform_.platform, bytesOf(input));
  ASSERT_TRUE(output);
  EXPECT_LT(platform_.memory.blockSize(output->block()), output->size() + 64);
}

struct ErrorText {
  int code;
  const char* text;
};

using LibraryAndError = std::tuple<DeflateLibrary, ErrorText>;

class CompressionErrorTest : public testing::TestWithParam<LibraryAndError>, protected CompressingPlatform {
 protected:
  CompressionErrorTest() : CompressingPlatform(std::get<DeflateLibrary>(GetParam())) {}
  static const ErrorText& wanted() { return std::get<ErrorText>(GetParam()); }
};

class InitializationErrorTest : public CompressionErrorTest {};

TEST_P(InitializationErrorTest, IsLoggedWithItsText) {
  platform_.deflate.faults.initialize = wanted().code;
  platform_.deflate.faults.message = "broken";
  EXPECT_FALSE(gzipDeflate(platform_.platform, bytesOf("x")));
  EXPECT_EQ(errors(),
            std::vector<std::string>{std::string("compressDataWithZlibOrGzip: deflateInit2() Error: \"") +
                                     wanted().text + "\" Message: \"broken\""});
}

INSTANTIATE_TEST_SUITE_P(
    EveryCode, InitializationErrorTest,
    testing::Combine(
        testing::ValuesIn(kDeflateLibraries),
        testing::Values(
            ErrorText{-6, "The version of zlib.h and the version of the library linked do not match."},
            ErrorText{-5, "Unknown error code."}, ErrorText{-4, "Insufficient memory."},
            ErrorText{-3, "Unknown error code."}, ErrorText{-2, "Invalid parameter passed in to function."},
            ErrorText{-1, "Unknown error code."}, ErrorText{-99, "Unknown error code."})));

class DeflateErrorTest : public CompressionErrorTest {};

TEST_P(DeflateErrorTest, IsLoggedWithItsTextAndEndsTheStream) {
  platform_.deflate.faults.finish = {wanted().code};
  platform_.deflate.faults.message = "broken";
  EXPECT_FALSE(gzipDeflate(platform_.platform, bytesOf("x")));
  EXPECT_EQ(errors(),
            std::vector<std::string>{
                std::string("compressDataWithZlibOrGzip: zlib error while attempting compression: \"") +
                wanted().text + "\" Message: \"broken\""});
  EXPECT_EQ(platform_.deflate.calls.ended, 1);
}

INSTANTIATE_TEST_SUITE_P(
    EveryCode, DeflateErrorTest,
    testing::Combine(
        testing::ValuesIn(kDeflateLibraries),
        testing::Values(
            ErrorText{-6, "The version of zlib.h and the version of the library linked do not match."},
            ErrorText{-5, "Ran out of output buffer for writing compressed bytes."},
            ErrorText{-4, "Memory could not be allocated for processing."},
            ErrorText{-3, "The deflate data was invalid or incomplete."},
            ErrorText{-2, "The stream state was inconsistent (e.g., next_in or next_out was NULL)."},
            ErrorText{-1, "Error occured while reading file."}, ErrorText{-99, "Unknown error code."},
            ErrorText{2, "Unknown error code."})));

TEST_P(PayloadCompressionTest, GoesOnWhenDeflateAsksForMore) {
  platform_.deflate.faults.finish = {0, 0};
  const std::optional<Data> output = gzipDeflate(platform_.platform, bytesOf("telemetry"));
  ASSERT_TRUE(output);
  EXPECT_EQ(inflated(*output, 31, 9), "telemetry");
  EXPECT_EQ(platform_.deflate.calls.finished, 3);
}

TEST_P(PayloadCompressionTest, ReportsABoundThatIsTooSmall) {
  platform_.deflate.faults.bound = 1;
  EXPECT_FALSE(gzipDeflate(platform_.platform, bytesOf("telemetry")));
  EXPECT_EQ(errors().size(), 1u);
  EXPECT_TRUE(platform_.sink.contains("Ran out of output buffer for writing compressed bytes."));
}

TEST_P(PayloadCompressionTest, ShowsAMissingMessageAndAMissingStream) {
  platform_.deflate.faults.noStream = true;
  EXPECT_FALSE(gzipDeflate(platform_.platform, bytesOf("x")));
  EXPECT_EQ(
      errors(),
      std::vector<std::string>{
          "compressDataWithZlibOrGzip: deflateInit2() Error: \"Insufficient memory.\" Message: \"(null)\""});
}

}  // namespace
}  // namespace kyt
