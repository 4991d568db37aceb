// The other end of event posts in benchmarks: takes HTTP/1.1 posts on loopback, answers each with 200 at
// once, counts them, and keeps the first bodies so that the reference works on the very same records. Not for
// anything else.
#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace kyt::bench {

class SinkServer {
 public:
  explicit SinkServer(unsigned threads, size_t keepBodies);
  ~SinkServer();
  SinkServer(const SinkServer&) = delete;
  SinkServer& operator=(const SinkServer&) = delete;

  [[nodiscard]] int port() const { return port_; }
  [[nodiscard]] uint64_t posts() const { return posts_.load(); }
  [[nodiscard]] uint64_t bodyBytes() const { return bodyBytes_.load(); }
  [[nodiscard]] std::vector<std::string> bodies();

 private:
  struct Client {
    std::string in;
  };
  void serve(int listener);
  void take(std::string&& body);

  int port_ = 0;
  size_t keepBodies_;
  std::atomic<bool> stopping_{false};
  std::atomic<uint64_t> posts_{0}, bodyBytes_{0};
  std::mutex mutex_;
  std::vector<std::string> bodies_;
  std::vector<std::thread> threads_;
};

}  // namespace kyt::bench
