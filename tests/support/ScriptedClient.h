// A client process that a test leads step by step: kytctl running a session from its standard input. What it
// prints is read line by line, with a deadline. One thread.
#pragma once

#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tests/support/Eventually.h"

namespace kyt {

class ScriptedClient {
 public:
  // `arguments` are further ones of "kytctl session", such as "--socket", PATH. As another user only where
  // this process may become that user.
  ScriptedClient(const std::string& kytctl, std::vector<std::string> arguments,
                 std::optional<uid_t> user = std::nullopt) {
    arguments.insert(arguments.begin(), {kytctl, "session", "-"});
    std::vector<char*> raw;
    for (std::string& argument : arguments) raw.push_back(argument.data());
    raw.push_back(nullptr);
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return;
    pid_ = ::fork();
    if (pid_ == 0) {
      if (user && (::setgroups(0, nullptr) != 0 || ::setgid(*user) != 0 || ::setuid(*user) != 0))
        ::_exit(126);
      for (int fd = 0; fd < 3; ++fd) ::dup2(ends[1], fd);
      ::execv(raw[0], raw.data());
      ::_exit(127);
    }
    ::close(ends[1]);
    pipe_ = ends[0];
  }
  ~ScriptedClient() {
    kill();
    if (pipe_ >= 0) ::close(pipe_);
  }
  ScriptedClient(const ScriptedClient&) = delete;
  ScriptedClient& operator=(const ScriptedClient&) = delete;

  void step(std::string json) {
    json += '\n';
    static_cast<void>(::send(pipe_, json.data(), json.size(), MSG_NOSIGNAL));
  }
  // The next line of its output; "(nothing)" when none comes, "(the end)" when it has ended.
  std::string line(std::chrono::milliseconds patience = kTestDeadline) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
      if (const size_t end = unread_.find('\n'); end != std::string::npos) {
        std::string text = unread_.substr(0, end);
        unread_.erase(0, end + 1);
        return text;
      }
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      pollfd ready{pipe_, POLLIN, 0};
      const int polled = ::poll(&ready, 1, static_cast<int>(std::max<int64_t>(left.count(), 0)));
      if (polled < 0 && errno == EINTR) continue;
      if (polled <= 0) return "(nothing)";
      char buffer[4096];
      const ssize_t count = ::recv(pipe_, buffer, sizeof buffer, 0);
      if (count <= 0) return "(the end)";
      unread_.append(buffer, static_cast<size_t>(count));
    }
  }
  std::string ask(std::string json) {
    step(std::move(json));
    return line();
  }
  // No more steps: what it still prints, and its exit status in the last line.
  std::vector<std::string> end() {
    ::shutdown(pipe_, SHUT_WR);
    std::vector<std::string> lines;
    std::string text = line();
    for (; text != "(the end)" && text != "(nothing)"; text = line()) lines.push_back(std::move(text));
    if (text == "(nothing)") ::kill(pid_, SIGKILL);  // it hangs
    lines.push_back("status " + std::to_string(wait()));
    return lines;
  }
  // As a crash: no goodbye.
  void kill() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    wait();
  }
  [[nodiscard]] pid_t pid() const { return pid_; }

 private:
  int wait() {
    int status = -1;
    while (pid_ > 0 && ::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  pid_t pid_ = -1;
  int pipe_ = -1;
  std::string unread_;
};

}  // namespace kyt
