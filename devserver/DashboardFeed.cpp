#include "devserver/DashboardFeed.h"

#include <arpa/inet.h>
#include <errno.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

#include "devserver/Datagram.h"
#include "devserver/JsonText.h"

namespace kyt::devserver {
namespace {

constexpr size_t kMaxDelayed = 10000;
constexpr size_t kShortened = 61;  // one byte less than holds the number

std::string addressText(const sockaddr_in& address) {
  char text[INET_ADDRSTRLEN] = {};
  inet_ntop(AF_INET, &address.sin_addr, text, sizeof text);
  return std::string(text) + ":" + std::to_string(ntohs(address.sin_port));
}

}  // namespace

std::unique_ptr<DashboardFeed> DashboardFeed::start(const std::string& address, uint16_t port, Store& store,
                                                    AcknowledgementRules& rules, std::string& error) {
  sockaddr_in own{};
  own.sin_family = AF_INET;
  own.sin_port = htons(port);
  if (inet_pton(AF_INET, address.c_str(), &own.sin_addr) != 1) {
    error = "the dashboard feed needs an IPv4 address to listen on, not " + address;
    return nullptr;
  }
  const int socket = ::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  const int wake = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  socklen_t size = sizeof own;
  if (socket < 0 || wake < 0 || bind(socket, reinterpret_cast<const sockaddr*>(&own), size) != 0 ||
      getsockname(socket, reinterpret_cast<sockaddr*>(&own), &size) != 0) {
    error = "can't listen on UDP port " + std::to_string(port) + ": " + std::strerror(errno);
    if (socket >= 0) close(socket);
    if (wake >= 0) close(wake);
    return nullptr;
  }
  return std::unique_ptr<DashboardFeed>(new DashboardFeed(socket, wake, ntohs(own.sin_port), store, rules));
}

DashboardFeed::DashboardFeed(int socket, int wake, uint16_t port, Store& store, AcknowledgementRules& rules)
    : socket_(socket), wake_(wake), port_(port), store_(store), rules_(rules) {
  thread_ = std::thread([this] { run(); });
}

DashboardFeed::~DashboardFeed() {
  stopping_ = true;
  eventfd_write(wake_, 1);
  thread_.join();
  close(socket_);
  close(wake_);
}

void DashboardFeed::run() {
  pthread_setname_np(pthread_self(), "kyt-feed");
  while (!stopping_) {
    pollfd waits[] = {{socket_, POLLIN, 0}, {wake_, POLLIN, 0}};
    poll(waits, 2, sendDue());
    receiveAll();
  }
}

void DashboardFeed::receiveAll() {
  char buffer[65536];
  for (;;) {
    sockaddr_in sender{};
    socklen_t size = sizeof sender;
    const ssize_t got =
        recvfrom(socket_, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&sender), &size);
    if (got < 0 && (errno == EINTR || errno == ECONNREFUSED)) continue;
    if (got < 0 || stopping_) return;
    take({buffer, static_cast<size_t>(got)}, sender);
  }
}

void DashboardFeed::take(std::string_view bytes, const sockaddr_in& sender) {
  Arrival arrival;
  arrival.kind = Arrival::Kind::line;
  arrival.received = timeNow();
  const auto read = readDatagram(bytes);
  if (const auto* datagram = std::get_if<Datagram>(&read)) {
    const bool asked = (datagram->flags & Datagram::kReliable) != 0;
    const std::string done = asked ? acknowledge(bytes, datagram->event, sender) : "not asked for";
    arrival.good = true;
    arrival.json = datagramAsJson(*datagram, addressText(sender), done);
  } else {
    JsonText json;
    json.object().member("sender", addressText(sender)).member("reason", std::get<std::string>(read));
    arrival.json = json.member("size", bytes.size()).endObject().text();
  }
  store_.add(std::move(arrival));
}

std::string DashboardFeed::acknowledge(std::string_view bytes, uint16_t event, const sockaddr_in& sender) {
  using Action = AcknowledgementRule::Action;
  const std::optional<AcknowledgementRule> rule = rules_.take();
  const std::string answer = acknowledgement(bytes, event);
  if (!rule) {
    send(answer, sender);
    return "yes";
  }
  switch (rule->action) {
    case Action::lose:
      break;
    case Action::delay:
      if (delayed_.size() < kMaxDelayed)
        delayed_.emplace(std::chrono::steady_clock::now() + rule->delay, Delayed{sender, answer});
      break;
    case Action::repeat:
      for (unsigned i = 0; i < rule->copies; ++i) send(answer, sender);
      break;
    case Action::corrupt:
      send(acknowledgement(bytes, static_cast<uint16_t>(~event)), sender);
      break;
    case Action::shorten:
      send(answer.substr(0, kShortened), sender);
      break;
  }
  return AcknowledgementRules::nameOf(rule->action);
}

void DashboardFeed::send(const std::string& bytes, const sockaddr_in& to) const {
  // A dashboard's acknowledgement may be lost anyway, so a failure is not looked at.
  (void)sendto(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL, reinterpret_cast<const sockaddr*>(&to),
               sizeof to);
}

int DashboardFeed::sendDue() {
  const Time now = std::chrono::steady_clock::now();
  while (!delayed_.empty() && delayed_.begin()->first <= now) {
    send(delayed_.begin()->second.bytes, delayed_.begin()->second.to);
    delayed_.erase(delayed_.begin());
  }
  if (delayed_.empty()) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(delayed_.begin()->first - now);
  return static_cast<int>(left.count());
}

}  // namespace kyt::devserver
