// What could not be sent: posts of events that failed, kept on disk and sent again until they are taken, refused for good,
// too old or displaced. docs/ARCHITECTURE.md says how it works. Made and owned by the composition root where the settings
// ask for it; fed by OutboxURLSession.
//
// All of it runs on a queue of its own, whose executor has threads for that, since the disk may take its time: no session
// waits for it. Any thread may call what is public; list(), drop() and finish() may wait for the disk.
#pragma once

#include <atomic>
#include <cstdint>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "outbox/KeptPosts.h"
#include "outbox/OutboxBooks.h"
#include "outbox/PostVerdict.h"
#include "platform/PostStore.h"
#include "platform/URLSession.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Departures.h"
#include "platform/base/Function.h"
#include "platform/base/Mutex.h"
#include "platform/base/Settings.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

class DiagnosticsConsent;
class Log;
class RandomSource;

// A post of events that failed.
struct FailedPost {
  StoredPost post;                             // without number and time
  std::shared_ptr<const BookedEvents> booked;  // whose they are; null: nobody's
  std::optional<Duration> retryAfter;
  bool isUnanswered = false, mayHaveLeft = true;
  int status = 0;  // 0: unanswered
};

class Outbox final : public std::enable_shared_from_this<Outbox> {
 public:
  struct Ports {
    Clock& clock;
    TimerService& timers;
    RandomSource& random;
    Executor& executor;
    DiagnosticsConsent& consent;
    Counters& counters;
    Log& log;
    Books& books;
    Departures& departures;
    URLSessionFactory& network;
    PostStore& store;
  };
  // Of one server's line, for people.
  struct Server {
    struct User {
      uint64_t posts = 0, bytes = 0;
    };
    std::string server;
    uint64_t posts = 0, bytes = 0, inFlight = 0;
    uint64_t failingAlone = 0;  // posts that it failed while it took others
    unsigned failures = 0;      // in a row
    int lastStatus = 0;         // 0: no answer came
    Duration oldest{};          // age
    Duration untilNextTry{};    // 0: now
    std::map<uint32_t, User> users;
  };
  // What an administrator drops: all where nothing is said.
  struct Filter {
    std::optional<std::string> server;
    std::optional<uint32_t> user;
  };

  // The longest between two looks at age and consent, and after a disk's failure.
  static constexpr std::chrono::minutes kLongestRest{30};
  static constexpr std::chrono::seconds kDiskPause{30};
  // A network that comes and goes makes no server be asked more often than this.
  static constexpr std::chrono::seconds kBetweenTries{5};
  static constexpr unsigned kMostAtATime = 4;  // to one server that takes them

  [[nodiscard]] static std::shared_ptr<Outbox> create(Ports ports, OutboxSettings settings);
  Outbox(const Outbox&) = delete;
  Outbox& operator=(const Outbox&) = delete;

  // Reads what an earlier process left, and sends it.
  void begin();
  // The owner may have decided anew.
  void consentMayHaveChanged() { wake(); }
  // Keeps the post, or not: `settled` is told once, when it is on disk (the post counts as outbox in the books then) or
  // when it cannot be: on the caller's thread before this returns, on the outbox's queue, or on another one when the disk has
  // taken longer than Limits::outboxCommitTime.
  void keep(FailedPost post, Function<void(bool isKept)> settled);
  // Whether there is hope that a post can be kept.
  [[nodiscard]] bool isTaking() const EXCLUDES(mutex_);
  // As the owner says at this moment. May read a small file.
  [[nodiscard]] bool isConsentGiven() const;
  // A first post to that address was taken.
  void serverAnswers(std::string_view url) EXCLUDES(mutex_);
  // What such an answer asks for.
  [[nodiscard]] std::optional<Duration> pauseBy(const URLResponse* response) const {
    return retryAfter(response, ports_.clock.timeOfDay());
  }
  [[nodiscard]] bool isEmpty() const { return size_.load(std::memory_order_relaxed) == 0; }

  [[nodiscard]] std::vector<Server> list();
  void flush();  // sends without waiting for the time of the next try
  struct Dropped {
    uint64_t posts = 0;
    const char* problem = nullptr;  // null: the disk has let them go
  };
  [[nodiscard]] Dropped drop(Filter filter);

  // Shut-down: sends nothing any more, but goes on keeping.
  void stopSending();
  // Shut-down, its end: keeps what came, and closes the file. False when the disk takes longer.
  [[nodiscard]] bool finishWithin(Duration patience);

 private:
  struct Incoming {
    FailedPost failed;
    uint64_t ticket = 0;  // of who waits
  };
  // Who waits to be told whether a post is kept; told by the queue, or when the disk takes too long.
  struct Waiting {
    Function<void(bool)> settled;
    MonotonicTime since{};
    std::string server;
  };
  // A post on its way.
  struct Sending {
    int64_t number = 0;
    ServerLine* line = nullptr;
    std::string url;
    size_t bytes = 0, bodyBytes = 0;
    MonotonicTime since{};
    OutboxBooks::Events events;
    std::shared_ptr<URLSession> session;
    std::shared_ptr<URLTask> task;
    bool isAbandoned = false;  // it has left the outbox meanwhile
  };
  struct Answer {
    std::shared_ptr<Sending> sending;
    PostVerdict verdict = PostVerdict::sendAgain;
    std::optional<Duration> retryAfter;
    bool isUnanswered = false, mayHaveLeft = true;
    int status = 0;  // 0: unanswered
  };
  // What came from other threads since the last turn.
  struct Inbox {
    std::vector<Incoming> posts;
    std::vector<Answer> answers;
    std::vector<std::string> answering;  // servers
    size_t bytes = 0;
    std::map<uint32_t, size_t> bytesOfUsers;
    bool connectivityChanged = false, flush = false;
  };
  // A change of the file, and of what is known of it, that happens as a whole or not.
  struct Plan {
    std::vector<Incoming> posts;
    std::vector<std::pair<int64_t, OutboxBooks::Events>> displaced;
  };

  Outbox(Ports ports, OutboxSettings settings);
  void wake() EXCLUDES(mutex_);
  void turn() REQUIRES(*queue_) EXCLUDES(mutex_);
  void turnIsOver(const Inbox& inbox) REQUIRES(*queue_) EXCLUDES(mutex_);
  void load() REQUIRES(*queue_);
  void forgetUnreadable(const std::vector<int64_t>& numbers) REQUIRES(*queue_);
  [[nodiscard]] int64_t bornAt(int64_t keptAt) const;
  [[nodiscard]] int64_t seconds() const;                 // since the boot
  [[nodiscard]] std::optional<int64_t> timeNow() const;  // since 1970; none: the clock has not been set
  void noteAge(const StoredPost& post) REQUIRES(*queue_);
  void takeTime() REQUIRES(*queue_);
  void takeAges() REQUIRES(*queue_);
  void doubtNoAges() REQUIRES(*queue_);
  [[nodiscard]] bool believesAges() REQUIRES(*queue_);
  [[nodiscard]] bool noteConsent() REQUIRES(*queue_);

  void take(Answer& answer) REQUIRES(*queue_);
  void tellOwner(const std::string& url, const OutboxBooks::Events& events, uint64_t bodyBytes,
                 bool isAnswered);
  void takeNews(const Inbox& inbox) REQUIRES(*queue_);
  void fail(ServerLine& line, std::optional<Duration> pause, bool isUnanswered) REQUIRES(*queue_);
  void failAgain(KeptPosts::Entry& entry, const Answer& answer) REQUIRES(*queue_);
  void pause(ServerLine& line, Duration length) REQUIRES(*queue_);
  void takePauses(bool isBelieved = false) REQUIRES(*queue_);
  void notePauses() REQUIRES(*queue_);
  void forgetNoted() REQUIRES(*queue_);
  // Not before the time that the server has asked for.
  static void setNextTry(ServerLine& line, MonotonicTime time);
  // False: it has no effect.
  bool hasten(ServerLine& line, Duration sinceLastTry) REQUIRES(*queue_);
  void hearGood(ServerLine& line) REQUIRES(*queue_);
  void takes(ServerLine& line) REQUIRES(*queue_);
  [[nodiscard]] Duration pauseAfter(unsigned failures);
  void forgetWithoutConsent() REQUIRES(*queue_);
  void forgetTooOld() REQUIRES(*queue_);
  void leave(KeptPosts::Entry& entry, Reason fate) REQUIRES(*queue_);
  [[nodiscard]] OutboxBooks::Events eventsOf(const KeptPosts::Entry& entry) REQUIRES(*queue_);

  void keepBounds() REQUIRES(*queue_);
  void keepAll(std::vector<Incoming> posts) REQUIRES(*queue_);
  [[nodiscard]] bool makeRoom(Plan& plan, uint32_t user, uint64_t bytes) REQUIRES(*queue_);
  void commit(Plan plan) REQUIRES(*queue_);
  void kept(Plan& plan) REQUIRES(*queue_);
  void notKept(Plan& plan) REQUIRES(*queue_);
  void refuse(const std::string& server, Function<void(bool)> settled);
  void refuse(const Incoming& post) EXCLUDES(mutex_);
  // None: it was told already.
  [[nodiscard]] std::optional<Waiting> takeWaiting(uint64_t ticket) EXCLUDES(mutex_);
  [[nodiscard]] bool isWaiting(uint64_t ticket) const EXCLUDES(mutex_);
  // Takes both, or neither.
  [[nodiscard]] bool takeIn(FailedPost& post, Function<void(bool)>& settled) EXCLUDES(mutex_);
  [[nodiscard]] bool hasRoomOnTheWay(uint32_t user, size_t bytes) REQUIRES(mutex_);
  void watchDeadline() REQUIRES(mutex_);
  void tellWhoWaitedTooLong() EXCLUDES(mutex_);
  [[nodiscard]] bool diskRests() const EXCLUDES(mutex_);
  void handle(const PostStoreProblem& problem) REQUIRES(*queue_);
  [[nodiscard]] bool cannotRead(KeptPosts::Entry& entry, const PostStoreProblem& problem) REQUIRES(*queue_);
  void lose(KeptPosts::Entry& entry, const PostStoreProblem& problem) REQUIRES(*queue_);

  void sendWhatIsDue() REQUIRES(*queue_);
  void sendFrom(ServerLine& line) REQUIRES(*queue_);
  [[nodiscard]] bool hasPlaceFor(const ServerLine& line) REQUIRES(*queue_);
  [[nodiscard]] bool send(KeptPosts::Entry& entry) REQUIRES(*queue_);
  [[nodiscard]] std::shared_ptr<URLSession> sessionFor(ServerLine& line, const StoredPost& post)
      REQUIRES(*queue_);
  void setTimer() REQUIRES(*queue_);
  void watchConnectivity() REQUIRES(*queue_);

  // Constant.
  const Ports ports_;
  const OutboxSettings settings_;
  const std::shared_ptr<SerialQueue> queue_, deadlines_;

  // Self-synchronised.
  std::atomic<size_t> size_{0};
  std::atomic<bool> someFail_{false}, isStopping_{false};
  mutable Mutex mutex_;
  Inbox inbox_ GUARDED_BY(mutex_);
  size_t bytesOnTheWay_ GUARDED_BY(mutex_) = 0;
  std::map<uint32_t, size_t> bytesOfUsersOnTheWay_ GUARDED_BY(mutex_);
  std::map<uint64_t, Waiting> waiting_ GUARDED_BY(mutex_);  // by ticket: in the order in which they came
  uint64_t lastTicket_ GUARDED_BY(mutex_) = 0;
  bool isDeadlineWatched_ GUARDED_BY(mutex_) = false;
  bool isDiskSlow_ GUARDED_BY(mutex_) =
      false;  // the turn that goes on has kept somebody waiting for too long
  TimerHandle deadline_ GUARDED_BY(mutex_);
  bool isAwake_ GUARDED_BY(mutex_) = false;
  MonotonicTime diskRestsUntil_ GUARDED_BY(mutex_){};

  // The queue's.
  KeptPosts posts_ GUARDED_BY(*queue_);
  OutboxBooks books_ GUARDED_BY(*queue_);
  std::map<int64_t, std::shared_ptr<Sending>> inFlight_ GUARDED_BY(*queue_);
  size_t bytesInFlight_ GUARDED_BY(*queue_) = 0;
  std::vector<int64_t> removed_ GUARDED_BY(*queue_);  // not yet from the file
  bool removesForGood_ GUARDED_BY(*queue_) = false;
  int64_t last_ GUARDED_BY(*queue_) = 0, lastLoaded_ GUARDED_BY(*queue_) = 0;
  uint64_t diskWork_ GUARDED_BY(*queue_) = 0;      // what the disk has done well
  unsigned unreadInARow_ GUARDED_BY(*queue_) = 0;  // posts that it did not give
  MonotonicTime readingRestsUntil_ GUARDED_BY(*queue_){}, notingRestsUntil_ GUARDED_BY(*queue_){};
  bool isLoaded_ GUARDED_BY(*queue_) = false, isWatching_ GUARDED_BY(*queue_) = false;
  bool isClosed_ GUARDED_BY(*queue_) = false, wasConsentGiven_ GUARDED_BY(*queue_) = true;
  uint64_t consentEpoch_ GUARDED_BY(*queue_) = 0;  // of the last look
  bool isConsentNoted_ GUARDED_BY(*queue_) = false, mustRemoveSetAside_ GUARDED_BY(*queue_) = false;
  // Ages, in seconds since the boot.
  int64_t oldestBorn_ GUARDED_BY(*queue_) = std::numeric_limits<int64_t>::max();  // none is older
  int64_t loadedAt_ GUARDED_BY(*queue_) = 0, nextAgeLook_ GUARDED_BY(*queue_) = 0;
  int64_t nextSetAsideLook_ GUARDED_BY(*queue_) = 0;
  int64_t pausesAheadUntil_ GUARDED_BY(*queue_) =
      0;  // since 1970: then the clock is behind them no more; 0: none is
  int64_t untimed_ GUARDED_BY(*queue_) =
      0;  // the last post of which the clock has not said when it was kept; 0: none
  bool hasAgesToTake_ GUARDED_BY(*queue_) =
      false;  // posts of before the start, when the clock had not been set
  TimerHandle timer_ GUARDED_BY(*queue_);
};

}  // namespace kyt
