// Bytes on their way to a client, in the order in which they were added. They lie in blocks of some 64 KiB: what waits for
// a client that does not read can be megabytes, and one text of that size would be copied as it grows, and mapped by the
// kernel anew each time. Nothing is kept of what was written. One thread at a time.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace kyt {

class OutgoingBytes {
 public:
  // The text to whose end the next message is added, whole. Valid until the next call of anything here.
  [[nodiscard]] std::string& end();
  [[nodiscard]] bool empty() const { return size() == 0; }
  [[nodiscard]] size_t size() const { return fullBytes_ + last_.size() - written_; }
  // What is written next: empty only when there is nothing.
  [[nodiscard]] std::string_view front() const;
  // So many bytes of front() are written.
  void remove(size_t bytes);
  void clear() { *this = OutgoingBytes(); }

 private:
  static constexpr size_t kFull = 65536;         // a block of that size takes no other message
  static constexpr size_t kRoom = kFull + 8192;  // of a new one, so that it seldom grows

  [[nodiscard]] bool hasFull() const { return next_ < full_.size(); }
  std::vector<std::string> full_;  // before last_; those before next_ are written
  size_t next_ = 0;
  size_t fullBytes_ = 0;  // in full_, from next_
  std::string last_;
  size_t written_ = 0;  // of the first block that is not all written
};

}  // namespace kyt
