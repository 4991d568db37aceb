#include "platform/base/Books.h"

#include <algorithm>
#include <cassert>
#include <functional>
#include <map>
#include <numeric>
#include <span>
#include <tuple>
#include <unordered_set>

#include "platform/base/Limits.h"
#include "platform/base/Mutex.h"
#include "platform/base/TextEscape.h"

namespace kyt {

namespace {

using Number = std::atomic<uint64_t>;

// What leaves a place is written after it came there, and read before: so no reader sees more leave than came.
void add(Number& number, uint64_t events) {
  number.fetch_add(events, std::memory_order_acq_rel);
}
uint64_t read(const Number& number) {
  return number.load(std::memory_order_acquire);
}

// Programs without rows that are told from each other: of each row "other", and further ones of all together, so that no
// user's programs keep those of others from being counted.
constexpr size_t kMostMergedOfRow = 64;
constexpr size_t kMostMergedBesides = 4096;

size_t hashOf(const ReportingProgram& program) {
  const std::string text = std::to_string(program.user) + '/' + std::to_string(program.clientType) + '/' +
                           std::to_string(program.clientName.size()) + '/' + program.clientName +
                           program.service;
  return std::hash<std::string>()(text);
}

}  // namespace

struct Books::Row {
  bool isInternal = false;  // constant once there is a tally
  Number postsBegun{0}, postsEnded{0};
  Number waitsBegun{0}, waitsEnded{0};
  Number outboxEntered{0}, outboxLeft{0};
  Number restored{0};  // taken by an earlier process
  Number batchesLeft{0};
  Number delivered{0};
  std::array<Number, kFates.size()> dropped{};

  // Guarded by the mutex of the books.
  Tally* first = nullptr;
  uint64_t taken = 0, batched = 0;  // of tallies that are gone
  uint64_t programsMerged = 0;
  std::unordered_set<size_t> merged;  // their hashes
  const BookRowName* name = nullptr;  // constant

  void fill(BookRow& row) const;
};

struct Books::State {
  explicit State(const Clock* c) : clock(c) {}
  const Clock* const clock;
  RecentFates recent;

  using Key = BookRowName;

  mutable Mutex mutex;
  std::map<Key, Row> rows GUARDED_BY(mutex);
  std::map<uint32_t, size_t> rowsOfUser GUARDED_BY(mutex);
  size_t rowsOfPrograms GUARDED_BY(mutex) = 0;
  size_t mergedBesides GUARDED_BY(mutex) = 0;

  Row& row(Key key) REQUIRES(mutex);
  Row& otherRow(uint32_t user, bool isInternal) REQUIRES(mutex);
  void countMerged(Row& row, const ReportingProgram& program) REQUIRES(mutex);
};

// What leaves is read before what came, and each place before the one before it on an event's road: so the events of a row
// add up to no more than were taken, and what is left over is on its way between two places.
void Books::Row::fill(BookRow& row) const {
  row.delivered = read(delivered);
  for (size_t i = 0; i < kFates.size(); ++i) row.dropped[i] = read(dropped[i]);
  const uint64_t leftOutbox = read(outboxLeft);
  row.outbox = read(outboxEntered) - leftOutbox;
  const uint64_t ended = read(postsEnded);
  const uint64_t noLongerWaiting = read(waitsEnded);
  const uint64_t begunToWait = read(waitsBegun);
  const uint64_t posted = read(postsBegun) - ended;
  row.waiting =
      std::min(begunToWait - noLongerWaiting, posted);  // one may have waited more than once meanwhile
  row.inFlight = posted - row.waiting;
  const uint64_t left = read(batchesLeft);
  uint64_t entered = batched;
  for (const Tally* tally = first; tally != nullptr; tally = tally->next_) entered += read(tally->batched_);
  row.batched = entered - left;
  row.taken = taken + read(restored);
  for (const Tally* tally = first; tally != nullptr; tally = tally->next_) row.taken += read(tally->taken_);
  row.queued = row.taken - row.batched - posted - row.outbox - row.delivered - row.droppedInAll();
  row.programsMerged = programsMerged;
}

Books::Row& Books::State::row(Key key) {
  if (const auto known = rows.find(key); known != rows.end()) return known->second;
  size_t& ofUser = rowsOfUser[key.program.user];
  const bool hasRoom =
      rowsOfPrograms < Limits::maxBookRows - Limits::bookRowsForOthers && ofUser < Limits::maxBookRowsOfUser;
  if (!hasRoom) {
    Row& other = otherRow(key.program.user, key.isInternal);
    countMerged(other, key.program);
    return other;
  }
  ++rowsOfPrograms;
  ++ofUser;
  const bool isInternal = key.isInternal;
  const auto made = rows.try_emplace(std::move(key)).first;
  made->second.name = &made->first;
  made->second.isInternal = isInternal;
  return made->second;
}

Books::Row& Books::State::otherRow(uint32_t user, bool isInternal) {
  const auto keyOf = [isInternal](uint32_t whose) {
    return Key{{whose, 0, std::string(kOtherPrograms), ""}, std::string(kOtherPrograms), isInternal, true};
  };
  auto found = rows.find(keyOf(user));
  if (found == rows.end()) {
    // The last two are for all users that come after.
    const bool isLast = rows.size() - rowsOfPrograms + 2 >= Limits::bookRowsForOthers;
    found = rows.try_emplace(keyOf(isLast ? kAllUsers : user)).first;
    found->second.name = &found->first;
    found->second.isInternal = isInternal;
    found->second.programsMerged = 1;
  }
  return found->second;
}

void Books::State::countMerged(Row& row, const ReportingProgram& program) {
  const bool isBesides = row.merged.size() >= kMostMergedOfRow;
  if (isBesides && mergedBesides >= kMostMergedBesides) return;
  if (!row.merged.insert(hashOf(program)).second) return;
  if (isBesides) ++mergedBesides;
  row.programsMerged = row.merged.size();
}

Books::Books() : state_(std::make_shared<State>(nullptr)) {}
Books::Books(const Clock& clock) : state_(std::make_shared<State>(&clock)) {}
Books::~Books() = default;

std::shared_ptr<Tally> Books::open(const ReportingProgram& program, std::string_view backEnd,
                                   bool isInternal) {
  State::Key key{{program.user, program.clientType, std::string(cutName(program.clientName)),
                  std::string(cutName(program.service))},
                 std::string(cutName(backEnd)),
                 isInternal,
                 false};
  MutexLock lock(state_->mutex);
  return std::make_shared<Tally>(state_, state_->row(std::move(key)), program);
}

std::shared_ptr<Tally> Books::reopen(BookRowName name) {
  const ReportingProgram program = name.program;
  MutexLock lock(state_->mutex);
  Row& row = name.isOther ? state_->otherRow(program.user, name.isInternal) : state_->row(std::move(name));
  return std::make_shared<Tally>(state_, row, program);
}

std::vector<BookRow> Books::snapshot() const {
  std::vector<BookRow> rows;
  MutexLock lock(state_->mutex);
  rows.reserve(state_->rows.size());
  for (const auto& [key, row] : state_->rows) {
    BookRow& filled = rows.emplace_back();
    filled.program = key.program;
    filled.backEnd = key.backEnd;
    filled.isInternal = key.isInternal;
    row.fill(filled);
  }
  return rows;
}

FateFigures Books::lastHour() const {
  return state_->clock != nullptr ? state_->recent.lastHour(state_->clock->monotonic()) : FateFigures();
}

// Called by open(), which holds the mutex.
Tally::Tally(std::shared_ptr<Books::State> state, Books::Row& row, const ReportingProgram& program)
    : state_(std::move(state)), row_(row), program_(program), next_(row.first) {
  if (next_ != nullptr) next_->previous_ = this;
  row_.first = this;
}

Tally::~Tally() {
  MutexLock lock(state_->mutex);
  row_.taken += taken_.load(std::memory_order_relaxed);
  row_.batched += batched_.load(std::memory_order_relaxed);
  (previous_ != nullptr ? previous_->next_ : row_.first) = next_;
  if (next_ != nullptr) next_->previous_ = previous_;
}

void Tally::leaveBatch(size_t events) {
  add(row_.batchesLeft, events);
}
void Tally::beginPost(size_t events) {
  add(row_.postsBegun, events);
}
void Tally::endPost(size_t events) {
  add(row_.postsEnded, events);
}
void Tally::beginWaiting(size_t events) {
  add(row_.waitsBegun, events);
}
void Tally::endWaiting(size_t events) {
  add(row_.waitsEnded, events);
}
void Tally::enterOutbox(size_t events) {
  add(row_.outboxEntered, events);
}
void Tally::leaveOutbox(size_t events) {
  add(row_.outboxLeft, events);
}
void Tally::restore(size_t events) {
  add(row_.restored, events);
  add(row_.outboxEntered, events);
}
const BookRowName& Tally::rowName() const {
  return *row_.name;
}
void Tally::deliver(size_t events) {
  add(row_.delivered, events);
  if (state_->clock != nullptr && !row_.isInternal)
    state_->recent.addDelivered(state_->clock->monotonic(), events);
}
void Tally::drop(Reason fate, size_t events) {
  const size_t number = fateNumber(fate);
  assert(number < kFates.size());
  add(row_.dropped[number], events);
  if (state_->clock != nullptr && !row_.isInternal)
    state_->recent.addDropped(state_->clock->monotonic(), number, events);
}

PassedEvent Tally::passed(EventKind kind, std::optional<Reason> dropped) const {
  PassedEvent event;
  event.program = program_;
  event.isInternal = row_.isInternal;
  event.kind = kind;
  event.dropped = dropped;
  if (state_->clock != nullptr) event.seconds = state_->clock->timeOfDay().seconds;
  return event;
}

BookedEvents BookedEvents::unbooked(size_t events) {
  BookedEvents made;
  made.add(nullptr, events);
  return made;
}

void BookedEvents::add(Tally* tally, size_t events) {
  if (events == 0) return;
  size_ += events;
  if (runs_.empty() || runs_.back().tally.get() != tally)
    runs_.push_back({tally != nullptr ? tally->shared_from_this() : nullptr, 0});
  runs_.back().events += events;
}

template <typename Operation>
void BookedEvents::forEachRun(Operation operation) const {
  for (const Run& run : runs_)
    if (run.tally) operation(*run.tally, run.events);
}

std::vector<std::pair<ReportingProgram, size_t>> BookedEvents::programs() const {
  std::vector<std::pair<ReportingProgram, size_t>> all;
  forEachRun([&all](Tally& tally, size_t events) {
    for (auto& [program, sum] : all)
      if (program == tally.program()) {
        sum += events;
        return;
      }
    all.emplace_back(tally.program(), events);
  });
  return all;
}

void BookedEvents::leaveBatch() const {
  forEachRun([](Tally& tally, size_t events) { tally.leaveBatch(events); });
}
void BookedEvents::beginPost() const {
  forEachRun([](Tally& tally, size_t events) { tally.beginPost(events); });
}
void BookedEvents::endPost() const {
  forEachRun([](Tally& tally, size_t events) { tally.endPost(events); });
}
void BookedEvents::beginWaiting() const {
  forEachRun([](Tally& tally, size_t events) { tally.beginWaiting(events); });
}
void BookedEvents::endWaiting() const {
  forEachRun([](Tally& tally, size_t events) { tally.endWaiting(events); });
}
void BookedEvents::deliver() const {
  forEachRun([](Tally& tally, size_t events) { tally.deliver(events); });
  if (shown_ != nullptr) tellWatchers(std::nullopt);
}
void BookedEvents::drop(Counters& counters, Reason fate) const {
  counters.add(fate, size_);
  forEachRun([fate](Tally& tally, size_t events) { tally.drop(fate, events); });
  if (shown_ != nullptr) tellWatchers(fate);
}

void BookedEvents::tellWatchers(std::optional<Reason> dropped) const {
  PassedEvent fate;
  fate.dropped = dropped;
  if (dropped) fate.rule = shown_->rule;
  if (shown_->post != nullptr && shown_->post->number() != 0) fate.post = shown_->post;
  fate.isFirstOfPost = fate.post != nullptr;
  tellWatchers(std::move(fate));
}

void BookedEvents::tellWatchers(PassedEvent fate) const {
  Watchers& watchers = *shown_->watchers;
  ToldBody body;
  if (fate.isFirstOfPost) body.body = fate.post->body();
  std::span<const EventKind> kinds = shown_->kinds;
  for (const Run& run : runs_) {
    const std::span<const EventKind> own = kinds.first(std::min(run.events, kinds.size()));
    kinds = kinds.subspan(own.size());
    if (!run.tally || watchers.loseAll(run.tally->program(), own, run.events)) continue;
    for (size_t i = 0; i < run.events; ++i) {
      const EventKind kind = i < own.size() ? own[i] : EventKind();
      if (!watchers.want(run.tally->program(), kind)) continue;
      PassedEvent event = run.tally->passed(kind, fate.dropped);
      event.backEnd = shown_->backEnd;
      event.isKept = fate.isKept;
      event.rule = fate.rule;
      event.post = fate.post;
      watchers.tell(std::move(event), fate.isFirstOfPost ? &body : nullptr);
    }
  }
  if (fate.isFirstOfPost) shown_->post->forgetBody();
}

std::vector<BookedEvents::OfRow> BookedEvents::rows() const {
  std::vector<OfRow> rows;
  forEachRun([&rows](const Tally& tally, size_t events) {
    const BookRowName& name = tally.rowName();
    const auto known =
        std::find_if(rows.begin(), rows.end(), [&name](const OfRow& row) { return row.row == name; });
    if (known != rows.end())
      known->events += events;
    else
      rows.push_back({name, events});
  });
  return rows;
}

void BookedEvents::keep(int status) const {
  forEachRun([](Tally& tally, size_t events) {
    tally.endPost(events);
    tally.enterOutbox(events);
  });
  areKept_ = true;
  if (shown_ == nullptr) return;
  PassedEvent fate;
  fate.isKept = true;
  if (shown_->post != nullptr && shown_->post->number() != 0) {
    shown_->post->answered(status);
    fate.post = shown_->post;
  }
  fate.isFirstOfPost = fate.post != nullptr;
  tellWatchers(std::move(fate));
}

// What was answered never changes, so this is another post to the same server.
void BookedEvents::tellEnd(std::optional<Reason> dropped, int status) const {
  if (shown_ == nullptr) return;
  PassedEvent fate;
  fate.dropped = dropped;
  if (status != 0 && shown_->post != nullptr) {
    const auto repeat = std::make_shared<WatchedPost>(shown_->watchers);
    repeat->leaves(shown_->post->server(), {});
    repeat->answered(status);
    fate.post = repeat;
  }
  tellWatchers(std::move(fate));
}

Tally* BookedEventsReader::next() {
  if (run_ == end_) return nullptr;
  Tally* tally = run_->tally.get();
  if (++read_ == run_->events) {
    ++run_;
    read_ = 0;
  }
  return tally;
}

PostedEvents::PostedEvents(BookedEvents events, Counters& counters)
    : events_(std::make_shared<const BookedEvents>(std::move(events))), counters_(&counters) {
  events_->beginPost();
}

PostedEvents::~PostedEvents() {
  if (events_) dropped(Reason::postCancelled);
}

std::shared_ptr<const BookedEvents> PostedEvents::close() {
  if (events_ && events_->areKept()) events_ = nullptr;
  if (events_) events_->endPost();
  return std::move(events_);
}

void PostedEvents::delivered() {
  if (const auto events = close()) events->deliver();
}

void PostedEvents::dropped(Reason fate) {
  if (const auto events = close()) events->drop(*counters_, fate);
}

uint64_t BookRow::droppedInAll() const {
  return std::accumulate(dropped.begin(), dropped.end(), uint64_t{0});
}

std::string describeRow(const BookRow& row) {
  const auto name = [](const std::string& text) {
    std::string shown = "\"";
    for (const char c : escapedName(text)) {
      if (c == '"') shown += '\\';
      shown += c;
    }
    return shown += '"';
  };
  std::string line = "user=" + std::to_string(row.program.user) +
                     " type=" + std::to_string(row.program.clientType) +
                     " client=" + name(row.program.clientName) + " service=" + name(row.program.service) +
                     " back-end=" + row.backEnd + (row.isInternal ? " internal" : "");
  if (row.programsMerged != 0) line += " programs=" + std::to_string(row.programsMerged);
  const auto figure = [&line](const char* key, uint64_t number) {
    line.append(" ").append(key).append("=").append(std::to_string(number));
  };
  figure("taken", row.taken);
  figure("queued", row.queued);
  figure("batched", row.batched);
  figure("in-flight", row.inFlight);
  figure("waiting", row.waiting);
  figure("outbox", row.outbox);
  figure("delivered", row.delivered);
  figure("dropped", row.droppedInAll());
  for (size_t i = 0; i < kFates.size(); ++i)
    if (row.dropped[i] != 0) figure(reasonName(kFates[i]), row.dropped[i]);
  return line;
}

}  // namespace kyt
