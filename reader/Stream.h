// The log that posts are read from: a stream of NATS JetStream, by a durable consumer. What was read and not acknowledged
// comes again, to this reader or another of the same consumer, after a while. One thread.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "reader/Post.h"

namespace kyt::reader {

struct StreamOptions {
  std::vector<std::string> servers;  // nats://HOST:PORT
  std::string stream = "kyt-events";
  std::string durable = "kytreader";
  int acknowledgeWithin = 60;  // seconds; of a consumer that is made
  int batch = 200;             // messages at a time, and at most 64 MiB of them
};

// An error is a text for people.
class Stream {
 public:
  explicit Stream(StreamOptions options);
  ~Stream();
  Stream(const Stream&) = delete;
  Stream& operator=(const Stream&) = delete;

  // Connects to any of the servers and takes up the consumer, which is made where there is none. May be called again: what
  // was taken and not acknowledged is given up. Keeps trying to connect again by itself afterwards.
  [[nodiscard]] std::optional<std::string> open();
  // The next posts, in order; empty: none came in that time. Those of the call before must have been acknowledged or
  // given up. After a problem open() is due: the consumer may be gone.
  [[nodiscard]] std::vector<Post> next(std::chrono::milliseconds time, std::optional<std::string>& problem);
  // All that the last call of next() gave.
  [[nodiscard]] std::optional<std::string> acknowledge();

 private:
  struct Handles;
  // A consumer that was deleted is as quiet as one that has nothing to give.
  [[nodiscard]] std::optional<std::string> askForConsumer();

  const StreamOptions options_;
  std::unique_ptr<Handles> handles_;
  int quietCalls_ = 0;
};

}  // namespace kyt::reader
