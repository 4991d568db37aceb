#include "platform/base/Watchers.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Books.h"
#include "platform/base/WatchRing.h"

namespace kyt {
namespace {

PassedEvent event(int32_t category, uint32_t user = 1000, std::string client = "a") {
  PassedEvent made;
  made.program = {user, 7, std::move(client), "s"};
  made.kind = {category, 1};
  return made;
}

class WatchersTest : public ::testing::Test {
 protected:
  std::shared_ptr<Watchers> watchers_ = std::make_shared<Watchers>();
};

TEST_F(WatchersTest, KnowWhetherAnybodyWatches) {
  EXPECT_FALSE(watchers_->anybody());
  auto watcher = watchers_->watch({});
  EXPECT_TRUE(watchers_->anybody());
  watcher.reset();
  EXPECT_FALSE(watchers_->anybody());
}

TEST_F(WatchersTest, TellEachWhatItsFilterLetsThrough) {
  const auto all = watchers_->watch({});
  const auto ofUser = watchers_->watch({.user = 1001});
  const auto ofClient = watchers_->watch({.client = "b"});
  const auto ofCategory = watchers_->watch({.category = 3});
  watchers_->tell(event(1));
  watchers_->tell(event(2, 1001));
  watchers_->tell(event(3, 1000, "b"));
  for (int32_t category = 1; category <= 3; ++category) EXPECT_EQ(all->next()->kind.category, category);
  EXPECT_EQ(all->next(), nullptr);
  EXPECT_EQ(ofUser->next()->kind.category, 2);
  EXPECT_EQ(ofUser->next(), nullptr);
  EXPECT_EQ(ofClient->next()->kind.category, 3);
  EXPECT_EQ(ofClient->next(), nullptr);
  EXPECT_EQ(ofCategory->next()->program.clientName, "b");
  EXPECT_EQ(ofCategory->next(), nullptr);
}

TEST_F(WatchersTest, AreFewAtATime) {
  std::vector<std::unique_ptr<Watcher>> all;
  for (size_t i = 0; i < Limits::maxWatchers; ++i) all.push_back(watchers_->watch({}));
  EXPECT_NE(all.back(), nullptr);
  EXPECT_EQ(watchers_->watch({}), nullptr);
  all.pop_back();
  EXPECT_NE(watchers_->watch({}), nullptr);
}

TEST_F(WatchersTest, CountWhatFindsNoRoomAndKeepTheOldest) {
  const auto idle = watchers_->watch({});
  const auto quick = watchers_->watch({});
  const auto most = static_cast<int32_t>(Limits::maxWatchedEvents);
  for (int32_t i = 0; i < most + 5; ++i) {
    watchers_->tell(event(i));
    ASSERT_EQ(quick->next()->kind.category, i);
  }
  EXPECT_EQ(quick->takeLost(), 0U);
  EXPECT_EQ(idle->takeLost(), 5U);
  EXPECT_EQ(idle->takeLost(), 0U);
  for (int32_t i = 0; i < most; ++i) ASSERT_EQ(idle->next()->kind.category, i);
  EXPECT_EQ(idle->next(), nullptr);
  watchers_->tell(event(1));
  EXPECT_NE(idle->next(), nullptr);
}

TEST_F(WatchersTest, WantAnEventWhereOneOfThemHasRoomAndLoseItOtherwise) {
  const ReportingProgram a{1000, 7, "a", "s"}, b{1000, 7, "b", "s"};
  EXPECT_FALSE(watchers_->want(a, {1, 1})) << "nobody watches";
  const auto full = watchers_->watch({.client = "a"});
  EXPECT_FALSE(watchers_->want(b, {1, 1})) << "nobody asked for it";
  EXPECT_TRUE(watchers_->want(a, {1, 1}));
  for (size_t i = 0; i < Limits::maxWatchedEvents; ++i) watchers_->tell(event(1));
  EXPECT_EQ(full->takeLost(), 0U);
  EXPECT_FALSE(watchers_->want(a, {1, 1}));
  EXPECT_FALSE(watchers_->want(b, {1, 1}));
  EXPECT_EQ(full->takeLost(), 1U);
  const auto quick = watchers_->watch({});
  EXPECT_TRUE(watchers_->want(a, {1, 1})) << "who has room is told, and the other loses it then";
  EXPECT_EQ(full->takeLost(), 0U);
  watchers_->tell(event(1));
  EXPECT_EQ(full->takeLost(), 1U);
  EXPECT_NE(full->next(), nullptr);
  EXPECT_TRUE(watchers_->want(a, {1, 1})) << "it has read one";
  EXPECT_EQ(full->takeLost() + quick->takeLost(), 0U);
}

TEST_F(WatchersTest, LoseAllEventsOfAPostAtOnceWhereNobodyHasRoom) {
  const ReportingProgram a{1000, 7, "a", "s"}, b{1000, 7, "b", "s"};
  const std::vector<EventKind> kinds = {{5, 1}, {6, 1}, {6, 2}};
  EXPECT_TRUE(watchers_->loseAll(a, kinds, 3)) << "nobody watches";
  const auto all = watchers_->watch({}), ofB = watchers_->watch({.client = "b"}),
             six = watchers_->watch({.category = 6});
  EXPECT_FALSE(watchers_->loseAll(a, kinds, 3));
  for (size_t i = 0; i < Limits::maxWatchedEvents; ++i) watchers_->tell(event(6));
  EXPECT_EQ(all->takeLost() + six->takeLost(), 0U);
  EXPECT_TRUE(watchers_->loseAll(a, kinds, 4)) << "who has room asked for another program";
  EXPECT_EQ(all->takeLost(), 4U);
  EXPECT_EQ(six->takeLost(), 2U);
  EXPECT_EQ(ofB->takeLost(), 0U);
  EXPECT_FALSE(watchers_->loseAll(b, kinds, 3)) << "who asked for it has room";
  EXPECT_EQ(all->takeLost() + six->takeLost() + ofB->takeLost(), 0U) << "each is asked for by itself then";
  EXPECT_NE(six->next(), nullptr);
  EXPECT_FALSE(watchers_->loseAll(a, kinds, 3)) << "it has read one";
}

TEST_F(WatchersTest, AreToldOfAPostByProgramAndKindHoweverItsEventsAlternate) {
  Books books;
  Counters counters;
  const auto watcher = books.watchers()->watch({});
  const auto a = books.open({1000, 7, "a", "s"}, "httppost", false);
  const auto b = books.open({1000, 7, "b", "s"}, "httppost", false);
  BookedEvents events;
  for (const auto& tally : {a, a, b, a}) {
    tally->take();
    events.add(tally.get());
  }
  events.add(nullptr);
  b->take();
  events.add(b.get());
  events.show({books.watchers(), "httppost", "", {{1, 1}, {2, 1}, {3, 1}, {4, 1}, {5, 1}}, nullptr});
  PostedEvents(std::move(events), counters).delivered();
  std::string told;
  while (const auto event = watcher->next())
    told += event->program.clientName + std::to_string(event->kind.category) + " ";
  EXPECT_EQ(told, "a1 a2 b3 a4 b-1 ");
}

TEST_F(WatchersTest, KnowProgramsByNamesThatAreLongerThanTheBooksKeep) {
  const std::string name(Limits::maxBookNameBytes + 9, 'n');
  const auto watcher = watchers_->watch({.client = std::string(cutName(name))});
  EXPECT_TRUE(watchers_->want({1000, 7, name, "s"}, {1, 1}));
  watchers_->tell(event(1, 1000, name));
  EXPECT_NE(watcher->next(), nullptr);
}

TEST_F(WatchersTest, CutNamesAsTheBooksDo) {
  const auto watcher = watchers_->watch({});
  watchers_->tell(event(1, 1, std::string(Limits::maxBookNameBytes + 9, 'n')));
  EXPECT_EQ(watcher->next()->program.clientName.size(), Limits::maxBookNameBytes);
}

TEST_F(WatchersTest, KeepBodiesWhereSomebodyWantsThemAndThereIsRoom) {
  const auto withoutBodies = watchers_->watch({});
  const auto post = [this](size_t bytes) {
    auto made = std::make_shared<WatchedPost>(watchers_);
    made->leaves("https://a", std::string(bytes, 'b'));
    EXPECT_EQ(made->bodyBytes(), bytes);
    return made;
  };
  EXPECT_EQ(post(10)->body(), nullptr);
  const auto watcher = watchers_->watch({.bodies = true});
  EXPECT_EQ(post(10)->body()->text(), "bbbbbbbbbb");
  std::vector<std::shared_ptr<WatchedPost>> kept;
  for (size_t i = 0; i < Limits::maxWatchedBodies / Limits::maxWatchedBodyBytes; ++i) {
    kept.push_back(post(Limits::maxWatchedBodyBytes + 1));
    ASSERT_EQ(kept.back()->body()->text().size(), Limits::maxWatchedBodyBytes);
  }
  EXPECT_EQ(post(10)->body(), nullptr);
  kept.pop_back();
  EXPECT_EQ(post(10)->body()->text(), "bbbbbbbbbb");
}

TEST_F(WatchersTest, AreToldByTheBooksWhatBecameOfAPost) {
  Books books;
  Counters counters;
  const auto watcher = books.watchers()->watch({.bodies = true});
  const auto tally = books.open({1000, 7, "a", "s"}, "httppost", false);
  BookedEvents events;
  tally->take();
  events.add(tally.get());
  tally->take();
  events.add(tally.get());
  const auto post = std::make_shared<WatchedPost>(books.watchers());
  post->leaves("https://a", "[]");
  events.show({books.watchers(), "httppost", "", {{5, 1}, {6, 2}}, post});
  {
    PostedEvents posted(std::move(events), counters);
    EXPECT_EQ(watcher->next(), nullptr);
    posted.events()->watchedPost()->answered(503);
    posted.dropped(Reason::postRefused);
  }
  const auto first = watcher->next(), second = watcher->next();
  ASSERT_NE(second, nullptr);
  EXPECT_EQ(first->kind.category, 5);
  EXPECT_TRUE(first->isFirstOfPost);
  EXPECT_EQ(second->kind.type, 2);
  EXPECT_FALSE(second->isFirstOfPost);
  EXPECT_EQ(second->dropped, Reason::postRefused);
  EXPECT_EQ(second->post->status(), 503);
  EXPECT_EQ(second->backEnd, "httppost");
  EXPECT_EQ(watcher->next(), nullptr);
}

// A post of events of the categories 5, 6 and 6, told to whoever watches.
class BodiesOfWatchers : public ::testing::Test {
 protected:
  void post(const std::string& body) {
    const auto tally = books_.open({1000, 7, "a", "s"}, "httppost", false);
    BookedEvents events;
    for (int i = 0; i < 3; ++i) {
      tally->take();
      events.add(tally.get());
    }
    const auto post = std::make_shared<WatchedPost>(books_.watchers());
    post->leaves("https://a", body);
    post->answered(200);
    events.show({books_.watchers(), "httppost", "", {{5, 1}, {6, 1}, {6, 2}}, post});
    PostedEvents(std::move(events), counters_).delivered();
  }
  static std::string bodyOf(const std::shared_ptr<const PassedEvent>& event) {
    if (event == nullptr) return "no event";
    if (!event->isFirstOfPost) return "not the first";
    return event->body != nullptr ? event->body->text() : "not kept";
  }
  Books books_;
  Counters counters_;
};

TEST_F(BodiesOfWatchers, ComeWithTheFirstEventThatEachIsTold) {
  const auto all = books_.watchers()->watch({.bodies = true}),
             ofCategory = books_.watchers()->watch({.category = 6, .bodies = true}),
             without = books_.watchers()->watch({});
  for (const char* body : {"[1]", "[2]"}) {
    post(body);
    EXPECT_EQ(bodyOf(all->next()), body);
    EXPECT_EQ(bodyOf(all->next()), "not the first");
    EXPECT_EQ(bodyOf(all->next()), "not the first");
    EXPECT_EQ(bodyOf(ofCategory->next()), body);
    EXPECT_EQ(bodyOf(ofCategory->next()), "not the first");
    for (int i = 0; i < 3; ++i) EXPECT_EQ(bodyOf(without->next()), "not the first");
  }
}

TEST_F(BodiesOfWatchers, AreNotKeptAwayFromOneByAnotherThatReadsNothing) {
  const auto deaf = books_.watchers()->watch({.bodies = true}), alsoDeaf = books_.watchers()->watch({}),
             quick = books_.watchers()->watch({.bodies = true});
  const std::string body(Limits::maxWatchedBodyBytes, 'b');
  for (size_t i = 0; i < 2 * Limits::maxWatchedBodies / body.size(); ++i) {
    post(body);
    ASSERT_EQ(bodyOf(quick->next()), body) << i;
    for (int rest = 0; rest < 2; ++rest) ASSERT_EQ(bodyOf(quick->next()), "not the first");
  }
  // What it has a share for waits; of the rest the size is told.
  size_t kept = 0, left = 0;
  while (const auto event = deaf->next()) {
    kept += bodyOf(event) == body ? 1 : 0;
    left += bodyOf(event) == "not kept" ? 1 : 0;
    if (event->isFirstOfPost) {
      EXPECT_EQ(event->post->bodyBytes(), body.size());
    }
  }
  EXPECT_GT(kept, 0U);
  EXPECT_GT(left, 0U);
  EXPECT_EQ(kept + left, 2 * Limits::maxWatchedBodies / body.size());
  post(body);
  EXPECT_EQ(bodyOf(deaf->next()), body) << "its share is free again";
}

TEST_F(BodiesOfWatchers, AreForgottenWithTheLastWhoHasThem) {
  auto watcher = books_.watchers()->watch({.bodies = true});
  const std::string body(Limits::maxWatchedBodyBytes, 'b');
  for (int round = 0; round < 20; ++round) {
    for (int i = 0; i < 10; ++i) post(body);
    watcher.reset();
    watcher = books_.watchers()->watch({.bodies = true});
  }
  std::vector<std::shared_ptr<WatchedPost>> all;
  for (size_t i = 0; i < Limits::maxWatchedBodies / body.size(); ++i) {
    all.push_back(std::make_shared<WatchedPost>(books_.watchers()));
    all.back()->leaves("https://a", body);
    ASSERT_NE(all.back()->body(), nullptr) << i;
  }
}

TEST_F(WatchersTest, OfTheGroupLeaveAPlaceToTheDaemonsOwners) {
  std::vector<std::unique_ptr<Watcher>> all;
  for (size_t i = 0; i < Limits::maxWatchersOfGroup; ++i) {
    all.push_back(watchers_->watch({}, false));
    ASSERT_NE(all.back(), nullptr);
  }
  EXPECT_EQ(watchers_->watch({}, false), nullptr);
  const auto owner = watchers_->watch({}, true);
  EXPECT_NE(owner, nullptr);
  all.pop_back();
  EXPECT_NE(watchers_->watch({}, false), nullptr);
}

// For the thread sanitizer too: everything that was told arrived or is counted, in each teller's order.
TEST_F(WatchersTest, LoseNothingUncountedHoweverManyTell) {
  constexpr uint32_t kTellers = 4, kEach = 20000;
  const auto watcher = watchers_->watch({});
  std::vector<std::thread> tellers;
  std::atomic<uint32_t> done{0};
  for (uint32_t user = 0; user < kTellers; ++user)
    tellers.emplace_back([this, user, &done] {
      for (uint32_t i = 0; i < kEach; ++i) {
        const PassedEvent passed = event(static_cast<int32_t>(i), user);
        if (user % 2 == 0 || watchers_->want(passed.program, passed.kind)) watchers_->tell(passed);
      }
      ++done;
    });
  uint64_t told = 0;
  std::vector<int32_t> latest(kTellers, -1);
  for (;;) {
    const bool last = done == kTellers;
    while (const auto passed = watcher->next()) {
      ++told;
      EXPECT_GT(passed->kind.category, latest[passed->program.user]);
      latest[passed->program.user] = passed->kind.category;
    }
    if (last) break;
    std::this_thread::yield();
  }
  for (std::thread& teller : tellers) teller.join();
  EXPECT_EQ(told + watcher->takeLost(), uint64_t{kTellers} * kEach);
  EXPECT_GT(told, 0U);
}

TEST_F(WatchersTest, ComeAndGoWhileOthersTell) {
  std::atomic<bool> over{false};
  std::vector<std::thread> tellers;
  for (uint32_t user = 0; user < 3; ++user)
    tellers.emplace_back([this, user, &over] {
      while (!over) {
        watchers_->tell(event(1, user));
        std::this_thread::yield();
      }
    });
  for (int i = 0; i < 60; ++i) {
    const auto watcher = watchers_->watch({.user = 1});
    ASSERT_NE(watcher, nullptr);
    std::shared_ptr<const PassedEvent> passed;
    while (passed == nullptr) passed = watcher->next();
    EXPECT_EQ(passed->program.user, 1U);
  }
  over = true;
  for (std::thread& teller : tellers) teller.join();
  EXPECT_FALSE(watchers_->anybody());
}

}  // namespace
}  // namespace kyt
