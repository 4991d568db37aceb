// How a source hands a report over: whole, in part, or not at all.
#include "sources/Delivery.h"

#include <gtest/gtest.h>

#include "kytreporting/FakeDaemon.h"

namespace kyt::sources {
namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

const std::vector<SourceEvent> kThree = {{301, 1, {}}, {301, 2, {}}, {301, 3, {}}};

Delivery::Options to(const testing::FakeDaemon& daemon, seconds patience = seconds(60)) {
  return {daemon.socketPath(), "kytsource-test", 9, patience};
}
size_t messagesAt(const testing::FakeDaemon& daemon) {
  size_t count = 0;
  for (const testing::Event& event : daemon.events())
    if (event.kind == testing::Kind::message) ++count;
  return count;
}

TEST(Delivery, HandsAReportOverAsOneSessionThatEndsInOrder) {
  testing::FakeDaemon daemon;
  ASSERT_EQ(daemon.start(), std::nullopt);
  Delivery delivery(to(daemon));
  const Handover handover = delivery.deliver(kThree);
  EXPECT_TRUE(handover.isWhole());
  EXPECT_EQ(delivery.problem(), "");
  EXPECT_EQ(messagesAt(daemon), 3U);
}

TEST(Delivery, OffersNothingWhereTheDaemonHasNoStorebagAndSaysSo) {
  testing::FakeDaemon::Options options;
  options.storebag = false;
  testing::FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  Delivery delivery(to(daemon));
  const Handover handover = delivery.deliver(kThree);
  EXPECT_FALSE(handover.offered);
  EXPECT_EQ(handover.taken, std::vector<bool>(3, false));
  EXPECT_NE(delivery.problem().find("storebag"), std::string::npos) << delivery.problem();
  EXPECT_EQ(messagesAt(daemon), 0U);
}

TEST(Delivery, CountsAsTakenWhatNobodyConsentedTo) {
  testing::FakeDaemon::Options options;
  options.live = {};
  testing::FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  Delivery delivery(to(daemon));
  EXPECT_TRUE(delivery.deliver(kThree).isWhole());
}

TEST(Delivery, TakesNoLongerThanItsPatienceWhereTheDaemonDiesAmidAReport) {
  testing::FakeDaemon::Options options;
  options.dieAfter = 2;
  testing::FakeDaemon daemon(std::move(options));
  ASSERT_EQ(daemon.start(), std::nullopt);
  constexpr seconds kPatience{5};
  Delivery delivery(to(daemon, kPatience));
  const auto began = steady_clock::now();
  const Handover handover = delivery.deliver(kThree);
  EXPECT_LT(steady_clock::now() - began, kPatience * 3 / 2);
  EXPECT_TRUE(handover.offered);
  EXPECT_FALSE(handover.isWhole());
  EXPECT_NE(delivery.problem(), "");
}

TEST(Delivery, HasNothingToSayWhereThereIsNothingToHandOver) {
  Delivery delivery({"/nonexistent/socket", "kytsource-test", 9});
  EXPECT_TRUE(delivery.deliver({}).isWhole());
}

}  // namespace
}  // namespace kyt::sources
