// A session with recording back ends, a connection in memory, and a delegate that answers as the test says and
// insists on the agent's lock where a session must hold it.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/ipc/fake/FakeListener.h"
#include "platform/objects/Keys.h"
#include "session/ReportingdSession.h"
#include "session/ReportingdSessionClass.h"
#include "session/ReportingdSessionDelegate.h"
#include "tests/support/RecordingBackend.h"
#include "tests/support/RecordingMessageLog.h"
#include "tests/support/TestPlatform.h"

namespace kyt {

class FakeSessionDelegate final : public ReportingdSessionDelegate {
 public:
  std::optional<Dictionary> storebag, sharedData;
  std::optional<String> storebagVersion, parentID;  // the latter: of parentSessionIDStringForSession()
  std::shared_ptr<ReportingdSession> parent, ancestor;
  std::vector<std::string> calls;
  std::vector<Dictionary> updates;
  std::vector<std::string> removedKeys;
  int changes = 0;  // of figures, told
  int aggregationChanges = 0;
  std::function<void()> onDownstreamUpdate;

  // Whether somebody holds the lock, and so keeps another thread from it.
  [[nodiscard]] bool isLocked() {
    bool free = false;
    std::thread([&] {
      if (!monitor_.tryLock()) return;
      monitor_.unlock();
      free = true;
    }).join();
    return !free;
  }

  std::string description() const override { return "<Delegate>"; }
  Monitor& monitor() override { return monitor_; }
  std::optional<Dictionary> storebagForSession(ReportingdSession&) override {
    calls.emplace_back("storebag");
    return storebag;
  }
  std::optional<String> storebagVersionForSession(ReportingdSession&) override { return storebagVersion; }
  std::optional<AncestorIdentifiers> parentSessionIDStringForSession(ReportingdSession&) override {
    if (!parentID) return std::nullopt;
    return AncestorIdentifiers{std::make_shared<std::string>(parentID->str()), parentID->size()};
  }
  void updateCorrelatedSessions(ReportingdSession& session) override {
    calls.push_back("correlated " + std::to_string(session.hierarchyLevel()));
    EXPECT_TRUE(!session.hierarchyToken() || isLocked()) << "a member without the agent's lock";
  }
  std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(ReportingdSession&) override {
    lockedCall("ancestor");
    return ancestor;
  }
  void aggregationMayHaveChanged(ReportingdSession&) override { ++aggregationChanges; }
  void updateDownstreamSessions(ReportingdSession&) override {
    calls.emplace_back("downstream");
    if (onDownstreamUpdate) onDownstreamUpdate();
  }
  std::shared_ptr<ReportingdSession> parentSessionForChild(ReportingdSession&) override { return parent; }
  void updateSharedDataForSession(ReportingdSession&, const Dictionary& data) override {
    lockedCall("update");
    updates.push_back(data);
  }
  void removeObjectFromSharedDataForSession(ReportingdSession&, const String& key) override {
    lockedCall("remove");
    removedKeys.push_back(key.str());
  }
  std::optional<Dictionary> sharedDataForSession(ReportingdSession&) override {
    lockedCall("shared");
    return sharedData;
  }
  void sessionFiguresMayHaveChanged(ReportingdSession&) override { ++changes; }
  void addAgentHealthInfoForSession(ReportingdSession&, Dictionary& payload) override {
    lockedCall("health");
    payload.set("Health", 1);
  }

  // The calls that must be made under the lock, as they came.
  std::vector<std::string> lockedCalls;

  [[nodiscard]] int count(std::string_view call) const {
    int number = 0;
    for (const std::string& c : calls) number += c == call ? 1 : 0;
    return number;
  }

 private:
  void lockedCall(const char* call) {
    EXPECT_TRUE(isLocked()) << call << " without the agent's lock";
    lockedCalls.emplace_back(call);
  }

  Monitor monitor_;
};

class SessionFixture : public ::testing::Test {
 protected:
  struct Client {
    std::shared_ptr<FakeConnection> connection;
    std::shared_ptr<ReportingdSession> session;
  };

  Client newClient() {
    auto connection =
        std::make_shared<FakeConnection>(SerialQueue::create("test.connection", test_.executor), 1000);
    connection->resume();
    auto session = ReportingdSession::initWithSessionDelegate(delegate_, connection, class_);
    return {std::move(connection), std::move(session)};
  }
  static Dictionary sessionInfo(uint32_t sessionID = 42, bool requireUserInfo = true) {
    return Dictionary{{kKYTReportingSessionInfoSessionID, sessionID},
                      {kKYTReportingSessionInfoClientType, 7},
                      {kKYTReportingSessionInfoRequireUserInfo, requireUserInfo}};
  }
  static Dictionary sessionInfoAtLevel(int level, const char* token = "T") {
    Dictionary info = sessionInfo();
    info.set(kKYTReportingSessionInfoHierarchyToken, Dictionary{{kKYTReportingHierarchyTokenLevel, level},
                                                                {kKYTReportingHierarchyTokenTokenID, token}});
    return info;
  }
  static Dictionary userInfo(const char* client = "a", const char* service = "s") {
    return Dictionary{{kKYTReportingUserInfoClientName, client}, {kKYTReportingUserInfoServiceName, service}};
  }
  static Dictionary table(std::initializer_list<const char*> names) {
    Dictionary table;
    for (const char* name : names) table.set(name, Dictionary());
    return table;
  }
  static Dictionary message(unsigned category, unsigned type, Value payload = nullptr) {
    Dictionary dictionary{{kKYTReportingMessageParametersCategory, category},
                          {kKYTReportingMessageParametersType, type}};
    if (!payload.isNull()) dictionary.set(kKYTReportingMessageParametersPayload, std::move(payload));
    return dictionary;
  }
  // Identifies and configures client_ with back ends of these names.
  std::optional<Array> configure(std::initializer_list<const char*> names) {
    return configure(client_, names, sessionInfo());
  }
  std::optional<Array> configure(Client& client, std::initializer_list<const char*> names,
                                 const Dictionary& info) {
    delegate_.storebag = table(names);
    delegate_.storebagVersion = String("1.5");
    client.session->setSessionInfo(info, std::nullopt, nullptr, false);
    std::optional<Array> states;
    client.session->startConfigWithCompletionHandler([&](std::optional<Array> s) { states = std::move(s); });
    return states;
  }
  // Of client_: what it answers to a message.
  Value send(Dictionary dictionary) {
    Value answer("no reply");
    client_.session->sendMessageWithDictionary(std::move(dictionary),
                                               [&](Value a) { answer = std::move(a); });
    return answer;
  }
  RecordingBackend& backend(std::string_view name) { return *factory_.latest(name); }
  bool logged(LogLevel level, std::string_view text) const { return test_.sink.contains(level, text); }

  TestPlatform test_;
  RecordingBackendFactory factory_{test_.platform};
  RecordingMessageLog messageLog_;
  ReportingdSessionClass class_{test_.configuration, factory_, messageLog_};
  FakeSessionDelegate delegate_;
  Client client_ = newClient();
};

}  // namespace kyt
