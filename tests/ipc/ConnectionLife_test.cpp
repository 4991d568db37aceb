#include "platform/ipc/ConnectionLife.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

namespace kyt {
namespace {

constexpr Life kStages[] = {Life::offered,  Life::shakingHands, Life::open,  Life::finishing,
                            Life::stopping, Life::ended,        Life::closed};

TEST(ConnectionLife, BeginsWithTheOffer) {
  const ConnectionLife life;
  EXPECT_TRUE(life.reached(Life::offered));
  EXPECT_FALSE(life.reached(Life::shakingHands));
}

TEST(ConnectionLife, ReachesAStageWithAllBeforeIt) {
  ConnectionLife life;
  EXPECT_EQ(life.advance(Life::finishing), Life::offered);
  EXPECT_EQ(life.advance(Life::ended), Life::finishing);
  EXPECT_TRUE(life.reached(Life::stopping));
  EXPECT_TRUE(life.reached(Life::ended));
  EXPECT_FALSE(life.reached(Life::closed));
}

TEST(ConnectionLife, NeverGoesBack) {
  for (const Life reached : kStages) {
    ConnectionLife life;
    life.advance(reached);
    for (const Life asked : kStages) {
      if (asked > reached) continue;
      EXPECT_EQ(life.advance(asked), std::nullopt);
      EXPECT_TRUE(life.reached(reached));
    }
  }
}

TEST(ConnectionLife, TellsOneOfManyThreadsThatItBroughtAStageAbout) {
  for (int round = 0; round < 50; ++round) {
    ConnectionLife life;
    std::atomic<int> told{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
      threads.emplace_back([&] {
        if (life.advance(Life::ended)) ++told;
      });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(told, 1);
  }
}

}  // namespace
}  // namespace kyt
