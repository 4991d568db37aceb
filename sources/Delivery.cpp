#include "sources/Delivery.h"

#include <algorithm>
#include <memory>

#include "client/include/kytreporting/KYTReporting.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Keys.h"

namespace kyt::sources {

namespace {

// What the library's thread tells the one that waits. Shared by both: a completion may come after the wait ended.
class Answers {
 public:
  explicit Answers(size_t count) : delivered_(count), open_(count) {}
  void take(size_t index, const std::optional<Error>& error) {
    const MutexLock lock(mutex_);
    delivered_[index] = !error;
    if (error) problem_ = error->localizedDescription;
    if (--open_ == 0) done_.notifyAll();
  }
  void waitUntil(MonotonicTime deadline) {
    const MutexLock lock(mutex_);
    while (open_ != 0 && done_.waitUntil(mutex_, deadline)) {
    }
    if (open_ != 0 && problem_.empty()) problem_ = "the daemon did not answer in time";
  }
  std::vector<bool> delivered(std::string& problem) {
    const MutexLock lock(mutex_);
    problem = problem_;
    return delivered_;
  }

 private:
  Mutex mutex_;
  ConditionVariable done_;
  std::vector<bool> delivered_ GUARDED_BY(mutex_);
  size_t open_ GUARDED_BY(mutex_);
  std::string problem_ GUARDED_BY(mutex_);
};

}  // namespace

std::vector<bool> Delivery::deliver(const std::vector<SourceEvent>& events) {
  KYTReporting::Options session;
  session.socketPath = options_.socket;
  SessionInfo info;
  info.clientType = options_.clientType;
  info.clientVersion = 1;
  info.batchEvent = true;
  session.sessionInfo = info;  // with user information, so that the owner's consent is asked for
  session.userInfo = Dictionary{{kKYTReportingUserInfoClientName, options_.client},
                                {kKYTReportingUserInfoServiceName, "kytsource"}};
  // A little less than our own patience, so that the library's reason comes first.
  session.callDeadline = options_.patience * 9 / 10;
  const auto deadline = std::chrono::steady_clock::now() + options_.patience;
  const auto answers = std::make_shared<Answers>(events.size());
  const std::unique_ptr<KYTReporting> reporting = KYTReporting::open(std::move(session));
  reporting->startConfiguration();
  for (size_t index = 0; index < events.size(); ++index)
    reporting->sendMessage(
        events[index].category, events[index].type, events[index].payload, 0,
        [answers, index](const Value&, const std::optional<Error>& error) { answers->take(index, error); });
  answers->waitUntil(deadline);
  std::vector<bool> delivered = answers->delivered(problem_);
  if (std::find(delivered.begin(), delivered.end(), true) != delivered.end()) {
    static_cast<void>(reporting->finish(options_.patience));
  } else if (const std::string reason = reporting->stateReason(); !reason.empty()) {
    problem_ = reason;
  }
  return delivered;
}

}  // namespace kyt::sources
