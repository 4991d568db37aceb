// Runs the built kytreceiver as a process on ports of its own, and posts to it over bare sockets.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/support/TemporaryFolder.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::receiver {

struct HttpReply {
  int status = 0;  // 0: the connection ended, or the time was over
  std::map<std::string, std::string> headers;
  std::string body;
  std::chrono::milliseconds took{0};
};

// A TCP connection on which requests follow each other.
class HttpConnection {
 public:
  explicit HttpConnection(uint16_t port);
  bool send(std::string_view bytes) const;
  [[nodiscard]] HttpReply receive(std::chrono::milliseconds timeout = std::chrono::seconds(30));
  [[nodiscard]] HttpReply post(std::string_view path, std::string_view body,
                               const std::vector<std::string>& headers = {});
  [[nodiscard]] HttpReply get(std::string_view path);
  // Nothing more comes, within that time.
  [[nodiscard]] bool isClosed(std::chrono::milliseconds timeout = std::chrono::seconds(30));

 private:
  [[nodiscard]] bool fill(std::chrono::steady_clock::time_point deadline);

  Descriptor socket_;
  std::string received_;
};

class ReceiverProcess {
 public:
  struct Options {
    std::string program;  // empty: the built one
    std::string kind = "nats";
    std::string servers;                       // of the log, as a TOML array
    std::string log;                           // further lines of [log]
    std::string path = "digest = \"none\"\n";  // of the path /v1/events
    std::string more;                          // further lines before the sections
    std::string spool;                         // its folder; empty: one of this object's
    uint64_t spoolMaxBytes = 64 << 20;
    std::string limits;  // further lines of [limits]
    std::vector<std::string> arguments;
    uint16_t port = 0, metricsPort = 0;
    // A program and its arguments, which run the receiver: none, or what prepares the place for it.
    std::vector<std::string> wrapper;
  };
  explicit ReceiverProcess(Options options);
  ~ReceiverProcess();  // terminate(); an end other than in order (a sanitizer's finding) fails the test
  ReceiverProcess(const ReceiverProcess&) = delete;
  ReceiverProcess& operator=(const ReceiverProcess&) = delete;

  void start();
  [[nodiscard]] bool isReady() const { return port_ != 0; }
  // 200 from /readyz, within half a minute.
  [[nodiscard]] bool becomesReady() const;
  [[nodiscard]] uint16_t port() const { return port_; }
  [[nodiscard]] uint16_t metricsPort() const { return metricsPort_; }
  [[nodiscard]] HttpReply post(std::string_view body, const std::vector<std::string>& headers = {}) const;
  [[nodiscard]] HttpReply get(std::string_view path) const;  // of the metrics' port
  // A sample of the metrics by its name and labels, as it stands there; none: there is no such.
  [[nodiscard]] std::optional<double> metric(std::string_view sample) const;
  void signal(int number) const { process_.signal(number); }
  [[nodiscard]] int pid() const { return process_.pid(); }
  // The exit status after SIGTERM, or none when it did not end in time.
  std::optional<int> terminate(std::chrono::seconds timeout = std::chrono::seconds(40));
  void kill();
  [[nodiscard]] std::string output() const { return folder_.read("output"); }
  [[nodiscard]] std::string configFile() const { return folder_ / "kytreceiver.toml"; }

 private:
  const TemporaryFolder folder_;
  const Options options_;
  tools::ChildProcess process_;
  bool isRunning_ = false;
  uint16_t port_ = 0, metricsPort_ = 0;
};

// The daemon's way: gzip.
[[nodiscard]] std::string gzipped(std::string_view text);
// A post's JSON, which no other has.
[[nodiscard]] std::string postText(uint64_t number, size_t filler = 0);

}  // namespace kyt::receiver
