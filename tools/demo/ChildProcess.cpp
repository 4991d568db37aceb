#include "tools/demo/ChildProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <thread>

extern char** environ;

namespace kyt::tools {

ChildProcess::ChildProcess(ChildProcess&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)), status_(other.status_) {}

ChildProcess& ChildProcess::operator=(ChildProcess&& other) noexcept {
  std::swap(pid_, other.pid_);
  std::swap(status_, other.status_);
  return *this;
}

ChildProcess::~ChildProcess() {
  if (pid_ < 0 || status_) return;
  signal(SIGTERM);
  if (wait(std::chrono::seconds(5))) return;
  signal(SIGKILL);
  (void)wait(std::chrono::seconds(5));
}

std::optional<ChildProcess> ChildProcess::start(const std::string& program,
                                                const std::vector<std::string>& arguments,
                                                const Options& options) {
  std::vector<std::string> environment;
  for (char** entry = environ; *entry != nullptr; ++entry) environment.emplace_back(*entry);
  for (const auto& [name, value] : options.environment) {
    std::erase_if(environment,
                  [prefix = name + "="](const std::string& text) { return text.starts_with(prefix); });
    environment.push_back(name + "=" + value);
  }
  std::vector<char*> argv{const_cast<char*>(program.c_str())}, envp;
  for (const std::string& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
  for (const std::string& entry : environment) envp.push_back(const_cast<char*>(entry.c_str()));
  argv.push_back(nullptr);
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  const std::string input = options.inputFile.empty() ? "/dev/null" : options.inputFile;
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, input.c_str(), O_RDONLY, 0);
  if (!options.outputFile.empty()) {
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, options.outputFile.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
  }
  pid_t pid = -1;
  const int result = posix_spawnp(&pid, program.c_str(), &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  if (result != 0) {
    errno = result;
    return std::nullopt;
  }
  ChildProcess child;
  child.pid_ = pid;
  return child;
}

void ChildProcess::signal(int number) const {
  if (pid_ > 0 && !status_) kill(pid_, number);
}

std::optional<int> ChildProcess::wait(std::chrono::milliseconds timeout) {
  if (status_ || pid_ < 0) return status_;
  (void)waitUntil(timeout, [this] {
    int status = 0;
    const pid_t ended = waitpid(pid_, &status, WNOHANG);
    if (ended == pid_) status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    if (ended < 0 && errno != EINTR) status_ = -1;
    return status_.has_value();
  });
  return status_;
}

void briefPause() {
  std::this_thread::sleep_for(std::chrono::milliseconds(5));
}

}  // namespace kyt::tools
