// Devices that post as fast as they are answered, each on its own connection, and know what was answered. A post that got
// no answer is posted again, byte for byte, as a device with an outbox or libcurl does.
#pragma once

#include <atomic>
#include <chrono>
#include <map>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Mutex.h"

namespace kyt::receiver {

class Load {
 public:
  struct Options {
    std::vector<uint16_t> ports;  // of receivers; each device goes to the next when one fails
    unsigned devices = 8;
    size_t filler = 2000;                // bytes of a post, about
    std::chrono::milliseconds pause{0};  // between two posts of a device
  };
  explicit Load(Options options);
  ~Load();  // stop()
  Load(const Load&) = delete;
  Load& operator=(const Load&) = delete;

  // Each device ends with its answer, or gives up a post that nobody takes.
  void stop();

  // From here on any thread.
  [[nodiscard]] uint64_t answered() const { return answered_.load(); }
  [[nodiscard]] std::chrono::milliseconds longest() const {
    return std::chrono::milliseconds(longest_.load());
  }
  // After stop(): the IDs of posts that were answered with 200, and how often each other status came.
  [[nodiscard]] const std::set<std::string>& taken() const { return taken_; }
  [[nodiscard]] const std::map<int, int>& others() const { return others_; }
  // Of the posts that were answered with 200, those that are not there.
  [[nodiscard]] size_t missingIn(const std::map<std::string, int>& stored) const;

 private:
  void run(unsigned device);

  const Options options_;
  std::atomic<bool> isStopping_{false};
  std::atomic<uint64_t> answered_{0};
  std::atomic<int64_t> longest_{0};
  Mutex mutex_;
  std::set<std::string> taken_;  // written under the mutex, read after stop()
  std::map<int, int> others_;
  std::vector<std::thread> threads_;
};

}  // namespace kyt::receiver
