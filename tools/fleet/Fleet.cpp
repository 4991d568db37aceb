#include "tools/fleet/Fleet.h"

#include <signal.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <sstream>
#include <utility>

#include "platform/linux/data/RapidJSON.h"
#include "tools/StorebagFile.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/Http.h"
#include "tools/demo/Ports.h"

namespace kyt::tools {

namespace fs = std::filesystem;

namespace {

constexpr size_t kNodes = 3;
constexpr std::chrono::seconds kPatience{60};
constexpr char kLogServer[] = "/usr/sbin/nats-server";

Error failure(std::string text) {
  return Error{"KYTToolsErrorDomain", -1, std::move(text)};
}

// What a server said before it gave up: the folder goes with the fleet.
Error failureOf(const char* what, const std::string& log) {
  auto said = readFile(log);
  return failure(
      std::string(what) + ": " +
      (std::holds_alternative<std::string>(said) ? std::get<std::string>(said) : std::string("no log")));
}

std::string url(uint16_t port, const char* scheme) {
  return std::string(scheme) + "://127.0.0.1:" + std::to_string(port);
}

// The paths of the demonstration's storebags.
std::string pathSettings() {
  std::string text;
  for (const char* ending : {"", "/realtime"}) {
    text += std::string("[[path]]\nurl_path = \"/v1/events/kytdemo") + ending +
            "\"\ndigest = \"required\"\ndigest_keys = { \"QPW/kytdemo\" = [\"" + kDemoDigestKeyHex +
            "\"] }\n";
    text += std::string("[[path]]\nurl_path = \"") + kFleetPath + ending + "\"\n";
  }
  return text + "[[path]]\nurl_path = \"/v1/events/example\"\n";
}

}  // namespace

std::variant<std::unique_ptr<Fleet>, Error> Fleet::start(FleetOptions options) {
  if (!fs::exists(kLogServer)) return failure("nats-server is not installed");
  if (!Postgres::isHere()) return failure("postgresql is not installed");
  std::unique_ptr<Fleet> fleet(new Fleet);
  auto postgres = Postgres::start();
  if (auto* error = std::get_if<Error>(&postgres)) return *error;
  fleet->postgres_ = std::get<std::unique_ptr<Postgres>>(std::move(postgres));
  auto stage = Stage::make(std::move(options.stage));
  if (auto* error = std::get_if<Error>(&stage)) return *error;
  fleet->stage_ = std::get<std::unique_ptr<Stage>>(std::move(stage));
  if (auto error = fleet->startLog()) return *error;
  if (auto error = fleet->startReceivers(options.receivers)) return *error;
  if (auto error = fleet->startReader()) return *error;
  if (auto error = fleet->startFront(options.site)) return *error;
  for (const auto& [bag, backend, client] :
       {std::tuple("cadmor", "qrs", "kytdemo"), std::tuple("dulvek", "httppost", "kytdemo-plain")})
    if (auto error = fleet->stage_->putStorebag(bag, demoBag(fleet->front_->base() + "/v1", backend, client)))
      return *error;
  return fleet;
}

// The daemon's posts end before what takes them.
Fleet::~Fleet() {
  if (stage_ != nullptr) static_cast<void>(stage_->stopDaemon());
}

std::string Fleet::nodeFile(size_t node, const char* ending) const {
  return folder() + "/log-" + std::to_string(node + 1) + ending;
}

std::string Fleet::receiverFile(size_t receiver, const char* ending) const {
  return folder() + "/receiver-" + std::to_string(receiver + 1) + ending;
}

std::optional<Error> Fleet::startLog() {
  nodes_.resize(kNodes);
  std::string routes;
  for (Node& node : nodes_) {
    node = {freePort(), freePort(), freePort(), {}};
    routes += (routes.empty() ? "\"" : ", \"") + url(node.routes, "nats") + "\"";
  }
  for (size_t i = 0; i < kNodes; ++i) {
    const std::string text =
        "server_name: log-" + std::to_string(i + 1) +
        "\nlisten: \"127.0.0.1:" + std::to_string(nodes_[i].port) +
        "\"\nhttp: \"127.0.0.1:" + std::to_string(nodes_[i].monitor) +
        "\"\nmax_payload: 20MB\nmax_pending: 80MB\njetstream { store_dir: \"" + nodeFile(i, "") +
        "\" }\ncluster { name: fleet, listen: \"127.0.0.1:" + std::to_string(nodes_[i].routes) +
        "\", routes: [" + routes + " ] }\n";
    if (auto error = writeFile(nodeFile(i, ".conf"), text, 0644)) return error;
    if (auto error = startNode(i)) return error;
  }
  return std::nullopt;
}

std::optional<Error> Fleet::startNode(size_t node) {
  ChildProcess::Options how;
  how.outputFile = nodeFile(node, ".log");
  auto started = ChildProcess::start(kLogServer, {"-c", nodeFile(node, ".conf")}, how);
  if (!started) return failure(std::string(kLogServer) + ": " + std::strerror(errno));
  nodes_[node].process = std::move(*started);
  if (waitUntil(kPatience,
                [&] { return takesConnections(nodes_[node].port) || !nodes_[node].process.isRunning(); }) &&
      nodes_[node].process.isRunning())
    return std::nullopt;
  return failureOf("the log's server did not start", how.outputFile);
}

void Fleet::killNode(size_t node) {
  nodes_[node].process.signal(SIGKILL);
  static_cast<void>(nodes_[node].process.wait(kPatience));
}

std::optional<size_t> Fleet::leader() const {
  for (const Node& node : nodes_) {
    const auto answer = httpGet(url(node.monitor, "http") + "/jsz?streams=true", 5);
    if (!answer || answer->status != 200) continue;
    const size_t stream = answer->body.find("\"name\": \"kyt-events\"");
    const std::string key = "\"leader\": \"log-";
    const size_t at = stream == std::string::npos ? stream : answer->body.find(key, stream);
    if (at == std::string::npos) continue;
    const size_t number = static_cast<size_t>(std::atoi(answer->body.c_str() + at + key.size()));
    if (number >= 1 && number <= nodes_.size()) return number - 1;
  }
  return std::nullopt;
}

std::optional<Error> Fleet::startReceivers(size_t count) {
  std::string servers;
  for (const Node& node : nodes_)
    servers += (servers.empty() ? "\"" : ", \"") + url(node.port, "nats") + "\"";
  receivers_.resize(count);
  for (size_t i = 0; i < count; ++i) {
    receivers_[i].port = freePort();
    receivers_[i].metrics = freePort();
    const std::string text = "listen = \"127.0.0.1:" + std::to_string(receivers_[i].port) +
                             "\"\nmetrics = \"127.0.0.1:" + std::to_string(receivers_[i].metrics) +
                             "\"\n[log]\nkind = \"nats\"\nservers = [" + servers +
                             "]\nreplicas = 3\n[spool]\npath = \"" + receiverFile(i, ".spool") + "\"\n" +
                             pathSettings();
    if (auto error = writeFile(receiverFile(i, ".toml"), text, 0644)) return error;
    if (i == 0)
      if (auto error = makeStreams()) return error;
    if (auto error = startReceiver(i)) return error;
  }
  return std::nullopt;
}

// The nodes need some seconds to agree on a leader.
std::optional<Error> Fleet::makeStreams() {
  ChildProcess::Options how;
  how.outputFile = folder() + "/streams.log";
  const bool isMade = waitUntil(kPatience, [&] {
    auto made = ChildProcess::start(stage_->program("kytreceiver"),
                                    {"--config", receiverFile(0, ".toml"), "--make-streams"}, how);
    return made && made->wait(kPatience) == 0;
  });
  return isMade ? std::nullopt : std::optional(failureOf("no streams", how.outputFile));
}

std::optional<Error> Fleet::startReceiver(size_t receiver) {
  ChildProcess::Options how;
  how.outputFile = receiverFile(receiver, ".log");
  auto started =
      ChildProcess::start(stage_->program("kytreceiver"), {"--config", receiverFile(receiver, ".toml")}, how);
  if (!started) return failure(std::string("kytreceiver: ") + std::strerror(errno));
  Receiver& made = receivers_[receiver];
  made.process = std::move(*started);
  const bool isReady = waitUntil(kPatience, [&] {
    if (!made.process.isRunning()) return true;
    const auto answer = httpGet(url(made.metrics, "http") + "/readyz", 5);
    return answer && answer->status == 200;
  });
  if (isReady && made.process.isRunning()) return std::nullopt;
  return failureOf("a receiver did not start", how.outputFile);
}

void Fleet::killReceiver(size_t receiver) {
  receivers_[receiver].process.signal(SIGKILL);
  static_cast<void>(receivers_[receiver].process.wait(kPatience));
}

std::optional<int> Fleet::endReceiver(size_t receiver) {
  receivers_[receiver].process.signal(SIGTERM);
  return receivers_[receiver].process.wait(kPatience);
}

std::optional<double> Fleet::figure(size_t receiver, const std::string& sample) const {
  const auto answer = httpGet(url(receivers_[receiver].metrics, "http") + "/metrics", 5);
  if (!answer || answer->status != 200) return std::nullopt;
  std::istringstream lines(answer->body);
  for (std::string line; std::getline(lines, line);)
    if (line.starts_with(sample + " ")) return std::atof(line.c_str() + sample.size());
  return std::nullopt;
}

double Fleet::sum(const std::string& sample) const {
  double all = 0;
  for (size_t i = 0; i < receivers_.size(); ++i) all += figure(i, sample).value_or(0);
  return all;
}

std::optional<Error> Fleet::startReader() {
  std::vector<std::string> arguments = {"--database", postgres_->database(), "--acknowledge-within", "5"};
  for (const Node& node : nodes_) arguments.insert(arguments.end(), {"--server", url(node.port, "nats")});
  ChildProcess::Options how;
  how.outputFile = folder() + "/reader.log";
  auto started = ChildProcess::start(stage_->program("kytreader"), arguments, how);
  if (!started) return failure(std::string("kytreader: ") + std::strerror(errno));
  reader_ = std::move(*started);
  return std::nullopt;
}

std::optional<Error> Fleet::startFront(const std::string& site) {
  FrontOptions options;
  options.folder = folder() + "/nginx";
  options.site = site;
  options.certificate = folder() + "/server/server.pem";
  options.key = folder() + "/server/server-key.pem";
  for (const Receiver& receiver : receivers_) options.receivers.push_back(receiver.port);
  std::error_code error;
  fs::create_directories(options.folder, error);
  auto started = Front::start(options);
  if (auto* problem = std::get_if<Error>(&started)) return *problem;
  front_.emplace(std::get<Front>(std::move(started)));
  return std::nullopt;
}

}  // namespace kyt::tools
