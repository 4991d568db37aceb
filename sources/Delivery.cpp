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
  explicit Answers(size_t count) : taken_(count), open_(count) {}
  void configure(bool hasStorebag, const std::optional<Error>& error) {
    const MutexLock lock(mutex_);
    hasStorebag_ = hasStorebag && !error;
    if (error) problem_ = error->localizedDescription;
    changed_.notifyAll();
  }
  void take(size_t index, const std::optional<Error>& error) {
    const MutexLock lock(mutex_);
    taken_[index] = !error;
    if (error) problem_ = error->localizedDescription;
    if (--open_ == 0) changed_.notifyAll();
  }
  // Whether the session was configured, from a storebag.
  [[nodiscard]] bool waitForStorebag(MonotonicTime deadline) {
    const MutexLock lock(mutex_);
    while (!hasStorebag_ && changed_.waitUntil(mutex_, deadline)) {
    }
    return hasStorebag_.value_or(false);
  }
  void waitForAll(MonotonicTime deadline) {
    const MutexLock lock(mutex_);
    while (open_ != 0 && changed_.waitUntil(mutex_, deadline)) {
    }
  }
  [[nodiscard]] std::vector<bool> taken() {
    const MutexLock lock(mutex_);
    return taken_;
  }
  // Why not all was taken; empty: it was.
  [[nodiscard]] std::string problem() {
    const MutexLock lock(mutex_);
    return open_ != 0 && problem_.empty() ? "the daemon did not answer in time" : problem_;
  }

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  std::optional<bool> hasStorebag_ GUARDED_BY(mutex_);
  std::vector<bool> taken_ GUARDED_BY(mutex_);
  size_t open_ GUARDED_BY(mutex_);
  std::string problem_ GUARDED_BY(mutex_);
};

KYTReporting::Options sessionOptions(const Delivery::Options& given) {
  KYTReporting::Options session;
  session.socketPath = given.socket;
  SessionInfo info;
  info.clientType = given.clientType;
  info.clientVersion = 1;
  info.batchEvent = true;
  session.sessionInfo = info;  // with user information, so that the owner's consent is asked for
  session.userInfo = Dictionary{{kKYTReportingUserInfoClientName, given.client},
                                {kKYTReportingUserInfoServiceName, "kytsource"}};
  // A little less than our own patience, so that the library's reason comes first.
  session.callDeadline = given.patience * 9 / 10;
  return session;
}

}  // namespace

bool Handover::isWhole() const {
  return offered && std::find(taken.begin(), taken.end(), false) == taken.end();
}

Handover Delivery::deliver(const std::vector<SourceEvent>& events) {
  problem_.clear();
  if (events.empty()) return {true, {}};
  const auto deadline = std::chrono::steady_clock::now() + options_.patience;
  const auto answers = std::make_shared<Answers>(events.size());
  const std::unique_ptr<KYTReporting> reporting = KYTReporting::open(sessionOptions(options_));
  reporting->startConfiguration([answers](const auto& states, const std::optional<Error>& error) {
    answers->configure(states.has_value(), error);
  });
  const auto why = [&] {
    const std::string reason =
        reporting->state() < KYTReporting::State::noLiveBackEnd ? reporting->stateReason() : "";
    return reason.empty() ? answers->problem() : reason;
  };
  if (!answers->waitForStorebag(deadline)) {
    problem_ = why();
    return {false, std::vector<bool>(events.size(), false)};
  }
  for (size_t index = 0; index < events.size(); ++index)
    reporting->sendMessage(
        events[index].category, events[index].type, events[index].payload, 0,
        [answers, index](const Value&, const std::optional<Error>& error) { answers->take(index, error); });
  answers->waitForAll(deadline);
  using std::chrono::milliseconds;
  const auto left = std::chrono::duration_cast<milliseconds>(deadline - std::chrono::steady_clock::now());
  const auto taken = answers->taken();
  if (left > milliseconds(0) && std::find(taken.begin(), taken.end(), true) != taken.end())
    static_cast<void>(reporting->finish(left));
  Handover handover{true, answers->taken()};
  // A daemon that took the place of the first meanwhile may have no storebag.
  if (reporting->state() == KYTReporting::State::noStorebag) handover.taken.assign(events.size(), false);
  if (!handover.isWhole()) problem_ = why();
  return handover;
}

}  // namespace kyt::sources
