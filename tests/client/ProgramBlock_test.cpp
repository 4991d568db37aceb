// Blocks of the program that may end what runs them.
#include "client/ProgramBlock.h"

#include <gtest/gtest.h>

#include <memory>

namespace kyt::client {
namespace {

TEST(ProgramBlock, RunsAgainAndAgain) {
  int sum = 0;
  ProgramBlock<int> block([&sum](int more) { sum += more; });
  EXPECT_TRUE(block.isReady());
  block.run(1);
  block.run(2);
  EXPECT_EQ(sum, 3);
  EXPECT_TRUE(block.isReady());
}

TEST(ProgramBlock, DoesNothingWhereNoneWasGiven) {
  ProgramBlock<int> block(nullptr);
  EXPECT_FALSE(block.isReady());
  block.run(1);
}

TEST(ProgramBlock, DoesNotRunInsideItself) {
  int runs = 0;
  ProgramBlock<>* self = nullptr;
  ProgramBlock<> block([&] {
    ++runs;
    EXPECT_FALSE(self->isReady());
    self->run();
  });
  self = &block;
  block.run();
  EXPECT_EQ(runs, 1);
}

TEST(ProgramBlock, FreesWhatItHoldsWhenItIsDropped) {
  const auto held = std::make_shared<int>(0);
  ProgramBlock<> block([held] {});
  EXPECT_EQ(held.use_count(), 2);
  block.drop();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(block.isReady());
}

TEST(ProgramBlock, RunsToItsEndWhenItIsDroppedFromInside) {
  auto held = std::make_shared<int>(0);
  ProgramBlock<>* self = nullptr;
  long heldInside = 0;
  ProgramBlock<> block([held, &self, &heldInside] {
    self->drop();
    heldInside = held.use_count();
  });
  self = &block;
  block.run();
  EXPECT_EQ(heldInside, 2);
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(block.isReady());
}

}  // namespace
}  // namespace kyt::client
