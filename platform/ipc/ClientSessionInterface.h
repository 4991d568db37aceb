// The two protocols of the IPC service, as the daemon's code sees them: what a client calls on its session,
// and the one operation that the daemon calls on its client. The wire form is the D-Bus interface description
// in docs/com.vantu.kytreportingd.xml; platform/ipc/ translates.
//
// All operations of ClientSessionInterface are called on the connection's serial IPC queue, one at a time.
// Each reply may be called from any thread, at once or later, exactly once; one that is dropped uncalled
// answers the client with an error. Arguments are the callee's own.
#pragma once

#include <cstdint>
#include <optional>
#include <utility>

#include "platform/FileExtension.h"
#include "platform/base/Descriptor.h"
#include "platform/base/Error.h"
#include "platform/base/Function.h"
#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"

namespace kyt {

using StatesReply = Function<void(std::optional<Array>)>;  // back-end names, or none
using StringReply = Function<void(String)>;
using ObjectReply = Function<void(Value)>;  // null: none
using ResultReply = Function<void(Value, std::optional<Error>)>;
using SuccessReply = Function<void(bool)>;
using SuccessErrorReply = Function<void(bool, std::optional<Error>)>;

class ClientSessionInterface : public ExportedObject {
 public:
  virtual void setSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo,
                              Value frameworksToCheck, bool hasAggregationBlock) = 0;
  virtual void startConfigWithCompletionHandler(StatesReply reply) = 0;
  virtual void fetchStatesWithUserInfo(std::optional<Dictionary> userInfo, StatesReply reply) = 0;
  virtual void fetchDisplayURL(StringReply reply) = 0;
  // `reply` is empty when the caller expects none.
  virtual void sendMessageWithDictionary(Dictionary message, ObjectReply reply) = 0;
  virtual void flushMessagesWithCompletion(ResultReply completion) = 0;
  virtual void finishSessionGracefully() = 0;
  virtual void uploadFileAtPath(String fileURL, String extensionToken, std::optional<FileExtension> extension,
                                SuccessReply completionHandler) = 0;
  virtual void uploadLogData(Value logData, SuccessErrorReply completionHandler) = 0;
  virtual void sendMessageWithSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo,
                                          uint16_t category, uint16_t type, std::optional<Dictionary> payload,
                                          StringReply reply) = 0;
  virtual void updateSharedDataWithDictionary(Dictionary sharedData) = 0;
  virtual void updateSharedDataForKey(String key, Value value) = 0;  // null: none
  virtual void setDigestKey(Data key, int32_t algorithm) = 0;
};

// The remote object proxy of one connection. Callable from any thread; never blocks.
class ClientSessionReplyInterface {
 public:
  virtual ~ClientSessionReplyInterface() = default;
  // One way. An error means that the message cannot reach the client (it is gone, or the message is too
  // large). One that is dropped because the client reads too slowly is counted there, and is no error: there
  // may be thousands a second, and each error is a log line. The all-zero message without objects, which ends an
  // aggregation, is never dropped.
  [[nodiscard]] virtual std::optional<Error> sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                                 double timestamp, uint16_t category,
                                                                 uint16_t type,
                                                                 std::optional<Dictionary> payload) = 0;
};

}  // namespace kyt
