#include "tools/kytctl/Answers.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/base/TextEscape.h"

namespace kyt::tools {

namespace {

constexpr char kSocketPath[] = "/run/kytreportingd/com.vantu.kytreportingd";

// Why nobody takes a connection there now, or 0.
int connectError(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return ENAMETOOLONG;
  std::memcpy(address.sun_path, path.data(), path.size());
  const int tried = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (tried < 0) return 0;
  const bool taken = ::connect(tried, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  const int why = errno;
  ::close(tried);
  return taken || why == EAGAIN ? 0 : why;  // EAGAIN: a daemon that has no time
}

}  // namespace

void Answer::set(std::string text, std::optional<Error> error) {
  const std::lock_guard lock(mutex_);
  if (set_) return;
  text_ = std::move(text);
  error_ = std::move(error);
  set_ = true;
  changed_.notify_all();
}

std::optional<std::pair<std::string, std::optional<Error>>> Answer::wait(double seconds) {
  std::unique_lock lock(mutex_);
  if (!changed_.wait_for(lock, std::chrono::duration<double>(seconds), [this] { return set_; }))
    return std::nullopt;
  return std::pair(text_, error_);
}

void Refusal::become(KYTReporting::State state, const std::string& why) {
  const std::lock_guard lock(mutex_);
  why_.reset();
  if (state != KYTReporting::State::refused) return;
  why_ = why;
  if (const auto call = call_.lock()) call->set({}, Error{{}, 0, why});
}

void Refusal::answers(const std::shared_ptr<Answer>& call) {
  const std::lock_guard lock(mutex_);
  call_ = call;
  if (why_) call->set({}, Error{{}, 0, *why_});
}

std::optional<std::string> Refusal::why() const {
  const std::lock_guard lock(mutex_);
  return why_;
}

std::string socketPath(const ConnectionOptions& connection) {
  if (!connection.socket.empty()) return connection.socket;
  if (!connection.root.empty()) return connection.root + kSocketPath;
  const char* chosen = std::getenv("KYTREPORTING_SOCKET");
  return chosen != nullptr && *chosen != '\0' ? chosen : kSocketPath;
}

std::optional<std::string> noDaemon(const ConnectionOptions& connection) {
  const std::string path = socketPath(connection);
  const int why = connectError(path);
  if (why == 0) return std::nullopt;
  return "no daemon listens at " + path + ": " + std::strerror(why);
}

bool nobodyListens(const ConnectionOptions& connection) {
  const int why = connectError(socketPath(connection));
  return why == ENOENT || why == ECONNREFUSED;
}

int failedCall(const ConnectionOptions& connection, const std::string& what, const std::string& text) {
  return failed(what + ": " + noDaemon(connection).value_or(text));
}

int report(const std::shared_ptr<Answer>& answer, const ConnectionOptions& connection,
           const std::string& what) {
  const auto said = answer->wait(connection.timeoutSeconds);
  if (!said) return failedCall(connection, what, "no answer in time");
  if (said->second) return failedCall(connection, what, said->second->localizedDescription);
  if (!said->first.empty()) std::printf("%s\n", escapedText(said->first).c_str());
  return 0;
}

std::string statesText(const std::optional<std::vector<std::string>>& states) {
  if (!states) return "no storebag";
  std::string text = "live:";
  for (const std::string& name : *states) text += " " + name;
  return text;
}

}  // namespace kyt::tools
