// Who waits for the daemon's answer to a call, and that answer as it was read.
//
// Threads: one at a time. A completion runs where give() or fail() is called.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "kytreporting/KYTReporting.h"
#include "platform/ipc/Contract.h"

namespace kyt {
struct Message;
}

namespace kyt::client {

[[nodiscard]] Error clientError(ClientError code, std::string text);
// Of a reply that is an error.
[[nodiscard]] Error daemonError(const Message& message);

using StateNames = std::optional<std::vector<std::string>>;

// What a reply brings, in the types of the completions; true where the contract has nothing but the reply itself.
struct Reply {
  std::variant<bool, Value, std::string, StateNames> result = true;
  std::optional<Error> error;
};

// The reply to a call of that method; none when it has another form than the contract says.
[[nodiscard]] std::optional<Reply> readReply(wire::Method method, const Message& message);

// The completion of a call, which runs once at most; or nobody.
class Answer {
 public:
  Answer() = default;
  // An empty completion is nobody.
  template <typename Result>
  Answer(Function<void(Result, std::optional<Error>)> completion) {  // NOLINT(google-explicit-constructor)
    if (completion) completion_ = std::move(completion);
  }

  [[nodiscard]] bool isAwaited() const { return completion_.index() != 0; }
  // The reply has the type of the completion's method.
  void give(Reply reply);
  void fail(ClientError code, const std::string& text);

 private:
  std::variant<std::monostate, KYTReporting::StatesCompletion, KYTReporting::ObjectCompletion,
               KYTReporting::TextCompletion, KYTReporting::SuccessCompletion>
      completion_;
};

}  // namespace kyt::client
