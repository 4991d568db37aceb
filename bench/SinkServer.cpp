#include "bench/SinkServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <charconv>
#include <map>

namespace kyt::bench {

namespace {

constexpr char kAnswer[] = "HTTP/1.1 200 OK\r\nContent-Type: application/json\r\nContent-Length: 2\r\n\r\n{}";

int makeListener(int port) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  const int one = 1;
  setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  setsockopt(fd, SOL_SOCKET, SO_REUSEPORT, &one, sizeof one);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<uint16_t>(port));
  if (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || listen(fd, 1024) != 0)
    std::abort();
  return fd;
}

int portOf(int fd) {
  sockaddr_in address{};
  socklen_t length = sizeof address;
  getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
  return ntohs(address.sin_port);
}

// The length of the body that the head announces, or npos when the head is not whole yet.
size_t wholeLength(const std::string& in, size_t& head) {
  const size_t end = in.find("\r\n\r\n");
  if (end == std::string::npos) return std::string::npos;
  head = end + 4;
  const size_t at = in.find("Content-Length: ");
  size_t length = 0;
  if (at != std::string::npos && at < end) std::from_chars(in.data() + at + 16, in.data() + end, length);
  return head + length;
}

}  // namespace

SinkServer::SinkServer(unsigned threads, size_t keepBodies) : keepBodies_(keepBodies) {
  for (unsigned i = 0; i < threads; ++i) {
    const int listener = makeListener(port_);
    if (port_ == 0) port_ = portOf(listener);
    threads_.emplace_back([this, listener] { serve(listener); });
  }
}

SinkServer::~SinkServer() {
  stopping_ = true;
  for (std::thread& thread : threads_) thread.join();
}

std::vector<std::string> SinkServer::bodies() {
  const std::lock_guard lock(mutex_);
  return bodies_;
}

void SinkServer::take(std::string&& body) {
  bodyBytes_ += body.size();
  if (posts_.fetch_add(1) >= keepBodies_) return;
  const std::lock_guard lock(mutex_);
  bodies_.push_back(std::move(body));
}

void SinkServer::serve(int listener) {
  const int epoll = epoll_create1(EPOLL_CLOEXEC);
  epoll_event wanted{EPOLLIN, {.fd = listener}};
  epoll_ctl(epoll, EPOLL_CTL_ADD, listener, &wanted);
  std::map<int, Client> clients;
  std::array<epoll_event, 64> events;
  std::array<char, 65536> bytes;
  while (!stopping_) {
    const int count = epoll_wait(epoll, events.data(), events.size(), 50);
    for (int i = 0; i < count; ++i) {
      const int fd = events[static_cast<size_t>(i)].data.fd;
      if (fd == listener) {
        const int made = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (made < 0) continue;
        const int one = 1;
        setsockopt(made, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
        epoll_event client{EPOLLIN, {.fd = made}};
        epoll_ctl(epoll, EPOLL_CTL_ADD, made, &client);
        clients[made];
        continue;
      }
      const ssize_t got = recv(fd, bytes.data(), bytes.size(), 0);
      if (got <= 0) {
        close(fd);
        clients.erase(fd);
        continue;
      }
      std::string& in = clients[fd].in;
      in.append(bytes.data(), static_cast<size_t>(got));
      size_t head = 0;
      for (size_t whole = wholeLength(in, head); whole <= in.size(); whole = wholeLength(in, head)) {
        take(in.substr(head, whole - head));
        in.erase(0, whole);
        if (send(fd, kAnswer, sizeof kAnswer - 1, MSG_NOSIGNAL) < 0) break;
      }
    }
  }
  for (const auto& [fd, client] : clients) close(fd);
  close(epoll);
  close(listener);
}

}  // namespace kyt::bench
