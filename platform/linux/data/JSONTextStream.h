// RapidJSON's output stream onto a std::string, by way of a buffer on the stack: appending single characters
// to a string costs a check of its capacity each, and growing it by resize() would fill what is about to be
// overwritten. Used by RapidJSON.cpp alone.
#pragma once

#include <bit>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace kyt {

class JSONTextStream {
 public:
  using Ch = char;

  explicit JSONTextStream(std::string& out) : out_(out), begin_(out.size()) {}
  JSONTextStream(const JSONTextStream&) = delete;
  JSONTextStream& operator=(const JSONTextStream&) = delete;
  ~JSONTextStream() { Flush(); }

  void Put(char c) {
    if (next_ == buffer_ + kSize) Flush();
    *next_++ = c;
  }
  void Flush() {
    out_.append(buffer_, static_cast<size_t>(next_ - buffer_));
    flushed_ = out_.size() - begin_;
    next_ = buffer_;
  }

  // Room for that many characters, kSize at most, to be taken with advance().
  char* room(size_t size) {
    if (static_cast<size_t>(buffer_ + kSize - next_) < size) Flush();
    return next_;
  }
  void advance(char* end) { next_ = end; }

  void append(std::string_view text) {
    if (text.size() > kSize) {
      Flush();
      out_.append(text);
      flushed_ += text.size();
      return;
    }
    char* to = room(text.size());
    if (!text.empty()) std::memcpy(to, text.data(), text.size());
    next_ = to + text.size();
  }

  // How much has been written since the stream was made, and a piece of that once more.
  [[nodiscard]] size_t position() const { return flushed_ + static_cast<size_t>(next_ - buffer_); }
  void repeat(size_t from, size_t size) {
    while (size != 0) {
      size_t now = size < kSize ? size : kSize;
      char* to = room(now);
      if (from < flushed_) {
        now = now < flushed_ - from ? now : flushed_ - from;
        std::memcpy(to, out_.data() + begin_ + from, now);
      } else {
        std::memcpy(to, buffer_ + (from - flushed_), now);
      }
      next_ = to + now;
      from += now;
      size -= now;
    }
  }

  // The text in quotation marks, escaped as RapidJSON escapes.
  void appendQuoted(std::string_view text) {
    if (text.size() <= kPiece) [[likely]] {
      char* to = room(6 * text.size() + kSlack);
      *to++ = '"';
      to = escaped(to, text.data(), text.size());
      *to++ = '"';
      next_ = to;
      return;
    }
    Put('"');
    for (; text.size() > kPiece; text.remove_prefix(kPiece))
      next_ = escaped(room(kSize), text.data(), kPiece);
    next_ = escaped(room(kSize), text.data(), text.size());
    Put('"');
  }

 private:
  static constexpr size_t kSize = 4096;
  // For the quotation marks, and since short ends are written as whole words.
  static constexpr size_t kSlack = 16;
  // Of a text: at most six characters are written for one.
  static constexpr size_t kPiece = (kSize - kSlack) / 6;

  // Whether one of eight characters must be escaped: below a blank, a quotation mark or a backslash.
  static bool anyEscaped(uint64_t word) {
    constexpr uint64_t kOnes = 0x0101010101010101U;
    constexpr uint64_t kHighs = 0x8080808080808080U;
    const auto hasZero = [](uint64_t v) { return (v - kOnes) & ~v & kHighs; };
    const uint64_t control = (word - kOnes * 0x20) & ~word & kHighs;
    return (control | hasZero(word ^ kOnes * '"') | hasZero(word ^ kOnes * '\\')) != 0;
  }

  static uint64_t load64(const char* from) {
    uint64_t word;
    std::memcpy(&word, from, sizeof word);
    return word;
  }

  // Writes the text and returns the end. It is copied by words as long as nothing in them is escaped; the
  // last word overlaps the one before, and a text shorter than a word is put together from overlapping
  // pieces.
  static char* escaped(char* to, const char* from, size_t size) {
    const char* const end = from + size;
    if (size < 8)
      return std::endian::native == std::endian::little ? shortText(to, from, size) : slowly(to, from, end);
    for (; end - from >= 8; from += 8, to += 8) {
      const uint64_t word = load64(from);
      if (anyEscaped(word)) return slowly(to, from, end);
      std::memcpy(to, &word, 8);
    }
    if (from == end) return to;
    const uint64_t last = load64(end - 8);
    if (anyEscaped(last)) return slowly(to, from, end);
    to += end - from;
    std::memcpy(to - 8, &last, 8);
    return to;
  }

  static char* shortText(char* to, const char* from, size_t size) {
    if (size == 0) return to;
    uint64_t word = ~uint64_t{0} << (8 * size);  // above the text, characters that are never escaped
    if (size >= 4) {
      uint32_t low;
      uint32_t high;
      std::memcpy(&low, from, 4);
      std::memcpy(&high, from + size - 4, 4);
      word |= low | static_cast<uint64_t>(high) << (8 * (size - 4));
    } else {
      const auto at = [from](size_t i) {
        return static_cast<uint64_t>(static_cast<unsigned char>(from[i])) << (8 * i);
      };
      word |= at(0) | at(size / 2) | at(size - 1);
    }
    if (anyEscaped(word)) return slowly(to, from, from + size);
    std::memcpy(to, &word, 8);
    return to + size;
  }

  static char* slowly(char* to, const char* from, const char* end) {
    while (from != end) {
      for (int i = 0; i < 8 && from != end; ++i) to = appendCharacter(to, *from++);
      for (; end - from >= 8; from += 8, to += 8) {
        const uint64_t word = load64(from);
        if (anyEscaped(word)) break;
        std::memcpy(to, &word, 8);
      }
    }
    return to;
  }

  static char* appendCharacter(char* to, char c) {
    const auto code = static_cast<unsigned char>(c);
    if (code >= 0x20 && c != '"' && c != '\\') [[likely]] {
      *to = c;
      return to + 1;
    }
    *to++ = '\\';
    switch (c) {
      case '"':
      case '\\':
        *to++ = c;
        break;
      case '\b':
        *to++ = 'b';
        break;
      case '\f':
        *to++ = 'f';
        break;
      case '\n':
        *to++ = 'n';
        break;
      case '\r':
        *to++ = 'r';
        break;
      case '\t':
        *to++ = 't';
        break;
      default:
        std::memcpy(to, "u00", 3);
        to[3] = static_cast<char>('0' + (code >> 4));
        to[4] = "0123456789ABCDEF"[code & 15];
        to += 5;
    }
    return to;
  }

  std::string& out_;
  const size_t begin_;  // in `out_`, where this stream began
  size_t flushed_ = 0;  // so much has gone there
  char* next_ = buffer_;
  char buffer_[kSize];
};

}  // namespace kyt
