// A client session whose answers are waited for, as texts that tests compare.
#pragma once

#include <chrono>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "kytreporting/KYTReporting.h"
#include "tests/support/Eventually.h"

namespace kyt {

class TestClient {
 public:
  // With a name the session promises user information and gives it.
  TestClient(std::string socketPath, int clientType, const std::string& name = {}, uint32_t sessionID = 77) {
    KYTReporting::Options options;
    options.socketPath = std::move(socketPath);
    options.sessionInfo = Dictionary{{kKYTReportingSessionInfoSessionID, sessionID},
                                     {kKYTReportingSessionInfoClientType, clientType},
                                     {kKYTReportingSessionInfoBatchEvent, true},
                                     {kKYTReportingSessionInfoRequireUserInfo, !name.empty()}};
    if (!name.empty())
      options.userInfo =
          Dictionary{{kKYTReportingUserInfoClientName, name}, {kKYTReportingUserInfoServiceName, "test"}};
    session_ = KYTReporting::open(std::move(options));
  }

  // "none" without a storebag, else "live:" and the names of the live back ends; "no answer" in time.
  std::string configure() {
    auto answer = std::make_shared<std::promise<std::string>>();
    session_->startConfiguration(
        [answer](std::optional<std::vector<std::string>> states, std::optional<Error> error) {
          if (error) return answer->set_value("error: " + error->localizedDescription);
          if (!states) return answer->set_value("none");
          std::string text = "live:";
          for (const std::string& name : *states) text += " " + name;
          answer->set_value(text);
        });
    return waitFor(answer);
  }
  // "flushed", or the error's text.
  std::string flush() { return waitFor(startFlush()); }
  std::shared_ptr<std::promise<std::string>> startFlush() {
    auto answer = std::make_shared<std::promise<std::string>>();
    session_->flush([answer](const Value&, std::optional<Error> error) {
      answer->set_value(error ? "error: " + error->localizedDescription : "flushed");
    });
    return answer;
  }
  std::string displayURL() {
    auto answer = std::make_shared<std::promise<std::string>>();
    session_->fetchDisplayURL([answer](std::string text, std::optional<Error> error) {
      answer->set_value(error ? "error: " + error->localizedDescription : std::move(text));
    });
    return waitFor(answer);
  }
  bool send(uint16_t category, uint16_t type, Dictionary payload, uint32_t flag = 0) {
    return session_->sendMessage(category, type, std::move(payload), flag);
  }
  bool finish() { return session_->finish(std::chrono::seconds(20)); }
  void close() { session_.reset(); }
  KYTReporting* operator->() { return session_.get(); }

  static std::string waitFor(const std::shared_ptr<std::promise<std::string>>& answer) {
    auto future = answer->get_future();
    return future.wait_for(kTestDeadline) == std::future_status::ready ? future.get() : "no answer";
  }

 private:
  std::unique_ptr<KYTReporting> session_;
};

}  // namespace kyt
