#include "platform/linux/outbox/PostRecord.h"

#include <utility>

namespace kyt {
namespace {

constexpr uint64_t kByConsent = 1, kCellular = 2;
constexpr uint64_t kInternal = 1, kOther = 2;
constexpr int64_t kLatest = 253402300799;  // the end of the year 9999

uint64_t checksum(std::initializer_list<std::string_view> parts) {
  constexpr uint64_t kPrime = 1099511628211U;
  uint64_t sum = 14695981039346656037U;
  for (const std::string_view part : parts)
    for (const char c : part) sum = (sum ^ static_cast<unsigned char>(c)) * kPrime;
  return sum;
}

class Writer {
 public:
  void number(uint64_t value) {
    while (value >= 0x80) {
      text_ += static_cast<char>(0x80 | (value & 0x7F));
      value >>= 7;
    }
    text_ += static_cast<char>(value);
  }
  void text(std::string_view value) {
    number(value.size());
    text_ += value;
  }
  [[nodiscard]] std::string take() { return std::move(text_); }

 private:
  std::string text_;
};

class Reader {
 public:
  explicit Reader(std::string_view text) : left_(text) {}
  uint64_t number() {
    uint64_t value = 0;
    for (unsigned shift = 0; shift < 64 && !left_.empty(); shift += 7) {
      const auto byte = static_cast<unsigned char>(left_.front());
      left_.remove_prefix(1);
      value |= uint64_t{byte & 0x7FU} << shift;
      if (byte < 0x80) return value;
    }
    isWrong_ = true;
    return 0;
  }
  uint32_t number32() {
    const uint64_t value = number();
    if (value > UINT32_MAX) isWrong_ = true;
    return static_cast<uint32_t>(value);
  }
  std::string text() {
    const uint64_t size = number();
    if (size > left_.size()) isWrong_ = true;
    if (isWrong_) return {};
    std::string value(left_.substr(0, size));
    left_.remove_prefix(size);
    return value;
  }
  // How many entries follow: each has a byte at least.
  uint64_t count() {
    const uint64_t entries = number();
    if (entries > left_.size()) isWrong_ = true;
    return isWrong_ ? 0 : entries;
  }
  [[nodiscard]] bool isWhole() const { return !isWrong_ && left_.empty(); }

 private:
  std::string_view left_;
  bool isWrong_ = false;
};

}  // namespace

std::string postRecord(const StoredPost& post) {
  Writer writer;
  writer.number(static_cast<uint64_t>(post.keptAt));
  writer.number(post.user);
  writer.number((post.isByConsent ? kByConsent : 0) | (post.allowsCellularAccess ? kCellular : 0));
  writer.text(post.url);
  writer.text(post.identity);
  writer.text(post.sourceApplication);
  writer.number(post.events.size());
  for (const auto& [row, events] : post.events) {
    writer.number(events);
    writer.number(row.program.user);
    writer.number(static_cast<uint32_t>(row.program.clientType));
    writer.number((row.isInternal ? kInternal : 0) | (row.isOther ? kOther : 0));
    writer.text(row.program.clientName);
    writer.text(row.program.service);
    writer.text(row.backEnd);
  }
  writer.number(post.headers.size());
  for (const auto& [name, value] : post.headers) {
    writer.text(name);
    writer.text(value);
  }
  return writer.take();
}

std::optional<StoredPost> readPostRecord(std::string_view record) {
  Reader reader(record);
  StoredPost post;
  post.keptAt = static_cast<int64_t>(reader.number());
  post.user = reader.number32();
  const uint64_t flags = reader.number();
  post.isByConsent = (flags & kByConsent) != 0;
  post.allowsCellularAccess = (flags & kCellular) != 0;
  post.url = reader.text();
  post.identity = reader.text();
  post.sourceApplication = reader.text();
  for (uint64_t left = reader.count(); left > 0; --left) {
    BookedEvents::OfRow& events = post.events.emplace_back();
    events.events = reader.number32();
    events.row.program.user = reader.number32();
    events.row.program.clientType = static_cast<int32_t>(reader.number32());
    const uint64_t kind = reader.number();
    events.row.isInternal = (kind & kInternal) != 0;
    events.row.isOther = (kind & kOther) != 0;
    events.row.program.clientName = reader.text();
    events.row.program.service = reader.text();
    events.row.backEnd = reader.text();
  }
  for (uint64_t left = reader.count(); left > 0; --left) {
    std::string name = reader.text();
    post.headers.emplace_back(std::move(name), reader.text());
  }
  const bool isPossible = post.keptAt >= 0 && post.keptAt <= kLatest;
  if (!reader.isWhole() || !isPossible) return std::nullopt;
  return post;
}

uint64_t postChecksum(std::string_view record, std::string_view body) {
  return checksum({record, body});
}

uint64_t postHeadChecksum(int64_t number, std::string_view record) {
  return checksum({std::to_string(number), record});
}

}  // namespace kyt
