// Posts a second from a log into PostgreSQL: a stream is filled, then one reader, two, and four take all of it. One server of
// the log and one database, both on this machine with their defaults.
//
//   kyt_bench_reader PROGRAMS [POSTS]
#include <nats/nats.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <variant>
#include <vector>

#include "receiver/PostCheck.h"
#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/TemporaryFolder.h"
#include "tools/fleet/Postgres.h"

namespace kyt {
namespace {

constexpr int kEvents = 50;  // of a post
constexpr int kFields = 20;  // of an event, besides those of the daemon
constexpr std::chrono::minutes kMost(10);

using Clock = std::chrono::steady_clock;

// A batch as devices send it: 30 kB of JSON, 7 kB compressed.
std::string postBody(std::mt19937& random) {
  std::string text =
      R"({"postTime":1769860800.25,"clientId":")" + std::to_string(random()) + R"(","events":[)";
  for (int event = 0; event < kEvents; ++event) {
    text += event == 0 ? "{" : ",{";
    text += R"("ClientName":"example","ServiceName":"calls","_method":10,"_status":1,"_eventNumber":)" +
            std::to_string(event);
    for (int field = 0; field < kFields; ++field)
      text +=
          ",\"measurement" + std::to_string(field) + "\":\"value " + std::to_string(random() % 2000) + '"';
    text += '}';
  }
  return receiver::gzipped(text + "]}");
}

// The log, filled.
class FilledLog {
 public:
  explicit FilledLog(uint64_t posts) : posts_(posts) { servers_.start(); }
  ~FilledLog() {
    jsCtx_Destroy(context_);
    natsConnection_Destroy(connection_);
  }
  FilledLog(const FilledLog&) = delete;
  FilledLog& operator=(const FilledLog&) = delete;

  [[nodiscard]] bool fill() {
    if (!tools::waitUntil(std::chrono::seconds(30),
                          [&] { return natsConnection_ConnectTo(&connection_, url().c_str()) == NATS_OK; }))
      return false;
    if (natsConnection_JetStream(&context_, connection_, nullptr) != NATS_OK) return false;
    jsStreamConfig stream;
    jsStreamConfig_Init(&stream);
    const char* subjects[] = {"kyt.events.*"};
    stream.Name = "kyt-events";
    stream.Subjects = subjects;
    stream.SubjectsLen = 1;
    if (!tools::waitUntil(std::chrono::seconds(30), [&] {
          return js_AddStream(nullptr, context_, &stream, nullptr, nullptr) == NATS_OK;
        }))
      return false;
    std::mt19937 random(1);
    for (uint64_t i = 0; i < posts_; ++i)
      if (!put(postBody(random))) return false;
    jsPubOptions options;
    jsPubOptions_Init(&options);
    options.MaxWait = std::chrono::milliseconds(kMost).count();
    return js_PublishAsyncComplete(context_, &options) == NATS_OK;
  }
  [[nodiscard]] std::string url() const { return servers_.url(0); }
  [[nodiscard]] uint64_t posts() const { return posts_; }
  [[nodiscard]] double bytesOfAPost() const {
    return static_cast<double>(bytes_) / static_cast<double>(posts_);
  }

 private:
  bool put(const std::string& body) {
    bytes_ += body.size();
    http::Request request;
    request.path = "/v1/events";
    request.headers = {
        {"X-KYT-Sender", "QPW"}, {"X-KYT-Client-Name", "example"}, {"Content-Encoding", "gzip"}};
    natsMsg* message = nullptr;
    if (natsMsg_Create(&message, "kyt.events.0", nullptr, body.data(), static_cast<int>(body.size())) !=
        NATS_OK)
      return false;
    for (const auto& [name, value] :
         receiver::factsOf(request, receiver::messageID(body), 1769860800000, false))
      natsMsgHeader_Set(message, name.c_str(), value.c_str());
    const bool isPut = js_PublishMsgAsync(context_, &message, nullptr) == NATS_OK;
    natsMsg_Destroy(message);
    return isPut;
  }

  const uint64_t posts_;
  uint64_t bytes_ = 0;
  receiver::NatsServers servers_;
  natsConnection* connection_ = nullptr;
  jsCtx* context_ = nullptr;
};

// So many readers of one consumer take the whole stream into tables that are empty before; the seconds that takes.
std::optional<double> readAll(const std::string& programs, const FilledLog& log, tools::Postgres& postgres,
                              int readers) {
  static_cast<void>(postgres.query("DROP TABLE IF EXISTS kyt_events, kyt_posts, kyt_unreadable"));
  const TemporaryFolder folder;
  std::vector<tools::ChildProcess> processes;
  const auto begin = Clock::now();
  for (int i = 0; i < readers; ++i) {
    tools::ChildProcess::Options how;
    how.outputFile = folder / "reader.log";
    auto started = tools::ChildProcess::start(programs + "/kytreader",
                                              {"--server", log.url(), "--database", postgres.database(),
                                               "--durable", "bench-" + std::to_string(readers)},
                                              how);
    if (!started) return std::nullopt;
    processes.push_back(std::move(*started));
  }
  const std::string wanted = std::to_string(log.posts()) + "\n";
  bool isWhole = false;
  while (!isWhole && Clock::now() - begin < kMost) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));  // each question costs a process
    isWhole = postgres.query("SELECT count(*) FROM kyt_posts") == wanted;
  }
  const double seconds = std::chrono::duration<double>(Clock::now() - begin).count();
  if (!isWhole) std::fprintf(stderr, "%s", folder.read("reader.log").c_str());
  return isWhole ? std::optional(seconds) : std::nullopt;
}

int run(const std::string& programs, uint64_t posts) {
  auto started = tools::Postgres::start();
  if (auto* error = std::get_if<Error>(&started))
    return std::fprintf(stderr, "%s\n", error->localizedDescription.c_str()), 1;
  const auto postgres = std::get<std::unique_ptr<tools::Postgres>>(std::move(started));
  FilledLog log(posts);
  if (!log.fill()) return std::fprintf(stderr, "the log could not be filled\n"), 1;
  for (int readers : {1, 2, 4}) {
    const auto seconds = readAll(programs, log, *postgres, readers);
    if (!seconds) return 1;
    const double rate = static_cast<double>(posts) / *seconds;
    std::printf("%d readers: %.0f posts a second, %.0f events, %.1f MB/s of posts (%.0f bytes each)\n",
                readers, rate, rate * kEvents, rate * log.bytesOfAPost() * 1e-6, log.bytesOfAPost());
    std::fflush(stdout);
  }
  return 0;
}

}  // namespace
}  // namespace kyt

int main(int argc, char** argv) {
  if (argc < 2) return std::fprintf(stderr, "usage: kyt_bench_reader PROGRAMS [POSTS]\n"), 2;
  return kyt::run(argv[1], argc > 2 ? std::strtoull(argv[2], nullptr, 10) : 5000);
}
