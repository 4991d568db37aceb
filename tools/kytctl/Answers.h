// What kytctl's commands that talk to the daemon have in common: where it listens, the wait for its answer, and why
// there is none.
#pragma once

#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "kytreporting/KYTReporting.h"
#include "platform/base/Error.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

// What a completion said, waited for by the command's own thread. Shared: the completion may come after the
// time-out. What is said first stands.
class Answer {
 public:
  void set(std::string text, std::optional<Error> error);
  // None after `seconds` without an answer.
  [[nodiscard]] std::optional<std::pair<std::string, std::optional<Error>>> wait(double seconds);

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::string text_;
  std::optional<Error> error_;
  bool set_ = false;
};

// What a session's calls wait for besides their answers: that the daemon refuses them. The library goes on trying, since
// a grant may come; a command says so instead and ends. The state comes on the library's thread.
class Refusal {
 public:
  void become(KYTReporting::State state, const std::string& why);
  // From now on a refusal is this call's answer. It is at once, if the daemon refuses already.
  void answers(const std::shared_ptr<Answer>& call);
  // Why it refuses now, or none.
  [[nodiscard]] std::optional<std::string> why() const;

 private:
  mutable std::mutex mutex_;
  std::optional<std::string> why_;
  std::weak_ptr<Answer> call_;
};

// The socket that is meant: --socket, below --root, the environment's KYTREPORTING_SOCKET, or the fixed one.
[[nodiscard]] std::string socketPath(const ConnectionOptions& connection);

// "no daemon listens at PATH: REASON" when nobody takes a connection there now, or none.
[[nodiscard]] std::optional<std::string> noDaemon(const ConnectionOptions& connection);

// Whether nobody could listen there: the socket or its folder is missing, or nobody has it open. What stands in the way
// otherwise (a folder that may not be entered, a path that is too long) is a wrong installation.
[[nodiscard]] bool nobodyListens(const ConnectionOptions& connection);

// Says that `what` failed, and why; returns 1. The text stands unless nobody listens.
int failedCall(const ConnectionOptions& connection, const std::string& what, const std::string& text);

// Waits, and prints the answer; 0 when there was one. Texts that are empty are not printed.
int report(const std::shared_ptr<Answer>& answer, const ConnectionOptions& connection,
           const std::string& what);

// "no storebag", or "live:" and the names.
[[nodiscard]] std::string statesText(const std::optional<std::vector<std::string>>& states);

}  // namespace kyt::tools
