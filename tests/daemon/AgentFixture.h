// The agent with its real sessions and storebag cache, over a listener in memory, recording back ends and a
// network that a test answers.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "config/StorebagFetcher.h"
#include "daemon/ReportingdAgent.h"
#include "platform/fake/FakeProcessTransaction.h"
#include "platform/ipc/fake/FakeListener.h"
#include "platform/objects/Keys.h"
#include "session/ReportingdSession.h"
#include "session/ReportingdSessionClass.h"
#include "tests/support/RecordingBackend.h"
#include "tests/support/RecordingMessageLog.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TestPlatform.h"

namespace kyt {

class AgentFixture : public ::testing::Test {
 protected:
  struct Client {
    std::shared_ptr<FakeConnection> connection;
    std::shared_ptr<ReportingdSession> session;  // null: refused
    explicit operator bool() const { return session != nullptr; }
  };

  // Sessions and their connections hold each other until the connections end.
  void TearDown() override {
    for (const auto& connection : connections_) connection->invalidateNow();
  }

  AgentFixture() {
    test_.clientBundle.setResource("publicKey", "der", testPublicKey());
    serve(releaseBag(table({"httppost"})));
    listener_.setDelegate(agent_);
    listener_.resume();
  }

  static Dictionary table(std::initializer_list<const char*> names) {
    Dictionary table;
    for (const char* name : names) table.set(name, Dictionary());
    return table;
  }
  void serve(const Dictionary& bag, FakeURLSessionFactory::Headers headers = {}) {
    FakeURLSessionFactory::Reply reply;
    reply.headers = std::move(headers);
    reply.body = signedBag(bag, test_.propertyLists);
    test_.urlSessions.setResponder([reply](const URLRequest&) { return reply; });
  }
  void serveNothing() {
    FakeURLSessionFactory::Reply reply;
    reply.error = Error{kKYTURLErrorDomain, 6, "no such host"};
    test_.urlSessions.setResponder([reply](const URLRequest&) { return reply; });
  }

  Client connect(Value entitlement = true, uint32_t user = 1000) {
    Client client;
    client.connection =
        std::make_shared<FakeConnection>(SerialQueue::create("test.connection", test_.executor), user);
    client.connection->setDescription("<connection>");
    if (!entitlement.isNull()) client.connection->setEntitlement(kEntitlement, std::move(entitlement));
    connections_.push_back(client.connection);
    if (listener_.connect(client.connection))
      client.session = std::static_pointer_cast<ReportingdSession>(client.connection->exportedObject());
    return client;
  }
  static Dictionary sessionInfo(int clientType = 7, uint32_t sessionID = 1) {
    return Dictionary{{kKYTReportingSessionInfoSessionID, sessionID},
                      {kKYTReportingSessionInfoClientType, clientType}};
  }
  static Dictionary sessionInfoAt(int level, const char* token = "T", uint32_t sessionID = 1) {
    Dictionary info = sessionInfo(7, sessionID);
    info.set(kKYTReportingSessionInfoHierarchyToken, Dictionary{{kKYTReportingHierarchyTokenLevel, level},
                                                                {kKYTReportingHierarchyTokenTokenID, token}});
    return info;
  }
  void identify(Client& client, const Dictionary& info, bool aggregates = false) {
    client.connection->call([&](ClientSessionInterface& session) {
      session.setSessionInfo(info, std::nullopt, nullptr, aggregates);
    });
  }
  // A connected and identified client.
  Client clientWith(const Dictionary& info, bool aggregates = false, uint32_t user = 1000) {
    Client client = connect(true, user);
    identify(client, info, aggregates);
    return client;
  }
  std::optional<Array> configure(Client& client) {
    std::optional<Array> states;
    client.connection->call([&](ClientSessionInterface& session) {
      session.startConfigWithCompletionHandler([&](std::optional<Array> s) { states = std::move(s); });
    });
    return states;
  }
  bool logged(LogLevel level, std::string_view text) const { return test_.sink.contains(level, text); }

  TestPlatform test_;
  RecordingBackendFactory factory_{test_.platform};
  RecordingMessageLog messageLog_;
  Mutex backendClassLock_;
  StorebagFetcher fetcher_{test_.configuration, backendClassLock_};
  ReportingdSessionClass class_{test_.configuration, factory_, messageLog_};
  FakeProcessTransaction transaction_;
  ReportingdAgent agent_{test_.configuration, fetcher_, class_, transaction_};
  FakeListener listener_;
  std::vector<std::shared_ptr<FakeConnection>> connections_;
};

}  // namespace kyt
