// The books: for each reporting program and each back end, how many events the daemon has taken, and where each of them
// is or what became of it. Of every row, in every snapshot: taken = queued + batched + inFlight + waiting + outbox +
// delivered + dropped by reason. docs/ARCHITECTURE.md says how it is counted.
//
// An event is booked as taken once for each back end of its session when the session has it from its client, or once under
// the back end "-" where there is none. Its fates are kFates (Counters.h).
//
// The road of one event takes no lock: what is counted for each event stands in the Tally of its back end, of which each
// number has one writer at a time; the rest, for each post or drop, in the row, by atomic additions. The mutex is for
// opening and closing tallies and for reading. Any thread may read. The composition root owns the one Books; tallies may
// outlive it.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/RecentFates.h"
#include "platform/base/ReportingProgram.h"
#include "platform/base/Watchers.h"

namespace kyt {

// The back end of events that none took.
inline constexpr std::string_view kNoBackEnd = "-";

// The program and back end of the rows for programs that had no room for rows of their own, and the user of the one for all
// users who came after.
inline constexpr std::string_view kOtherPrograms = "other";
inline constexpr uint32_t kAllUsers = ~uint32_t{0};

// What names a row, for who keeps events longer than the process lives.
struct BookRowName {
  ReportingProgram program;
  std::string backEnd;
  bool isInternal = false, isOther = false;
  friend auto operator<=>(const BookRowName&, const BookRowName&) = default;
};

struct BookRow {
  ReportingProgram program;
  std::string backEnd;      // "-": none took the event
  bool isInternal = false;  // the daemon's own start and stop messages of the program's sessions
  uint64_t taken = 0;
  uint64_t queued = 0;    // taken, and not yet in any other place
  uint64_t batched = 0;   // in the batch of a back end
  uint64_t inFlight = 0;  // in a request that was not answered yet
  uint64_t waiting = 0;   // in one that waits for connectivity
  uint64_t outbox = 0;    // in a post that is kept on disk, to be sent again
  uint64_t delivered = 0;
  std::array<uint64_t, kFates.size()> dropped{};
  // Not 0: this is a row "other" of a user, of so many programs (at least) that had no room for rows of their own.
  uint64_t programsMerged = 0;

  [[nodiscard]] uint64_t pending() const { return queued + batched + inFlight + waiting + outbox; }
  [[nodiscard]] uint64_t droppedFor(Reason fate) const { return dropped.at(fateNumber(fate)); }
  [[nodiscard]] uint64_t droppedInAll() const;
};

// A line for people and tests: "user=1000 type=7 client="a" service="b" back-end=httppost … dropped: post-failed=2".
[[nodiscard]] std::string describeRow(const BookRow& row);

class Tally;

class Books {
 public:
  Books();
  // With a clock, which outlives the books and their tallies, there are figures of the last hour too.
  explicit Books(const Clock& clock);
  ~Books();
  Books(const Books&) = delete;
  Books& operator=(const Books&) = delete;

  // A tally of that row, which is made where there is none and there is room (Limits::maxBookRows); further programs
  // share the row "other" of their user, and the daemon's own messages of their sessions another one. Names are cut to Limits::maxBookNameBytes. Takes a lock.
  [[nodiscard]] std::shared_ptr<Tally> open(const ReportingProgram& program, std::string_view backEnd,
                                            bool isInternal);
  // The same by a name that a tally had, perhaps in an earlier process.
  [[nodiscard]] std::shared_ptr<Tally> reopen(BookRowName name);

  // All rows, in the order of user, client type, names and back end. Waits for nobody but open() and ends of tallies.
  [[nodiscard]] std::vector<BookRow> snapshot() const;

  // Of the programs' events, not the daemon's own, by back end. Without a clock all 0.
  [[nodiscard]] FateFigures lastHour() const;

  // Who watches events get their fates. Whoever books a fate tells them, where anybody watches.
  [[nodiscard]] const std::shared_ptr<Watchers>& watchers() const { return watchers_; }

 private:
  friend class Tally;
  struct Row;
  struct State;
  const std::shared_ptr<State> state_;
  const std::shared_ptr<Watchers> watchers_ = std::make_shared<Watchers>();
};

// One back end's part of a row. take() belongs to the queue of its session, enterBatch() to the one that guards the batch;
// the others may be called from any thread. What leaves a place is counted after it came there.
class Tally final : public std::enable_shared_from_this<Tally> {
 public:
  // For Books alone.
  Tally(std::shared_ptr<Books::State> state, Books::Row& row, const ReportingProgram& program);
  ~Tally();  // what it counted stays in the row
  Tally(const Tally&) = delete;
  Tally& operator=(const Tally&) = delete;

  // Whose events these are. Any thread.
  [[nodiscard]] const ReportingProgram& program() const { return program_; }
  // One of its events, for watchers.
  [[nodiscard]] PassedEvent passed(EventKind kind, std::optional<Reason> dropped) const;

  void take() { addByOneWriter(taken_); }
  void enterBatch() { addByOneWriter(batched_); }
  void leaveBatch(size_t events);
  void beginPost(size_t events);
  void endPost(size_t events);
  void beginWaiting(size_t events);
  void endWaiting(size_t events);
  void enterOutbox(size_t events);
  void leaveOutbox(size_t events);
  // Events that an earlier process took, and that lie in the outbox.
  void restore(size_t events);
  void deliver(size_t events);
  void drop(Reason fate, size_t events);
  [[nodiscard]] const BookRowName& rowName() const;

 private:
  friend class Books;
  static void addByOneWriter(std::atomic<uint64_t>& number) {
    number.store(number.load(std::memory_order_relaxed) + 1, std::memory_order_release);
  }

  const std::shared_ptr<Books::State> state_;
  Books::Row& row_;
  const ReportingProgram program_;
  std::atomic<uint64_t> taken_{0}, batched_{0};
  Tally *next_ = nullptr, *previous_ = nullptr;  // of the same row; guarded by the books' mutex
};

// How many events of which tallies, in their order: those of a batch, or of a message. Mostly one tally, or two: the
// session's start message and its program's events. One thread at a time.
class BookedEvents {
 public:
  BookedEvents() = default;
  // Of no tally: counted, not booked.
  static BookedEvents unbooked(size_t events);

  // What watchers are told of them besides what their tallies say.
  struct Shown {
    std::shared_ptr<Watchers> watchers;
    std::string backEnd;
    const char* rule = "";         // where they are dropped
    std::vector<EventKind> kinds;  // of each, in order
    std::shared_ptr<WatchedPost> post;
  };
  // From now on whoever watches is told their fate. Only where anybody watches, and once they are complete.
  void show(Shown shown) { shown_ = std::make_shared<const Shown>(std::move(shown)); }
  [[nodiscard]] bool areShown() const { return shown_ != nullptr; }
  // What carries them; null: they are not shown, or not posted.
  [[nodiscard]] WatchedPost* watchedPost() const { return shown_ != nullptr ? shown_->post.get() : nullptr; }

  void add(Tally* tally, size_t events = 1);  // null: of none
  [[nodiscard]] size_t size() const { return size_; }

  // How many are whose.
  [[nodiscard]] std::vector<std::pair<ReportingProgram, size_t>> programs() const;

  // Of all of them.
  void leaveBatch() const;
  void beginPost() const;
  void endPost() const;
  void beginWaiting() const;
  void endWaiting() const;
  void deliver() const;
  void drop(Counters& counters, Reason fate) const;

  // Of those that are booked: how many of which row.
  struct OfRow {
    BookRowName row;
    uint64_t events = 0;
    friend auto operator<=>(const OfRow&, const OfRow&) = default;
  };
  [[nodiscard]] std::vector<OfRow> rows() const;
  // The outbox has them: their post has ended with that status (0: no answer came), and whoever posted them (PostedEvents)
  // closes nothing any more. By whoever answers the post, before the answer.
  void keep(int status) const;
  // For watchers alone: what became at last of what was kept.
  void tellEnd(std::optional<Reason> dropped, int status) const;
  [[nodiscard]] bool areKept() const { return areKept_; }

 private:
  friend class BookedEventsReader;
  struct Run {
    std::shared_ptr<Tally> tally;
    size_t events = 0;
  };
  template <typename Operation>
  void forEachRun(Operation operation) const;
  void tellWatchers(std::optional<Reason> dropped) const;
  void tellWatchers(PassedEvent fate) const;

  std::vector<Run> runs_;
  size_t size_ = 0;
  std::shared_ptr<const Shown> shown_;  // null: nobody is told
  mutable bool areKept_ = false;
};

// The tally of each event, in order; null past the last.
class BookedEventsReader {
 public:
  explicit BookedEventsReader(const BookedEvents& events)
      : run_(events.runs_.begin()), end_(events.runs_.end()) {}
  [[nodiscard]] Tally* next();

 private:
  std::vector<BookedEvents::Run>::const_iterator run_, end_;
  size_t read_ = 0;  // of the run
};

// The events of one post, from the decision to post until its answer. Whoever has this closes it: what is destroyed
// unanswered was cut off by the end of the daemon. The counters outlive it. One thread at a time.
class PostedEvents {
 public:
  PostedEvents(BookedEvents events, Counters& counters);
  PostedEvents(PostedEvents&& other) noexcept = default;
  PostedEvents& operator=(PostedEvents&&) = delete;
  ~PostedEvents();

  [[nodiscard]] size_t size() const { return events_ ? events_->size() : 0; }
  // For the request that carries them, which may begin to wait and stop waiting until it is answered.
  [[nodiscard]] std::shared_ptr<const BookedEvents> events() const { return events_; }
  // The first of these counts: events may leave a message that is posted all the same.
  void delivered();
  void dropped(Reason fate);

 private:
  [[nodiscard]] std::shared_ptr<const BookedEvents> close();
  std::shared_ptr<const BookedEvents> events_;  // null once closed
  Counters* counters_;
};

}  // namespace kyt
