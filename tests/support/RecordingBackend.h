// A back end that keeps what it was given and answers as a test says, and a factory that makes one for each
// entry of the back-end table. For tests of sessions and of the agent. The factory's list keeps the back
// ends, so that a test can look at them after their session has ended.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "backend/BackendFactory.h"
#include "backend/KYTReportingBackend.h"
#include "platform/base/Mutex.h"

namespace kyt {

class RecordingBackend final : public KYTReportingBackend {
 public:
  struct Sent {
    Dictionary message;
    TimeValue timestamp;
    uint16_t method = 0, respCode = 0;
    uint16_t eventID = 0;
    int32_t flag = 0;
  };

  RecordingBackend(Platform& platform, String name, Dictionary profile)
      : KYTReportingBackend(Making(), platform, std::move(name), std::move(profile),
                            std::make_shared<SessionFacts>()) {}

  // How it answers.
  Value answer;  // of a send
  std::optional<size_t>
      answersIfWanted;  // it asks for a text of so many bytes first, and flushes give `answer` too
  bool acceptsFiles = false, acceptsLogData = false;
  uint64_t batchSize = 0;
  int32_t stateAfterUpdate = kBackendStateEnabled;
  std::function<void()> onUpdateState;
  bool holdsFlushes = false;  // completions wait in `flushes`; otherwise they run at once
  Value flushResult;
  std::optional<Error> flushError;
  void setLists(std::optional<Array> whitelist, std::optional<Array> blacklist) {
    setEventWhitelist(std::move(whitelist));
    setEventBlacklist(std::move(blacklist));
  }

  // What it was given.
  std::vector<Sent> sent;
  std::vector<FlushCompletion> flushes;
  int flushCount = 0, updateCount = 0, cleanupCount = 0, userInfoCount = 0;
  std::vector<std::string> uploadedPaths, tokens, calls;
  std::vector<SessionIDPath> correlatedIDs;
  std::vector<Value> logData;
  uint64_t sizeQuestions = 0;
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityInterface> connectivity() const {
    return connectivityDelegate();
  }

  using KYTReportingBackend::sendMessage;
  Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID, MessageFlag flag) override {
    calls.emplace_back("send");
    sent.push_back({std::move(message), timestamp, method, respCode, static_cast<uint16_t>(eventID),
                    static_cast<int32_t>(flag)});
    return isWanted() ? answer : Value();
  }
  Value flushMessagesWithCompletion(FlushCompletion completion) override {
    calls.emplace_back("flush");
    ++flushCount;
    if (answersIfWanted) flushResult = isWanted() ? answer : Value();
    if (holdsFlushes)
      flushes.push_back(std::move(completion));
    else
      completion(flushResult, flushError);
    return nullptr;
  }
  bool uploadFileAtPath(const String& path, const String& token, FileOffer&) override {
    uploadedPaths.push_back(path.str());
    tokens.push_back(token.str());
    return acceptsFiles;
  }
  bool uploadLogData(const Value& data) override {
    logData.push_back(data);
    return acceptsLogData;
  }
  void updateState() override {
    if (onUpdateState) onUpdateState();
    calls.emplace_back("updateState");
    ++updateCount;
    setState(stateAfterUpdate);
  }
  void cleanup() override {
    calls.emplace_back("cleanup");
    ++cleanupCount;
  }
  void setUserInfoDict(std::optional<Dictionary> value) override {
    ++userInfoCount;
    KYTReportingBackend::setUserInfoDict(std::move(value));
  }
  void setCorrelatedSessionID(const SessionIDPath& sessionID) override {
    correlatedIDs.push_back(sessionID);
    KYTReportingBackend::setCorrelatedSessionID(sessionID);
  }
  [[nodiscard]] uint64_t batchedEventsSize() override {
    ++sizeQuestions;
    return batchSize;
  }

 private:
  [[nodiscard]] bool isWanted() const { return !answersIfWanted || isAnswerWanted(*answersIfWanted); }
};

// Thread-safe; the back ends that it made are not.
class RecordingBackendFactory final : public BackendFactory {
 public:
  explicit RecordingBackendFactory(Platform& platform) : platform_(platform) {}

  // Called for each back end that is made, before anyone uses it.
  std::function<void(RecordingBackend&)> prepare;
  // Names for which nothing is made.
  std::set<std::string> unknownNames;

  // The latest of that name, or null; and all that were made, in order.
  [[nodiscard]] std::shared_ptr<RecordingBackend> latest(std::string_view name) const {
    MutexLock lock(mutex_);
    for (auto made = made_.rbegin(); made != made_.rend(); ++made)
      if ((*made)->name() == name) return *made;
    return nullptr;
  }
  [[nodiscard]] std::vector<std::shared_ptr<RecordingBackend>> made() const {
    MutexLock lock(mutex_);
    return made_;
  }
  struct Call {
    std::optional<Dictionary> table, sessionInfo, userInfo;
    std::string udid;
  };
  [[nodiscard]] std::vector<Call> calls() const {
    MutexLock lock(mutex_);
    return calls_;
  }

  std::shared_ptr<KYTReportingBackend> newBackendWithName(const String& name, const Dictionary& profile,
                                                          const SharedSessionFacts&) override {
    if (unknownNames.count(name.str()) != 0) return nullptr;
    auto backend = std::make_shared<RecordingBackend>(platform_, name, profile);
    if (prepare) prepare(*backend);
    MutexLock lock(mutex_);
    made_.push_back(backend);
    return backend;
  }
  std::optional<Backends> createBackends(const std::optional<Dictionary>& table,
                                         const std::optional<Dictionary>& sessionInfo,
                                         const std::optional<Dictionary>& userInfo,
                                         const String& udid) override {
    {
      MutexLock lock(mutex_);
      calls_.push_back({table, sessionInfo, userInfo, udid.str()});
    }
    if (!table || !sessionInfo) return std::nullopt;
    Backends backends;
    for (const DictionaryEntry& entry : *table) {
      const Dictionary* profile = entry.value.dictionary();
      auto backend = newBackendWithName(entry.key, profile != nullptr ? *profile : Dictionary(), nullptr);
      if (backend != nullptr) backends.add(entry.key, std::move(backend));
    }
    return backends;
  }

 private:
  Platform& platform_;
  mutable Mutex mutex_;
  std::vector<std::shared_ptr<RecordingBackend>> made_ GUARDED_BY(mutex_);
  std::vector<Call> calls_ GUARDED_BY(mutex_);
};

}  // namespace kyt
