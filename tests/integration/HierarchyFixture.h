// A stage with client processes that form hierarchies, and the records that arrived from them.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "tests/integration/StageFixture.h"
#include "tests/support/ScriptedClient.h"

namespace kyt {

class HierarchyTest : public StageTest {
 protected:
  using Process = std::unique_ptr<ScriptedClient>;

  [[nodiscard]] Process process() const {
    return std::make_unique<ScriptedClient>(stage_->program("kytctl"),
                                            std::vector<std::string>{"--socket", socket()});
  }
  // The step that opens a session under that client name; without a token for a level below 0.
  [[nodiscard]] static std::string opening(const std::string& name, int level, int sessionID,
                                           bool aggregate = false, int clientType = 20,
                                           const std::string& token = "4f1c") {
    std::string info = "\"SessionID\":" + std::to_string(sessionID) +
                       ",\"ClientType\":" + std::to_string(clientType) +
                       ",\"ClientVersion\":1,\"BatchEvent\":true,\"RequireUserInfo\":true";
    if (level >= 0)
      info += ",\"HierarchyToken\":{\"TokenID\":\"" + token + "\",\"Level\":" + std::to_string(level) + "}";
    return "{\"do\":\"open\",\"sessionInfo\":{" + info + "},\"userInfo\":{\"ClientName\":\"" + name +
           "\",\"ServiceName\":\"test\"}" + (aggregate ? ",\"aggregate\":true}" : "}");
  }
  // A process with an open and configured session; `live` is what configuring must print.
  [[nodiscard]] Process open(const std::string& name, int level, int sessionID, bool aggregate = false,
                             const std::string& live = "live: httppost") {
    Process client = process();
    client->step(opening(name, level, sessionID, aggregate));
    EXPECT_EQ(client->ask(R"({"do":"configure"})"), live) << name << "\n" << daemonLog();
    return client;
  }
  static std::string sending(int category, const std::string& payload = "{}") {
    return "{\"do\":\"send\",\"category\":" + std::to_string(category) +
           ",\"type\":1,\"payload\":" + payload + "}";
  }
  // Sent, and taken by the daemon: the answer to the next call says so.
  static void sendAndSettle(ScriptedClient& client, int category, const std::string& payload = "{}") {
    client.step(sending(category, payload));
    EXPECT_EQ(client.ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  }

  // Flushes, and waits for the server's answer; what kytctl printed.
  static std::string flush(ScriptedClient& client) {
    client.step(R"({"do":"flush"})");
    client.step(R"({"do":"displayURL"})");
    std::string text;
    for (std::string line = client.line(); line != "https://display.example.org/"; line = client.line()) {
      if (line == "(nothing)" || line == "(the end)") return line;
      text += line + "\n";
    }
    return text;
  }
  static void finish(ScriptedClient& client) {
    client.step(R"({"do":"finish"})");
    EXPECT_EQ(client.end().back(), "status 0");
  }

  // The records of a client, with that method (below 0: any), in the order of their numbers.
  [[nodiscard]] std::vector<Dictionary> records(const std::string& client, int method = -1,
                                                int status = -1) const {
    std::string query = "/api/events?since=0&limit=1000&client=" + client;
    if (method >= 0) query += "&method=" + std::to_string(method);
    if (status >= 0) query += "&status=" + std::to_string(status);
    const Value answer = stage_->query(query);
    const Dictionary* dictionary = answer.dictionary();
    const Value* events = dictionary != nullptr ? dictionary->find("events") : nullptr;
    std::vector<Dictionary> found;
    if (events == nullptr || events->array() == nullptr) return found;
    for (const Value& event : *events->array())
      if (const Value* record = event.dictionary()->find("record"); record != nullptr)
        found.push_back(*record->dictionary());
    return found;
  }
  [[nodiscard]] static Value entryOf(const Dictionary& record, const char* key) {
    const Value* value = record.find(key);
    return value != nullptr ? *value : Value();
  }
  [[nodiscard]] static std::string textOf(const Dictionary& record, const char* key) {
    return description(entryOf(record, key));
  }
  [[nodiscard]] size_t countLogged(std::string_view text) const {
    const std::string log = daemonLog();
    size_t count = 0;
    for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) ++count;
    return count;
  }
};

}  // namespace kyt
