// Which posts the outbox holds, without what is in them: in the order in which they were kept, in a line for each server,
// each user's counted. Some 40 bytes a post. Used by Outbox, on its queue.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Clock.h"

namespace kyt {

class URLSession;

// The posts to one server, and how it has answered of late.
struct ServerLine {
  // A post that failed although it left, so that it may be the reason itself: the line goes on with the next one.
  struct Aside {
    bool wasTried = true;  // since the server took one
    unsigned strikes = 0;  // times that it failed while the server took others
    unsigned unread = 0;   // times that the disk did not give it although it did other work
    unsigned unreadTries = 0;
    uint64_t workBefore = 0;    // of the disk, when it did not give it
    MonotonicTime notBefore{};  // where it waits alone: its own next try
    [[nodiscard]] bool waitsAlone() const { return strikes != 0 || unread != 0; }
  };
  // Posts of two identities never share a connection.
  struct Sender {
    std::string identity, sourceApplication;
    std::shared_ptr<URLSession> session;
    size_t inFlight = 0;
  };
  std::string server;
  uint64_t posts = 0, bytes = 0;
  int64_t from = 0;            // no post before this number is to be sent
  unsigned failures = 0;       // in a row
  bool isOpen = false;         // the last one was taken: several may go at a time
  bool isUnreachable = false;  // it failed without an answer
  bool isPrompt = false;       // its last request did not take long
  int lastStatus = 0;          // 0: none yet, or no answer came
  MonotonicTime nextTry{}, lastTry{};
  MonotonicTime notBefore{};  // says the server; none: it has not, or nobody heeds it any more
  MonotonicTime noted{};      // the disk knows it for so long; none: it does not
  bool isHastened = false;    // the next try is sooner since the server took a new post
  unsigned hastened = 0;      // such tries that failed, in a row
  size_t inFlight = 0;
  std::vector<Sender> senders;
  std::map<int64_t, Aside> aside;  // by number
  unsigned newStrikes = 0;         // since the server took one
};

class KeptPosts {
 public:
  struct Entry {
    int64_t number = 0;
    ServerLine* line = nullptr;
    int64_t born = 0;  // monotonic seconds
    uint32_t bytes = 0, user = 0;
    uint16_t contents = 0;  // OutboxBooks::remember()
    bool isByConsent = false, isInFlight = false, isGone = false, isAside = false;
  };

  // `number` is greater than all before. The line is made where there is none.
  Entry& add(int64_t number, const std::string& server, uint64_t bytes, uint32_t user, bool isByConsent,
             int64_t born);
  [[nodiscard]] Entry* find(int64_t number);  // null: not there, or gone
  // What is to be sent next; null: none now. The oldest, but for those that stand aside and are not due.
  [[nodiscard]] Entry* next(ServerLine& line, MonotonicTime now);
  // When one of those that stand aside is due, where there is nothing else to send; none: there is.
  [[nodiscard]] static std::optional<MonotonicTime> whenDue(const ServerLine& line);
  // It failed and may have left: it stands aside. False: it fails alone, which says nothing about the server, and its next
  // try is its own, after pause(strikes).
  template <typename Pause>
  [[nodiscard]] bool standAside(Entry& entry, MonotonicTime now, Pause pause) {
    ServerLine::Aside* failingAlone = standAsideOrStrike(entry);
    if (failingAlone == nullptr) return true;
    const bool isNew = failingAlone->strikes == 0;
    failingAlone->notBefore = now + pause(failingAlone->strikes++);
    // Many in a row say that the server fails after all.
    return isNew && ++entry.line->newStrikes % kMostNewStrikes == 0;
  }
  // The disk does not give it: it waits alone, for as long as its caller says there.
  [[nodiscard]] static ServerLine::Aside& setUnread(Entry& entry);
  // It is not sent before that time, where it waits alone.
  static void delay(Entry& entry, MonotonicTime until);
  // The server took one: those that stand aside come again, in their order. `all`: also those that wait for their own time.
  static void comeBack(ServerLine& line, bool all = false);
  // The oldest that nobody is sending, of a user, of all; null: none.
  [[nodiscard]] Entry* oldestOfUser(uint32_t user);
  [[nodiscard]] Entry* oldest();
  void setInFlight(Entry& entry, bool isInFlight);
  // It counts no more. It may be put back until forgetGone(), which makes entries' addresses invalid.
  void remove(Entry& entry);
  void putBack(int64_t number);
  // The one that was added last was never there.
  void removeNewest();
  void forgetGone();
  void clear();

  [[nodiscard]] size_t size() const { return size_; }
  [[nodiscard]] uint64_t bytes() const { return bytes_; }
  [[nodiscard]] uint64_t bytesOfUser(uint32_t user) const;
  [[nodiscard]] size_t postsOfUser(uint32_t user) const;
  [[nodiscard]] std::vector<uint32_t> users() const;
  [[nodiscard]] size_t byConsent() const { return byConsent_; }
  [[nodiscard]] ServerLine* line(const std::string& server);  // null: none
  [[nodiscard]] std::map<std::string, ServerLine>& lines() { return lines_; }
  // Those that are there, oldest first.
  [[nodiscard]] std::deque<Entry>& entries() { return entries_; }

 private:
  struct User {
    uint64_t bytes = 0;
    size_t posts = 0;
    int64_t from = 0;
  };
  static constexpr size_t kMostAside = 1024;  // of a line; each takes some 80 bytes
  static constexpr unsigned kMostNewStrikes = 8;
  void count(Entry& entry);
  [[nodiscard]] Entry* oldestOf(ServerLine& line);
  [[nodiscard]] Entry* dueAside(ServerLine& line, MonotonicTime now, const Entry* before);
  // Null where its failure tells nothing of it alone.
  [[nodiscard]] static ServerLine::Aside* standAsideOrStrike(Entry& entry);

  std::deque<Entry> entries_;
  std::map<std::string, ServerLine> lines_;
  std::map<uint32_t, User> users_;
  size_t size_ = 0, byConsent_ = 0;
  int64_t from_ = 0;  // as ServerLine::from, of all
  uint64_t bytes_ = 0;
};

}  // namespace kyt
