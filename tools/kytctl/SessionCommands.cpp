// Events by hand: one alone, or a scripted session.
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <mutex>
#include <thread>

#include "kytreporting/KYTReporting.h"
#include "platform/DataServices.h"
#include "platform/TextEscape.h"
#include "platform/linux/RapidJSONWriter.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

namespace {

constexpr uint64_t kQueued =
    1024;  // messages that a script lets wait, well below what a session's queue holds

// What a completion said, waited for by the command's own thread. Shared: the completion may come after the
// time-out.
class Answer {
 public:
  void set(std::string text, std::optional<Error> error) {
    const std::lock_guard lock(mutex_);
    text_ = std::move(text);
    error_ = std::move(error);
    set_ = true;
    changed_.notify_all();
  }
  // None after `seconds` without an answer.
  std::optional<std::pair<std::string, std::optional<Error>>> wait(double seconds) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, std::chrono::duration<double>(seconds), [this] { return set_; }))
      return std::nullopt;
    return std::pair(text_, error_);
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::string text_;
  std::optional<Error> error_;
  bool set_ = false;
};

// The messages that an aggregating session gets, printed as they come, each a line of JSON. Shared: they come
// on the library's thread, and the last may come while the session closes.
class Aggregated {
 public:
  void print(const AggregatedMessage& message) {
    Dictionary line{{"timestamp", message.timestamp},
                    {"category", static_cast<unsigned>(message.category)},
                    {"type", static_cast<unsigned>(message.type)}};
    if (message.sessionInfo) line.set("sessionInfo", *message.sessionInfo);
    if (message.payload) line.set("payload", *message.payload);
    const std::string text = escapedText(description(Dictionary{{"aggregated", std::move(line)}}));
    std::printf("%s\n", text.c_str());
    std::fflush(stdout);
    const std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  [[nodiscard]] bool waitFor(uint64_t count, double seconds) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::duration<double>(seconds), [&] { return count_ >= count; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  uint64_t count_ = 0;
};

std::string socketPath(const ConnectionOptions& connection) {
  if (!connection.socket.empty()) return connection.socket;
  if (connection.root.empty()) return {};
  return connection.root + "/run/kytreportingd/com.vantu.kytreportingd";
}

// Prints the answer; whether it was one.
int report(const std::shared_ptr<Answer>& answer, const ConnectionOptions& connection, const char* what) {
  const auto said = answer->wait(connection.timeoutSeconds);
  if (!said) return failed(std::string(what) + ": no answer in time");
  if (said->second) return failed(std::string(what) + ": " + said->second->localizedDescription);
  if (!said->first.empty()) std::printf("%s\n", escapedText(said->first).c_str());
  return 0;
}

std::string statesText(const std::optional<std::vector<std::string>>& states) {
  if (!states) return "no storebag";
  std::string text = "live:";
  for (const std::string& name : *states) text += " " + name;
  return text;
}

class Script {
 public:
  explicit Script(const ConnectionOptions& connection) : connection_(connection) {
    steps_ = {{"open", &Script::open},
              {"configure", &Script::configure},
              {"states", &Script::states},
              {"send", &Script::send},
              {"flush", &Script::flush},
              {"displayURL", &Script::displayURL},
              {"sharedData", &Script::sharedData},
              {"digestKey", &Script::digestKey},
              {"wait", &Script::wait},
              {"finish", &Script::finish}};
  }

  int run(const Dictionary& step) {
    const Value* what = step.find("do");
    if (what == nullptr || !what->isString()) return failed("a step needs \"do\"");
    const auto found = steps_.find(what->string()->str());
    if (found == steps_.end()) return failed("unknown step \"" + what->string()->str() + "\"");
    if (found->first != "open" && !session_) return failed("the first step is {\"do\":\"open\"}");
    return (this->*found->second)(step);
  }

 private:
  static std::optional<Dictionary> dictionaryAt(const Dictionary& step, const char* key) {
    const Value* value = step.find(key);
    if (value == nullptr || !value->isDictionary()) return std::nullopt;
    return *value->dictionary();
  }
  static uint32_t numberAt(const Dictionary& step, const char* key, uint32_t otherwise) {
    const Value* value = step.find(key);
    return value != nullptr ? value->unsignedIntValue() : otherwise;
  }

  int open(const Dictionary& step) {
    KYTReporting::Options options;
    options.socketPath = socketPath(connection_);
    options.sessionInfo = dictionaryAt(step, "sessionInfo").value_or(Dictionary());
    options.userInfo = dictionaryAt(step, "userInfo");
    if (const Value* aggregate = step.find("aggregate"); aggregate != nullptr && aggregate->boolValue())
      options.aggregationBlock = [aggregated = aggregated_](const AggregatedMessage& message) {
        aggregated->print(message);
      };
    session_ = KYTReporting::open(std::move(options));
    return 0;
  }
  int wait(const Dictionary& step) {
    if (aggregated_->waitFor(numberAt(step, "messages", 1), connection_.timeoutSeconds)) return 0;
    return failed("wait: not so many messages in time");
  }
  int configure(const Dictionary&) {
    auto answer = std::make_shared<Answer>();
    session_->startConfiguration([answer](auto states, std::optional<Error> error) {
      answer->set(statesText(states), std::move(error));
    });
    return report(answer, connection_, "configure");
  }
  int states(const Dictionary& step) {
    auto answer = std::make_shared<Answer>();
    session_->fetchStates(dictionaryAt(step, "userInfo"), [answer](auto states, std::optional<Error> error) {
      answer->set(statesText(states), std::move(error));
    });
    return report(answer, connection_, "states");
  }
  int send(const Dictionary& step) {
    const auto category = static_cast<uint16_t>(numberAt(step, "category", 0));
    const auto type = static_cast<uint16_t>(numberAt(step, "type", 0));
    const uint32_t flag = numberAt(step, "flag", 0);
    const Dictionary payload = dictionaryAt(step, "payload").value_or(Dictionary());
    if (const Value* reply = step.find("reply"); reply != nullptr && reply->boolValue()) {
      auto answer = std::make_shared<Answer>();
      session_->sendMessage(category, type, payload, flag,
                            [answer](const Value& value, std::optional<Error> error) {
                              answer->set(value.isNull() ? "" : description(value), std::move(error));
                            });
      return report(answer, connection_, "send");
    }
    for (uint32_t i = numberAt(step, "repeat", 1); i > 0; --i) {
      if (!waitForRoom()) return failed("send: the queue stays full");
      if (!session_->sendMessage(category, type, payload, flag))
        return failed("send: the message does not fit into the queue");
    }
    return 0;
  }
  // A script that repeats a message more often than the session's queue holds goes on at the daemon's pace.
  bool waitForRoom() {
    const auto deadline =
        std::chrono::steady_clock::now() + std::chrono::duration<double>(connection_.timeoutSeconds);
    while (session_->statistics().queued >= kQueued) {
      if (std::chrono::steady_clock::now() >= deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
  }
  int flush(const Dictionary&) {
    auto answer = std::make_shared<Answer>();
    session_->flush([answer](const Value& value, std::optional<Error> error) {
      answer->set(value.isNull() ? "flushed" : description(value), std::move(error));
    });
    return report(answer, connection_, "flush");
  }
  int displayURL(const Dictionary&) {
    auto answer = std::make_shared<Answer>();
    session_->fetchDisplayURL([answer](std::string url, std::optional<Error> error) {
      answer->set(std::move(url), std::move(error));
    });
    return report(answer, connection_, "displayURL");
  }
  int sharedData(const Dictionary& step) {
    const std::optional<Dictionary> entries = dictionaryAt(step, "entries");
    if (!entries) return failed("sharedData needs \"entries\"");
    for (const DictionaryEntry& entry : *entries) session_->updateSharedData(entry.key, entry.value);
    return 0;
  }
  int digestKey(const Dictionary& step) {
    const Value* hex = step.find("hex");
    std::string bytes;
    const std::string digits = hex != nullptr && hex->isString() ? hex->string()->str() : "";
    for (size_t i = 0; i + 1 < digits.size(); i += 2) {
      unsigned byte = 0;
      if (std::sscanf(digits.substr(i, 2).c_str(), "%2x", &byte) != 1)
        return failed("digestKey: \"hex\" is no hex");
      bytes += static_cast<char>(byte);
    }
    session_->setDigestKey(Data(std::string_view(bytes)),
                           static_cast<int32_t>(numberAt(step, "algorithm", 0)));
    return 0;
  }
  int finish(const Dictionary&) {
    const auto timeout = std::chrono::milliseconds(static_cast<int64_t>(connection_.timeoutSeconds * 1000));
    const bool done = session_->finish(timeout);
    const KYTReporting::Statistics figures = session_->statistics();
    std::printf("sent %llu, lost %llu, dropped %llu\n", static_cast<unsigned long long>(figures.sent),
                static_cast<unsigned long long>(figures.lostOnConnectionEnd),
                static_cast<unsigned long long>(figures.droppedQueueFull + figures.droppedInvalid));
    return done ? 0 : failed("finish: the daemon did not take everything in time");
  }

  const ConnectionOptions& connection_;
  const std::shared_ptr<Aggregated> aggregated_ = std::make_shared<Aggregated>();
  std::map<std::string, int (Script::*)(const Dictionary&)> steps_;
  std::unique_ptr<KYTReporting> session_;
};

}  // namespace

int sendCommand(const ConnectionOptions& connection, const SendOptions& given) {
  RapidJSONWriter json;
  auto payload = json.parse(given.payloadJSON);
  if (auto* error = std::get_if<Error>(&payload)) return failed("--payload: " + error->localizedDescription);
  if (!std::get<Value>(payload).isDictionary()) return failed("--payload is a JSON object");
  KYTReporting::Options options;
  options.socketPath = socketPath(connection);
  options.sessionInfo = {{kKYTReportingSessionInfoSessionID, given.sessionID},
                         {kKYTReportingSessionInfoClientType, given.clientType},
                         {kKYTReportingSessionInfoClientVersion, static_cast<unsigned>(given.clientVersion)},
                         {kKYTReportingSessionInfoRequireUserInfo, given.requireUserInfo}};
  if (!given.userInfoJSON.empty()) {
    auto userInfo = json.parse(given.userInfoJSON);
    if (auto* error = std::get_if<Error>(&userInfo))
      return failed("--user-info: " + error->localizedDescription);
    if (!std::get<Value>(userInfo).isDictionary()) return failed("--user-info is a JSON object");
    options.userInfo = *std::get<Value>(userInfo).dictionary();
  }
  auto answer = std::make_shared<Answer>();
  KYTReporting::sendSingleMessage(std::move(options), given.category, given.type,
                                  *std::get<Value>(payload).dictionary(),
                                  [answer](std::string text, std::optional<Error> error) {
                                    answer->set(std::move(text), std::move(error));
                                  });
  const auto said = answer->wait(connection.timeoutSeconds);
  if (!said) return failed("send: no answer in time");
  if (said->second) return failed("send: " + said->second->localizedDescription);
  std::printf("%s\n", escapedText(said->first).c_str());
  return said->first == "finished" ? 0 : 1;
}

int sessionCommand(const ConnectionOptions& connection, const std::string& path) {
  // Line by line, so that a person or a program may decide on the next step after the last one's answer.
  std::ifstream file;
  if (path != "-") {
    file.open(path);
    if (!file) return failed(path + ": " + std::strerror(errno));
  }
  std::istream& lines = path == "-" ? std::cin : file;
  RapidJSONWriter json;
  Script script(connection);
  std::string line;
  for (int number = 1; std::getline(lines, line); ++number) {
    if (line.find_first_not_of(" \t\r") == std::string::npos || line[line.find_first_not_of(" \t")] == '#')
      continue;
    auto step = json.parse(line);
    if (auto* error = std::get_if<Error>(&step))
      return failed("line " + std::to_string(number) + ": " + error->localizedDescription);
    const Dictionary* dictionary = std::get<Value>(step).dictionary();
    if (dictionary == nullptr) return failed("line " + std::to_string(number) + ": a step is a JSON object");
    if (const int status = script.run(*dictionary); status != 0) return status;
    std::fflush(stdout);
  }
  return 0;
}

}  // namespace kyt::tools
