#include "tests/client/TestDaemon.h"

#include <gtest/gtest.h>

#include "platform/objects/Keys.h"
#include "tests/support/Eventually.h"

namespace kyt {

namespace {

std::string numberAt(const Dictionary& message, const char* key) {
  const Value* value = message.find(key);
  return value != nullptr ? description(*value) : "-";
}

class RecordingSession final : public ClientSessionInterface {
 public:
  explicit RecordingSession(std::shared_ptr<RecordedCalls> record) : record_(std::move(record)) {}

  void setSessionInfo(Dictionary info, std::optional<Dictionary> user, Value, bool aggregates) override {
    record_->add("SetSessionInfo " + numberAt(info, "SessionID") + (user ? " user" : "") +
                 (aggregates ? " aggregates" : ""));
  }
  void startConfigWithCompletionHandler(StatesReply reply) override {
    record_->add("StartConfig");
    if (record_->answersConfiguration) reply(record_->states);
  }
  void fetchStatesWithUserInfo(std::optional<Dictionary> user, StatesReply reply) override {
    record_->add(user ? "FetchStates " + numberAt(*user, "ClientName") : "FetchStates none");
    reply(std::nullopt);
  }
  void fetchDisplayURL(StringReply reply) override { reply("https://display"); }
  void sendMessageWithDictionary(Dictionary message, ObjectReply reply) override {
    {  // before the call is seen by whoever waits for it
      const std::lock_guard lock(record_->mutex);
      if (const Value* payload = message.find("Payload"); payload != nullptr && payload->isDictionary())
        record_->lastPayload = *payload->dictionary();
    }
    record_->add("Send " + numberAt(message, "Category") + " " + numberAt(message, "Type") + " " +
                 numberAt(message, "Flag"));
    if (reply) reply("posted");
  }
  void flushMessagesWithCompletion(ResultReply completion) override {
    record_->add("Flush");
    {
      const std::lock_guard lock(record_->mutex);
      if (record_->holdFlush) {
        record_->heldFlushes.push_back(std::move(completion));
        return;
      }
    }
    completion(Value(), Error{"SomeDomain", -1, "Nothing to flush"});
  }
  void finishSessionGracefully() override { record_->add("Finish"); }
  void uploadFileAtPath(String url, String, std::optional<FileExtension> extension,
                        SuccessReply reply) override {
    const bool both = extension && extension->file.get() >= 0 && extension->folder.get() >= 0;
    record_->add("Upload " + url.str() + (both ? " with descriptors" : ""));
    reply(true);
  }
  void uploadLogData(Value data, SuccessErrorReply reply) override {
    record_->add("LogData " + std::to_string(data.array() != nullptr ? data.array()->size() : 0));
    reply(false, std::nullopt);
  }
  void sendMessageWithSessionInfo(Dictionary, std::optional<Dictionary>, uint16_t category, uint16_t type,
                                  std::optional<Dictionary>, StringReply reply) override {
    record_->add("Single " + std::to_string(category) + " " + std::to_string(type));
    reply("finished");
  }
  void updateSharedDataWithDictionary(Dictionary data) override {
    record_->add("SharedData " + std::to_string(data.size()));
  }
  void updateSharedDataForKey(String key, Value value) override {
    record_->add("SharedData " + key.str() + "=" + description(value));
  }
  void setDigestKey(Data key, int32_t algorithm) override {
    record_->add("DigestKey " + std::string(key.view()) + " " + std::to_string(algorithm));
  }

 private:
  std::shared_ptr<RecordedCalls> record_;
};

}  // namespace

bool TestDaemon::start() {
  reactor_ = EpollReactor::create();
  pool_ = std::make_unique<WorkerPool>(WorkerPoolOptions{});
  auto acceptor = UnixSocketAcceptor::bindAt(path_);
  if (!reactor_ || acceptor.index() != 0) return false;
  server_ = std::make_unique<DBusServer>(
      DBusServerServices{limits_, counters_, log_, clock_, *reactor_, *pool_, *reactor_, *this, budget_,
                         "0123456789abcdef0123456789abcdef"},
      std::move(std::get<0>(acceptor)));
  server_->setDelegate(*this);
  server_->resume();
  return true;
}

void TestDaemon::stop() {
  if (!server_) return;
  server_->stopAccepting();
  server_->invalidateConnections();
  {
    const std::lock_guard lock(mutex_);
    connections_.clear();
    for (const auto& record : records_) {
      const std::lock_guard held(record->mutex);
      record->heldFlushes.clear();
    }
  }
  EXPECT_TRUE(eventually([this] { return server_->connectionCount() == 0; }));
  server_.reset();
  pool_->shutDown();
  reactor_->stop();
  pool_.reset();
  reactor_.reset();
}

bool TestDaemon::listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) {
  if (endings_.fetch_sub(1) > 0) return false;
  entitled_ = accepts_ && refusals_.fetch_sub(1) <= 0;
  if (!connection->entitlementValue(kEntitlement).boolValue()) return false;
  auto record = std::make_shared<RecordedCalls>();
  record->holdFlush = holdFlush_;
  record->answersConfiguration = answersConfigurations_;
  const std::lock_guard lock(mutex_);
  record->states = states_;
  connection->setExportedObject(std::make_shared<RecordingSession>(record));
  records_.push_back(std::move(record));
  connections_.push_back(connection);
  connection->resume();
  return true;
}

size_t TestDaemon::connections() const {
  const std::lock_guard lock(mutex_);
  return records_.size();
}

std::vector<std::string> TestDaemon::calls() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> out;
  for (const auto& record : records_) {
    const std::lock_guard held(record->mutex);
    out.insert(out.end(), record->calls.begin(), record->calls.end());
  }
  return out;
}

size_t TestDaemon::count(const std::string& prefix) const {
  size_t found = 0;
  for (const std::string& call : calls())
    if (call.starts_with(prefix)) ++found;
  return found;
}

Dictionary TestDaemon::lastPayload() const {
  const std::lock_guard lock(mutex_);
  if (records_.empty()) return {};
  const std::lock_guard held(records_.back()->mutex);
  return records_.back()->lastPayload;
}

void TestDaemon::sendToClient(std::optional<Dictionary> info, double timestamp, uint16_t category,
                              uint16_t type, std::optional<Dictionary> payload) {
  const std::lock_guard lock(mutex_);
  if (!connections_.empty())
    (void)connections_.back()->remoteObjectProxy().sendMessageToClient(std::move(info), timestamp, category,
                                                                       type, std::move(payload));
}

}  // namespace kyt
