// Which clients have an adaptor, where it comes from, and what is forwarded to it.
#include "backends/qdx/QDXBackend.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <set>
#include <string>
#include <vector>

#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class QDX : public testing::Test {
 protected:
  std::shared_ptr<QDXBackend> make(int32_t clientType = 7) {
    SessionFacts facts;
    facts.compType = clientType;
    return QDXBackend::initWithName(platform_.configuration, kKYTReportingBackendQDX, Dictionary{},
                                    std::make_shared<SessionFacts>(facts));
  }
  // Through the operation that routed events go through.
  void send(QDXBackend& backend) {
    EXPECT_TRUE(
        backend.sendMessage(Dictionary{{"k", "v"}}, TimeValue{5, 6}, 700, 65535, MessageFlag{1}).isNull());
  }
  bool logged(LogLevel level, std::string_view line) { return platform_.sink.contains(level, line); }

  TestPlatform platform_;
  FakePluginBundles& bundles_ = platform_.pluginBundles;
};

TEST_F(QDX, ExistsForThreeClientTypes) {
  const std::set<int32_t> allowed = {7, 11, 13};
  for (int32_t type = -40; type <= 100; ++type)
    EXPECT_EQ(QDXBackend::isClientTypeAllowed(type), allowed.count(type) != 0) << type;
  EXPECT_FALSE(QDXBackend::isClientTypeAllowed(std::numeric_limits<int32_t>::min()));
  EXPECT_FALSE(QDXBackend::isClientTypeAllowed(std::numeric_limits<int32_t>::max()));
  for (const int32_t type : {7, 11, 13}) {
    EXPECT_NE(make(type), nullptr) << type;
    EXPECT_TRUE(logged(
        LogLevel::normal,
        "QDXBackend(initWithName): Loading QDX adaptor class for client type " + std::to_string(type)));
  }
}

TEST_F(QDX, IsRefusedToOthersWithALine) {
  for (const int32_t type : {6, 8, 12, 14, 0, -7}) {
    EXPECT_EQ(make(type), nullptr) << type;
    EXPECT_TRUE(
        logged(LogLevel::error,
               "QDXBackend(initWithName): No matching bundle found for client type " + std::to_string(type)));
  }
  EXPECT_TRUE(bundles_.paths.empty());
}

TEST_F(QDX, WithoutAClientTypeThereIsNone) {
  EXPECT_EQ(QDXBackend::initWithName(platform_.configuration, "qdx", Dictionary{},
                                     std::make_shared<SessionFacts>()),
            nullptr);
  EXPECT_TRUE(
      logged(LogLevel::error, "QDXBackend(initWithName): No matching bundle found for client type 0"));
}

TEST_F(QDX, WithoutTheBundleEachEventSaysSo) {
  const auto backend = make();
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(bundles_.paths,
            std::vector<std::string>{
                "/System/Library/PrivateFrameworks/Cadmor.framework/Frameworks/TQSPerformance.framework"});
  send(*backend);
  send(*backend);
  EXPECT_EQ(platform_.sink.count(LogLevel::error,
                                 "QDXBackend(sendMessage): QDX adaptor (null) does not respond to "
                                 "forwarding selector sendMessageWithMethod:respCode:dict:"),
            2u);
}

TEST_F(QDX, ForwardsMethodCodeAndDictionary) {
  bundles_.present = true;
  const auto backend = make(11);
  ASSERT_NE(backend, nullptr);
  send(*backend);
  ASSERT_EQ(bundles_.state->calls.size(), 1u);
  const auto& call = bundles_.state->calls[0];
  EXPECT_EQ(call.operation, "sendMessageWithMethod:respCode:dict:");
  EXPECT_EQ(call.method, 700);
  EXPECT_EQ(call.respCode, 65535);
  EXPECT_EQ(Value(call.dictionary), Value(Dictionary{{"k", "v"}}));
}

TEST_F(QDX, LoadsTheBundleOnceAndMakesAnAdaptorForEachBackEnd) {
  bundles_.present = true;
  auto first = make(), second = make();
  EXPECT_EQ(bundles_.state->loadCalls, 1);
  EXPECT_EQ(bundles_.state->instances, 2);
  first.reset();
  EXPECT_EQ(bundles_.state->instances, 1);
}

TEST_F(QDX, AMissingClassOrObjectLeavesNoAdaptor) {
  bundles_.present = true;
  const auto hasNoAdaptor = [&] {
    platform_.sink.clear();
    const auto backend = make();
    ASSERT_NE(backend, nullptr);
    EXPECT_FALSE(logged(LogLevel::error, "QDXBackend")) << "reported when it was made";
    send(*backend);
    EXPECT_TRUE(logged(LogLevel::error,
                       "QDXBackend(sendMessage): QDX adaptor (null) does not respond to "
                       "forwarding selector sendMessageWithMethod:respCode:dict:"));
  };
  bundles_.state->loads = false;
  hasNoAdaptor();
  bundles_.state->loads = true;
  bundles_.state->className = "Another";
  hasNoAdaptor();
  bundles_.state->className = "QDXAdaptor";
  bundles_.state->initialises = false;
  hasNoAdaptor();
  EXPECT_TRUE(bundles_.state->calls.empty());
}

TEST_F(QDX, AnAdaptorWithoutTheOperationIsNamed) {
  bundles_.present = true;
  bundles_.state->operations = {"sendMessage:"};
  const auto backend = make(13);
  send(*backend);
  EXPECT_TRUE(logged(LogLevel::error,
                     "QDXBackend(sendMessage): QDX adaptor <QDXAdaptor> does not respond to forwarding "
                     "selector sendMessageWithMethod:respCode:dict:"));
}

TEST_F(QDX, CountsEachEventThatItsAdaptorDoesNotTake) {
  const auto without = make();
  send(*without);
  send(*without);
  EXPECT_EQ(platform_.counters.value(Reason::adaptorUnavailable), 2u);
  bundles_.present = true;
  const auto with = make();
  send(*with);
  EXPECT_EQ(platform_.counters.value(Reason::adaptorUnavailable), 2u);
  bundles_.state->operations = {"sendMessage:"};
  send(*make());
  EXPECT_EQ(platform_.counters.value(Reason::adaptorUnavailable), 3u);
}

}  // namespace
}  // namespace kyt
