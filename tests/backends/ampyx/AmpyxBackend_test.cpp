// What is recorded in the power log, and what deliberately is not.
#include "backends/ampyx/AmpyxBackend.h"

#include <gtest/gtest.h>

#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class Ampyx : public testing::Test {
 protected:
  void record(const Dictionary& message, uint16_t method, uint16_t respCode = 9, uint16_t eventID = 3) {
    EXPECT_TRUE(backend_->sendMessage(message, TimeValue{1, 2}, method, respCode, EventID{eventID}).isNull());
  }
  const std::vector<FakePowerLog::Event>& events() { return platform_.powerLog.events; }

  TestPlatform platform_;
  std::shared_ptr<AmpyxBackend> backend_ = AmpyxBackend::initWithName(
      platform_.configuration, kKYTReportingBackendAmpyx, Dictionary{}, std::make_shared<SessionFacts>());
};

TEST_F(Ampyx, RecordsTheMessageWithItsNumbers) {
  const Dictionary message{{"a", "b"}};
  record(message, 65535, 200, 40000);
  ASSERT_EQ(events().size(), 1u);
  EXPECT_EQ(events()[0].agent, 28u);
  EXPECT_EQ(events()[0].name, "Medsrv-KYT");
  EXPECT_EQ(Value(events()[0].dictionary),
            Value(Dictionary{{"a", "b"}, {"method", 65535u}, {"respCode", 200u}, {"event", 40000u}}));
  EXPECT_EQ(message.size(), 1u);
}

TEST_F(Ampyx, RecordsNothingForMethodZeroOrAnEmptyMessage) {
  record(Dictionary{{"a", 1}}, 0);
  record(Dictionary{}, 5);
  EXPECT_TRUE(events().empty());
}

TEST_F(Ampyx, OverwritesTheMessagesOwnKeys) {
  record(Dictionary{{"event", "mine"}, {"method", "mine"}, {"respCode", "mine"}}, 1, 2, 3);
  ASSERT_EQ(events().size(), 1u);
  EXPECT_EQ(Value(events()[0].dictionary),
            Value(Dictionary{{"event", 3u}, {"method", 1u}, {"respCode", 2u}}));
}

// Routed events come with a flag, and this class leaves that operation to the base.
TEST_F(Ampyx, RoutedEventsRecordNothing) {
  EXPECT_TRUE(backend_->sendMessage(Dictionary{{"a", 1}}, TimeValue{}, 5, 6, MessageFlag{0}).isNull());
  EXPECT_TRUE(
      backend_->sendMessage(Dictionary{{"a", 1}}, TimeValue{}, 5, 6, EventID{7}, MessageFlag{0}).isNull());
  EXPECT_TRUE(events().empty());
}

TEST_F(Ampyx, CountsWhatItDoesNotRecord) {
  record(Dictionary{{"a", 1}}, 0);
  record(Dictionary{}, 5);
  backend_->sendMessage(Dictionary{{"a", 1}}, TimeValue{}, 5, 6, MessageFlag{0});
  EXPECT_EQ(platform_.counters.value(Reason::notForThisBackEnd), 3u);
  record(Dictionary{{"a", 1}}, 5);
  EXPECT_EQ(platform_.counters.value(Reason::notForThisBackEnd), 3u);
}

}  // namespace
}  // namespace kyt
