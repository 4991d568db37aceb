// Folds the flush answers of a session's back ends into one: the first error, or, when none errs, the result
// of the back end that finishes last. Answers after that are logged and otherwise absorbed. There is no
// time-out.
//
// Answers come on any thread, several at once, and may come after the session has ended, so this holds all
// that they need and no session. Shared by the completions of one flush; the class outlives it.
#pragma once

#include <cstdint>
#include <optional>

#include "platform/base/Error.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/objects/Value.h"
#include "session/ReportingdSessionClass.h"

namespace kyt {

class FlushFanIn {
 public:
  // `user`: whose session it is.
  FlushFanIn(ReportingdSessionClass& sessionClass, uint32_t user, ResultReply completion,
             int32_t outstandingBackends);
  void backendFinished(const String& key, const String& name, Value result, std::optional<Error> error);

 private:
  ReportingdSessionClass& class_;
  const uint32_t user_;
  // Guarded by class_.lock(), one lock for the flushes of all sessions.
  ResultReply pending_ GUARDED_BY(class_.lock());
  int32_t outstanding_ GUARDED_BY(class_.lock());
};

}  // namespace kyt
