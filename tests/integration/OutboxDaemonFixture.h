// The built daemon with an outbox, and a server that takes, refuses or holds what comes, as the test says.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/Programs.h"
#include "tests/support/ReadFile.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
inline constexpr int kTorvel = 5;

class OutboxOfTheDaemon : public ::testing::Test {
 protected:
  OutboxOfTheDaemon() : daemon_(server_.url("")) {
    putBag(Array{entry("plain", server_.url("/events"))});
    server_.setHandler([this](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      const std::lock_guard lock(mutex_);
      if (request.method == "GET") {
        reply.body = document_;
        return reply;
      }
      reply.status = percentTaken_ > static_cast<int>(random_() % 100) ? 200 : 503;
      if (!retryAfter_.empty()) reply.headers.emplace_back("Retry-After", retryAfter_);
      if (breaksOff_) {
        reply.body = "half of it is sent";
        reply.behaviour = TestHTTPServer::Behaviour::stopMidBody;
      }
      if (holds_) reply.behaviour = TestHTTPServer::Behaviour::hold;
      const bool isTaken = reply.status == 200 && !holds_;
      ++(isTaken ? taken_ : failed_)[request.body];
      if (isTaken) takenIn_[request.body].push_back(life_);
      return reply;
    });
    daemon_.root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
    consent(true);
  }
  void TearDown() override {
    if (!started_) return;
    server_.release();
    end();
  }
  void settings(const std::string& more) {
    daemon_.writeSettings("[storebag]\ninternal_host = \"" + server_.url("") + "\"\npublic_host = \"" +
                          server_.url("") + "\"\n[log]\ntarget = \"stderr\"\n" + more);
  }
  void consent(bool isGiven) {
    daemon_.root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml",
                         std::string("consent = ") + (isGiven ? "true\n" : "false\n"));
  }
  static Dictionary entry(const std::string& client, const std::string& url) {
    return Dictionary{{"client", client},          {"locale_whitelist", Array{"DE"}}, {"filters", Array{}},
                      {"sampling_threshold", 1.0}, {"event_threshold", 1000},         {"post_url", url}};
  }
  // Before the daemon starts.
  void putBag(Array entries) {
    const Dictionary section{{"httppost", Dictionary{{"clients", std::move(entries)}}}};
    const std::lock_guard lock(mutex_);
    document_ = signedBag(Dictionary{{"version", "1"}, {"vantu_internal", section}}, propertyLists_);
  }
  void start() {
    nextLife();
    started_ = daemon_.startAndWait();
    ASSERT_TRUE(started_) << daemon_.log();
  }
  void nextLife() {
    const std::lock_guard lock(mutex_);
    ++life_;
  }
  void end() {
    started_ = false;
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  void kill() {
    started_ = false;
    daemon_.terminate(SIGKILL);
    EXPECT_EQ(daemon_.exitStatus(), -1);
  }
  void take(int percent) {
    const std::lock_guard lock(mutex_);
    percentTaken_ = percent;
  }
  // What its answers ask for; empty: nothing.
  void retryAfter(const std::string& value) {
    const std::lock_guard lock(mutex_);
    retryAfter_ = value;
  }
  void hold(bool holds) {
    const std::lock_guard lock(mutex_);
    holds_ = holds;
  }
  void breakOff(bool breaks) {
    const std::lock_guard lock(mutex_);
    breaksOff_ = breaks;
  }
  [[nodiscard]] std::map<std::string, int> taken() const {
    const std::lock_guard lock(mutex_);
    return taken_;
  }
  [[nodiscard]] std::map<std::string, int> failed() const {
    const std::lock_guard lock(mutex_);
    return failed_;
  }
  [[nodiscard]] std::map<std::string, std::vector<int>> takenIn() const {
    const std::lock_guard lock(mutex_);
    return takenIn_;
  }
  // The daemon has heard of each post that it kept.
  [[nodiscard]] bool isEmpty() const {
    return runProgram(std::string(KYT_PROGRAMS) + "/kytctl",
                      {"--root", daemon_.root().path(), "outbox", "list"})
               .text.find("Nothing waits in the outbox") != std::string::npos;
  }
  [[nodiscard]] std::string folder() const { return daemon_.root() / "var/lib/kytreportingd/outbox"; }
  [[nodiscard]] std::string ofProcess(const std::string& name) const {
    return readFile("/proc/" + std::to_string(daemon_.process()) + "/" + name);
  }
  [[nodiscard]] bool hasThread(const std::string& name) const {
    const std::string tasks = "/proc/" + std::to_string(daemon_.process()) + "/task";
    for (const auto& task : std::filesystem::directory_iterator(tasks)) {
      std::ifstream file(task.path() / "comm");
      std::string thread;
      if (std::getline(file, thread) && thread.starts_with(name)) return true;
    }
    return false;
  }

  mutable std::mutex mutex_;
  std::mt19937 random_{1};
  int percentTaken_ = 0;
  std::string retryAfter_;
  bool holds_ = false, breaksOff_ = false, started_ = false;
  std::string document_;
  std::map<std::string, int> taken_, failed_;        // bodies
  int life_ = 0;                                     // which daemon this is
  std::map<std::string, std::vector<int>> takenIn_;  // each body, in which lives
  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_;
};

inline constexpr char kOn[] = "[outbox]\nenabled = true\n";

}  // namespace kyt
