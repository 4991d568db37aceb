#include "tests/support/TestHTTP2Server.h"

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <map>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <thread>

#include "tests/support/LostPackets.h"

namespace kyt {
namespace {

constexpr std::string_view kPreface = "PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n";
constexpr size_t kFrameHead = 9;
constexpr uint16_t kMostStreams = 3;  // the setting's number

std::string bigEndian(uint64_t value, size_t bytes) {
  std::string text;
  for (size_t i = bytes; i > 0; --i) text.push_back(static_cast<char>(value >> (8 * (i - 1)) & 0xff));
  return text;
}

uint32_t readNumber(std::string_view bytes) {
  uint32_t value = 0;
  for (const char c : bytes) value = value << 8 | static_cast<unsigned char>(c);
  return value;
}

int chooseProtocol(SSL*, const unsigned char** chosen, unsigned char* size, const unsigned char* offered,
                   unsigned offeredSize, void*) {
  static constexpr unsigned char mine[] = {2, 'h', '2'};
  return SSL_select_next_proto(const_cast<unsigned char**>(chosen), size, mine, sizeof mine, offered,
                               offeredSize) == OPENSSL_NPN_NEGOTIATED
             ? SSL_TLSEXT_ERR_OK
             : SSL_TLSEXT_ERR_ALERT_FATAL;
}

using Context = std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)>;

Context makeContext(const TestCertificate& made) {
  Context context(SSL_CTX_new(TLS_server_method()), SSL_CTX_free);
  BIO* memory = BIO_new_mem_buf(made.certificatePEM.data(), -1);
  X509* certificate = PEM_read_bio_X509(memory, nullptr, nullptr, nullptr);
  BIO_free(memory);
  memory = BIO_new_mem_buf(made.keyPEM.data(), -1);
  EVP_PKEY* key = PEM_read_bio_PrivateKey(memory, nullptr, nullptr, nullptr);
  BIO_free(memory);
  const bool good = SSL_CTX_use_certificate(context.get(), certificate) == 1 &&
                    SSL_CTX_use_PrivateKey(context.get(), key) == 1;
  X509_free(certificate);
  EVP_PKEY_free(key);
  if (!good) throw std::runtime_error("TestHTTP2Server: bad certificate");
  SSL_CTX_set_alpn_select_cb(context.get(), chooseProtocol, nullptr);
  return context;
}

}  // namespace

void TestHTTP2Server::Connection::frame(uint8_t type, uint8_t flags, uint32_t stream,
                                        std::string_view payload) {
  write(bigEndian(payload.size(), 3) + static_cast<char>(type) + static_cast<char>(flags) +
        bigEndian(stream, 4) + std::string(payload));
}

void TestHTTP2Server::Connection::headers(uint32_t stream, int status, bool last) {
  // A literal under the table's name for the status.
  frame(kHeaders, static_cast<uint8_t>(kEndHeaders | (last ? kEndStream : 0)), stream,
        std::string("\x08\x03") + std::to_string(status));
}

void TestHTTP2Server::Connection::answer(uint32_t stream, int status, std::string_view body) {
  headers(stream, status, body.empty());
  if (!body.empty()) frame(kData, kEndStream, stream, body);
}

void TestHTTP2Server::Connection::resetStream(uint32_t stream, uint32_t code) {
  frame(kReset, 0, stream, bigEndian(code, 4));
}

void TestHTTP2Server::Connection::goAway(uint32_t lastStream, uint32_t code) {
  frame(kGoAway, 0, 0, bigEndian(lastStream, 4) + bigEndian(code, 4));
}

void TestHTTP2Server::Connection::allowStreams(uint32_t count) {
  frame(kSettings, 0, 0, bigEndian(kMostStreams, 2) + bigEndian(count, 4));
}

class TestHTTP2Server::Implementation {
 public:
  explicit Implementation(Options options)
      : options_(std::move(options)), context_(makeContext(options_.certificate)) {
    signal(SIGPIPE, SIG_IGN);  // TLS writes to a connection that the client closed
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (bind(listener_, reinterpret_cast<sockaddr*>(&address), size) != 0 || listen(listener_, 1024) != 0 ||
        getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &size) != 0)
      throw std::runtime_error("TestHTTP2Server: cannot listen");
    port_ = ntohs(address.sin_port);
    acceptor_ = std::thread([this] { acceptConnections(); });
  }
  ~Implementation() {
    stopping_ = true;
    shutdown(listener_, SHUT_RDWR);
    acceptor_.join();
    close(listener_);
    for (const auto& one : connections_) one->stop();
  }
  Implementation(const Implementation&) = delete;
  Implementation& operator=(const Implementation&) = delete;

  class Served final : public Connection {
   public:
    Served(Implementation& server, int socket, size_t number)
        : server_(server), socket_(socket), number_(number), wake_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}
    ~Served() override {
      close(socket_);
      close(wake_);
    }
    void start() {
      thread_ = std::thread([this] { run(); });
    }
    void stop() {
      wants(End::stop);
      thread_.join();
    }
    [[nodiscard]] size_t number() const override { return number_; }
    [[nodiscard]] bool hasEnded() const { return ended_; }
    void write(std::string bytes) override {
      {
        std::lock_guard lock(mutex_);
        out_ += bytes;
      }
      eventfd_write(wake_, 1);
    }
    void end() override { wants(End::orderly); }
    void reset() override { wants(End::reset); }
    void loseWhatComes(bool loses) override { losePackets(socket_, loses); }

   private:
    enum class End { none, orderly, reset, stop };
    void wants(End end) {
      {
        std::lock_guard lock(mutex_);
        end_ = std::max(end_, end);
      }
      eventfd_write(wake_, 1);
    }

    void run() {
      ssl_ = SSL_new(server_.context_.get());
      SSL_set_fd(ssl_, socket_);
      SSL_set_accept_state(ssl_);
      SSL_set_mode(ssl_, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
      while (step()) {
        pollfd both[2] = {{socket_, static_cast<short>(POLLIN | (blocked_ ? POLLOUT : 0)), 0},
                          {wake_, POLLIN, 0}};
        poll(both, 2, -1);
        eventfd_t count = 0;
        eventfd_read(wake_, &count);
      }
      SSL_free(ssl_);
      shutdown(socket_, SHUT_RDWR);
      ended_ = true;
    }

    // Whether it goes on.
    bool step() {
      char bytes[16384];
      for (;;) {
        const int count = SSL_read(ssl_, bytes, sizeof bytes);
        if (count > 0) {
          in_.append(bytes, static_cast<size_t>(count));
          continue;
        }
        const int error = SSL_get_error(ssl_, count);
        if (error != SSL_ERROR_WANT_READ && error != SSL_ERROR_WANT_WRITE) return false;
        break;
      }
      if (SSL_is_init_finished(ssl_) == 1 && !greeted_) greet();
      takeFrames();
      return flush();
    }

    void greet() {
      greeted_ = true;
      helps_ = !server_.options_.greet || server_.options_.greet(*this);
      if (helps_) allowStreams(server_.options_.streams);
    }

    bool flush() {
      std::lock_guard lock(mutex_);
      if (end_ == End::stop) return false;
      if (end_ == End::reset) {
        sockaddr none{};
        none.sa_family = AF_UNSPEC;
        connect(socket_, &none, sizeof none);
        return false;
      }
      blocked_ = false;
      while (greeted_ && !out_.empty()) {
        const int count =
            SSL_write(ssl_, out_.data(), static_cast<int>(std::min<size_t>(out_.size(), 65536)));
        if (count > 0) {
          out_.erase(0, static_cast<size_t>(count));
          continue;
        }
        const int error = SSL_get_error(ssl_, count);
        blocked_ = error == SSL_ERROR_WANT_WRITE || error == SSL_ERROR_WANT_READ;
        return blocked_;
      }
      if (end_ != End::orderly || !greeted_) return true;
      SSL_shutdown(ssl_);
      return false;
    }

    void takeFrames() {
      if (!prefaced_ && in_.size() >= kPreface.size()) {
        prefaced_ = true;
        in_.erase(0, kPreface.size());
      }
      size_t taken = 0;
      while (prefaced_ && in_.size() - taken >= kFrameHead) {
        const std::string_view rest = std::string_view(in_).substr(taken);
        const size_t whole = kFrameHead + readNumber(rest.substr(0, 3));
        if (rest.size() < whole) break;
        taken += whole;
        take(static_cast<uint8_t>(rest[3]), static_cast<uint8_t>(rest[4]), readNumber(rest.substr(5, 4)),
             rest.substr(kFrameHead, whole - kFrameHead));
      }
      in_.erase(0, taken);
    }

    void take(uint8_t type, uint8_t flags, uint32_t stream, std::string_view payload) {
      if (helps_ && type == kSettings && (flags & kAcknowledge) == 0) frame(kSettings, kAcknowledge, 0);
      if (helps_ && type == kPing && (flags & kAcknowledge) == 0) frame(kPing, kAcknowledge, 0, payload);
      if (type == kHeaders) {
        bodies_[stream];
        server_.handle(*this, {stream, {}, number_}, false);
      }
      if (type == kData) {
        bodies_[stream] += payload;
        if (helps_ && !payload.empty()) {
          frame(kWindow, 0, 0, bigEndian(payload.size(), 4));
          if ((flags & kEndStream) == 0) frame(kWindow, 0, stream, bigEndian(payload.size(), 4));
        }
      }
      if ((type == kHeaders || type == kData) && (flags & kEndStream) != 0)
        server_.handle(*this, {stream, bodies_[stream], number_}, true);
    }

    Implementation& server_;
    const int socket_;
    const size_t number_;
    const int wake_;
    std::atomic<bool> ended_{false};
    std::mutex mutex_;
    std::string out_;
    End end_ = End::none;
    // The thread's.
    SSL* ssl_ = nullptr;
    bool greeted_ = false, helps_ = true, prefaced_ = false, blocked_ = false;
    std::string in_;
    std::map<uint32_t, std::string> bodies_;
    std::thread thread_;
  };

  void handle(Connection& connection, Request request, bool whole) {
    Handler handler;
    {
      std::lock_guard lock(mutex_);
      handler = whole ? handler_ : begins_;
      if (whole) requests_.push_back(request);
      if (whole && !handler) handler = [](Connection& on, const Request& it) { on.answer(it.stream); };
    }
    if (handler) handler(connection, request);
  }

  Options options_;
  Context context_;
  int listener_ = -1;
  uint16_t port_ = 0;
  std::atomic<bool> stopping_{false};
  mutable std::mutex mutex_;
  Handler handler_, begins_;
  std::vector<Request> requests_;
  std::vector<std::unique_ptr<Served>> connections_;

 private:
  void acceptConnections() {
    for (;;) {
      const int accepted = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (stopping_) {
        if (accepted >= 0) close(accepted);
        return;
      }
      if (accepted < 0) continue;
      const int on = 1;
      setsockopt(accepted, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
      std::lock_guard lock(mutex_);
      connections_.push_back(std::make_unique<Served>(*this, accepted, connections_.size() + 1));
      connections_.back()->start();
    }
  }

  std::thread acceptor_;
};

TestHTTP2Server::TestHTTP2Server(Options options)
    : implementation_(std::make_unique<Implementation>(std::move(options))) {}
TestHTTP2Server::~TestHTTP2Server() = default;

void TestHTTP2Server::setHandler(Handler handler, Handler begins) {
  std::lock_guard lock(implementation_->mutex_);
  implementation_->handler_ = std::move(handler);
  implementation_->begins_ = std::move(begins);
}

uint16_t TestHTTP2Server::port() const {
  return implementation_->port_;
}

std::string TestHTTP2Server::url() const {
  return "https://127.0.0.1:" + std::to_string(port()) + "/";
}

std::vector<TestHTTP2Server::Request> TestHTTP2Server::requests() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->requests_;
}

size_t TestHTTP2Server::times(std::string_view body) const {
  size_t count = 0;
  for (const Request& request : requests()) count += request.body == body ? 1 : 0;
  return count;
}

bool TestHTTP2Server::waitForRequests(size_t count) const {
  return eventually([&] { return requests().size() >= count; });
}

size_t TestHTTP2Server::connectionsAccepted() const {
  std::lock_guard lock(implementation_->mutex_);
  return implementation_->connections_.size();
}

void TestHTTP2Server::forEachConnection(const std::function<void(Connection&)>& use) const {
  std::lock_guard lock(implementation_->mutex_);
  for (const auto& one : implementation_->connections_)
    if (!one->hasEnded()) use(*one);
}

}  // namespace kyt
