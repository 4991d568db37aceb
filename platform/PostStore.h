// Posts on disk, for the outbox alone: what could not be sent is kept here with all that sending it again needs, byte for
// byte. The real one is SQLite (platform/linux/outbox/SQLitePostStore.h).
//
// One thread at a time; every operation may block as long as the disk likes. A change is there as a whole or not at all,
// and when change() has returned well it outlives a loss of power.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "platform/base/Books.h"
#include "platform/base/Function.h"
#include "platform/objects/Value.h"

namespace kyt {

inline constexpr uint32_t kNoUser = ~uint32_t{0};  // the daemon's own post

struct StoredPost {
  int64_t number = 0;        // from 1, in the order in which they were kept
  int64_t keptAt = 0;        // seconds since 1970; 0: the clock had not been set; see PostStore::setLatest
  uint32_t user = kNoUser;   // whose share it counts towards
  bool isByConsent = false;  // see URLRequest
  bool allowsCellularAccess = true;
  std::string url, identity, sourceApplication;
  std::vector<std::pair<std::string, std::string>> headers;
  std::vector<BookedEvents::OfRow> events;
  Data body;
};

// What is known of a post without reading its body.
struct StoredPostHead {
  StoredPost post;  // without headers and body
  uint64_t bytes = 0;
  bool isUnreadable = false;  // nothing is known of it but its number; 0: nor that, or how many there are
};

struct PostStoreProblem {
  // Unavailable: a full or missing disk, a missing library; another time may do better. Post: that one cannot be read any
  // more, all others can. Damaged: none can be, and setAside() gives a new beginning.
  enum class Kind { unavailable, post, damaged };
  Kind kind = Kind::unavailable;
  std::string text;
};

class PostStore {
 public:
  // Address, headers and body: what the outbox's limits count.
  [[nodiscard]] static uint64_t bytesOf(const StoredPost& post) {
    uint64_t bytes = post.url.size() + post.body.view().size();
    for (const auto& [name, value] : post.headers) bytes += name.size() + value.size();
    return bytes;
  }

  virtual ~PostStore() = default;
  // Before all else: calls `found` with each post, oldest first; of what is damaged with what is left. A store that was never
  // written to is not made by this.
  [[nodiscard]] virtual std::optional<PostStoreProblem> open(Function<void(StoredPostHead)> found) = 0;
  // Adds and removes; numbers that are not there are removed already, and those that the disk does not give are from now on not
  // there. `forGood`: what is removed, and
  // what was removed before, is overwritten too.
  [[nodiscard]] virtual std::optional<PostStoreProblem> change(std::span<const StoredPost* const> added,
                                                               std::span<const int64_t> removed,
                                                               bool forGood) = 0;
  [[nodiscard]] virtual std::variant<StoredPost, PostStoreProblem> read(int64_t number) = 0;
  // No post up to that number was kept after that time.
  [[nodiscard]] virtual std::optional<PostStoreProblem> setLatest(int64_t number, int64_t time) = 0;
  // Numbers that the outbox keeps for itself: of the consent by which posts were collected (DiagnosticsConsent::epoch), and
  // since when the clock says that posts are too old (seconds since 1970). 0 where none was set. A store that was never
  // written to is made by set() alone.
  enum class Note : int64_t { consentEpoch = 1, tooOldSince = 2 };
  [[nodiscard]] virtual int64_t note(Note name) = 0;
  [[nodiscard]] virtual std::optional<PostStoreProblem> setNote(Note name, int64_t value) = 0;
  // How long servers want to be left alone, each under a number that stands for its name, in seconds since 1970.
  struct ServerPause {
    uint64_t server = 0;
    int64_t since = 0, until = 0;  // when that was noted; 0: none any more
  };
  // As they lie there, Limits::maxOutboxPauses at most: a damaged file may say anything.
  [[nodiscard]] virtual std::vector<ServerPause> pauses() = 0;
  // All of them, in place of what was there of these servers, or none. A store that is not there is made by those with an end
  // alone.
  [[nodiscard]] virtual std::optional<PostStoreProblem> setPauses(std::span<const ServerPause> pauses) = 0;
  // Nothing is left in it: it may give its room back to the disk.
  virtual void becameEmpty() = 0;
  // What is there is put beside, for a person to look at, and the next change begins anew. Its text: what was done.
  [[nodiscard]] virtual std::string setAside() = 0;
  // Files that lie beside it. Any thread.
  [[nodiscard]] virtual uint64_t filesAside() const = 0;
  // What was put aside is gone, if there was any, and if it was last written before that time (seconds since 1970). False: it
  // cannot be removed.
  [[nodiscard]] virtual bool removeSetAside(int64_t before) = 0;
  virtual void close() = 0;
};

}  // namespace kyt
