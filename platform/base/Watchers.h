// Who watches events pass: whoever ends an event's road tells it here, and each watcher has a ring of its own for those that
// its filter lets through. While nobody watches, that is one relaxed load. While somebody does, nobody waits for a watcher:
// what finds a ring full is counted as its loss and forgotten.
//
// The books own the one object (Books::watchers()); posts on their way and watchers share it. Any thread.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Mutex.h"
#include "platform/base/ReportingProgram.h"

namespace kyt {

// An event's category and type; -1: it has none.
struct EventKind {
  int32_t category = -1, type = -1;
};

class Watchers;

// The beginning of a request's body: counts as kept until nobody has it.
class WatchedBody {
 public:
  WatchedBody(std::shared_ptr<Watchers> watchers, std::string_view text);
  ~WatchedBody();
  WatchedBody(const WatchedBody&) = delete;
  WatchedBody& operator=(const WatchedBody&) = delete;
  [[nodiscard]] const std::string& text() const { return text_; }

 private:
  const std::shared_ptr<Watchers> watchers_;
  const std::string text_;
};

// A request that carries watched events. It has one user at a time until it is answered, and never changes then.
class WatchedPost {
 public:
  explicit WatchedPost(std::shared_ptr<Watchers> watchers) : watchers_(std::move(watchers)) {}
  WatchedPost(const WatchedPost&) = delete;
  WatchedPost& operator=(const WatchedPost&) = delete;

  // The request is made: to which server, and the text of its body before compression. The text is kept where somebody wants
  // it and Limits::maxWatchedBodies has room, its first Limits::maxWatchedBodyBytes.
  void leaves(std::string_view server, std::string_view body);
  void answered(int status) { status_ = status; }
  // Its events are told: who was given the body has it. The teller's, like body().
  void forgetBody() { body_ = nullptr; }

  [[nodiscard]] uint64_t number() const { return number_; }  // 0: no request was made
  [[nodiscard]] const std::string& server() const { return server_; }
  [[nodiscard]] const std::shared_ptr<const WatchedBody>& body() const { return body_; }  // null: not kept
  [[nodiscard]] size_t bodyBytes() const { return bodyBytes_; }                           // of the whole text
  [[nodiscard]] int status() const { return status_; }                                    // 0: no answer came

 private:
  const std::shared_ptr<Watchers> watchers_;
  uint64_t number_ = 0;
  std::string server_;
  std::shared_ptr<const WatchedBody> body_;
  size_t bodyBytes_ = 0;
  int status_ = 0;
};

// One event, when it is known what became of it, and before that when the outbox keeps it.
struct PassedEvent {
  ReportingProgram program;  // its names cut as in the books
  std::string backEnd;
  bool isInternal = false;
  EventKind kind;
  std::optional<Reason> dropped;  // none: delivered, or kept
  bool isKept = false;            // in the outbox: no end yet
  const char* rule = "";  // what made a back end drop it, a word with hyphens; empty: the reason says all
  int64_t seconds = 0;    // since 1970
  std::shared_ptr<const WatchedPost> post;  // null: no request carried it
  // For a watcher who wants bodies: the first event of the post that it is told, and the body, where there was room for it.
  bool isFirstOfPost = false;
  std::shared_ptr<const WatchedBody> body;
};

// The body of a post while its events are told: each watcher who wants bodies gets it with the first that it is told.
struct ToldBody {
  std::shared_ptr<const WatchedBody> body;  // null: not kept
  uint32_t had = 0;                         // bits of the watchers who have it
};

struct WatchFilter {
  std::optional<uint32_t> user = std::nullopt;
  std::optional<std::string> client = std::nullopt;  // the name, as the books have it
  std::optional<uint16_t> category = std::nullopt;
  bool bodies = false;
  // `program` as it is, or with its names cut.
  [[nodiscard]] bool admits(const ReportingProgram& program, EventKind kind) const;
  [[nodiscard]] bool admitsProgram(const ReportingProgram& program) const;
};

// One watcher's end. One thread at a time. Its destructor waits for those who tell it something at that moment.
class Watcher {
 public:
  Watcher(std::shared_ptr<Watchers> watchers, size_t place, bool bodies)
      : watchers_(std::move(watchers)), place_(place), bodies_(bodies) {}
  ~Watcher();
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  [[nodiscard]] std::shared_ptr<const PassedEvent> next();  // null: none waits
  // How many found the ring full since this was asked last.
  [[nodiscard]] uint64_t takeLost();
  [[nodiscard]] bool wantsBodies() const { return bodies_; }

 private:
  const std::shared_ptr<Watchers> watchers_;
  const size_t place_;
  const bool bodies_;
};

class Watchers : public std::enable_shared_from_this<Watchers> {
 public:
  Watchers();
  ~Watchers();
  Watchers(const Watchers&) = delete;
  Watchers& operator=(const Watchers&) = delete;

  // Null where Limits::maxWatchers watch already, or Limits::maxWatchersOfGroup of those who are not the daemon's owners.
  [[nodiscard]] std::unique_ptr<Watcher> watch(WatchFilter filter, bool isOwner = true);

  // Asked before anything is made for telling.
  [[nodiscard]] bool anybody() const { return watching_.load(std::memory_order_relaxed) != 0; }
  // Whether somebody whose filter lets such an event through has room for it: asked before it is made. Where none has, it
  // counts as lost to them.
  [[nodiscard]] bool want(const ReportingProgram& program, EventKind kind);
  // Events of one program, `count` of them (those beyond `kinds` have none), before want() is asked for each: true where no
  // watcher of that program's events has room. They count as lost then to those whose filter lets them through.
  [[nodiscard]] bool loseAll(const ReportingProgram& program, std::span<const EventKind> kinds, size_t count);
  // `body`: of its post, until all events of that are told; null: nobody gets one.
  void tell(PassedEvent event, ToldBody* body = nullptr);

 private:
  friend class Watcher;
  friend class WatchedPost;
  friend class WatchedBody;
  struct Ring;
  struct Place {
    std::atomic<Ring*> ring{nullptr};
    std::atomic<uint32_t> tellers{0};  // that may be using it
  };
  // Calls `use` with each ring, and its place, whose filter lets the program through, which is not taken away meanwhile.
  template <typename Use>
  void forEachRing(const ReportingProgram& program, Use use);
  // … whose filter lets the event through.
  template <typename Use>
  void forEachRing(const ReportingProgram& program, EventKind kind, Use use);
  [[nodiscard]] bool wantsBodies() const { return wantingBodies_.load(std::memory_order_relaxed) != 0; }
  [[nodiscard]] bool takeRoom(size_t bytes);
  void end(size_t place, bool bodies);

  std::array<Place, Limits::maxWatchers> places_;
  std::atomic<uint32_t> watching_{0}, wantingBodies_{0};
  std::atomic<uint64_t> posts_{0};
  std::atomic<size_t> bodyBytes_{0};  // of all bodies that are kept
  Mutex mutex_;                       // for coming and going
};

}  // namespace kyt
