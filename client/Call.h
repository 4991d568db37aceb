// A call to the daemon: which, with what, and who waits for the answer. Made by the public operations on any thread,
// written and answered on the library's thread.
//
// Ownership: a call owns its arguments; descriptors are closed with it, or when they have been sent.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "client/Answer.h"
#include "platform/base/Descriptor.h"
#include "platform/ipc/Contract.h"
#include "platform/objects/Value.h"

namespace kyt {
class MessageWriter;
}

namespace kyt::client {

using wire::Method;

struct MessageArguments {
  uint16_t category = 0, type = 0;
  uint32_t flag = 0;
  Dictionary payload;
};
// Who a session is.
struct IdentityArguments {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  Value frameworks;
  bool aggregates = false;
};
struct SingleMessageArguments {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  uint16_t category = 0, type = 0;
  std::optional<Dictionary> payload;
};
struct UserInfoArguments {
  std::optional<Dictionary> userInfo;
};
struct SharedDataArguments {
  Dictionary entries;
};
struct SharedDataForKeyArguments {
  String key;
  Value value;  // null: removes the key
};
struct DigestKeyArguments {
  Data key;
  int32_t algorithm = 0;
};
struct UploadFileArguments {
  std::string fileURL;
  std::vector<Descriptor> extension;  // the open file, then its folder
};
struct UploadLogDataArguments {
  Array logData;
};
using Arguments = std::variant<std::monostate, MessageArguments, IdentityArguments, SingleMessageArguments,
                               UserInfoArguments, SharedDataArguments, SharedDataForKeyArguments,
                               DigestKeyArguments, UploadFileArguments, UploadLogDataArguments>;

struct Call {
  Method method;
  Arguments arguments = {};
  Answer answer = {};
};

// Writes the arguments of a call that was begun; `descriptors`: how many leave with it.
void writeArguments(MessageWriter& out, const Arguments& arguments, uint32_t descriptors);
void writeArguments(MessageWriter& out, const MessageArguments& arguments);

}  // namespace kyt::client
