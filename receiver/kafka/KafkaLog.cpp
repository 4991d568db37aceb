#include "receiver/kafka/KafkaLog.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <utility>
#include <variant>

#include "platform/base/TextEscape.h"
#include "platform/linux/base/Threads.h"
#include "platform/linux/files/Files.h"

namespace kyt::receiver {
namespace {

constexpr char kDeadTopic[] = "kyt-dead-letters";
constexpr int64_t kMaxMessageBytes = int64_t{20} << 20;
constexpr uint64_t kHeaderRoom = 8192;
constexpr size_t kMaxCredentialBytes = 65536;
constexpr int kPollMilliseconds = 50, kLookMilliseconds = 500;
constexpr int kRaised = 3;  // the level of errors among those of syslog

using Configuration = std::unique_ptr<rd_kafka_conf_t, void (*)(rd_kafka_conf_t*)>;

std::optional<std::string> set(const Configuration& configuration, const std::string& name,
                               const std::string& value) {
  std::array<char, 512> wrong{};
  if (rd_kafka_conf_set(configuration.get(), name.c_str(), value.c_str(), wrong.data(), wrong.size()) ==
      RD_KAFKA_CONF_OK)
    return std::nullopt;
  return std::string(wrong.data());
}

// The library's own settings, such as "sasl.username", one "NAME=VALUE" a line; empty lines and those with "#" count for
// nothing.
std::optional<std::string> setFromFile(const Configuration& configuration, const std::string& file) {
  const auto read = readRegularFile(file, kMaxCredentialBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&read)) return file + ": " + wrong->text;
  std::string_view left = std::get<FileContents>(read).bytes;
  for (int number = 1; !left.empty(); ++number) {
    const std::string_view line = left.substr(0, left.find('\n'));
    left.remove_prefix(std::min(line.size() + 1, left.size()));
    if (line.empty() || line.front() == '#') continue;
    const size_t sign = line.find('=');
    const std::string where = file + ":" + std::to_string(number) + ": ";
    if (sign == std::string_view::npos) return where + "a line must be NAME=VALUE";
    if (auto wrong =
            set(configuration, std::string(line.substr(0, sign)), std::string(line.substr(sign + 1))))
      return where + *wrong;
  }
  return std::nullopt;
}

}  // namespace

KafkaLog::KafkaLog(const LogSettings& settings, Log& lines) : settings_(settings), lines_(lines) {}

KafkaLog::~KafkaLog() {
  KafkaLog::stop();
}

std::optional<std::string> KafkaLog::open() {
  Configuration configuration(rd_kafka_conf_new(), rd_kafka_conf_destroy);
  std::string servers;
  for (const std::string& server : settings_.servers) servers += (servers.empty() ? "" : ",") + server;
  const std::pair<const char*, std::string> settings[] = {
      {"bootstrap.servers", servers},
      {"client.id", "kytreceiver"},
      {"acks", "all"},
      // Not idempotent: the library gives such a producer up for good when a broker has lost its place in the order. It
      // would remove the repeats of its own attempts; those of devices and of the spool come all the same.
      {"enable.idempotence", "false"},
      {"message.max.bytes", std::to_string(kMaxMessageBytes)},
      // A post whose time is over is in the spool; the library need not try it much longer.
      {"message.timeout.ms", std::to_string(settings_.publishTime.count() + 3000)},
      {"linger.ms", "1"},
      {"reconnect.backoff.max.ms", "1000"},
      {"queue.buffering.max.kbytes", "524288"}};
  for (const auto& [name, value] : settings)
    if (auto wrong = set(configuration, name, value)) return wrong;
  if (!settings_.caFile.empty()) {
    if (auto wrong = set(configuration, "security.protocol", "ssl")) return wrong;
    if (auto wrong = set(configuration, "ssl.ca.location", settings_.caFile)) return wrong;
  }
  if (!settings_.credentials.empty())
    if (auto wrong = setFromFile(configuration, settings_.credentials)) return wrong;
  rd_kafka_conf_set_opaque(configuration.get(), this);
  rd_kafka_conf_set_dr_msg_cb(configuration.get(), &KafkaLog::onDelivery);
  rd_kafka_conf_set_error_cb(configuration.get(), &KafkaLog::onError);
  rd_kafka_conf_set_log_cb(configuration.get(), &KafkaLog::onLine);
  std::array<char, 512> wrong{};
  client_.reset(rd_kafka_new(RD_KAFKA_PRODUCER, configuration.get(), wrong.data(), wrong.size()));
  if (!client_) return std::string(wrong.data());
  static_cast<void>(configuration.release());  // the client has it now
  return std::nullopt;
}

void KafkaLog::start(LogListener& listener) {
  listener_ = &listener;
  thread_ = std::thread([this] { run(); });
}

std::optional<uint64_t> KafkaLog::maxBodyBytes() const {
  return kMaxMessageBytes - kHeaderRoom;
}

rd_kafka_resp_err_t KafkaLog::produce(const char* topic, int32_t partition, uint64_t token,
                                      const LogMessage& message) {
  rd_kafka_headers_t* headers = rd_kafka_headers_new(message.headers.size());
  for (const auto& [name, value] : message.headers)
    rd_kafka_header_add(headers, name.c_str(), static_cast<ssize_t>(name.size()), value.data(),
                        static_cast<ssize_t>(value.size()));
  // NOLINTNEXTLINE(performance-no-int-to-ptr): the library carries it along and never looks at it
  void* opaque = reinterpret_cast<void*>(static_cast<uintptr_t>(token));
  std::array<rd_kafka_vu_t, 7> parts{};
  parts[0].vtype = RD_KAFKA_VTYPE_TOPIC;
  parts[0].u.cstr = topic;
  parts[1].vtype = RD_KAFKA_VTYPE_PARTITION;
  parts[1].u.i32 = partition;
  parts[2].vtype = RD_KAFKA_VTYPE_MSGFLAGS;
  parts[2].u.i = RD_KAFKA_MSG_F_COPY;
  parts[3].vtype = RD_KAFKA_VTYPE_KEY;
  parts[3].u.mem = {const_cast<char*>(message.id.data()), message.id.size()};
  parts[4].vtype = RD_KAFKA_VTYPE_VALUE;
  parts[4].u.mem = {const_cast<char*>(message.body.data()), message.body.size()};
  parts[5].vtype = RD_KAFKA_VTYPE_HEADERS;
  parts[5].u.headers = headers;
  parts[6].vtype = RD_KAFKA_VTYPE_OPAQUE;
  parts[6].u.ptr = opaque;
  rd_kafka_error_t* error = rd_kafka_produceva(client_.get(), parts.data(), parts.size());
  if (error == nullptr) return RD_KAFKA_RESP_ERR_NO_ERROR;
  const rd_kafka_resp_err_t code = rd_kafka_error_code(error);
  rd_kafka_error_destroy(error);
  rd_kafka_headers_destroy(headers);  // the library takes them with a message alone
  return code;
}

void KafkaLog::publish(uint64_t token, std::shared_ptr<const LogMessage> message) {
  const auto partition = static_cast<int32_t>(partitionOf(message->id, settings_.partitions));
  const rd_kafka_resp_err_t error = produce(settings_.stream.c_str(), partition, token, *message);
  if (error == RD_KAFKA_RESP_ERR_NO_ERROR) return;
  const bool isForGood = error == RD_KAFKA_RESP_ERR_MSG_SIZE_TOO_LARGE;
  listener_->logAnswered(
      token, {isForGood ? LogVerdict::refusedForGood : LogVerdict::refused, rd_kafka_err2str(error)});
}

void KafkaLog::publishDeadLetter(std::shared_ptr<const LogMessage> message) {
  if (!isThere_ || produce(kDeadTopic, RD_KAFKA_PARTITION_UA, 0, *message) != RD_KAFKA_RESP_ERR_NO_ERROR)
    listener_->deadLetterAnswered(false);
}

void KafkaLog::onDelivery(rd_kafka_t* /*client*/, const rd_kafka_message_t* message, void* self) {
  auto& log = *static_cast<KafkaLog*>(self);
  const auto token = static_cast<uint64_t>(reinterpret_cast<uintptr_t>(message->_private));
  if (log.isStopping_) return;
  if (token == 0) return log.listener_->deadLetterAnswered(message->err == RD_KAFKA_RESP_ERR_NO_ERROR);
  LogAnswer answer{LogVerdict::stored, {}};
  if (message->err == RD_KAFKA_RESP_ERR_MSG_SIZE_TOO_LARGE)
    answer = {LogVerdict::refusedForGood, rd_kafka_err2str(message->err)};
  else if (message->err != RD_KAFKA_RESP_ERR_NO_ERROR)
    answer = {LogVerdict::refused, rd_kafka_err2str(message->err)};
  log.listener_->logAnswered(token, answer);
}

void KafkaLog::onError(rd_kafka_t* client, int error, const char* reason, void* self) {
  auto& log = *static_cast<KafkaLog*>(self);
  if (error != RD_KAFKA_RESP_ERR__ALL_BROKERS_DOWN) return;
  log.lines_.error("log: %s", escapedText(reason).c_str());
  // What is not on its way is in the spool at once; the library would send it a second time.
  rd_kafka_purge(client, RD_KAFKA_PURGE_F_QUEUE);
  log.setUp(false);
}

void KafkaLog::onLine(const rd_kafka_t* client, int level, const char* facility, const char* text) {
  auto& log = *static_cast<KafkaLog*>(rd_kafka_opaque(client));
  if (level <= kRaised)
    log.lines_.error("log: %s: %s", escapedText(facility).c_str(), escapedText(text).c_str());
  else
    log.lines_.debug("log: %s: %s", escapedText(facility).c_str(), escapedText(text).c_str());
}

void KafkaLog::setUp(bool isUp) {
  MutexLock lock(upMutex_);
  isThere_ = isUp;
  if (!isStopping_ && std::exchange(isUp_, isUp) != isUp) listener_->logIsUp(isUp);
}

// Whether the topic is there, and each of its partitions that is used has a leader.
void KafkaLog::look() {
  rd_kafka_topic_t* topic = rd_kafka_topic_new(client_.get(), settings_.stream.c_str(), nullptr);
  const rd_kafka_metadata_t* found = nullptr;
  const rd_kafka_resp_err_t error = rd_kafka_metadata(client_.get(), 0, topic, &found, kLookMilliseconds);
  bool isThere = false;
  if (error == RD_KAFKA_RESP_ERR_NO_ERROR && found->topic_cnt == 1) {
    const rd_kafka_metadata_topic& about = found->topics[0];
    uint32_t led = 0;
    for (int i = 0; i < about.partition_cnt; ++i) led += about.partitions[i].leader >= 0 ? 1 : 0;
    isThere = about.err == RD_KAFKA_RESP_ERR_NO_ERROR && led >= settings_.partitions;
  }
  if (found != nullptr) rd_kafka_metadata_destroy(found);
  rd_kafka_topic_destroy(topic);
  if (isThere) {
    isMissingTold_ = false;
    setUp(true);
  } else if (!std::exchange(isMissingTold_, true)) {
    lines_.error("log: no topic \"%s\" with %u partitions that have a leader", settings_.stream.c_str(),
                 settings_.partitions);
  }
}

void KafkaLog::run() {
  beginServiceThread("kyt-kafka");
  while (!isStopping_) {
    rd_kafka_poll(client_.get(), kPollMilliseconds);
    if (!isThere_) look();
  }
}

void KafkaLog::stop() {
  if (isStopping_.exchange(true)) return;
  if (thread_.joinable()) thread_.join();
  if (client_) rd_kafka_purge(client_.get(), RD_KAFKA_PURGE_F_QUEUE | RD_KAFKA_PURGE_F_INFLIGHT);
  client_.reset();
}

}  // namespace kyt::receiver
