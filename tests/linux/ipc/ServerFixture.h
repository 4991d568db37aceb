// A whole IPC server on a socket in a temporary folder, with the real reactor and worker pool and a session
// that records its calls.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/DBusServer.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/queues/Log.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"
#include "tests/support/PlainClient.h"

namespace kyt::test {

inline constexpr const char* kMachineId = "00112233445566778899aabbccddeeff";

// Records what is called, and answers at once, or never when `holding`.
class RecordingSession final : public ClientSessionInterface {
 public:
  explicit RecordingSession(std::shared_ptr<Connection> connection) : connection_(std::move(connection)) {}
  void setSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo, Value frameworks,
                      bool aggregation) override {
    note("setSessionInfo " + description(sessionInfo) + " " + (userInfo ? description(*userInfo) : "none") +
         " " + description(frameworks) + (aggregation ? " yes" : " no"));
  }
  void startConfigWithCompletionHandler(StatesReply reply) override {
    note("startConfig");
    answerOrHold(std::move(reply), std::optional<Array>(Array{"httppost", "dashboard"}));
  }
  void fetchStatesWithUserInfo(std::optional<Dictionary> userInfo, StatesReply reply) override {
    note("fetchStates " + (userInfo ? description(*userInfo) : std::string("none")));
    answerOrHold(std::move(reply), std::optional<Array>());
  }
  void fetchDisplayURL(StringReply reply) override {
    note("fetchDisplayURL");
    answerOrHold(std::move(reply), String(std::string(displayURLBytes, 'u')));
  }
  void sendMessageWithDictionary(Dictionary message, ObjectReply reply) override {
    ++events;
    note("sendMessage " + description(message) + (reply ? " replies" : ""));
    if (dropsReplies) return;
    if (reply) answerOrHold(std::move(reply), Value(message));
  }
  void flushMessagesWithCompletion(ResultReply completion) override {
    note("flush");
    completion(Value(true), Error{"domain", 7, "text"});
  }
  void finishSessionGracefully() override { note("finish"); }
  void uploadFileAtPath(String fileURL, String token, std::optional<FileExtension> extension,
                        SuccessReply reply) override {
    std::string contents = "none";
    if (extension) {
      char buffer[64];
      const ssize_t count = ::pread(extension->file.get(), buffer, sizeof buffer, 0);
      contents.assign(buffer, count < 0 ? 0 : static_cast<size_t>(count));
    }
    note("upload " + fileURL.str() + " " + token.str() + " " + contents);
    reply(extension.has_value());
  }
  void uploadLogData(Value logData, SuccessErrorReply reply) override {
    note("uploadLogData " + description(logData));
    reply(false, Error{"domain", -1, "no"});
  }
  void sendMessageWithSessionInfo(Dictionary sessionInfo, std::optional<Dictionary>, uint16_t category,
                                  uint16_t type, std::optional<Dictionary> payload,
                                  StringReply reply) override {
    note("sendWithInfo " + description(sessionInfo) + " " + std::to_string(category) + " " +
         std::to_string(type) + " " + (payload ? description(*payload) : "none"));
    reply("status");
  }
  void updateSharedDataWithDictionary(Dictionary sharedData) override {
    note("shared " + description(sharedData));
  }
  void updateSharedDataForKey(String key, Value value) override {
    note("sharedKey " + key.str() + " " + description(value));
  }
  void setDigestKey(Data key, int32_t algorithm) override {
    note("digest " + std::string(key.view()) + " " + std::to_string(algorithm));
  }

  void note(std::string text) {
    MutexLock lock(mutex_);
    notes_.push_back(std::move(text));
  }
  [[nodiscard]] std::vector<std::string> notes() {
    MutexLock lock(mutex_);
    return notes_;
  }
  [[nodiscard]] bool has(const std::string& text) {
    for (const std::string& note : notes()) {
      if (note == text) return true;
    }
    return false;
  }
  Connection& connection() { return *connection_; }

  std::atomic<int> events{0};
  std::atomic<bool> dropsReplies{false};
  std::atomic<size_t> displayURLBytes{12};

 private:
  template <typename Reply, typename Answer>
  void answerOrHold(Reply reply, Answer answer) {
    reply(std::move(answer));
  }
  Mutex mutex_;
  std::vector<std::string> notes_ GUARDED_BY(mutex_);
  std::shared_ptr<Connection> connection_;
};

class FixedEntitlements final : public Entitlements {
 public:
  std::atomic<bool> entitled{true};
  Value valueFor(const PeerCredentials& peer, std::string_view key) override {
    return key == "com.vantu.private.kytreportingd" && peer.uid == ::getuid() ? Value(entitled.load())
                                                                              : Value();
  }
};

class Server final : public ListenerDelegate {
 public:
  explicit Server(Limits given = {})
      : limits(given), budget(UserShares::of(given, uint64_t{1} << 30, 65536)) {
    char name[] = "/tmp/kyt-ipc-XXXXXX";
    folder = ::mkdtemp(name);
    path = folder + "/socket";
    reactor = EpollReactor::create();
    auto bound = UnixSocketAcceptor::bindAt(path);
    listener = std::make_unique<DBusServer>(DBusServerServices{limits, counters, log, clock, *reactor, pool,
                                                               *reactor, entitlements, budget, kMachineId},
                                            std::move(std::get<0>(bound)));
    listener->setDelegate(*this);
    listener->resume();
  }
  ~Server() override {
    listener->stopAccepting();
    listener->invalidateConnections();
    EXPECT_TRUE(eventually([&] { return listener->connectionCount() == 0; }));
    reactor->stop();
    pool.shutDown();
    listener.reset();
    std::filesystem::remove_all(folder);
  }
  bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) override {
    if (ending) return false;
    const bool entitled = connection->entitlementValue("com.vantu.private.kytreportingd").boolValue();
    log.debug("offered: %s", connection->description().c_str());
    if (!entitled) return false;
    auto session = std::make_shared<RecordingSession>(connection);
    connection->setExportedObject(session);
    connection->setInterruptionHandler([session] { session->note("interrupted"); });
    connection->setInvalidationHandler([this, session] {
      session->note("invalidated");
      ++invalidations;
    });
    connection->resume();
    MutexLock lock(mutex_);
    sessions_.push_back(session);
    if (keepsNothing) sessions_.clear();
    ++accepted;
    return true;
  }
  // The session of the n-th accepted connection; waits for it.
  std::shared_ptr<RecordingSession> session(size_t index = 0) {
    std::shared_ptr<RecordingSession> found;
    EXPECT_TRUE(eventually([&] {
      MutexLock lock(mutex_);
      if (sessions_.size() <= index) return false;
      found = sessions_[index];
      return true;
    }));
    return found;
  }
  [[nodiscard]] uint64_t counted(Reason reason) const { return counters.value(reason); }

  const Limits limits;
  UserBudget budget;
  std::string folder, path;
  Counters counters;
  MemoryLogSink sink;
  Log log{sink, LogLevel::debug};
  LinuxClock clock;
  FixedEntitlements entitlements;
  std::atomic<int> accepted{0}, invalidations{0};
  std::atomic<bool> keepsNothing{false};
  std::atomic<bool> ending{false};  // takes nobody any more
  WorkerPool pool{WorkerPoolOptions{}};
  std::unique_ptr<EpollReactor> reactor;
  std::unique_ptr<DBusServer> listener;

 private:
  Mutex mutex_;
  std::vector<std::shared_ptr<RecordingSession>> sessions_ GUARDED_BY(mutex_);
};

inline size_t openDescriptors() {
  size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    (void)entry;
    ++count;
  }
  return count;
}

}  // namespace kyt::test
