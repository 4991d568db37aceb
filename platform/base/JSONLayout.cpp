#include "platform/base/JSONLayout.h"

#include <bit>
#include <cstdint>
#include <cstring>

namespace kyt {
namespace {

constexpr uint64_t kOnes = 0x0101010101010101U;
constexpr uint64_t kHighs = 0x8080808080808080U;

// The high bit of each byte that is `c`; above the first such byte others may be marked too.
uint64_t marksOf(uint64_t word, char c) {
  const uint64_t differs = word ^ (kOnes * static_cast<unsigned char>(c));
  return (differs - kOnes) & ~differs & kHighs;
}

class Layout {
 public:
  Layout(std::string& out, std::string_view compact)
      : out_(out), next_(compact.data()), end_(compact.data() + compact.size()) {}

  void run() {
    while (next_ != end_) {
      const char c = *next_++;
      switch (c) {
        case '"':
          text();
          break;
        case '{':
        case '[':
          open(c);
          break;
        case '}':
        case ']':
          if (depth_ != 0) --depth_;
          line();
          put(c);
          break;
        case ',':
          put(c);
          line();
          break;
        case ':':
          put(c);
          put(' ');
          break;
        default:
          put(c);
      }
    }
    flush();
  }

 private:
  static constexpr size_t kSize = 4096, kIndent = 4;

  void flush() {
    out_.append(buffer_, used_);
    used_ = 0;
  }
  void put(char c) {
    if (used_ == kSize) flush();
    buffer_[used_++] = c;
  }
  void open(char c) {
    put(c);
    if (next_ != end_ && (*next_ == '}' || *next_ == ']')) {
      put(*next_++);
      return;
    }
    ++depth_;
    line();
  }
  void line() {
    put('\n');
    for (size_t left = depth_ * kIndent; left != 0;) {
      if (used_ == kSize) flush();
      const size_t now = left < kSize - used_ ? left : kSize - used_;
      std::memset(buffer_ + used_, ' ', now);
      used_ += now;
      left -= now;
    }
  }
  // From behind the opening quotation mark to the closing one, by words as long as there is neither that nor a backslash.
  void text() {
    put('"');
    while (next_ != end_) {
      if (end_ - next_ >= 8 && std::endian::native == std::endian::little) {
        uint64_t word;
        std::memcpy(&word, next_, sizeof word);
        const uint64_t marks = marksOf(word, '"') | marksOf(word, '\\');
        if (kSize - used_ < sizeof word) flush();
        std::memcpy(buffer_ + used_, &word, sizeof word);
        const size_t plain = marks == 0 ? sizeof word : static_cast<size_t>(std::countr_zero(marks)) / 8;
        used_ += plain;
        next_ += plain;
        if (marks == 0) continue;
      }
      const char c = *next_++;
      put(c);
      if (c == '"') return;
      if (c == '\\' && next_ != end_) put(*next_++);
    }
  }

  std::string& out_;
  const char* next_;
  const char* const end_;
  size_t depth_ = 0, used_ = 0;
  char buffer_[kSize];
};

}  // namespace

void appendLaidOutJSON(std::string& out, std::string_view compact) {
  out.reserve(out.size() + compact.size() / 8 * 14);  // what records of short entries come to
  Layout(out, compact).run();
}

}  // namespace kyt
