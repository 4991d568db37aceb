#include "tests/support/TestHTTPServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <condition_variable>
#include <csignal>
#include <list>
#include <mutex>
#include <stdexcept>
#include <thread>

#include "tests/support/LostPackets.h"
#include "tests/support/NetworkNamespace.h"

namespace kyt {
namespace {

bool sameName(std::string_view a, std::string_view b) {
  return std::equal(a.begin(), a.end(), b.begin(), b.end(), [](char x, char y) {
    return std::tolower(static_cast<unsigned char>(x)) == std::tolower(static_cast<unsigned char>(y));
  });
}

const char* reason(int status) {
  return status == 200 ? "OK" : "Status";
}

std::string head(const TestHTTPServer::Reply& reply, bool withLength) {
  std::string text = "HTTP/1.1 " + std::to_string(reply.status) + " " + reason(reply.status) + "\r\n";
  bool chunked = false;
  for (const auto& [name, value] : reply.headers) {
    text += name + ": " + value + "\r\n";
    chunked = chunked || sameName(name, "Transfer-Encoding") || sameName(name, "Content-Length");
  }
  if (withLength && !chunked) text += "Content-Length: " + std::to_string(reply.body.size()) + "\r\n";
  return text + "\r\n";
}

// "::1" and its like have colons.
sockaddr_storage addressOf(const std::string& text, uint16_t port) {
  sockaddr_storage address{};
  auto& four = reinterpret_cast<sockaddr_in&>(address);
  auto& six = reinterpret_cast<sockaddr_in6&>(address);
  address.ss_family = text.find(':') == text.npos ? AF_INET : AF_INET6;
  four.sin_port = htons(port);  // at the same place in both
  if (address.ss_family == AF_INET) {
    inet_pton(AF_INET, text.c_str(), &four.sin_addr);
  } else {
    inet_pton(AF_INET6, text.c_str(), &six.sin6_addr);
  }
  return address;
}

std::string peerOf(int socket) {
  sockaddr_storage address{};
  socklen_t size = sizeof address;
  char text[INET6_ADDRSTRLEN] = {};
  if (getpeername(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0) return {};
  if (address.ss_family == AF_INET6)
    return inet_ntop(AF_INET6, &reinterpret_cast<sockaddr_in6&>(address).sin6_addr, text, sizeof text);
  return inet_ntop(AF_INET, &reinterpret_cast<sockaddr_in&>(address).sin_addr, text, sizeof text);
}

using Context = std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)>;

Context makeContext(const TestHTTPServer::Options& options) {
  Context context(nullptr, SSL_CTX_free);
  if (!options.certificate) return context;
  context.reset(SSL_CTX_new(TLS_server_method()));
  if (options.maximumTLSVersion != 0) {
    SSL_CTX_set_security_level(context.get(), 0);  // the library refuses TLS 1.1 by itself otherwise
    SSL_CTX_set_min_proto_version(context.get(), TLS1_VERSION);
    SSL_CTX_set_max_proto_version(context.get(), options.maximumTLSVersion);
  }
  BIO* memory = BIO_new_mem_buf(options.certificate->certificatePEM.data(), -1);
  X509* certificate = PEM_read_bio_X509(memory, nullptr, nullptr, nullptr);
  BIO_free(memory);
  memory = BIO_new_mem_buf(options.certificate->keyPEM.data(), -1);
  EVP_PKEY* key = PEM_read_bio_PrivateKey(memory, nullptr, nullptr, nullptr);
  BIO_free(memory);
  const bool good = certificate != nullptr && key != nullptr &&
                    SSL_CTX_use_certificate(context.get(), certificate) == 1 &&
                    SSL_CTX_use_PrivateKey(context.get(), key) == 1;
  X509_free(certificate);
  EVP_PKEY_free(key);
  if (!good) throw std::runtime_error("TestHTTPServer: bad certificate");
  return context;
}

// One accepted connection: bytes in and out, plain or through TLS.
class Stream {
 public:
  Stream(int socket, SSL_CTX* context)
      : socket_(socket), ssl_(context == nullptr ? nullptr : SSL_new(context)) {
    if (ssl_ != nullptr) SSL_set_fd(ssl_, socket_);
  }
  ~Stream() {
    // A TLS 1.2 session whose connection was not ended in order is never taken up again.
    if (ssl_ != nullptr) SSL_set_shutdown(ssl_, SSL_SENT_SHUTDOWN);
    SSL_free(ssl_);
  }
  Stream(const Stream&) = delete;
  Stream& operator=(const Stream&) = delete;
  bool handshake() { return ssl_ == nullptr || SSL_accept(ssl_) == 1; }
  bool isResumed() { return ssl_ != nullptr && SSL_session_reused(ssl_) == 1; }
  std::string tlsVersion() { return ssl_ == nullptr ? "" : SSL_get_version(ssl_); }
  bool readMore(std::string& buffer) {
    char bytes[65536];
    const ssize_t count =
        ssl_ == nullptr ? recv(socket_, bytes, sizeof bytes, 0) : SSL_read(ssl_, bytes, sizeof bytes);
    if (count <= 0) return false;
    buffer.append(bytes, static_cast<size_t>(count));
    return true;
  }
  void reset() const {
    sockaddr none{};
    none.sa_family = AF_UNSPEC;
    connect(socket_, &none, sizeof none);
  }
  // What is written leaves with the end, in one.
  void holdBack() const {
    const int on = 1;
    setsockopt(socket_, IPPROTO_TCP, TCP_CORK, &on, sizeof on);
  }
  void endWriting() {
    if (ssl_ != nullptr) SSL_shutdown(ssl_);
    shutdown(socket_, SHUT_WR);
  }
  bool write(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t count =
          ssl_ == nullptr
              ? send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL)
              : SSL_write(ssl_, bytes.data(), static_cast<int>(std::min<size_t>(bytes.size(), 1 << 20)));
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(count));
    }
    return true;
  }

 private:
  int socket_;
  SSL* ssl_;
};

std::optional<TestHTTPServer::Request> readRequest(Stream& stream, std::string& buffer) {
  size_t end = 0;
  while ((end = buffer.find("\r\n\r\n")) == std::string::npos)
    if (!stream.readMore(buffer)) return std::nullopt;
  TestHTTPServer::Request request;
  const std::string text = buffer.substr(0, end + 2);
  const size_t line = text.find("\r\n");
  const size_t first = text.find(' '), second = text.find(' ', first + 1);
  request.method = text.substr(0, first);
  request.target = text.substr(first + 1, second - first - 1);
  for (size_t at = line + 2; at < text.size();) {
    const size_t stop = text.find("\r\n", at), colon = text.find(':', at);
    size_t value = std::min(colon + 1, stop);
    while (value < stop && text[value] == ' ') ++value;
    request.headers.emplace_back(text.substr(at, std::min(colon, stop) - at),
                                 text.substr(value, stop - value));
    at = stop + 2;
  }
  const size_t length = std::stoul(request.header("Content-Length").value_or("0"));
  while (buffer.size() < end + 4 + length)
    if (!stream.readMore(buffer)) return std::nullopt;
  request.body = buffer.substr(end + 4, length);
  request.raw = buffer.substr(0, end + 4 + length);
  buffer.erase(0, end + 4 + length);
  return request;
}

}  // namespace

std::optional<std::string> TestHTTPServer::Request::header(std::string_view name) const {
  for (const auto& [key, value] : headers)
    if (sameName(key, name)) return value;
  return std::nullopt;
}

size_t TestHTTPServer::Request::headerCount(std::string_view name) const {
  return static_cast<size_t>(std::count_if(headers.begin(), headers.end(),
                                           [&](const auto& entry) { return sameName(entry.first, name); }));
}

class TestHTTPServer::Implementation {
 public:
  explicit Implementation(Options options) : options_(std::move(options)), context_(makeContext(options_)) {
    signal(SIGPIPE, SIG_IGN);  // TLS writes to a connection that the client closed
    sockaddr_storage address = addressOf(options_.address, options_.port);
    listener_ = socket(address.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const int on = 1;
    setsockopt(listener_, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    socklen_t size = sizeof address;
    if (bind(listener_, reinterpret_cast<sockaddr*>(&address), size) != 0 || listen(listener_, 1024) != 0 ||
        getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &size) != 0)
      throw std::runtime_error("TestHTTPServer: cannot listen on " + options_.address);
    port_ = ntohs(reinterpret_cast<sockaddr_in&>(address).sin_port);
    acceptor_ = std::thread([this] { acceptConnections(); });
  }

  ~Implementation() { stop(); }

  void stop() {
    {
      std::lock_guard lock(mutex_);
      if (std::exchange(stopping_, true)) return;
      changed_.notify_all();
      for (Connection& connection : connections_) shutdown(connection.socket, SHUT_RDWR);
    }
    shutdown(listener_, SHUT_RDWR);
    acceptor_.join();
    close(listener_);
    for (Connection& connection : connections_) connection.thread.join();
    for (Connection& connection : connections_) close(connection.socket);
  }

  void loseWhatComes() {
    std::lock_guard lock(mutex_);
    for (const Connection& connection : connections_) losePackets(connection.socket, true);
  }

  void closeConnections() {
    std::lock_guard lock(mutex_);
    for (Connection& connection : connections_) shutdown(connection.socket, SHUT_RDWR);
  }

  Options options_;
  Context context_;
  int listener_ = -1;
  uint16_t port_ = 0;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  Handler handler_;
  std::vector<Request> requests_;
  size_t open_ = 0;
  size_t handshakes_ = 0, resumed_ = 0;
  bool released_ = false;

  // A socket stays open until the server stops, so that its number means this connection as long as it is
  // listed.
  struct Connection {
    int socket;
    std::thread thread;
  };
  std::list<Connection> connections_;

 private:
  void acceptConnections() {
    for (;;) {
      const int accepted = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
      if (accepted < 0 && (errno == EINTR || errno == ECONNABORTED)) continue;
      std::lock_guard lock(mutex_);
      if (stopping_ || accepted < 0) {
        if (accepted >= 0) close(accepted);
        return;
      }
      const int on = 1;
      setsockopt(accepted, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
      ++open_;
      const size_t number = connections_.size() + 1;
      connections_.push_back({accepted, std::thread([this, accepted, number] { serve(accepted, number); })});
      changed_.notify_all();
    }
  }

  void serve(int socket, size_t number) {
    {
      Stream stream(socket, context_.get());
      std::string buffer;
      if (stream.handshake()) {
        countHandshake(stream);
        while (std::optional<Request> request = readRequest(stream, buffer)) {
          request->connection = number;
          request->peer = peerOf(socket);
          request->tlsVersion = stream.tlsVersion();
          if (!answer(stream, *std::move(request))) break;
        }
      }
    }
    shutdown(socket, SHUT_RDWR);
    std::lock_guard lock(mutex_);
    --open_;
    changed_.notify_all();
  }

  void countHandshake(Stream& stream) {
    if (!context_) return;
    std::lock_guard lock(mutex_);
    ++handshakes_;
    if (stream.isResumed()) ++resumed_;
  }

  // Whether the connection goes on.
  bool answer(Stream& stream, Request request) {
    Handler handler;
    const bool isHead = request.method == "HEAD";
    {
      std::lock_guard lock(mutex_);
      requests_.push_back(request);
      handler = handler_;
      changed_.notify_all();
    }
    const Reply reply = handler ? handler(request) : Reply{};
    const bool bodyless = reply.status == 204 || reply.status == 304;
    switch (reply.behaviour) {
      case Behaviour::close:
        return false;
      case Behaviour::reset:
        stream.reset();
        return false;
      case Behaviour::raw:
        stream.write(reply.body);
        return false;
      case Behaviour::stopMidBody:
        stream.write(head(reply, true) + reply.body.substr(0, reply.body.size() / 2));
        return false;
      case Behaviour::drip:
        return drip(stream, reply);
      case Behaviour::hold: {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [&] { return released_ || stopping_; });
        if (stopping_) return false;
        break;
      }
      case Behaviour::sayGoodbye:
        stream.holdBack();
        if (!stream.write(head(reply, !bodyless) + reply.body)) return false;
        stream.endWriting();
        return true;
      case Behaviour::answer:
        break;
    }
    return stream.write(head(reply, !bodyless) + (bodyless || isHead ? "" : reply.body)) && !reply.closeAfter;
  }

  bool drip(Stream& stream, const Reply& reply) {
    if (!stream.write(head(reply, true))) return false;
    for (const char c : reply.body) {
      std::unique_lock lock(mutex_);
      if (changed_.wait_for(lock, reply.interval, [&] { return stopping_; })) return false;
      lock.unlock();
      if (!stream.write(std::string_view(&c, 1))) return false;
    }
    return !reply.closeAfter;
  }

  bool stopping_ = false;
  std::thread acceptor_;
};

TestHTTPServer::TestHTTPServer() : TestHTTPServer(Options{}) {}
TestHTTPServer::TestHTTPServer(Options options)
    : implementation_(std::make_unique<Implementation>(std::move(options))) {}
TestHTTPServer::~TestHTTPServer() = default;

std::unique_ptr<TestHTTPServer> TestHTTPServer::in(const NetworkNamespace& network,
                                                   const std::string& address) {
  const NetworkNamespace::Entered entered(network);
  Options options;
  options.address = address;
  return std::make_unique<TestHTTPServer>(std::move(options));
}

void TestHTTPServer::setHandler(Handler handler) {
  std::lock_guard lock(implementation_->mutex_);
  implementation_->handler_ = std::move(handler);
}

void TestHTTPServer::setReply(Reply reply) {
  setHandler([reply = std::move(reply)](const Request&) { return reply; });
}

uint16_t TestHTTPServer::port() const {
  return implementation_->port_;
}

std::string TestHTTPServer::url(std::string_view path, std::string_view host) const {
  const Options& options = implementation_->options_;
  const bool isSix = options.address.find(':') != std::string::npos;
  const std::string address = isSix ? "[" + options.address + "]" : options.address;
  return std::string(options.certificate ? "https://" : "http://") +
         std::string(host.empty() ? std::string_view(address) : host) + ":" + std::to_string(port()) +
         std::string(path);
}

std::vector<TestHTTPServer::Request> TestHTTPServer::requests() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->requests_;
}

size_t TestHTTPServer::requestCount() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->requests_.size();
}

bool TestHTTPServer::waitForRequests(size_t count, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(implementation_->mutex_);
  return implementation_->changed_.wait_until(lock, std::chrono::steady_clock::now() + timeout,
                                              [&] { return implementation_->requests_.size() >= count; });
}

size_t TestHTTPServer::handshakes() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->handshakes_;
}

size_t TestHTTPServer::resumedHandshakes() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->resumed_;
}

size_t TestHTTPServer::connectionsAccepted() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->connections_.size();
}

size_t TestHTTPServer::connectionsOpen() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->open_;
}

bool TestHTTPServer::waitForConnectionsOpen(size_t count, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(implementation_->mutex_);
  return implementation_->changed_.wait_until(lock, std::chrono::steady_clock::now() + timeout,
                                              [&] { return implementation_->open_ == count; });
}

void TestHTTPServer::release() {
  std::lock_guard lock(implementation_->mutex_);
  implementation_->released_ = true;
  implementation_->changed_.notify_all();
}

void TestHTTPServer::loseWhatComes() {
  implementation_->loseWhatComes();
}
void TestHTTPServer::closeConnections() {
  implementation_->closeConnections();
}
void TestHTTPServer::stop() {
  implementation_->stop();
}

}  // namespace kyt
