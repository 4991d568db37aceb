// A log in memory, which stores, refuses or is silent as the test says, for all messages or for some. Any thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Mutex.h"
#include "receiver/EventLog.h"

namespace kyt::receiver {

class FakeLog final : public EventLog {
 public:
  enum class Mood { stores, refuses, refusesForGood, isSilent };

  void start(LogListener& listener) override { listener_ = &listener; }
  void publish(uint64_t token, std::shared_ptr<const LogMessage> message) override {
    LogAnswer answer;
    {
      MutexLock lock(mutex_);
      published_.emplace_back(token, message->id);
      const auto own = moods_.find(message->id);
      switch (own == moods_.end() ? mood_.load() : own->second) {
        case Mood::stores:
          answer.verdict = ++stored_[message->id] > 1 ? LogVerdict::duplicate : LogVerdict::stored;
          break;
        case Mood::refuses:
          answer = {LogVerdict::refused, "full"};
          break;
        case Mood::refusesForGood:
          answer = {LogVerdict::refusedForGood, "too large"};
          break;
        case Mood::isSilent:
          return;
      }
    }
    listener_->logAnswered(token, answer);
  }
  void publishDeadLetter(std::shared_ptr<const LogMessage> message) override {
    {
      MutexLock lock(mutex_);
      deadLetters_.push_back(std::move(message));
    }
    listener_->deadLetterAnswered(mood_ == Mood::stores);
  }
  [[nodiscard]] std::optional<uint64_t> maxBodyBytes() const override { return 1 << 20; }
  void stop() override {}

  void setMood(Mood mood) { mood_ = mood; }
  // Of the message with that ID alone, whatever the log's is.
  void setMoodOf(const std::string& id, Mood mood) {
    MutexLock lock(mutex_);
    moods_[id] = mood;
  }
  [[nodiscard]] std::vector<std::pair<uint64_t, std::string>> published() {
    MutexLock lock(mutex_);
    return published_;
  }
  [[nodiscard]] std::map<std::string, int> stored() {
    MutexLock lock(mutex_);
    return stored_;
  }
  [[nodiscard]] std::vector<std::shared_ptr<const LogMessage>> deadLetters() {
    MutexLock lock(mutex_);
    return deadLetters_;
  }

 private:
  LogListener* listener_ = nullptr;
  std::atomic<Mood> mood_{Mood::stores};
  Mutex mutex_;
  std::map<std::string, Mood> moods_ GUARDED_BY(mutex_);
  std::vector<std::pair<uint64_t, std::string>> published_ GUARDED_BY(mutex_);  // token, ID; in their order
  std::map<std::string, int> stored_ GUARDED_BY(mutex_);                        // how often
  std::vector<std::shared_ptr<const LogMessage>> deadLetters_ GUARDED_BY(mutex_);
};

}  // namespace kyt::receiver
