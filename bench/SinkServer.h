// The other end of event posts in benchmarks: takes HTTP/1.1 posts on loopback, with TLS or without, answers each with
// 200 at once, counts them, and keeps bodies so that the reference works on the very same records. Not for anything else.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

struct ssl_ctx_st;

namespace kyt::bench {

class SinkServer {
 public:
  // Keeps the last `keepBodies` bodies.
  explicit SinkServer(unsigned threads, size_t keepBodies);
  ~SinkServer();
  SinkServer(const SinkServer&) = delete;
  SinkServer& operator=(const SinkServer&) = delete;

  // From now on a second port takes posts with TLS; the files are PEM. False when they cannot be used.
  [[nodiscard]] bool addTLS(const std::string& certificate, const std::string& key);

  [[nodiscard]] int port() const { return port_; }
  [[nodiscard]] int portWithTLS() const { return portWithTLS_; }
  [[nodiscard]] uint64_t posts() const { return posts_.load(); }
  [[nodiscard]] uint64_t bodyBytes() const { return bodyBytes_.load(); }
  [[nodiscard]] std::vector<std::string> bodies();

 private:
  struct Client;
  void begin(int& port, ssl_ctx_st* tls);
  void serve(int listener, ssl_ctx_st* tls);
  // False: the connection has ended.
  [[nodiscard]] bool takeWhatCame(Client& client);
  void take(std::string&& body);

  const unsigned threadsOfPort_;
  const size_t keepBodies_;
  int port_ = 0, portWithTLS_ = 0;
  std::shared_ptr<ssl_ctx_st> tls_;
  std::atomic<bool> stopping_{false};
  std::atomic<uint64_t> posts_{0}, bodyBytes_{0};
  std::mutex mutex_;
  std::deque<std::string> bodies_;
  std::vector<std::thread> threads_;
};

}  // namespace kyt::bench
