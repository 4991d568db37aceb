#include "tests/receiver/Load.h"

#include <algorithm>
#include <optional>
#include <utility>

#include "receiver/PostCheck.h"
#include "tests/receiver/ReceiverProcess.h"

namespace kyt::receiver {

Load::Load(Options options) : options_(std::move(options)) {
  for (unsigned i = 0; i < options_.devices; ++i) threads_.emplace_back([this, i] { run(i); });
}

Load::~Load() {
  stop();
}

void Load::stop() {
  isStopping_ = true;
  for (std::thread& thread : threads_)
    if (thread.joinable()) thread.join();
}

void Load::run(unsigned device) {
  size_t port = device;
  std::optional<HttpConnection> connection;
  for (uint64_t number = 0; !isStopping_; ++number) {
    const std::string body = postText(uint64_t{device} << 32 | number, options_.filler);
    HttpReply reply;
    while (reply.status == 0) {
      if (!connection) connection.emplace(options_.ports.at(port % options_.ports.size()));
      reply = connection->post("/v1/events", body);
      if (reply.status != 0 && reply.headers["connection"] != "close") break;
      connection.reset();
      if (reply.status != 0) break;
      if (isStopping_) return;
      ++port;
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    ++answered_;
    if (options_.pause.count() > 0) std::this_thread::sleep_for(options_.pause);
    int64_t longest = longest_;
    while (longest < reply.took.count() && !longest_.compare_exchange_weak(longest, reply.took.count())) {
    }
    MutexLock lock(mutex_);
    if (reply.status == 200)
      taken_.insert(messageID(body));
    else
      ++others_[reply.status];
  }
}

size_t Load::missingIn(const std::map<std::string, int>& stored) const {
  return static_cast<size_t>(std::count_if(taken_.begin(), taken_.end(),
                                           [&](const std::string& id) { return !stored.contains(id); }));
}

}  // namespace kyt::receiver
