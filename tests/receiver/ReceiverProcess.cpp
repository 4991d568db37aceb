#include "tests/receiver/ReceiverProcess.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <cstdlib>
#include <sstream>
#include <utility>

#include "tests/support/Eventually.h"

namespace kyt::receiver {
namespace {

using std::chrono::steady_clock;

uint16_t numberAfter(const std::string& text, const std::string& key) {
  const size_t at = text.find(key);
  return at == std::string::npos ? uint16_t{0}
                                 : static_cast<uint16_t>(std::atoi(text.c_str() + at + key.size()));
}

}  // namespace

HttpConnection::HttpConnection(uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socket_ = ownDescriptor(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) socket_ = {};
}

bool HttpConnection::send(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t count = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count <= 0) return false;
    bytes.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

bool HttpConnection::fill(steady_clock::time_point deadline) {
  if (!socket_) return false;
  // Rounded up: whoever waited to the end must find the deadline passed.
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - steady_clock::now());
  pollfd waiting{socket_.get(), POLLIN, 0};
  if (::poll(&waiting, 1, static_cast<int>(std::max<long>(left.count(), 0))) <= 0) return false;
  char block[65536];
  const ssize_t count = ::recv(socket_.get(), block, sizeof block, 0);
  if (count <= 0) return false;
  received_.append(block, static_cast<size_t>(count));
  return true;
}

HttpReply HttpConnection::receive(std::chrono::milliseconds timeout) {
  const auto begin = steady_clock::now();
  const auto deadline = begin + timeout;
  HttpReply reply;
  size_t end = 0;
  while ((end = received_.find("\r\n\r\n")) == std::string::npos)
    if (!fill(deadline)) return reply;
  std::istringstream lines(received_.substr(0, end + 2));
  std::string line;
  std::getline(lines, line);
  const int status = line.size() > 9 ? std::atoi(line.c_str() + 9) : 0;
  while (std::getline(lines, line)) {
    const size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    std::string name = line.substr(0, colon);
    std::transform(name.begin(), name.end(), name.begin(), [](unsigned char c) { return std::tolower(c); });
    reply.headers[name] = line.substr(colon + 2, line.size() - colon - 3);
  }
  const size_t length = static_cast<size_t>(std::atol(reply.headers["content-length"].c_str()));
  while (received_.size() < end + 4 + length)
    if (!fill(deadline)) return reply;
  reply.status = status;
  reply.body = received_.substr(end + 4, length);
  received_.erase(0, end + 4 + length);
  reply.took = std::chrono::duration_cast<std::chrono::milliseconds>(steady_clock::now() - begin);
  return reply;
}

HttpReply HttpConnection::post(std::string_view path, std::string_view body,
                               const std::vector<std::string>& headers) {
  std::string request = "POST " + std::string(path) +
                        " HTTP/1.1\r\nHost: test\r\nContent-Length: " + std::to_string(body.size()) + "\r\n";
  for (const std::string& header : headers) request += header + "\r\n";
  // In one piece: the system would hold a second one back until the first is acknowledged.
  send((request + "\r\n").append(body));
  return receive();
}

HttpReply HttpConnection::get(std::string_view path) {
  send("GET " + std::string(path) + " HTTP/1.1\r\nHost: test\r\n\r\n");
  return receive();
}

bool HttpConnection::isClosed(std::chrono::milliseconds timeout) {
  const auto deadline = steady_clock::now() + timeout;
  while (fill(deadline)) {
  }
  return steady_clock::now() < deadline;
}

ReceiverProcess::ReceiverProcess(Options options) : options_(std::move(options)) {
  const std::string spool = options_.spool.empty() ? folder_ / "spool" : options_.spool;
  folder_.write("kytreceiver.toml",
                "listen = \"127.0.0.1:" + std::to_string(options_.port) +
                    "\"\nmetrics = \"127.0.0.1:" + std::to_string(options_.metricsPort) + "\"\n" +
                    options_.more + "[log]\nkind = \"" + options_.kind + "\"\nservers = " + options_.servers +
                    "\n" + options_.log + "[spool]\npath = \"" + spool +
                    "\"\nmax_bytes = " + std::to_string(options_.spoolMaxBytes) + "\n[limits]\n" +
                    options_.limits + "[[path]]\nurl_path = \"/v1/events\"\n" + options_.path);
  start();
}

ReceiverProcess::~ReceiverProcess() {
  if (isRunning_) {
    EXPECT_EQ(terminate(), 0) << output();
  }
}

void ReceiverProcess::start() {
  const std::string ready = folder_ / "ready";
  std::filesystem::remove(ready);
  std::vector<std::string> arguments = {"--config", configFile(), "--ready-file", ready};
  arguments.insert(arguments.end(), options_.arguments.begin(), options_.arguments.end());
  tools::ChildProcess::Options how;
  how.outputFile = folder_ / "output";
  std::vector<std::string> words = options_.wrapper;
  words.push_back(options_.program.empty() ? KYT_RECEIVER : options_.program);
  words.insert(words.end(), arguments.begin(), arguments.end());
  auto started = tools::ChildProcess::start(words.front(), {words.begin() + 1, words.end()}, how);
  ASSERT_TRUE(started);
  process_ = std::move(*started);
  isRunning_ = true;
  port_ = metricsPort_ = 0;
  const bool isThere = eventually([&] { return !process_.isRunning() || std::filesystem::exists(ready); });
  if (!isThere || !std::filesystem::exists(ready)) return;
  const std::string ports = folder_.read("ready");
  port_ = numberAfter(ports, "\"posts\":");
  metricsPort_ = numberAfter(ports, "\"metrics\":");
}

bool ReceiverProcess::becomesReady() const {
  return eventually([&] { return get("/readyz").status == 200; });
}

HttpReply ReceiverProcess::post(std::string_view body, const std::vector<std::string>& headers) const {
  return HttpConnection(port_).post("/v1/events", body, headers);
}

HttpReply ReceiverProcess::get(std::string_view path) const {
  return HttpConnection(metricsPort_).get(path);
}

std::optional<double> ReceiverProcess::metric(std::string_view sample) const {
  std::istringstream lines(get("/metrics").body);
  std::string line;
  while (std::getline(lines, line))
    if (line.starts_with(sample) && line.substr(sample.size()).starts_with(" "))
      return std::atof(line.c_str() + sample.size());
  return std::nullopt;
}

std::optional<int> ReceiverProcess::terminate(std::chrono::seconds timeout) {
  process_.signal(SIGTERM);
  const auto status = process_.wait(timeout);
  if (!status) kill();
  isRunning_ = false;
  return status;
}

void ReceiverProcess::kill() {
  process_.signal(SIGKILL);
  static_cast<void>(process_.wait(kTestDeadline));
  isRunning_ = false;
}

std::string gzipped(std::string_view text) {
  z_stream stream{};
  deflateInit2(&stream, Z_BEST_SPEED, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY);
  std::string out(deflateBound(&stream, text.size()), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  deflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  deflateEnd(&stream);
  return out;
}

std::string postText(uint64_t number, size_t filler) {
  return R"({"postTime":1769860800.25,"clientId":"device","events":[{"_eventNumber":)" +
         std::to_string(number) + R"(,"filler":")" + std::string(filler, 'x') + "\"}]}";
}

}  // namespace kyt::receiver
