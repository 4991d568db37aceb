// Following a journal: nothing is lost, nothing is told twice, and a flood costs no more than its share.
#include "sources/Follower.h"

#include <gtest/gtest.h>
#include <time.h>

#include <algorithm>

#include "sources/units/UnitFindings.h"
#include "tests/sources/WrittenJournal.h"

namespace kyt::sources {
namespace {

using std::chrono::microseconds;
using std::chrono::seconds;

class FollowedJournal : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!WrittenJournal::canBeWritten()) GTEST_SKIP() << "systemd-journal-remote is not installed";
    units_.write("cron.service", "");
    units_.write("ssh.service", "");
    written_.add(anyLine("before"));
    written_.add(failureOf("ssh.service"));
    written_.write();
    now_ = written_.nextTime();
  }
  // As a program that starts.
  void start() {
    follower_.reset();
    auto opened = Journal::open({written_.folder(), true, unitsProgram().matches});
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<Journal>>(opened)) << std::get<std::string>(opened);
    journal_ = std::get<std::unique_ptr<Journal>>(std::move(opened));
    Follower::Options options;
    options.stateFile = state_ / "state";
    options.category = 301;
    options.lookBudget = budget_;
    follower_ = std::make_unique<Follower>(
        *journal_, options, unitsProgram().finder({{units_.path()}, {}, {}}),
        [this](const std::vector<SourceEvent>& events) {
          Handover handover{daemonIsThere_, std::vector<bool>(events.size(), daemonIsThere_)};
          if (!daemonIsThere_) return handover;
          if (takesTheFirstAlone_) std::fill(handover.taken.begin() + 1, handover.taken.end(), false);
          delivered_.insert(delivered_.end(), events.begin(), events.end());
          return handover;
        },
        [this] { return now_; });
  }
  void look() {
    journal_->takeNews();
    follower_->look();
  }
  // What was delivered since the last call: "type unit count" of each event.
  std::vector<std::string> told() {
    std::vector<std::string> lines;
    for (const SourceEvent& event : delivered_) {
      const String* unit = event.payload.string("unit");
      lines.push_back(std::to_string(event.type) + " " + (unit != nullptr ? unit->str() : "-") + " " +
                      std::to_string(event.payload.integer("count")));
    }
    delivered_.clear();
    return lines;
  }
  // The same with the report's number, counted from 1.
  std::vector<std::string> toldWithNumbers() {
    std::vector<int> numbers;
    for (const SourceEvent& event : delivered_)
      numbers.push_back(event.payload.integer("report") - kFirst + 1);
    std::vector<std::string> lines = told();
    for (size_t i = 0; i < lines.size(); ++i) lines[i] += " of " + std::to_string(numbers[i]);
    return lines;
  }
  using Lines = std::vector<std::string>;
  // The number of the day on which the test's journal begins.
  static constexpr int kFirst = static_cast<int>(WrittenJournal::kBegin / 86'400'000'000 * 86'400);

  WrittenJournal written_;
  TemporaryFolder units_, state_;
  microseconds budget_ = seconds(60);
  bool daemonIsThere_ = true, takesTheFirstAlone_ = false;
  uint64_t now_ = 0;
  std::vector<SourceEvent> delivered_;
  std::unique_ptr<Journal> journal_;
  std::unique_ptr<Follower> follower_;
};

TEST_F(FollowedJournal, TellsNothingOfWhatWasThereBeforeTheFirstStart) {
  start();
  look();
  EXPECT_FALSE(follower_->hasFindings());
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines());
}

TEST_F(FollowedJournal, TellsWhatTheServiceManagerWroteAlone) {
  start();
  written_.add(failureOf("cron.service"));
  auto forged = failureOf("ssh.service");
  forged[0].second = "4711";  // whoever writes with the same identifier
  written_.add(forged);
  written_.add(restartOf("cron.service"));
  written_.add(failureOf("cron.service"));
  written_.add(failureOf("cron.service", "Alice's result"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), (Lines{"1 cron.service 2", "1 cron.service 1", "2 cron.service 1"}));
}

TEST_F(FollowedJournal, TellsNothingTwiceAndLosesNothingOverRestarts) {
  start();
  written_.add(failureOf("cron.service"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 cron.service 1"});
  // Written while the program does not run.
  follower_.reset();
  written_.add(failureOf("ssh.service"));
  written_.write();
  start();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 ssh.service 1"});
  start();
  look();
  EXPECT_FALSE(follower_->hasFindings());
}

TEST_F(FollowedJournal, KeepsWhatWasReadBeforeTheFirstFinding) {
  start();
  start();  // nothing was found in between
  written_.add(failureOf("cron.service"));
  written_.write();
  start();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 cron.service 1"});
}

TEST_F(FollowedJournal, WaitsForTheDaemonWithoutGrowingAndCountsIt) {
  start();
  daemonIsThere_ = false;
  for (int i = 0; i < 3; ++i) {
    written_.add(failureOf("cron.service"));
    written_.write();
    look();
    EXPECT_FALSE(follower_->report());
  }
  daemonIsThere_ = true;
  EXPECT_TRUE(follower_->report());
  ASSERT_EQ(delivered_.size(), 2U);
  EXPECT_EQ(delivered_[1].payload.integer("waits"), 3);
  EXPECT_EQ(told(), (Lines{"1 cron.service 3", "9 - 0"}));
}

TEST_F(FollowedJournal, TriesTheRestOfAReportThatWasTakenInPartAgainAsItWas) {
  start();
  written_.add(failureOf("cron.service"));
  written_.add(failureOf("ssh.service"));
  written_.write();
  look();
  takesTheFirstAlone_ = true;
  EXPECT_FALSE(follower_->report());
  EXPECT_EQ(toldWithNumbers(), (Lines{"1 cron.service 1 of 1", "1 ssh.service 1 of 1"}));
  takesTheFirstAlone_ = false;
  written_.add(failureOf("cron.service"));
  written_.add(failureOf("ssh.service"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->hasFindings());
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(toldWithNumbers(),
            (Lines{"1 ssh.service 1 of 1", "1 cron.service 1 of 2", "1 ssh.service 1 of 2", "9 - 0 of 2"}));
  EXPECT_FALSE(follower_->hasFindings());
}

TEST_F(FollowedJournal, TellsAReportThatWasTakenInPartOverARestartWithTheSameContents) {
  start();
  written_.add(failureOf("cron.service"));
  written_.add(failureOf("ssh.service"));
  written_.write();
  look();
  takesTheFirstAlone_ = true;
  EXPECT_FALSE(follower_->report());
  const Lines first = toldWithNumbers();
  takesTheFirstAlone_ = false;
  written_.add(failureOf("cron.service"));
  written_.write();
  start();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines()) << "what was begun is not read again yet";
  look();
  EXPECT_TRUE(follower_->report());
  Lines all = first;
  all.emplace_back("1 cron.service 1 of 2");
  EXPECT_EQ(toldWithNumbers(), all);
  start();
  look();
  EXPECT_FALSE(follower_->hasFindings());
}

TEST_F(FollowedJournal, TellsAReportThatWasTakenInPartAgainWhereNothingCameBehindIt) {
  start();
  written_.add(failureOf("cron.service"));
  written_.add(failureOf("ssh.service"));
  written_.write();
  look();
  takesTheFirstAlone_ = true;
  EXPECT_FALSE(follower_->report());
  const Lines first = toldWithNumbers();
  takesTheFirstAlone_ = false;
  start();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(toldWithNumbers(), first);
}

TEST_F(FollowedJournal, ReadsAgainAfterARestartWhatFoundNoDaemon) {
  start();
  daemonIsThere_ = false;
  written_.add(failureOf("cron.service"));
  written_.write();
  look();
  EXPECT_FALSE(follower_->report());
  daemonIsThere_ = true;
  start();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 cron.service 1"});
}

TEST_F(FollowedJournal, NumbersReportsOnOverRestarts) {
  std::vector<int> numbers;
  for (int i = 0; i < 3; ++i) {
    start();
    written_.add(failureOf("cron.service"));
    written_.write();
    look();
    EXPECT_TRUE(follower_->report());
    for (const SourceEvent& event : delivered_) numbers.push_back(event.payload.integer("report"));
    delivered_.clear();
  }
  EXPECT_EQ(numbers, (std::vector<int>{kFirst, kFirst + 1, kFirst + 2}));
}

TEST_F(FollowedJournal, GivesALookThatTakesTooLongUpAndCountsTheRestAtTheNext) {
  budget_ = microseconds(0);
  start();
  constexpr int kFlood = 500;
  for (int i = 0; i < kFlood; ++i) written_.add(failureOf("cron.service"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->isBehind());
  int looks = 1;
  for (; follower_->isBehind() && looks < kFlood; ++looks) look();
  EXPECT_GT(looks, 10);
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 cron.service 500"});
}

microseconds processorTime() {
  timespec time = {};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
  return seconds(time.tv_sec) + microseconds(time.tv_nsec / 1000);
}

// Two seconds of ten thousand entries each. Looks are five seconds apart (see UnitsSource for the program).
TEST_F(FollowedJournal, SumsAFloodUpInLooksThatTakeAHundredthOfTheTimeBetweenThem) {
  constexpr int kFlood = 20'000;
  budget_ = Follower::Options().lookBudget;
  start();
  for (int i = 0; i < kFlood; ++i) written_.add(failureOf(i % 2 == 0 ? "cron.service" : "ssh.service"));
  written_.write();
  now_ = written_.nextTime();
  int looks = 0;
  microseconds longest{0};
  do {
    const auto before = processorTime();
    look();
    longest = std::max(longest, processorTime() - before);
    ++looks;
  } while (follower_->isBehind() && looks < kFlood);
  EXPECT_GT(looks, 1) << "a flood that one look can read shows nothing";
  EXPECT_LT(longest, microseconds(seconds(5)) / 100);
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), (Lines{"1 cron.service 10000", "1 ssh.service 10000"}));
}

TEST_F(FollowedJournal, GoesOnAtThePresentWhereItIsFarBehindAndCountsWhatItPassedOver) {
  budget_ = microseconds(0);
  start();
  for (int i = 0; i < 100; ++i) written_.add(failureOf("cron.service"));
  written_.write();
  look();
  ASSERT_TRUE(follower_->isBehind());
  now_ += 3'600'000'000;
  look();
  EXPECT_FALSE(follower_->isBehind());
  written_.setNextTime(now_ + 1);
  written_.add(failureOf("ssh.service"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->report());
  ASSERT_EQ(delivered_.size(), 3U);
  // 16 were read; the first one of those passed over is the 17th.
  EXPECT_EQ(delivered_[2].payload.integer("entriesNotRead"), 84);
  EXPECT_EQ(told(), (Lines{"1 cron.service 16", "1 ssh.service 1", "9 - 0"}));
}

TEST_F(FollowedJournal, SaysThatSomethingIsGoneWhereTheJournalWasCleanedUpMeanwhile) {
  start();
  written_.add(failureOf("cron.service"));
  written_.write();
  look();
  EXPECT_TRUE(follower_->report());
  EXPECT_EQ(told(), Lines{"1 cron.service 1"});
  follower_.reset();
  journal_.reset();
  written_.removeFile("system.journal");
  written_.add(failureOf("ssh.service"));
  written_.write();
  start();
  look();
  EXPECT_TRUE(follower_->report());
  ASSERT_EQ(delivered_.size(), 2U);
  EXPECT_GE(delivered_[1].payload.integer("entriesNotRead"), 1);
  EXPECT_EQ(told(), (Lines{"1 ssh.service 1", "9 - 0"}));
}

TEST_F(FollowedJournal, IsNoJournalWhereTheFolderIsMissing) {
  const auto opened = Journal::open({written_.folder() + "/none", true, {}});
  ASSERT_TRUE(std::holds_alternative<std::string>(opened));
  EXPECT_EQ(std::get<std::string>(opened), "can't open the journal: No such file or directory");
}

}  // namespace
}  // namespace kyt::sources
