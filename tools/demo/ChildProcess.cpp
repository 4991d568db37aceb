#include "tools/demo/ChildProcess.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <thread>

extern char** environ;

namespace kyt::tools {

namespace {

constexpr char kNothing[] = "/dev/null";

// As an ordinary child. The result is as posix_spawnp's.
int spawn(const char* program, char* const* arguments, char* const* environment,
          const ChildProcess::Options& options, pid_t& pid) {
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(
      &actions, STDIN_FILENO, options.inputFile.empty() ? kNothing : options.inputFile.c_str(), O_RDONLY, 0);
  if (!options.outputFile.empty()) {
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, options.outputFile.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
  }
  const int result = posix_spawnp(&pid, program, &actions, nullptr, arguments, environment);
  posix_spawn_file_actions_destroy(&actions);
  return result;
}

// As another user, who need not be able to reach the program: it is opened before the change. The child's files are
// opened before it too. Between fork and exec only what a child of a program with threads may call.
int spawnAs(const User& user, const char* program, char* const* arguments, char* const* environment,
            const ChildProcess::Options& options, pid_t& pid) {
  const int file = open(program, O_RDONLY | O_CLOEXEC);
  if (file < 0) return errno;
  int failed[2];
  if (pipe2(failed, O_CLOEXEC) != 0) {
    const int error = errno;
    close(file);
    return error;
  }
  const char* in = options.inputFile.empty() ? kNothing : options.inputFile.c_str();
  const char* out = options.outputFile.empty() ? nullptr : options.outputFile.c_str();
  pid = fork();
  if (pid == 0) {
    const int input = open(in, O_RDONLY);
    const int output = out == nullptr ? STDOUT_FILENO : open(out, O_WRONLY | O_CREAT | O_APPEND, 0644);
    if (input >= 0 && output >= 0 && dup2(input, STDIN_FILENO) >= 0 &&
        (out == nullptr || (dup2(output, STDOUT_FILENO) >= 0 && dup2(output, STDERR_FILENO) >= 0)) &&
        setgroups(0, nullptr) == 0 && setresgid(user.group, user.group, user.group) == 0 &&
        setresuid(user.user, user.user, user.user) == 0)
      fexecve(file, arguments, environment);
    const int error = errno;
    (void)!write(failed[1], &error, sizeof error);
    _exit(127);
  }
  int error = pid < 0 ? errno : 0;
  close(failed[1]);
  if (pid > 0 && read(failed[0], &error, sizeof error) == sizeof error) waitpid(pid, nullptr, 0);
  close(failed[0]);
  close(file);
  return error;
}

}  // namespace

std::optional<User> User::of(const std::string& name) {
  if (const passwd* entry = getpwnam(name.c_str())) return User{name, entry->pw_uid, entry->pw_gid};
  if (name.empty() || name.size() > 9 || name.find_first_not_of("0123456789") != std::string::npos)
    return std::nullopt;
  const auto number = static_cast<uid_t>(std::strtoul(name.c_str(), nullptr, 10));
  return User{name, number, number};
}

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

  pid_t pid = -1;
  const int result = options.user
                         ? spawnAs(*options.user, program.c_str(), argv.data(), envp.data(), options, pid)
                         : spawn(program.c_str(), argv.data(), envp.data(), options, pid);
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
