#include "testing/Aggregators.h"

#include <chrono>
#include <utility>

#include "platform/ipc/ClientSessionInterface.h"
#include "platform/objects/Keys.h"

namespace kyt::testing {

void Aggregators::add(const Event& session, std::weak_ptr<Connection> connection) {
  Member member;
  member.info = session.sessionInfo;
  if (session.userInfo) member.info.merge(*session.userInfo);
  if (const Dictionary* place = session.sessionInfo.dictionary(kKYTReportingSessionInfoHierarchyToken)) {
    const String* token = place->string(kKYTReportingHierarchyTokenTokenID);
    member.token = token != nullptr ? token->str() : std::string();
    member.level = place->unsignedInteger(kKYTReportingHierarchyTokenLevel);
  }
  member.aggregates = session.aggregates;
  member.connection = std::move(connection);
  MutexLock lock(mutex_);
  members_[session.connection] = std::move(member);
}

void Aggregators::remove(uint64_t connection) {
  MutexLock lock(mutex_);
  members_.erase(connection);
}

const Aggregators::Member* Aggregators::aggregatorOf(const Member& sender) const {
  const Member* found = sender.aggregates ? &sender : nullptr;
  if (sender.token.empty()) return found;
  for (const auto& [number, member] : members_) {
    if (!member.aggregates || member.token != sender.token || member.level >= sender.level) continue;
    if (found == nullptr || member.level < found->level) found = &member;
  }
  return found;
}

void Aggregators::offer(const Event& message) {
  std::shared_ptr<Connection> to;
  Dictionary info;
  {
    MutexLock lock(mutex_);
    const auto sender = members_.find(message.connection);
    if (sender == members_.end()) return;
    const Member* aggregator = aggregatorOf(sender->second);
    if (aggregator == nullptr) return;
    to = aggregator->connection.lock();
    info = sender->second.info;
  }
  if (!to) return;
  const std::chrono::duration<double> now = std::chrono::system_clock::now().time_since_epoch();
  // An error says that it is gone: nobody is left to tell.
  (void)to->remoteObjectProxy().sendMessageToClient(std::move(info), now.count(), message.category,
                                                    message.type, message.payload);
}

}  // namespace kyt::testing
