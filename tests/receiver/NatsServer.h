// Real servers of NATS as processes of their own, on free ports of loopback with their files in a folder of the test's, and
// a look into their streams.
#pragma once

#include <nats/nats.h>
#include <signal.h>

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/TemporaryFolder.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::receiver {

// One to three servers; three make a cluster.
class NatsServers {
 public:
  struct Options {
    size_t servers = 1;
    std::string more;  // further lines of their configuration
  };
  NatsServers() : NatsServers(Options()) {}
  explicit NatsServers(Options options);

  [[nodiscard]] static bool isInstalled();
  void start(size_t index);
  void start();             // all
  void kill(size_t index);  // without a chance to say goodbye
  // It reads nothing more once this has returned.
  void pause(size_t index);
  void resume(size_t index) { processes_[index].signal(SIGCONT); }
  [[nodiscard]] std::string url(size_t index) const;
  [[nodiscard]] std::string urlsAsToml() const;  // ["nats://…", …]
  [[nodiscard]] size_t size() const { return ports_.size(); }
  // Their lines, for a test that failed.
  [[nodiscard]] std::string output(size_t index) const { return folder_.read(name(index) + ".log"); }

 private:
  [[nodiscard]] static std::string name(size_t index) { return "n" + std::to_string(index + 1); }

  const TemporaryFolder folder_;
  std::vector<uint16_t> ports_, routePorts_;
  std::vector<tools::ChildProcess> processes_;
};

struct StoredMessage {
  std::string subject, body;
  std::map<std::string, std::string> headers;
};

// A connection to look with. Its operations wait for servers half a minute at most.
class StreamView {
 public:
  explicit StreamView(const std::string& url);
  ~StreamView();
  StreamView(const StreamView&) = delete;
  StreamView& operator=(const StreamView&) = delete;

  [[nodiscard]] std::optional<uint64_t> messages(const char* stream = "kyt-events");  // none: no such stream
  // From 1.
  [[nodiscard]] std::optional<StoredMessage> message(uint64_t number, const char* stream = "kyt-events");
  // The header "Kyt-Id" of each message, and how often it is there.
  [[nodiscard]] std::map<std::string, int> ids();
  [[nodiscard]] std::string leader(const char* stream = "kyt-events");  // a server's name; empty: none
  [[nodiscard]] bool purge(const char* stream = "kyt-events");
  // The stream may have so many bytes from now on.
  [[nodiscard]] bool setMaxBytes(int64_t bytes);
  [[nodiscard]] bool setMaxMessageBytes(int32_t bytes);
  // The stream takes that subject alone from now on.
  [[nodiscard]] bool setSubject(const char* subject);
  [[nodiscard]] bool remove(const char* stream);

 private:
  natsConnection* connection_ = nullptr;
  jsCtx* context_ = nullptr;
};

}  // namespace kyt::receiver
