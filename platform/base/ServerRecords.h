// What each server last answered, and what last went wrong with it, for administrators. Written once for each request that
// has ended, never for an event. At most kMostServers are known; one more takes the place of the one that was heard of
// longest ago. Any thread; takes a lock.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Mutex.h"

namespace kyt {

struct ServerRecord {
  std::string address;     // scheme, host and port: "https://events.example.org:8443"
  uint64_t answers = 0;    // of any status
  int64_t lastAnswer = 0;  // seconds since 1970; 0: never
  int lastStatus = 0;
  uint64_t errors = 0;    // answers of 400 to 599, and requests without an answer
  std::string lastError;  // empty: none
  int64_t lastErrorAt = 0;
};

class ServerRecords {
 public:
  static constexpr size_t kMostServers = 64;  // of storebags, posts, uploads; a storebag may name any number
  void answered(std::string_view url, int status, int64_t now) EXCLUDES(mutex_);
  void failed(std::string_view url, std::string_view problem, int64_t now) EXCLUDES(mutex_);
  // By address.
  [[nodiscard]] std::vector<ServerRecord> all() const EXCLUDES(mutex_);

 private:
  ServerRecord& record(std::string_view url) REQUIRES(mutex_);
  mutable Mutex mutex_;
  std::map<std::string, ServerRecord, std::less<>> records_ GUARDED_BY(mutex_);
};

}  // namespace kyt
