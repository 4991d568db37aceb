// What devices, the log and the disk may take of a receiver, each with its unit and reason. What passes one is refused or
// left out, and counted (Figures.h).
#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>

namespace kyt::receiver {

struct Limits {
  // Bytes of the bodies of all posts that are not yet answered: memory. Past it posts get 429.
  static constexpr uint64_t maxBodiesBytes = uint64_t{256} << 20;
  // Of the body of a post that is refused by its headers, read and thrown away so that a front that is writing learns why:
  // more than a front lets through.
  static constexpr uint64_t maxDrainBytes = uint64_t{20} << 20;
  // Connections of the posts' port: descriptors. Further ones wait to be accepted.
  static constexpr unsigned maxConnections = 8192;
  static constexpr unsigned maxMetricsConnections = 16;
  // A body that any log takes, as NATS and Kafka are by default: 1 MiB with its headers. A larger one is refused for now
  // while nobody knows what this log takes; the spool could keep it for ever.
  static constexpr uint64_t surelyTakenBytes = (uint64_t{1} << 20) - 8192;
  // For posts that are in progress when the process is told to end: the body's rest, and its way to log or spool.
  static constexpr std::chrono::seconds drainTime{15};
  // … and for a proxy's next post on a connection that it has open: it learns with the answer that the connection ends.
  static constexpr std::chrono::seconds quietTime{1};
  // A post waits for the spool's disk so long; then it gets 429, though it may be kept all the same.
  static constexpr std::chrono::seconds spoolTime{5};
  // Posts in one change of the spool's file, and bytes of them: what one fdatasync makes durable, and the memory it takes.
  static constexpr size_t maxSpoolChangePosts = 512;
  static constexpr size_t maxSpoolChangeBytes = 16u << 20;
  // Posts of the spool on their way to the log, and bytes of them.
  static constexpr size_t maxReplayPosts = 64;
  static constexpr size_t maxReplayBytes = 32u << 20;
  // Between attempts to give the spool to a log that does not take it.
  static constexpr std::chrono::milliseconds replayPause{250};
  // Of the body of a post that can never be taken, in the dead-letter stream.
  static constexpr size_t maxDeadLetterBytes = 65536;
  // Dead letters: whoever sends rubbish cannot fill the log. So many at once, and so many a second.
  static constexpr unsigned deadLettersAtOnce = 100;
  static constexpr unsigned deadLettersPerSecond = 10;
  // After a failure, with no post in the spool to try the log with: until one of a device may.
  static constexpr std::chrono::milliseconds retryPause{1000};
  // Between two lines about messages that the log refused for good, of which anybody may post any number.
  static constexpr std::chrono::seconds tellPause{60};
  // Seconds for the log to acknowledge: with spoolTime after it a post is answered before its front gives it up, which is
  // after 10 where docs/FLEET.md is followed.
  static constexpr double maxPublishSeconds = 4;
  // After a change of the spool failed, a receiver without a log is not ready for so long. Then a post may try the disk:
  // where nobody sends any, none would ever show that the disk is well again.
  static constexpr std::chrono::seconds brokenTime{10};
  // Between attempts to open the spool of a disk that is broken.
  static constexpr std::chrono::seconds reopenPause{5};
  // Bytes of a header that a message carries on; what is longer is cut.
  static constexpr size_t maxFactBytes = 256;
  // Where posts are opened: bytes after decompression, which are so many times those before, but so many at least and at
  // most. The daemon's compress four to fifty to one; of a bomb a fraction of a second's work is done.
  static constexpr uint64_t maxInflation = 200;
  static constexpr uint64_t leastInflatedBytes = uint64_t{1} << 20;
  static constexpr uint64_t maxInflatedBytes = uint64_t{128} << 20;
  static constexpr unsigned maxJSONDepth = 32;
  // Bytes of a string of the JSON, as it is written there: it is collected in memory before it is looked at. A client's
  // message to the daemon has 1 MiB, of which each byte may be written as six.
  static constexpr size_t maxJSONStringBytes = size_t{8} << 20;
  // Threads for posts that are small once they are opened, as devices' are. One more for each larger size.
  static constexpr unsigned checkThreads = 2;
  // What is larger than one of these, in bytes once it is opened, waits for others of its size alone. The first holds a
  // batch of some hundred events.
  static constexpr std::array<uint64_t, 3> checkSizes = {uint64_t{1} << 20, uint64_t{16} << 20, ~uint64_t{0}};
  // Bytes of the bodies of each larger size that wait to be opened: memory, of which small posts need some too.
  static constexpr size_t maxWaitingCheckBytes = size_t{32} << 20;
  // A post waits so long to be opened; a front waits 10 s, and log and spool may need 7 of them.
  static constexpr std::chrono::seconds checkTime{2};
  // Seconds that a log may be told to keep posts: ten years. More is a mistake, and the servers count nanoseconds.
  static constexpr int64_t maxAgeSeconds = int64_t{10} * 365 * 86400;
  // Servers, paths and keys that a configuration may name: more is a mistake.
  static constexpr size_t maxPartitions = 1024;
};

}  // namespace kyt::receiver
