// A real daemon in a process of its own, under a private root, for tests from outside.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/objects/Value.h"
#include "tests/support/Eventually.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {

class DaemonProcess {
 public:
  // An internal build whose storebags come from `storebags`, a base address ("http://127.0.0.1:1234").
  explicit DaemonProcess(const std::string& storebags) {
    writeSettings("[storebag]\ninternal_host = \"" + storebags + "\"\npublic_host = \"" + storebags +
                  "\"\n[log]\ntarget = \"stderr\"\n[service]\nidle_exit_seconds = 0.2\n");
    root_.write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\n");
    root_.write("etc/kytreportingd/entitlements.d/test.toml",
                "[[grant]]\nuser = " + std::to_string(::geteuid()) +
                    "\n\"com.vantu.private.kytreportingd\" = true\n");
    const std::string share = root_ / "usr/share/kytreporting";
    std::filesystem::create_directories(root_ / "usr/share");
    std::filesystem::copy(KYT_PACKAGING_SHARE, share, std::filesystem::copy_options::recursive);
    root_.write("usr/share/kytreporting/KYTReporting.bundle/publicKey.der", testPublicKey().view());
  }
  ~DaemonProcess() {
    if (child_ > 0) {
      ::kill(child_, SIGKILL);
      static_cast<void>(exitStatus());
    }
    if (listening_ >= 0) ::close(listening_);
  }
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  [[nodiscard]] const TemporaryFolder& root() const { return root_; }
  [[nodiscard]] std::string socketPath() const { return root_ / "run/kytreportingd/com.vantu.kytreportingd"; }
  // Memory that the process holds for itself alone; 0 when it is not running.
  [[nodiscard]] long anonymousKiB() const {
    std::ifstream status("/proc/" + std::to_string(child_) + "/status");
    for (std::string line; std::getline(status, line);)
      if (line.starts_with("RssAnon:")) return std::stol(line.substr(8));
    return 0;
  }
  [[nodiscard]] std::string log() const { return root_.read("log"); }
  [[nodiscard]] bool logged(std::string_view text) const { return log().find(text) != std::string::npos; }
  void writeSettings(const std::string& text) { root_.write("etc/kytreportingd/kytreportingd.toml", text); }
  void addSettings(const std::string& text) {
    writeSettings(root_.read("etc/kytreportingd/kytreportingd.toml") + text);
  }
  void setRoot(std::string root) { rootOption_ = std::move(root); }
  // Runs in the new process, before the daemon does: for its environment, its user.
  void setBeforeExecution(std::function<void()> work) { beforeExecution_ = std::move(work); }
  // A program and its arguments in front of the daemon's.
  void setLauncher(std::vector<std::string> launcher) { launcher_ = std::move(launcher); }
  void setProgram(std::string program) { program_ = std::move(program); }
  [[nodiscard]] pid_t process() const { return child_; }
  // Waits until a client has connected to the socket that nobody serves yet.
  [[nodiscard]] bool isWantedBySomeone() const {
    pollfd waiting = {listening_, POLLIN, 0};
    return ::poll(&waiting, 1, static_cast<int>(std::chrono::milliseconds(kTestDeadline).count())) == 1;
  }
  // As a service manager does: the daemon gets a listening socket at its usual place.
  void activateBySocket() {
    std::filesystem::create_directories(root_ / "run/kytreportingd");
    listening_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    socketPath().copy(address.sun_path, sizeof address.sun_path - 1);
    if (::bind(listening_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listening_, 16) != 0)
      std::abort();
  }

  void start(std::vector<std::string> arguments = {"--log-level", "debug"}) {
    arguments.insert(arguments.begin(),
                     {program_, "--root", rootOption_.empty() ? root_.path() : rootOption_});
    arguments.insert(arguments.begin(), launcher_.begin(), launcher_.end());
    std::vector<char*> raw;
    for (std::string& argument : arguments) raw.push_back(argument.data());
    raw.push_back(nullptr);
    const std::string logFile = root_.write("log", "");  // what an earlier process wrote is over
    child_ = ::fork();
    if (child_ != 0) return;
    const int out = ::open(logFile.c_str(), O_WRONLY | O_APPEND);
    ::dup2(out, 1);
    ::dup2(out, 2);
    if (listening_ >= 0) {
      ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
      ::setenv("LISTEN_FDS", "1", 1);
      if (listening_ == 3)
        ::fcntl(3, F_SETFD, 0);
      else
        ::dup2(listening_, 3);
    }
    if (beforeExecution_) beforeExecution_();
    ::execvp(raw[0], raw.data());
    ::_exit(127);
  }
  [[nodiscard]] bool startAndWait() {
    start();
    return eventually([this] { return logged("main: Listener resumes with sandbox, start loop."); });
  }
  void terminate(int signal = SIGTERM) const { ::kill(child_, signal); }
  [[nodiscard]] bool hasEnded() const {
    siginfo_t state = {};
    return ::waitid(P_PID, static_cast<id_t>(child_), &state, WEXITED | WNOHANG | WNOWAIT) != 0 ||
           state.si_pid == child_;
  }
  // Waits for the end, which is brought about after two minutes. -1: ended by a signal.
  [[nodiscard]] int exitStatus() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(2);
    while (!hasEnded() && std::chrono::steady_clock::now() < deadline)
      std::this_thread::sleep_for(std::chrono::microseconds(200));
    if (!hasEnded()) ::kill(child_, SIGKILL);
    int status = 0;
    while (::waitpid(child_, &status, 0) < 0 && errno == EINTR) {
    }
    child_ = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  TemporaryFolder root_;
  std::string rootOption_, program_ = KYT_DAEMON;
  std::vector<std::string> launcher_;
  std::function<void()> beforeExecution_;
  pid_t child_ = 0;
  int listening_ = -1;
};

}  // namespace kyt
