#include "tests/receiver/NatsServer.h"

#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <thread>
#include <utility>

#include "tests/support/Eventually.h"
#include "tools/demo/Ports.h"

namespace kyt::receiver {
namespace {

constexpr char kProgram[] = "/usr/sbin/nats-server";

}  // namespace

bool NatsServers::isInstalled() {
  return ::access(kProgram, X_OK) == 0;
}

NatsServers::NatsServers(Options options) {
  for (size_t i = 0; i < options.servers; ++i) {
    ports_.push_back(tools::freePort());
    routePorts_.push_back(tools::freePort());
  }
  for (size_t i = 0; i < options.servers; ++i) {
    std::string text = "server_name: " + name(i) + "\nlisten: \"127.0.0.1:" + std::to_string(ports_[i]) +
                       "\"\nmax_payload: 20MB\nmax_pending: 80MB\njetstream { store_dir: \"" +
                       folder_.path() + "/" + name(i) + "\", max_mem: 64MB, max_file: 2GB }\n" +
                       options.more + "\n";
    if (options.servers > 1) {
      text += "cluster { name: test, listen: \"127.0.0.1:" + std::to_string(routePorts_[i]) + "\", routes: [";
      for (const uint16_t port : routePorts_) text += " \"nats://127.0.0.1:" + std::to_string(port) + "\",";
      text.back() = ']';
      text += " }\n";
    }
    folder_.write(name(i) + ".conf", text);
  }
  processes_.resize(options.servers);
}

void NatsServers::start(size_t index) {
  tools::ChildProcess::Options how;
  how.outputFile = folder_ / (name(index) + ".log");
  auto started = tools::ChildProcess::start(kProgram, {"-c", folder_ / (name(index) + ".conf")}, how);
  if (!started) throw std::runtime_error(std::string(kProgram) + " cannot be started");
  processes_[index] = std::move(*started);
}

void NatsServers::start() {
  for (size_t i = 0; i < size(); ++i) start(i);
}

void NatsServers::kill(size_t index) {
  processes_[index].signal(SIGKILL);
  static_cast<void>(processes_[index].wait(kTestDeadline));
}

// The signal is on its way when kill() returns: each thread takes it when it next runs.
void NatsServers::pause(size_t index) {
  processes_[index].signal(SIGSTOP);
  const std::string tasks = "/proc/" + std::to_string(processes_[index].pid()) + "/task";
  const bool standsStill = eventually([&] {
    const std::filesystem::directory_iterator all(tasks);
    return std::all_of(begin(all), end(all), [](const auto& task) {
      std::ifstream in(task.path() / "stat");
      std::string text;
      std::getline(in, text);
      return text.find(") T ") != std::string::npos;
    });
  });
  if (!standsStill) throw std::runtime_error("the log's server does not stand still");
}

std::string NatsServers::url(size_t index) const {
  return "nats://127.0.0.1:" + std::to_string(ports_[index]);
}

std::string NatsServers::urlsAsToml() const {
  std::string text;
  for (size_t i = 0; i < size(); ++i) text += (i == 0 ? "[\"" : ", \"") + url(i) + "\"";
  return text + "]";
}

StreamView::StreamView(const std::string& url) {
  const bool isConnected = eventually([&] {
    if (natsConnection_ConnectTo(&connection_, url.c_str()) == NATS_OK) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    return false;
  });
  if (!isConnected || natsConnection_JetStream(&context_, connection_, nullptr) != NATS_OK)
    throw std::runtime_error("cannot connect to " + url);
}

StreamView::~StreamView() {
  jsCtx_Destroy(context_);
  natsConnection_Destroy(connection_);
}

std::optional<uint64_t> StreamView::messages(const char* stream) {
  jsStreamInfo* info = nullptr;
  if (js_GetStreamInfo(&info, context_, stream, nullptr, nullptr) != NATS_OK) return std::nullopt;
  const uint64_t count = info->State.Msgs;
  jsStreamInfo_Destroy(info);
  return count;
}

std::string StreamView::leader(const char* stream) {
  jsStreamInfo* info = nullptr;
  if (js_GetStreamInfo(&info, context_, stream, nullptr, nullptr) != NATS_OK) return {};
  std::string name =
      info->Cluster != nullptr && info->Cluster->Leader != nullptr ? info->Cluster->Leader : "";
  jsStreamInfo_Destroy(info);
  return name;
}

bool StreamView::purge(const char* stream) {
  return js_PurgeStream(context_, stream, nullptr, nullptr) == NATS_OK;
}

bool StreamView::setMaxBytes(int64_t bytes) {
  jsStreamInfo* info = nullptr;
  if (js_GetStreamInfo(&info, context_, "kyt-events", nullptr, nullptr) != NATS_OK) return false;
  info->Config->MaxBytes = bytes;
  const bool isDone = js_UpdateStream(nullptr, context_, info->Config, nullptr, nullptr) == NATS_OK;
  jsStreamInfo_Destroy(info);
  return isDone;
}

bool StreamView::setMaxMessageBytes(int32_t bytes) {
  jsStreamInfo* info = nullptr;
  if (js_GetStreamInfo(&info, context_, "kyt-events", nullptr, nullptr) != NATS_OK) return false;
  info->Config->MaxMsgSize = bytes;
  const bool isDone = js_UpdateStream(nullptr, context_, info->Config, nullptr, nullptr) == NATS_OK;
  jsStreamInfo_Destroy(info);
  return isDone;
}

bool StreamView::setSubject(const char* subject) {
  jsStreamInfo* info = nullptr;
  if (js_GetStreamInfo(&info, context_, "kyt-events", nullptr, nullptr) != NATS_OK) return false;
  jsStreamConfig config = *info->Config;
  config.Subjects = &subject;
  config.SubjectsLen = 1;
  const bool isDone = js_UpdateStream(nullptr, context_, &config, nullptr, nullptr) == NATS_OK;
  jsStreamInfo_Destroy(info);
  return isDone;
}

bool StreamView::remove(const char* stream) {
  return js_DeleteStream(context_, stream, nullptr, nullptr) == NATS_OK;
}

std::optional<StoredMessage> StreamView::message(uint64_t number, const char* stream) {
  natsMsg* message = nullptr;
  if (js_GetMsg(&message, context_, stream, number, nullptr, nullptr) != NATS_OK) return std::nullopt;
  StoredMessage stored;
  stored.subject = natsMsg_GetSubject(message);
  stored.body.assign(natsMsg_GetData(message), static_cast<size_t>(natsMsg_GetDataLength(message)));
  const char** names = nullptr;
  int count = 0;
  if (natsMsgHeader_Keys(message, &names, &count) == NATS_OK) {
    for (int i = 0; i < count; ++i) {
      const char* value = nullptr;
      if (natsMsgHeader_Get(message, names[i], &value) == NATS_OK) stored.headers[names[i]] = value;
    }
    std::free(names);  // NOLINT(cppcoreguidelines-no-malloc): the library's
  }
  natsMsg_Destroy(message);
  return stored;
}

std::map<std::string, int> StreamView::ids() {
  std::map<std::string, int> found;
  // A cluster that has just lost a server has no answer now and then.
  std::optional<uint64_t> count;
  if (!eventually([&] { return (count = messages()).has_value(); }))
    throw std::runtime_error("the stream does not answer");
  for (uint64_t i = 1; i <= *count; ++i) {
    std::optional<StoredMessage> stored;
    if (!eventually([&] { return (stored = message(i)).has_value(); }))
      throw std::runtime_error("a message of the stream cannot be read");
    ++found[stored->headers.at("Kyt-Id")];
  }
  return found;
}

}  // namespace kyt::receiver
