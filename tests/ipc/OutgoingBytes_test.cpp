#include "platform/ipc/OutgoingBytes.h"

#include <gtest/gtest.h>

#include <algorithm>

namespace kyt {
namespace {

// Adds messages of that size until there are so many; returns all their bytes.
std::string fill(OutgoingBytes& outgoing, size_t message, int count) {
  std::string all;
  for (int i = 0; i < count; ++i) {
    const std::string text(message, static_cast<char>('a' + i % 26));
    outgoing.end().append(text);
    all += text;
  }
  return all;
}

// Writes all of it, so many bytes at a time at most.
std::string drain(OutgoingBytes& outgoing, size_t most) {
  std::string all;
  while (!outgoing.empty()) {
    const std::string_view front = outgoing.front().substr(0, most);
    EXPECT_FALSE(front.empty());
    if (front.empty()) break;
    all += front;
    outgoing.remove(front.size());
  }
  return all;
}

TEST(OutgoingBytes, LeaveInTheOrderInWhichTheyCame) {
  for (const size_t most : {size_t{1000}, size_t{65536}, SIZE_MAX}) {
    OutgoingBytes outgoing;
    const std::string all = fill(outgoing, 3001, 100);
    EXPECT_EQ(outgoing.size(), all.size());
    EXPECT_EQ(drain(outgoing, most), all) << most;
    EXPECT_TRUE(outgoing.front().empty());
  }
}

TEST(OutgoingBytes, MayBeAddedWhileOthersAreLeft) {
  OutgoingBytes outgoing;
  std::string all = fill(outgoing, 50000, 4);
  outgoing.remove(10);
  all += fill(outgoing, 70000, 3);
  EXPECT_EQ(outgoing.size(), all.size() - 10);
  EXPECT_EQ(drain(outgoing, 30000), all.substr(10));
  EXPECT_EQ(drain(outgoing, 1), "");
  all = fill(outgoing, 5, 2);
  EXPECT_EQ(drain(outgoing, 3), all);
}

TEST(OutgoingBytes, KeepFewOfThemTogether) {
  OutgoingBytes outgoing;
  fill(outgoing, 60, 1000);
  EXPECT_EQ(outgoing.front().size(), 60000u) << "so that they leave in one write";
}

TEST(OutgoingBytes, DoNotGrowAsOneText) {
  OutgoingBytes outgoing;
  fill(outgoing, 2700, 1000);
  EXPECT_LT(outgoing.end().capacity(), 131072u);
  for (; !outgoing.empty(); outgoing.remove(outgoing.front().size()))
    EXPECT_LT(outgoing.front().size(), 70000u);
}

TEST(OutgoingBytes, AMessageThatIsTakenBackLeavesTheOthers) {
  OutgoingBytes outgoing;
  const std::string all = fill(outgoing, 65536, 1);
  std::string& end = outgoing.end();
  const size_t before = end.size();
  end.append("not to be sent");
  end.resize(before);
  EXPECT_EQ(drain(outgoing, SIZE_MAX), all);
}

}  // namespace
}  // namespace kyt
