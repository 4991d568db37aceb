// Downloads and verifies storebags: the signed property lists in which a server says which back ends the
// sessions of a family of clients get. The agent is the only caller; it keeps what comes back
// (daemon/ReportingdAgent.h) and makes its calls under its monitor, so that several sessions that need the
// same bag download it once.
//
// A fetch blocks its thread until the reply is there, at most 15 seconds, or until the shut-down cancels what
// threads wait for; then none can begin any more. The requests of the whole process
// go through one URL session, made at first use while holding the lock of the class KYTReportingBackend,
// which the composition root owns. Every failure is an absent result and log lines that tell its cause at the default
// level; nothing here is fatal.
//
// The keys are read at each download: "publicKey.der" of the client framework's bundle and, where it is there,
// "publicKey2.der" beside it. A bag that either verifies counts, so that keys are replaced by having both for a while.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "config/Configuration.h"
#include "platform/Cryptography.h"
#include "platform/URLSession.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"

namespace kyt {

// No reply, however it asks, is kept longer than a day.
inline constexpr int32_t kMaxStorebagAge = 86400;  // seconds

class StorebagFetcher {
 public:
  StorebagFetcher(Configuration configuration, Mutex& backendClassLock);
  StorebagFetcher(const StorebagFetcher&) = delete;
  StorebagFetcher& operator=(const StorebagFetcher&) = delete;

  // One download and verification. The whole bag, or none. `maxAge` (seconds) is written as soon as a reply
  // came; `notModified` is set when the server said that the bag behind `lastModified` still holds.
  // `lastModified` (not null) is sent when it has a value and replaced by what the reply says.
  [[nodiscard]] std::optional<Dictionary> fetchStorebagWithName(const std::optional<String>& name,
                                                                int32_t& maxAge, bool& notModified,
                                                                std::optional<String>* lastModified);

  // The section for the environment in force, and the bag's version.
  [[nodiscard]] std::optional<Dictionary> fetchStorebagForEnvironmentAndClientType(
      int32_t clientType, int32_t& maxAge, std::optional<String>& version, bool& notModified,
      std::optional<String>* lastModified);

 private:
  struct Reply {
    std::optional<Data> data;
    std::optional<URLResponse> response;
    std::optional<Error> error;
  };

  Reply sendSynchronousRequest(URLRequest request);
  URLSession& urlSession();
  std::optional<Dictionary> verifiedBag(const Reply& reply);
  [[nodiscard]] std::vector<std::unique_ptr<PublicKey>> publicKeys() const;
  [[nodiscard]] bool verifies(const Data& bag, const Data& signature) const;

  Configuration configuration_;
  Mutex& backendClassLock_;
  std::unique_ptr<URLSession> urlSession_ GUARDED_BY(backendClassLock_);
};

}  // namespace kyt
