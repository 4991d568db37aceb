// A user at every limit of the agent, beside another user's hierarchy.
#include <gtest/gtest.h>

#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AgentLimits : public AgentFixture {
 protected:
  static constexpr uint32_t kHostile = 1000, kOther = 1001;
};

TEST_F(AgentLimits, OfOneUserLeaveAnothersHierarchyWhole) {
  test_.budget.shares()[Share::hierarchyTokens] = 2;
  test_.budget.shares()[Share::sharedDataBytes] = 2000;
  ReportingdAgent agent(test_.configuration, fetcher_, class_, transaction_);
  listener_.setDelegate(agent);
  Client parent = clientWith(sessionInfoAt(0, "T", 1), true, kOther);
  Client child = clientWith(sessionInfoAt(1, "T", 2), false, kOther);
  configure(parent);
  configure(child);
  child.connection->call([](ClientSessionInterface& session) {
    session.updateSharedDataWithDictionary(Dictionary{{"call", "c-1"}});
  });

  std::vector<Client> hostile;
  for (int i = 0; i < 50; ++i) {
    hostile.push_back(clientWith(
        sessionInfoAt(1, ("H" + std::to_string(i)).c_str(), static_cast<uint32_t>(100 + i)), true, kHostile));
    hostile.back().connection->call([](ClientSessionInterface& session) {
      session.updateSharedDataWithDictionary(Dictionary{{"k", std::string(1500, 'x')}});
    });
  }
  EXPECT_EQ(test_.counters.value(Reason::hierarchyTokenRefused), 48U);
  EXPECT_EQ(test_.sink.count(LogLevel::error, "hierarchy tokens, the most allowed"), 1U);
  EXPECT_EQ(test_.counters.value(Reason::sharedDataRefused), 1U + 48U) << "standalone sessions share nothing";
  EXPECT_EQ(agent.hierarchyTokenCount(), 3U);

  const size_t before = parent.connection->messagesToClient().size();
  child.connection->call([](ClientSessionInterface& session) {
    session.sendMessageWithDictionary(
        Dictionary{{kKYTReportingMessageParametersCategory, 10}, {kKYTReportingMessageParametersType, 1}},
        nullptr);
  });
  auto& backend = static_cast<RecordingBackend&>(*child.session->backendForKey("httppost"));
  ASSERT_FALSE(backend.sent.empty());
  EXPECT_EQ(*backend.sent.back().message.find(kKYTReportingMessageBlobSharedData),
            Value(Dictionary{{"call", "c-1"}}));
  EXPECT_EQ(backend.combinedSessionIDString(),
            String(parent.session->sessionIDString().str() + "." + child.session->sessionIDString().str()));
  ASSERT_EQ(parent.connection->messagesToClient().size(), before + 1) << "aggregated as ever";
  EXPECT_EQ(parent.connection->messagesToClient().back().category, 10);
  for (const auto& connection : connections_) connection->invalidateNow();
}

}  // namespace
}  // namespace kyt
