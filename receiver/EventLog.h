// The distributed log, as the receiver sees it: messages go in and are acknowledged. A port: the real ones are in
// receiver/nats/ and receiver/kafka/, tests have one in memory.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace kyt::receiver {

// A post on its way: its body as it came, its facts as headers. Never changed once it is published.
struct LogMessage {
  std::string id;  // SHA-256 of the body in hexadecimal digits: what repeats are known by
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;
};

enum class LogVerdict : uint8_t {
  stored,
  duplicate,      // it was there already
  refused,        // not now: without a leader, unreachable
  full,           // not now: it has no room
  refusedForGood  // never: larger than the log takes
};

struct LogAnswer {
  LogVerdict verdict = LogVerdict::refused;
  std::string text;  // why it is refused
};

// Who publishes. Called from threads of the log's own, or from publish() where that finds at once that a message cannot go;
// with no lock of the log's held that publish() needs. Must not block.
class LogListener {
 public:
  virtual ~LogListener() = default;
  virtual void logAnswered(uint64_t token, const LogAnswer& answer) = 0;
  // The log refuses messages of that partition now, and does not say which: each that is on its way is given up.
  virtual void partitionRefused(uint32_t partition, const std::string& why) = 0;
  // Of a dead letter: whether the log has it. Once for each, but for those that the end of the process cuts off.
  virtual void deadLetterAnswered(bool isStored) = 0;
  // Whether messages may be published. After `false` no answer to what was published before can be expected.
  virtual void logIsUp(bool isUp) = 0;
};

class EventLog {
 public:
  virtual ~EventLog() = default;
  // Connects, and keeps trying; once, before all else. The listener outlives stop().
  virtual void start(LogListener& listener) = 0;
  // Any thread, never blocks. Answered once with the token, or never: when the answer is lost, or after logIsUp(false).
  virtual void publish(uint64_t token, std::shared_ptr<const LogMessage> message) = 0;
  // Into the dead-letter stream.
  virtual void publishDeadLetter(std::shared_ptr<const LogMessage> message) = 0;
  // Bytes of body that a message may have; none: that is not known yet.
  [[nodiscard]] virtual std::optional<uint64_t> maxBodyBytes() const = 0;
  // No listener is called any more once this has returned.
  virtual void stop() = 0;
};

// Which of so many partitions a message belongs to: the first 8 digits of its ID, as a number, modulo their count.
[[nodiscard]] uint32_t partitionOf(const std::string& id, uint32_t partitions);

}  // namespace kyt::receiver
