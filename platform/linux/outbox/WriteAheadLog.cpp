#include "platform/linux/outbox/WriteAheadLog.h"

#include <array>
#include <fstream>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

namespace kyt {
namespace {

// https://www.sqlite.org/fileformat2.html#walformat: numbers are big-endian, checksums by the byte order that the last bit of
// the magic number says.
constexpr size_t kHeaderBytes = 32, kFrameHeaderBytes = 24, kSummedOfFrameHeader = 8;
constexpr uint32_t kMagic = 0x377F0682;
constexpr uint32_t kMostPageBytes = 65536;

using Sum = std::pair<uint32_t, uint32_t>;

uint32_t number(std::string_view bytes, size_t at, bool isBigEndian = true) {
  uint32_t value = 0;
  for (size_t i = 0; i < 4; ++i)
    value = value << 8 | static_cast<unsigned char>(bytes[at + (isBigEndian ? i : 3 - i)]);
  return value;
}

Sum sumOf(std::string_view bytes, bool isBigEndian, Sum sum) {
  for (size_t at = 0; at + 8 <= bytes.size(); at += 8) {
    sum.first += number(bytes, at, isBigEndian) + sum.second;
    sum.second += number(bytes, at + 4, isBigEndian) + sum.first;
  }
  return sum;
}

}  // namespace

uint64_t lastWholeFrame(const std::string& log) {
  std::ifstream file(log, std::ios::binary);
  std::array<char, kHeaderBytes> headerBytes{};
  if (!file.read(headerBytes.data(), headerBytes.size())) return 0;
  const std::string_view header(headerBytes.data(), headerBytes.size());
  const bool isBigEndian = (number(header, 0) & 1U) != 0;
  const uint32_t pageBytes = number(header, 8);
  if ((number(header, 0) & ~1U) != kMagic || pageBytes < 512 || pageBytes > kMostPageBytes) return 0;
  std::vector<char> bytes(kFrameHeaderBytes + pageBytes);
  Sum before{number(header, 24), number(header, 28)};
  uint64_t last = 0;
  for (uint64_t frame = 1; file.read(bytes.data(), static_cast<std::streamsize>(bytes.size())); ++frame) {
    const std::string_view text(bytes.data(), bytes.size());
    const bool isOfThisLog = text.substr(8, 8) == header.substr(16, 8);
    const Sum sum = sumOf(text.substr(kFrameHeaderBytes), isBigEndian,
                          sumOf(text.substr(0, kSummedOfFrameHeader), isBigEndian, before));
    before = {number(text, 16), number(text, 20)};
    if (isOfThisLog && sum == before && number(text, 4) != 0) last = frame;
  }
  return last;
}

}  // namespace kyt
