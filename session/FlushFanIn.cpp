#include "session/FlushFanIn.h"

#include <utility>

#include "platform/Platform.h"
#include "platform/queues/Log.h"
#include "session/MessageLog.h"

namespace kyt {

FlushFanIn::FlushFanIn(ReportingdSessionClass& sessionClass, uint32_t user, ResultReply completion,
                       int32_t outstandingBackends)
    : class_(sessionClass), user_(user), pending_(std::move(completion)), outstanding_(outstandingBackends) {}

void FlushFanIn::backendFinished(const String& key, const String& name, Value result,
                                 std::optional<Error> error) {
  class_.platform().log.debug("internalFlushMessagesWithCompletion: %s", name.c_str());
  if (!result.isNull()) class_.messageLog().writeToLogFile(user_, "[%@ -> flushMessages] %@", {key, result});
  ResultReply completion;
  {
    MutexLock lock(class_.lock());
    --outstanding_;
    if (pending_ && (error || outstanding_ < 1)) completion = std::move(pending_);
  }
  // Outside the lock: only one answer ever takes the completion, and writing a reply must not hold up other
  // sessions.
  if (completion) completion(std::move(result), std::move(error));
}

}  // namespace kyt
