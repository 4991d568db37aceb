#include "platform/base/Blocking.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>

namespace kyt {
namespace {

struct Diary final : BlockingObserver, HeldBack {
  void willBlock(BlockingKind kind) override {
    text += kind == BlockingKind::inLine      ? "stands "
            : kind == BlockingKind::computing ? "computes "
                                              : "will ";
  }
  void hasBlocked() override { text += "has "; }
  void giveAway() override { text += "gives "; }
  std::string text;
};

// Says who counts on this thread, and takes it back.
class Observed {
 public:
  explicit Observed(Diary& diary)
      : observer_(BlockingObserver::exchange(&diary)), held_(HeldBack::exchange(&diary)) {}
  ~Observed() {
    BlockingObserver::exchange(observer_);
    HeldBack::exchange(held_);
  }
  Observed(const Observed&) = delete;
  Observed& operator=(const Observed&) = delete;

 private:
  BlockingObserver* observer_;
  HeldBack* held_;
};

TEST(BlockingScope, GivesAwayWhatIsHeldBackBeforeItTellsTheObserver) {
  Diary diary;
  const Observed observed(diary);
  {
    const BlockingScope blocking;
    EXPECT_EQ(diary.text, "gives will ");
  }
  EXPECT_EQ(diary.text, "gives will has ");
}

TEST(BlockingScope, IsToldOnceWhereScopesNest) {
  Diary diary;
  const Observed observed(diary);
  {
    const BlockingScope outer;
    { const BlockingScope inner; }
    EXPECT_EQ(diary.text, "gives will gives ");
  }
  EXPECT_EQ(diary.text, "gives will gives has ");
}

TEST(BlockingScope, SaysWhetherItStandsInLineForALock) {
  Diary diary;
  const Observed observed(diary);
  { const BlockingScope blocking(BlockingKind::inLine); }
  EXPECT_EQ(diary.text, "gives stands has ");
}

TEST(BlockingScope, TellsOfWaitsWhileItsThreadComputes) {
  Diary diary;
  const Observed observed(diary);
  {
    const BlockingScope computing(BlockingKind::computing);
    EXPECT_EQ(diary.text, "gives computes ");
    { const BlockingScope blocking; }
    EXPECT_EQ(diary.text, "gives computes gives will has ");
    const BlockingScope blocking;
    const BlockingScope within(BlockingKind::computing);
  }
  EXPECT_EQ(diary.text, "gives computes gives will has gives will gives has ");
}

TEST(BlockingScope, ConcernsItsOwnThreadAlone) {
  Diary diary;
  const Observed observed(diary);
  std::thread([] { const BlockingScope blocking; }).join();
  EXPECT_EQ(diary.text, "");
}

}  // namespace
}  // namespace kyt
