#include "receiver/JSONCheck.h"

#include <rapidjson/error/en.h>
#include <rapidjson/reader.h>
#include <zlib.h>

#include <algorithm>
#include <array>
#include <utility>

#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

constexpr unsigned kParseFlags = rapidjson::kParseIterativeFlag | rapidjson::kParseValidateEncodingFlag;

// The text of a body, block by block, as RapidJSON reads it. At its end, or where it is wrong, it gives zeros.
class Text {
 public:
  using Ch = char;

  Text(std::string_view body, bool isGzip, uint64_t mostBytes)
      : left_(body), isGzip_(isGzip), mostBytes_(mostBytes) {
    if (isGzip_) {
      limit_ = mostInflatedBytes(body.size());
      stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
      stream_.avail_in = static_cast<uInt>(body.size());
      if (inflateInit2(&stream_, 15 + 16) != Z_OK) problem_ = "zlib cannot start";
    }
    fill();
  }
  ~Text() {
    if (isGzip_) inflateEnd(&stream_);
  }
  Text(const Text&) = delete;
  Text& operator=(const Text&) = delete;

  [[nodiscard]] char Peek() const { return at_ < block_.size() ? block_[at_] : '\0'; }
  char Take() {
    const char c = Peek();
    note(c);
    if (at_ < block_.size() && ++at_ == block_.size()) fill();
    return c;
  }
  [[nodiscard]] size_t Tell() const { return before_ + at_; }
  // For reading in place, which is not done.
  char* PutBegin() { return nullptr; }
  void Put(char) {}
  size_t PutEnd(char*) { return 0; }

  // All of the body was read, and nothing of it was wrong.
  [[nodiscard]] bool isAtEnd() const { return at_ == block_.size() && !problem_; }
  [[nodiscard]] const char* problem() const { return problem_; }
  [[nodiscard]] bool hasMore() const { return hasMore_; }
  [[nodiscard]] bool isStringTooLong() const { return stringBytes_ > Limits::maxJSONStringBytes; }

 private:
  // RapidJSON collects each string before it tells of it, so one that is too long ends the text.
  void note(char c) {
    if (!isInString_) {
      isInString_ = c == '"';
      stringBytes_ = 0;
    } else if (!std::exchange(isEscaped_, c == '\\' && !isEscaped_) && c == '"') {
      isInString_ = false;
    } else if (++stringBytes_ > Limits::maxJSONStringBytes && !problem_) {
      problem_ = "a string is too long";
      block_ = {};
      at_ = 0;
    }
  }
  void fill() {
    if (problem_) return;
    before_ += block_.size();
    at_ = 0;
    if (isGzip_) return inflateMore();
    block_ = std::exchange(left_, {});
    if (block_.size() > mostBytes_) setMore();
  }
  void setMore() {
    hasMore_ = true;
    problem_ = "it has more";
    block_ = {};
  }
  void inflateMore() {
    block_ = {};
    while (!problem_ && !isDone_ && block_.empty()) {
      stream_.next_out = reinterpret_cast<Bytef*>(room_.data());
      stream_.avail_out = static_cast<uInt>(room_.size());
      const int result = inflate(&stream_, Z_NO_FLUSH);
      const size_t made = room_.size() - stream_.avail_out;
      isDone_ = result == Z_STREAM_END;
      if (isDone_ && stream_.avail_in != 0) {
        problem_ = "bytes follow the end of the gzip body";
      } else if (result == Z_BUF_ERROR || (result == Z_OK && made == 0 && stream_.avail_in == 0)) {
        problem_ = "the gzip body ends early";
      } else if (result != Z_OK && !isDone_) {
        problem_ = "the body is no gzip";
      } else if (before_ + made > limit_) {
        problem_ = "the gzip body inflates to too much";
      } else if (before_ + made > mostBytes_) {
        setMore();
      } else {
        block_ = {room_.data(), made};
      }
    }
  }

  std::string_view left_, block_;
  const bool isGzip_;
  const uint64_t mostBytes_;
  bool hasMore_ = false;  // than these
  size_t at_ = 0, before_ = 0;
  uint64_t limit_ = 0;
  size_t stringBytes_ = 0;  // of the string that is being read, as it is written
  bool isInString_ = false, isEscaped_ = false;
  z_stream stream_{};
  bool isDone_ = false;
  const char* problem_ = nullptr;
  std::array<char, 32768> room_{};
};

// What a message may hold, told piece by piece. Its depth counts the objects and arrays that are open.
class Shape : public rapidjson::BaseReaderHandler<rapidjson::UTF8<>, Shape> {
 public:
  bool Default() { return depth_ != 0 ? isNoRecordWanted() : wrong("the message is no object"); }
  bool Null() { return isInRecord() ? wrong("a value of a record is null") : Default(); }
  bool Key(const char* text, rapidjson::SizeType size, bool) {
    isEvents_ = depth_ == 1 && std::string_view(text, size) == "events";
    return true;
  }
  bool StartObject() {
    if (isInRecord()) return wrong("a value of a record is no string, number or boolean");
    return deeper();
  }
  bool StartArray() {
    if (depth_ == 0) return wrong("the message is no object");
    if (isInRecord()) return wrong("a value of a record is no string, number or boolean");
    if (depth_ == 1 && isEvents_) isInEvents_ = true;
    return depth_ == 1 && isEvents_ ? (++depth_, true) : isNoRecordWanted() && deeper();
  }
  bool EndObject(rapidjson::SizeType) { return --depth_, true; }
  bool EndArray(rapidjson::SizeType) {
    if (--depth_ == 1) isInEvents_ = false;
    return true;
  }
  [[nodiscard]] const char* problem() const { return problem_; }

 private:
  [[nodiscard]] bool isInRecord() const { return isInEvents_ && depth_ >= 3; }
  bool isNoRecordWanted() {
    if (isInEvents_ && depth_ == 2) return wrong("an entry of \"events\" is no object");
    if (depth_ == 1 && isEvents_) return wrong("\"events\" is no array");
    return true;
  }
  bool deeper() {
    if (depth_ == 1 && isEvents_) return wrong("\"events\" is no array");
    return ++depth_ <= Limits::maxJSONDepth || wrong("the JSON is nested too deeply");
  }
  bool wrong(const char* what) {
    problem_ = what;
    return false;
  }

  unsigned depth_ = 0;
  bool isEvents_ = false, isInEvents_ = false;
  const char* problem_ = nullptr;
};

}  // namespace

uint64_t mostInflatedBytes(size_t compressed) {
  const uint64_t usual = std::max(uint64_t{compressed} * Limits::maxInflation, Limits::leastInflatedBytes);
  return std::min(usual, Limits::maxInflatedBytes);
}

std::optional<PostProblem> problemOfPost(std::string_view body, bool isGzip) {
  return lookAtPost(body, isGzip, ~uint64_t{0}).problem;
}

PostLook lookAtPost(std::string_view body, bool isGzip, uint64_t mostBytes) {
  Text text(body, isGzip, mostBytes);
  Shape shape;
  rapidjson::Reader reader;
  const rapidjson::ParseResult result = reader.Parse<kParseFlags>(text, shape);
  if (text.hasMore()) return {true, {}};
  const auto wrong = [](bool isOfGzip, std::string what) {
    return PostLook{false, PostProblem{isOfGzip, std::move(what)}};
  };
  if (text.problem() != nullptr) return wrong(!text.isStringTooLong(), text.problem());
  if (shape.problem() != nullptr) return wrong(false, shape.problem());
  if (result.IsError())
    return wrong(false, "the JSON is malformed at byte " + std::to_string(result.Offset()) + ": " +
                            rapidjson::GetParseError_En(result.Code()));
  if (!text.isAtEnd()) return wrong(false, "the JSON ends before the body");
  return {};
}

}  // namespace kyt::receiver
