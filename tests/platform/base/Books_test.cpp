#include "platform/base/Books.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <set>
#include <thread>

#include "platform/base/Limits.h"
#include "platform/fake/ManualClock.h"

namespace kyt {
namespace {

const ReportingProgram kProgram{1000, 7, "videocall", "call"};

class BooksTest : public testing::Test {
 protected:
  BookRow row() const {
    const std::vector<BookRow> rows = books_.snapshot();
    EXPECT_EQ(rows.size(), 1U);
    return rows.empty() ? BookRow() : rows.front();
  }
  static void expectClosed(const BookRow& row) {
    EXPECT_EQ(row.taken, row.queued + row.batched + row.inFlight + row.waiting + row.outbox + row.delivered +
                             row.droppedInAll());
  }
  // So many events, taken.
  BookedEvents taken(size_t events) const {
    BookedEvents booked;
    for (size_t i = 0; i < events; ++i) {
      tally_->take();
      booked.add(tally_.get());
    }
    return booked;
  }
  void open() { tally_ = books_.open(kProgram, "httppost", false); }

  Counters counters_;
  Books books_;
  std::shared_ptr<Tally> tally_;
};

TEST_F(BooksTest, ShowWhoseTheEventsAre) {
  open();
  static_cast<void>(taken(1));
  EXPECT_EQ(row().program, kProgram);
  EXPECT_EQ(row().backEnd, "httppost");
  EXPECT_FALSE(row().isInternal);
  EXPECT_EQ(row().programsMerged, 0U);
}

TEST_F(BooksTest, TellTheDaemonsOwnMessagesFromTheProgramsEvents) {
  const auto own = books_.open(kProgram, "httppost", true);
  open();
  own->take();
  own->take();
  static_cast<void>(taken(1));
  const std::vector<BookRow> rows = books_.snapshot();
  ASSERT_EQ(rows.size(), 2U);
  EXPECT_EQ(rows[0].taken, 1U);
  EXPECT_TRUE(rows[1].isInternal);
  EXPECT_EQ(rows[1].taken, 2U);
}

TEST_F(BooksTest, FollowAnEventFromPlaceToPlace) {
  open();
  const BookedEvents events = taken(3);
  EXPECT_EQ(row().queued, 3U);
  for (int i = 0; i < 3; ++i) tally_->enterBatch();
  EXPECT_EQ(row().batched, 3U);
  EXPECT_EQ(row().queued, 0U);
  events.leaveBatch();
  EXPECT_EQ(row().queued, 3U);
  PostedEvents posted(events, counters_);
  EXPECT_EQ(row().inFlight, 3U);
  posted.events()->beginWaiting();
  EXPECT_EQ(row().waiting, 3U);
  EXPECT_EQ(row().inFlight, 0U);
  posted.events()->endWaiting();
  EXPECT_EQ(row().inFlight, 3U);
  EXPECT_EQ(row().pending(), 3U);
  posted.delivered();
  EXPECT_EQ(row().delivered, 3U);
  EXPECT_EQ(row().pending(), 0U);
  expectClosed(row());
}

TEST_F(BooksTest, BookEachLossUnderItsReason) {
  open();
  for (const Reason fate : kFates) taken(2).drop(counters_, fate);
  for (const Reason fate : kFates) {
    EXPECT_EQ(row().droppedFor(fate), 2U) << reasonName(fate);
    EXPECT_EQ(counters_.value(fate), 2U) << reasonName(fate);
  }
  EXPECT_EQ(row().droppedInAll(), row().taken);
  expectClosed(row());
}

TEST_F(BooksTest, BookAPostThatNobodyAnswersAsCutOff) {
  open();
  { const PostedEvents posted(taken(2), counters_); }
  EXPECT_EQ(row().droppedFor(Reason::postCancelled), 2U);
  EXPECT_EQ(row().pending(), 0U);
  {
    PostedEvents posted(taken(1), counters_);
    PostedEvents moved(std::move(posted));
    moved.dropped(Reason::postFailed);
  }
  EXPECT_EQ(row().droppedInAll(), 3U) << "each once";
}

TEST_F(BooksTest, KnowWhatTheOutboxKeepsUntilItIsDeliveredOrLost) {
  open();
  PostedEvents posted(taken(5), counters_);
  posted.events()->keep(0);
  EXPECT_EQ(row().outbox, 5U);
  EXPECT_EQ(row().inFlight, 0U);
  EXPECT_EQ(row().pending(), 5U);
  expectClosed(row());
  tally_->leaveOutbox(3);
  tally_->deliver(3);
  tally_->leaveOutbox(2);
  tally_->drop(Reason::outboxTooOld, 2);
  EXPECT_EQ(row().outbox, 0U);
  EXPECT_EQ(row().delivered, 3U);
  EXPECT_EQ(row().droppedFor(Reason::outboxTooOld), 2U);
  expectClosed(row());
}

TEST_F(BooksTest, LetNobodyCloseAPostThatTheOutboxHas) {
  open();
  for (int end = 0; end < 3; ++end) {
    PostedEvents posted(taken(1), counters_);
    posted.events()->keep(0);
    if (end == 0) posted.delivered();
    if (end == 1) posted.dropped(Reason::postFailed);
  }
  EXPECT_EQ(row().outbox, 3U);
  EXPECT_EQ(row().delivered, 0U);
  EXPECT_EQ(row().droppedInAll(), 0U);
  EXPECT_EQ(counters_.value(Reason::postFailed), 0U);
  expectClosed(row());
}

TEST_F(BooksTest, TakeOverWhatAnEarlierProcessKeptByTheNameOfItsRow) {
  open();
  const BookedEvents events = taken(4);
  const std::vector<BookedEvents::OfRow> rows = events.rows();
  ASSERT_EQ(rows.size(), 1U);
  EXPECT_EQ(rows[0].events, 4U);
  Books next;
  next.reopen(rows[0].row)->restore(rows[0].events);
  const std::vector<BookRow> restored = next.snapshot();
  ASSERT_EQ(restored.size(), 1U);
  EXPECT_EQ(restored[0].program, kProgram);
  EXPECT_EQ(restored[0].backEnd, "httppost");
  EXPECT_EQ(restored[0].taken, 4U);
  EXPECT_EQ(restored[0].outbox, 4U);
  expectClosed(restored[0]);
}

TEST_F(BooksTest, TakeOverTheRowOfThoseThatHadNoRoom) {
  for (size_t i = 0; i < Limits::maxBookRowsOfUser; ++i)
    static_cast<void>(books_.open({1000, 7, std::to_string(i), ""}, "httppost", false));
  const auto merged = books_.open({1000, 7, "one too many", ""}, "httppost", false);
  EXPECT_TRUE(merged->rowName().isOther);
  Books next;
  next.reopen(merged->rowName())->restore(2);
  ASSERT_EQ(next.snapshot().size(), 1U);
  EXPECT_EQ(next.snapshot()[0].backEnd, "other");
  EXPECT_EQ(next.snapshot()[0].programsMerged, 1U);
  EXPECT_EQ(next.snapshot()[0].outbox, 2U);
}

TEST_F(BooksTest, KeepWhatTalliesCountedThatAreGone) {
  for (int i = 0; i < 3; ++i) {
    open();
    const BookedEvents events = taken(2);
    tally_->enterBatch();
    tally_->enterBatch();
    if (i != 0) events.leaveBatch();
    if (i != 0) events.deliver();
  }
  tally_.reset();
  EXPECT_EQ(row().taken, 6U);
  EXPECT_EQ(row().delivered, 4U);
  EXPECT_EQ(row().batched, 2U);
  expectClosed(row());
}

TEST_F(BooksTest, KeepTheTalliesOfEventsThatOutliveTheirBackEnd) {
  open();
  const auto other = books_.open({1000, 7, "later", "call"}, "httppost", false);
  BookedEvents events = taken(2);
  other->take();
  events.add(other.get());
  tally_.reset();
  PostedEvents posted(std::move(events), counters_);
  posted.delivered();
  const std::vector<BookRow> rows = books_.snapshot();
  ASSERT_EQ(rows.size(), 2U);
  EXPECT_EQ(rows[0].delivered, 1U);
  EXPECT_EQ(rows[1].delivered, 2U);
}

TEST_F(BooksTest, MayEndBeforeTheirTallies) {
  auto books = std::make_unique<Books>();
  const auto tally = books->open(kProgram, "httppost", false);
  books.reset();
  tally->take();
  tally->drop(Reason::batchFull, 1);
}

TEST(BookedEvents, AreReadInTheirOrder) {
  Books books;
  const auto a = books.open(kProgram, "a", false), b = books.open(kProgram, "b", false);
  BookedEvents events;
  events.add(a.get());
  events.add(a.get());
  events.add(b.get());
  events.add(nullptr, 2);
  events.add(a.get());
  EXPECT_EQ(events.size(), 6U);
  BookedEventsReader reader(events);
  for (Tally* expected : {a.get(), a.get(), b.get(), static_cast<Tally*>(nullptr),
                          static_cast<Tally*>(nullptr), a.get(), static_cast<Tally*>(nullptr)})
    EXPECT_EQ(reader.next(), expected);
}

TEST(Fates, AreReasonsThatStandOnce) {
  std::set<Reason> fates(kFates.begin(), kFates.end());
  EXPECT_EQ(fates.size(), kFates.size());
  for (size_t i = 0; i < kFates.size(); ++i) EXPECT_EQ(fateNumber(kFates[i]), i);
  EXPECT_EQ(fateNumber(Reason::requestFailed), kFates.size());
}

TEST(BooksWithAClock, KnowWhatBecameOfTheProgramsEventsInTheLastHour) {
  ManualClock clock;
  Books books(clock);
  EXPECT_EQ(books.lastHour().delivered, 0U);
  const auto programs = books.open(kProgram, "httppost", false), own = books.open(kProgram, "httppost", true);
  programs->deliver(3);
  programs->drop(Reason::postFailed, 2);
  own->deliver(10);
  own->drop(Reason::postFailed, 10);
  EXPECT_EQ(books.lastHour().delivered, 3U) << "not the daemon's own messages";
  EXPECT_EQ(books.lastHour().droppedInAll(), 2U);
  EXPECT_EQ(books.lastHour().dropped[fateNumber(Reason::postFailed)], 2U);
  clock.advance(std::chrono::minutes(30));
  programs->deliver(1);
  EXPECT_EQ(books.lastHour().delivered, 4U);
  clock.advance(std::chrono::minutes(31));
  EXPECT_EQ(books.lastHour().delivered, 1U);
  EXPECT_EQ(books.lastHour().droppedInAll(), 0U);
}

// Rows are bounded: clients choose the names of programs.
class BookRows : public testing::Test {
 protected:
  void book(uint32_t user, const std::string& name, bool isInternal = false) {
    books_.open({user, 7, name, "s"}, "httppost", isInternal)->take();
  }
  const BookRow* other(uint32_t user, bool isInternal = false) {
    rows_ = books_.snapshot();
    for (const BookRow& row : rows_)
      if (row.programsMerged != 0 && row.program.user == user && row.isInternal == isInternal) return &row;
    return nullptr;
  }
  uint64_t takenInAll() const {
    uint64_t taken = 0;
    for (const BookRow& row : books_.snapshot()) taken += row.taken;
    return taken;
  }
  Books books_;
  std::vector<BookRow> rows_;
};

TEST_F(BookRows, OfProgramsPastTheLimitAreTheirUsersOther) {
  constexpr size_t kPrograms = Limits::maxBookRowsOfUser + 30;
  for (size_t i = 0; i < kPrograms; ++i)
    for (int times = 0; times < 2; ++times) book(1000, "program " + std::to_string(i));
  const BookRow* row = other(1000);
  ASSERT_NE(row, nullptr);
  EXPECT_EQ(row->program.clientName, "other");
  EXPECT_EQ(row->programsMerged, 30U);
  EXPECT_EQ(row->taken, 60U);
  EXPECT_EQ(rows_.size(), Limits::maxBookRowsOfUser + 1);
  book(1000, "program 3");
  EXPECT_EQ(other(1000)->taken, 60U) << "a program that has a row keeps it";
}

TEST_F(BookRows, OfProgramsPastTheLimitTellTheDaemonsOwnMessagesFromTheirEvents) {
  for (size_t i = 0; i < Limits::maxBookRowsOfUser; ++i) book(1000, "program " + std::to_string(i));
  for (const char* name : {"a", "b", "c"}) book(1000, name);
  for (const char* name : {"a", "b", "b"}) book(1000, name, true);
  ASSERT_NE(other(1000), nullptr);
  EXPECT_EQ(other(1000)->taken, 3U);
  EXPECT_EQ(other(1000)->programsMerged, 3U);
  ASSERT_NE(other(1000, true), nullptr);
  EXPECT_EQ(other(1000, true)->taken, 3U);
  EXPECT_EQ(other(1000, true)->programsMerged, 2U);
  const auto tally = books_.open({1000, 7, "d", "s"}, "httppost", true);
  EXPECT_TRUE(tally->rowName().isInternal && tally->rowName().isOther);
  EXPECT_TRUE(tally->passed({}, std::nullopt).isInternal);
}

TEST_F(BookRows, ThatWereKeptAreFoundAgainAndCountNoProgram) {
  for (size_t i = 0; i <= Limits::maxBookRowsOfUser; ++i) book(1000, "program " + std::to_string(i));
  for (const bool isInternal : {false, true}) {
    const BookRowName name = books_.open({1000, 7, "a", "s"}, "httppost", isInternal)->rowName();
    const uint64_t programs = other(1000, isInternal)->programsMerged, taken = other(1000, isInternal)->taken;
    books_.reopen(name)->take();
    EXPECT_EQ(other(1000, isInternal)->taken, taken + 1);
    EXPECT_EQ(other(1000, isInternal)->programsMerged, programs);
  }
}

// Hashes of merged programs are bounded for all users together, and no user's keep those of another from being counted.
TEST_F(BookRows, CountTheMergedProgramsOfAUserWhateverAnotherDoes) {
  for (size_t i = 0; i < 10000; ++i) book(1000, std::to_string(i));
  EXPECT_EQ(other(1000)->programsMerged, 64U + 4096U) << "there is an end to it";
  for (size_t i = 0; i < Limits::maxBookRowsOfUser + 20; ++i) book(1001, std::to_string(i));
  EXPECT_EQ(other(1001)->programsMerged, 20U);
}

TEST_F(BookRows, OfAUserWithManyProgramsLeaveRoomForAnother) {
  for (size_t i = 0; i < 2 * Limits::maxBookRows; ++i) book(1000, std::to_string(i));
  book(1001, "a");
  EXPECT_EQ(other(1001), nullptr);
}

TEST_F(BookRows, AreNeverMoreThanTheLimitWhoeverComes) {
  uint64_t events = 0;
  for (uint32_t user = 1; user <= 3 * Limits::maxBookRows; ++user, events += 2) {
    book(user, "a");
    book(user, "a", true);
  }
  for (size_t i = 0; i < 3 * Limits::maxBookRows; ++i, ++events) book(9, std::to_string(i));
  EXPECT_EQ(books_.snapshot().size(), Limits::maxBookRows);
  EXPECT_EQ(takenInAll(), events);
}

TEST_F(BookRows, HaveNamesOfBoundedLength) {
  book(1000, std::string(Limits::maxBookNameBytes - 1, 'x') + "é" + std::string(100000, 'y'));
  const std::string name = books_.snapshot().front().program.clientName;
  EXPECT_EQ(name, std::string(Limits::maxBookNameBytes - 1, 'x')) << "no half characters";
}

// A reader at any moment sees rows that add up, and no number that goes back.
TEST(BooksOfManyThreads, AddUpInEverySnapshot) {
  Books books;
  Counters counters;
  std::atomic<bool> done{false};
  std::atomic<int> started{0};
  constexpr int kThreads = 3;
  const auto work = [&](unsigned number) {
    ++started;
    for (unsigned round = number; !done; ++round) {
      const auto tally = books.open(kProgram, "httppost", false);
      BookedEvents events;
      for (int i = 0; i < 20; ++i) {
        tally->take();
        tally->enterBatch();
        events.add(tally.get());
      }
      events.leaveBatch();
      PostedEvents posted(std::move(events), counters);
      posted.events()->beginWaiting();
      posted.events()->endWaiting();
      if (round % 2 == 0)
        posted.delivered();
      else
        posted.dropped(Reason::postFailed);
    }
  };
  std::vector<std::thread> threads;
  for (unsigned i = 0; i < kThreads; ++i) threads.emplace_back(work, i);
  uint64_t lastTaken = 0, lastEnded = 0;
  for (int i = 0; i < 3000 || started < kThreads;) {
    const std::vector<BookRow> rows = books.snapshot();
    if (rows.empty()) continue;
    ++i;
    const BookRow& row = rows.front();
    constexpr uint64_t kMostPending = uint64_t{kThreads} * 20;
    ASSERT_LE(row.queued, row.taken);
    ASSERT_LE(row.batched, kMostPending);
    ASSERT_LE(row.waiting, kMostPending);
    ASSERT_EQ(row.taken, row.pending() + row.delivered + row.droppedInAll());
    ASSERT_GE(row.taken, lastTaken);
    ASSERT_GE(row.delivered + row.droppedInAll(), lastEnded);
    lastTaken = row.taken;
    lastEnded = row.delivered + row.droppedInAll();
  }
  done = true;
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(books.snapshot().front().pending(), 0U);
}

TEST(RowsOfBooks, AreDescribedInALine) {
  BookRow row;
  row.program = {1000, 7, "a \"b\"\n", "s"};
  row.backEnd = "httppost";
  row.taken = 9;
  row.delivered = 6;
  row.batched = 1;
  row.dropped[fateNumber(Reason::postFailed)] = 2;
  EXPECT_EQ(
      describeRow(row),
      "user=1000 type=7 client=\"a \\\"b\\\"\\n\" service=\"s\" back-end=httppost taken=9 queued=0 batched=1 "
      "in-flight=0 waiting=0 outbox=0 delivered=6 dropped=2 post-failed=2");
}

TEST(BookedEvents, TellWhoseTheyAre) {
  Books books;
  ReportingProgram one, other;
  one.clientName = "one";
  other.clientName = "other";
  const auto first = books.open(one, "httppost", false), second = books.open(other, "httppost", false),
             own = books.open(one, "httppost", true);
  BookedEvents events;
  events.add(own.get());
  events.add(second.get(), 3);
  events.add(nullptr);
  events.add(first.get(), 2);
  EXPECT_EQ(events.programs(), (std::vector<std::pair<ReportingProgram, size_t>>{{one, 3}, {other, 3}}));
}

}  // namespace
}  // namespace kyt
