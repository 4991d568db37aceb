// Downloads and verifies storebags: the signed property lists in which a server says which back ends the
// sessions of a family of clients get. The agent is the only caller; it keeps what comes back
// (daemon/ReportingdAgent.h) and makes its calls under its monitor, so that several sessions that need the
// same bag download it once.
//
// A fetch blocks its thread until the reply is there, at most 15 seconds, or until the shut-down cancels what
// threads wait for; then none can begin any more. The requests of the whole process go through one URL session,
// made at first use while holding the lock of the class KYTReportingBackend, which the composition root owns.
// What the administrator wants refused although it verifies (config/StorebagGuard.h) is a failed fetch too, but the
// server is asked again with the date of the last good bag, not of the refused one.
// Every failure is a `Failed` and log lines that tell its cause at the default level; nothing here is fatal.
//
// The keys are read at each download: "publicKey.der" of the client framework's bundle and, where it is there,
// "publicKey2.der" beside it. A bag that either verifies counts, so that keys are replaced by having both for a while.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "config/Configuration.h"
#include "config/StorebagGuard.h"
#include "platform/Cryptography.h"
#include "platform/URLSession.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"

namespace kyt {

// No reply, however it asks, is kept longer than a day.
inline constexpr int32_t kMaxStorebagAge = 86400;  // seconds

// How each request is made: seconds from start to end, and how often it may be sent elsewhere.
inline constexpr Duration kStorebagRequestTimeout = std::chrono::seconds(15);
inline constexpr int kMaxStorebagRedirects = 5;

// The number after "max-age" in a "Cache-Control" header, a day without one. Only pieces between "=" and blanks are looked
// at, so a comma that touches the word hides it, deliberately: servers' answers have been tuned to this reading.
[[nodiscard]] int32_t maxAgeFromCacheControl(std::optional<std::string_view> header);

class StorebagFetcher {
 public:
  // The server said that the bag behind the date it was asked with still holds.
  struct NotModified {};
  // No reply, or no good bag in it.
  struct Failed {};
  // The part of a bag for the environment in force, and the version of the whole bag.
  struct Section {
    Dictionary contents;
    String version;
  };
  // How a fetch ended. A reply counts for the other two even if its bag was not good.
  template <typename Fetched>
  struct Fetch {
    std::variant<Fetched, NotModified, Failed> result = Failed();
    int32_t maxAge = 0;                  // seconds; 0 when no reply came
    std::optional<String> lastModified;  // to ask with next time: the reply's, else the one asked with
    std::string address;  // where it was asked for, without a name and password; empty: nowhere
    std::string problem;  // why there is no good bag of the server's; empty: there is
  };

  StorebagFetcher(Configuration configuration, Mutex& backendClassLock, StorebagRefusals refusals = {});
  StorebagFetcher(const StorebagFetcher&) = delete;
  StorebagFetcher& operator=(const StorebagFetcher&) = delete;

  // One download and verification: the whole bag. With `lastModified`, the server is asked to send the bag only
  // if it has changed since.
  [[nodiscard]] Fetch<Dictionary> fetchStorebagWithName(const std::optional<String>& name,
                                                        const std::optional<String>& lastModified);

  // The same, and the choice of the section. `maxAge` is the bag's own where it has one, at most a day.
  [[nodiscard]] Fetch<Section> fetchStorebagForEnvironmentAndClientType(
      int32_t clientType, const std::optional<String>& lastModified);

 private:
  [[nodiscard]] URLRequest storebagRequest(const std::optional<String>& name,
                                           const std::optional<String>& lastModified) const;
  URLSession& urlSession();
  // None with the reason in `problem`.
  std::optional<Dictionary> verifiedBag(const URLReply& reply, std::string& problem);
  // Why a bag that verifies is refused all the same; none: it is not.
  [[nodiscard]] std::optional<std::string> refusal(const std::optional<String>& name, const URLReply& reply,
                                                   const Dictionary& bag);
  [[nodiscard]] const Dictionary* sectionInForce(const Dictionary& bag, int32_t clientType) const;
  [[nodiscard]] std::vector<std::unique_ptr<PublicKey>> publicKeys() const;
  [[nodiscard]] bool verifies(const Data& bag, const Data& signature) const;
  [[nodiscard]] bool verifiesSHA256(const URLReply& reply) const;

  Configuration configuration_;
  Mutex& backendClassLock_;
  StorebagGuard guard_;
  std::unique_ptr<URLSession> urlSession_ GUARDED_BY(backendClassLock_);
};

}  // namespace kyt
