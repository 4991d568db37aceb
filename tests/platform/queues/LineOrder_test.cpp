#include "platform/queues/LineOrder.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/fake/MemoryLogSink.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

class LineOrderTest : public testing::Test {
 protected:
  void writeAt(const LineOrder::SharedPlace& place, const char* line) {
    const LineOrder::Scope scope(place);
    log_.normal("%s", line);
  }
  std::string lines() const {
    std::string all;
    for (const MemoryLogSink::Line& line : sink_.lines()) all += line.line;
    return all;
  }
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  LineOrder order_;
};

TEST_F(LineOrderTest, WritesAtOnceWhereNoPlaceIsTaken) {
  EXPECT_EQ(LineOrder::later(), nullptr) << "no order is entered";
  const LineOrder::Scope scope(order_);
  log_.normal("a");
  EXPECT_EQ(lines(), "a");
}

TEST_F(LineOrderTest, WhatComesAfterAPlaceWaitsForIt) {
  const LineOrder::Scope scope(order_);
  LineOrder::SharedPlace place = LineOrder::later();
  log_.debug("c");
  log_.error("d");
  EXPECT_EQ(lines(), "");
  writeAt(place, "a");
  writeAt(place, "b");
  EXPECT_EQ(lines(), "ab");
  place.reset();
  EXPECT_EQ(lines(), "abcd");
  EXPECT_EQ(sink_.lines().at(3).level, LogLevel::error);
  log_.normal("e");
  EXPECT_EQ(lines(), "abcde");
}

TEST_F(LineOrderTest, PlacesThatEndInAnotherOrderAreWrittenInTheirs) {
  const LineOrder::Scope scope(order_);
  LineOrder::SharedPlace first = LineOrder::later();
  log_.normal("b");
  LineOrder::SharedPlace second = LineOrder::later(), third = LineOrder::later();
  log_.normal("f");
  writeAt(third, "e");
  writeAt(second, "c");
  second.reset();
  writeAt(first, "a");
  EXPECT_EQ(lines(), "a");
  first.reset();
  EXPECT_EQ(lines(), "abce");
  writeAt(third, "E");
  third.reset();
  EXPECT_EQ(lines(), "abceEf");
}

TEST_F(LineOrderTest, APlaceThatIsNeverUsedHoldsNothingUpWhenItEnds) {
  const LineOrder::Scope scope(order_);
  static_cast<void>(LineOrder::later());
  log_.normal("a");
  EXPECT_EQ(lines(), "a");
}

TEST_F(LineOrderTest, OthersLinesWaitForNobody) {
  LineOrder::SharedPlace place;
  {
    const LineOrder::Scope scope(order_);
    place = LineOrder::later();
    LineOrder other;
    const LineOrder::Scope inner(other);
    log_.normal("a");
  }
  log_.normal("b");
  EXPECT_EQ(lines(), "ab");
}

TEST_F(LineOrderTest, APlaceMayOutliveItsOrder) {
  LineOrder::SharedPlace place;
  {
    LineOrder gone;
    const LineOrder::Scope scope(gone);
    place = LineOrder::later();
    log_.normal("b");
  }
  writeAt(place, "a");
  place.reset();
  EXPECT_EQ(lines(), "ab");
}

TEST_F(LineOrderTest, SaysWhenMuchWaits) {
  const LineOrder::Scope scope(order_);
  EXPECT_FALSE(LineOrder::holdsMuch());
  LineOrder::SharedPlace place = LineOrder::later();
  for (size_t i = 0; i + 1 < LineOrder::kMuch / 64; ++i) log_.normal("%s", std::string(64, 'x').c_str());
  EXPECT_FALSE(LineOrder::holdsMuch());
  log_.normal("%s", std::string(64, 'y').c_str());
  EXPECT_TRUE(LineOrder::holdsMuch());
  place.reset();
  EXPECT_FALSE(LineOrder::holdsMuch());
}

TEST_F(LineOrderTest, LinesOfSeveralThreadsKeepTheirOrder) {
  const LineOrder::Scope scope(order_);
  std::string wanted;
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < 50; ++i) {
      const char* const letter = &"abcdefghijklmnopqrstuvwxyz"[i % 25];
      wanted += *letter;
      wanted += 'Z';
      threads.emplace_back([this, letter, place = LineOrder::later()]() mutable {
        const LineOrder::SharedPlace own = std::move(place);
        const LineOrder::Scope inner(own);
        log_.normal("%c", *letter);
      });
      log_.normal("Z");
    }
  }
  EXPECT_EQ(lines(), wanted);
}

}  // namespace
}  // namespace kyt
