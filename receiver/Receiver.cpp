#include "receiver/Receiver.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <memory>
#include <optional>
#include <thread>
#include <utility>
#include <variant>

#include "http/HttpServer.h"
#include "platform/base/ConditionVariable.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/Threads.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "platform/linux/service/ServiceManager.h"
#include "receiver/DeadLetters.h"
#include "receiver/Delivery.h"
#include "receiver/Limits.h"
#include "receiver/Metrics.h"
#include "receiver/Spool.h"
#include "receiver/SpoolFolder.h"

namespace kyt::receiver {
namespace {

using http::HttpServer;
using std::chrono::milliseconds;

constexpr milliseconds kTick(50);
constexpr size_t kMaxPEMBytes = 1u << 20;

// Calls what looks at deadlines, several times a second.
class Ticker {
 public:
  explicit Ticker(std::function<void()> tick) : tick_(std::move(tick)), thread_([this] { run(); }) {}
  ~Ticker() {
    {
      MutexLock lock(mutex_);
      isStopping_ = true;
      changed_.notifyAll();
    }
    thread_.join();
  }
  Ticker(const Ticker&) = delete;
  Ticker& operator=(const Ticker&) = delete;

 private:
  void run() {
    beginServiceThread("kyt-ticks");
    for (;;) {
      {
        const MonotonicTime next = std::chrono::steady_clock::now() + kTick;
        MutexLock lock(mutex_);
        while (!isStopping_ && changed_.waitUntil(mutex_, next)) {
        }
        if (isStopping_) return;
      }
      tick_();
    }
  }

  const std::function<void()> tick_;
  Mutex mutex_;
  ConditionVariable changed_;
  bool isStopping_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

// The identity for HTTPS. False: it cannot be read, which was said.
bool readIdentity(const Settings& settings, std::optional<http::Identity>& identity, Log& lines) {
  if (settings.certificateFile.empty()) return true;
  identity.emplace();
  for (const auto& [file, into] : {std::pair{&settings.certificateFile, &identity->certificate},
                                   std::pair{&settings.keyFile, &identity->key}}) {
    auto read = readRegularFile(*file, kMaxPEMBytes);
    if (const auto* wrong = std::get_if<ReadProblem>(&read)) {
      lines.error("start: %s: %s", file->c_str(), wrong->text.c_str());
      return false;
    }
    *into = std::move(std::get<FileContents>(read).bytes);
  }
  return true;
}

bool writeReadyFile(const std::string& file, const HttpServer& posts, const HttpServer* metrics, Log& lines) {
  if (file.empty()) return true;
  std::string text = "{\"posts\":" + std::to_string(posts.port());
  if (metrics != nullptr) text += ",\"metrics\":" + std::to_string(metrics->port());
  text += ",\"pid\":" + std::to_string(::getpid()) + "}\n";
  const std::string made = file + ".new";
  const Descriptor out = ownDescriptor(::open(made.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (out.get() >= 0 && writeAll(out.get(), text) && std::rename(made.c_str(), file.c_str()) == 0)
    return true;
  lines.error("start: %s: %s", file.c_str(), errorText(errno).c_str());
  return false;
}

// Settings count from the start on: a restart takes up others, and loses no post.
void waitForEnd(StopSignals& signals) {
  while (signals.wait() == SIGHUP) {
  }
}

// Posts that are in progress reach log or spool, and are answered; proxies learn that their connections end.
void drain(HttpServer& server, PostHandler& handler, Log& lines) {
  using Clock = std::chrono::steady_clock;
  lines.normal("end: %llu posts are in progress", static_cast<unsigned long long>(server.inProgress()));
  server.refuseConnections();
  const auto end = Clock::now() + Limits::drainTime;
  auto quietSince = Clock::now();
  while (Clock::now() < end && server.connections() != 0) {
    if (server.inProgress() != 0) quietSince = Clock::now();
    if (Clock::now() - quietSince >= Limits::quietTime) break;
    std::this_thread::sleep_for(milliseconds(5));
  }
  handler.close();
  while (handler.waiting() != 0) std::this_thread::sleep_for(milliseconds(5));
}

http::ServerOptions serverOptions(const ListenAddress& address, unsigned maxConnections,
                                  const Settings& settings) {
  http::ServerOptions options;
  options.address = address.address;
  options.port = address.port;
  options.maxConnections = maxConnections;
  options.requestTime = settings.bodyTime;
  // What ends slow connections looks 20 times a second; the server itself is the later one.
  options.idleTime = std::max(settings.idleTime, settings.bodyTime) + std::chrono::seconds(5);
  return options;
}

}  // namespace

int runReceiver(const Settings& settings, const ReceiverOptions& options, EventLog& log, StopSignals& signals,
                Log& lines) {
  std::optional<http::Identity> identity;
  if (!readIdentity(settings, identity, lines)) return 1;
  SpoolFolder folder(settings.spoolPath);
  if (const auto wrong = folder.take(); wrong && folder.isTaken())
    return lines.error("spool: %s", wrong->c_str()), 1;
  const LinuxClock clock;
  Figures figures;
  SQLitePostStore store(settings.spoolPath, "libsqlite3.so.0", SQLitePostStore::Aside::each);
  Spool spool(
      store, settings.spoolMaxBytes, clock, figures, lines, settings.log.partitions,
      [&folder] { return folder.take(); }, [&folder] { return folder.isOurs(); });
  spool.open();
  Delivery delivery(log, spool, clock, figures, lines, settings.log.publishTime);
  DeadLetters deadLetters(log, clock, figures);
  PostHandler handler(settings, options.posts, delivery, log, deadLetters, clock, figures);
  MetricsSources sources{figures, delivery, spool};
  MetricsHandler metricsHandler(sources);
  http::Suspensions suspensions([] {});

  std::string error;
  std::unique_ptr<HttpServer> server, metrics;
  if (settings.metrics) {
    http::ServerOptions metricsOptions =
        serverOptions(*settings.metrics, Limits::maxMetricsConnections, settings);
    metricsOptions.threads = 1;
    metrics = HttpServer::start(metricsOptions, nullptr, metricsHandler, suspensions, error);
    if (!metrics) return lines.error("start: metrics: %s", error.c_str()), 1;
  }
  // Last: posts come at once, and from then on nothing may fail that would leave one without an answer.
  http::ServerOptions portOptions = serverOptions(settings.listen, Limits::maxConnections, settings);
  portOptions.maxBodiesBytes = Limits::maxBodiesBytes;
  portOptions.maxDrainBytes = Limits::maxDrainBytes;
  server = HttpServer::start(portOptions, identity ? &*identity : nullptr, handler, suspensions, error);
  if (!server) return lines.error("start: %s", error.c_str()), 1;
  sources.server = server.get();
  spool.start(delivery);
  log.start(delivery);
  auto ticker = std::make_unique<Ticker>([&] {
    delivery.tick();
    spool.tick();
    server->endSlowConnections(settings.idleTime);
    if (metrics) metrics->endSlowConnections(settings.idleTime);
  });
  int status = writeReadyFile(options.readyFile, *server, metrics.get(), lines) ? 0 : 1;
  if (status == 0) {
    lines.normal("start: posts are taken at %s port %u", settings.listen.address.c_str(),
                 unsigned{server->port()});
    metricsHandler.open();
    ServiceManager::ready("taking posts");
    waitForEnd(signals);
    ServiceManager::stopping();
    metricsHandler.drain();
  }
  drain(*server, handler, lines);
  suspensions.stop();
  ticker.reset();
  metrics.reset();
  server.reset();
  log.stop();
  spool.stop();
  lines.normal("end: %llu posts were stored, %llu spooled; %llu are in the spool",
               static_cast<unsigned long long>(figures.stored.load()),
               static_cast<unsigned long long>(figures.spooled.load()),
               static_cast<unsigned long long>(spool.posts()));
  return status;
}

}  // namespace kyt::receiver
