// Which posts the outbox holds, without what is in them: in the order in which they were kept, in a line for each server,
// each user's counted. Some 40 bytes a post. Used by Outbox, on its queue.
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/base/Clock.h"

namespace kyt {

class URLSession;

// The posts to one server, and how it has answered of late.
struct ServerLine {
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
  MonotonicTime nextTry{}, lastTry{};
  MonotonicTime notBefore{};  // says the server
  size_t inFlight = 0;
  std::vector<Sender> senders;
};

class KeptPosts {
 public:
  struct Entry {
    int64_t number = 0;
    ServerLine* line = nullptr;
    int64_t born = 0;  // monotonic seconds
    uint32_t bytes = 0, user = 0;
    bool isByConsent = false, isInFlight = false, isGone = false;
  };

  // `number` is greater than all before. The line is made where there is none.
  Entry& add(int64_t number, const std::string& server, uint64_t bytes, uint32_t user, bool isByConsent,
             int64_t born);
  [[nodiscard]] Entry* find(int64_t number);  // null: not there, or gone
  // The oldest that nobody is sending: of a line, of a user, of all; null: none.
  [[nodiscard]] Entry* oldestOf(ServerLine& line);
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
  void count(Entry& entry);

  std::deque<Entry> entries_;
  std::map<std::string, ServerLine> lines_;
  std::map<uint32_t, User> users_;
  size_t size_ = 0, byConsent_ = 0;
  int64_t from_ = 0;  // as ServerLine::from, of all
  uint64_t bytes_ = 0;
};

}  // namespace kyt
