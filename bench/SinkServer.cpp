#include "bench/SinkServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <map>
#include <span>

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

struct SinkServer::Client {
  Client(int socket, SSL_CTX* context) : fd(socket) {
    if (context == nullptr) return;
    tls.reset(SSL_new(context));
    SSL_set_fd(tls.get(), fd);
    SSL_set_accept_state(tls.get());
  }
  ~Client() { close(fd); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Positive: bytes. Zero: nothing now. Negative: the end.
  ssize_t read(std::span<char> bytes) {
    if (tls == nullptr) {
      const ssize_t got = recv(fd, bytes.data(), bytes.size(), 0);
      if (got > 0) return got;
      return got < 0 && errno == EAGAIN ? 0 : -1;
    }
    ERR_clear_error();
    const int got = SSL_read(tls.get(), bytes.data(), static_cast<int>(bytes.size()));
    if (got > 0) return got;
    return SSL_get_error(tls.get(), got) == SSL_ERROR_WANT_READ ? 0 : -1;
  }
  bool answer() {
    if (tls == nullptr) return send(fd, kAnswer, sizeof kAnswer - 1, MSG_NOSIGNAL) > 0;
    return SSL_write(tls.get(), kAnswer, sizeof kAnswer - 1) > 0;
  }

  const int fd;
  std::unique_ptr<SSL, decltype(&SSL_free)> tls{nullptr, &SSL_free};
  std::string in;
};

SinkServer::SinkServer(unsigned threads, size_t keepBodies)
    : threadsOfPort_(threads), keepBodies_(keepBodies) {
  begin(port_, nullptr);
}

SinkServer::~SinkServer() {
  stopping_ = true;
  for (std::thread& thread : threads_) thread.join();
}

bool SinkServer::addTLS(const std::string& certificate, const std::string& key) {
  tls_.reset(SSL_CTX_new(TLS_server_method()), &SSL_CTX_free);
  if (tls_ == nullptr || SSL_CTX_use_certificate_chain_file(tls_.get(), certificate.c_str()) != 1 ||
      SSL_CTX_use_PrivateKey_file(tls_.get(), key.c_str(), SSL_FILETYPE_PEM) != 1)
    return false;
  // As web servers do: what was said in one connection is resumed in the next.
  SSL_CTX_set_session_cache_mode(tls_.get(), SSL_SESS_CACHE_SERVER);
  const unsigned char context[] = "bench";
  SSL_CTX_set_session_id_context(tls_.get(), context, sizeof context - 1);
  begin(portWithTLS_, tls_.get());
  return true;
}

void SinkServer::begin(int& port, SSL_CTX* tls) {
  for (unsigned i = 0; i < threadsOfPort_; ++i) {
    const int listener = makeListener(port);
    if (port == 0) port = portOf(listener);
    threads_.emplace_back([this, listener, tls] { serve(listener, tls); });
  }
}

std::vector<std::string> SinkServer::bodies() {
  const std::lock_guard lock(mutex_);
  return {bodies_.begin(), bodies_.end()};
}

void SinkServer::take(std::string&& body) {
  bodyBytes_ += body.size();
  {
    const std::lock_guard lock(mutex_);
    bodies_.push_back(std::move(body));
    if (bodies_.size() > keepBodies_) bodies_.pop_front();
  }
  ++posts_;
}

bool SinkServer::takeWhatCame(Client& client) {
  std::array<char, 65536> bytes;
  ssize_t got = client.read(bytes);
  // What TLS has decrypted already, no report of the descriptor tells again.
  for (; got > 0; got = client.read(bytes)) {
    client.in.append(bytes.data(), static_cast<size_t>(got));
    size_t head = 0;
    for (size_t whole = wholeLength(client.in, head); whole <= client.in.size();
         whole = wholeLength(client.in, head)) {
      take(client.in.substr(head, whole - head));
      client.in.erase(0, whole);
      if (!client.answer()) return false;
    }
    if (client.tls == nullptr && static_cast<size_t>(got) < bytes.size()) return true;
  }
  return got == 0;
}

void SinkServer::serve(int listener, SSL_CTX* tls) {
  const int epoll = epoll_create1(EPOLL_CLOEXEC);
  epoll_event wanted{EPOLLIN, {.fd = listener}};
  epoll_ctl(epoll, EPOLL_CTL_ADD, listener, &wanted);
  std::map<int, Client> clients;
  std::array<epoll_event, 64> events;
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
        clients.try_emplace(made, made, tls);
        continue;
      }
      const auto client = clients.find(fd);
      if (client != clients.end() && !takeWhatCame(client->second)) clients.erase(client);
    }
  }
  close(epoll);
  close(listener);
}

}  // namespace kyt::bench
