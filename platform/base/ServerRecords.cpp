#include "platform/base/ServerRecords.h"

#include <algorithm>

namespace kyt {

namespace {

constexpr size_t kMostAddressBytes = 256;
constexpr size_t kMostProblemBytes = 256;

// Without the path, and without a name and password before the host.
std::string serverOf(std::string_view url) {
  const size_t scheme = url.find("://");
  const size_t begin = scheme == std::string_view::npos ? 0 : scheme + 3;
  std::string_view host = url.substr(begin, url.find_first_of("/?#", begin) - begin);
  if (const size_t at = host.rfind('@'); at != std::string_view::npos) host.remove_prefix(at + 1);
  return (std::string(url.substr(0, begin)) + std::string(host)).substr(0, kMostAddressBytes);
}

}  // namespace

ServerRecord& ServerRecords::record(std::string_view url) {
  std::string address = serverOf(url);
  if (const auto known = records_.find(address); known != records_.end()) return known->second;
  if (records_.size() >= kMostServers) {
    const auto lastHeard = [](const auto& entry) {
      return std::max(entry.second.lastAnswer, entry.second.lastErrorAt);
    };
    records_.erase(std::min_element(records_.begin(), records_.end(), [&](const auto& a, const auto& b) {
      return lastHeard(a) < lastHeard(b);
    }));
  }
  ServerRecord& made = records_[address];
  made.address = std::move(address);
  return made;
}

void ServerRecords::answered(std::string_view url, int status, int64_t now) {
  MutexLock lock(mutex_);
  ServerRecord& server = record(url);
  ++server.answers;
  server.lastAnswer = now;
  server.lastStatus = status;
  if (status < 400 || status > 599) return;
  ++server.errors;
  server.lastError = "status " + std::to_string(status);
  server.lastErrorAt = now;
}

void ServerRecords::failed(std::string_view url, std::string_view problem, int64_t now) {
  MutexLock lock(mutex_);
  ServerRecord& server = record(url);
  ++server.errors;
  server.lastError = problem.substr(0, kMostProblemBytes);
  server.lastErrorAt = now;
}

std::vector<ServerRecord> ServerRecords::all() const {
  std::vector<ServerRecord> servers;
  MutexLock lock(mutex_);
  servers.reserve(records_.size());
  for (const auto& [address, server] : records_) servers.push_back(server);
  return servers;
}

}  // namespace kyt
