// A small HTTP/1.1 server on loopback for tests, plain or TLS, with a thread for each connection. It records
// every request as it came and answers as its handler says, which includes every way in which a real server
// misbehaves.
//
// The handler runs on the connections' threads, several at once. All operations may be called from any
// thread; the destructor stops the server, whatever its connections are doing.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "tests/support/Eventually.h"
#include "tests/support/TestCertificates.h"

namespace kyt {

class NetworkNamespace;

class TestHTTPServer {
 public:
  using Headers = std::vector<std::pair<std::string, std::string>>;

  struct Request {
    std::string method, target;
    Headers headers;
    std::string body;
    std::string raw;         // head and body, byte for byte
    size_t connection = 0;   // numbered from 1 in the order of acceptance
    std::string peer;        // the client's address
    std::string tlsVersion;  // "TLSv1.3"; empty over plain HTTP
    // The first header of that name, compared without case.
    [[nodiscard]] std::optional<std::string> header(std::string_view name) const;
    [[nodiscard]] size_t headerCount(std::string_view name) const;
  };

  enum class Behaviour {
    answer,       // status, headers, body; the connection stays open
    hold,         // answers after release() (or never: the client may give up)
    stopMidBody,  // announces the whole body, sends half of it and closes
    raw,          // sends `body` instead of a reply, byte for byte, and closes
    close,        // closes without a byte
    reset,        // resets the connection without a byte
    drip,         // the body a byte at a time, `interval` apart
    sayGoodbye,   // answers, ends its side of the connection at the same time, and goes on reading
  };

  struct Reply {
    int status = 200;
    Headers headers = {};  // Content-Length is added unless Transfer-Encoding is among them
    std::string body = {};
    Behaviour behaviour = Behaviour::answer;
    std::chrono::milliseconds interval{100};
    bool closeAfter = false;
  };
  using Handler = std::function<Reply(const Request&)>;

  struct Options {
    std::optional<TestCertificate> certificate;  // then it speaks TLS
    int maximumTLSVersion = 0;                   // 0x0302 is TLS 1.1; 0: the newest
    std::string address = "127.0.0.1";           // or one of IPv6
    uint16_t port = 0;                           // 0: any free one
  };

  // Listens from here on; answers 200 without a body until a handler is set. Throws when it cannot.
  TestHTTPServer();
  explicit TestHTTPServer(Options options);
  ~TestHTTPServer();
  // One that listens in another network.
  static std::unique_ptr<TestHTTPServer> in(const NetworkNamespace& network, const std::string& address);
  TestHTTPServer(const TestHTTPServer&) = delete;
  TestHTTPServer& operator=(const TestHTTPServer&) = delete;

  void setHandler(Handler handler);
  void setReply(Reply reply);  // the same for every request

  [[nodiscard]] uint16_t port() const;
  // "http://127.0.0.1:PORT" + path, or https, with `host` instead of the address when given.
  [[nodiscard]] std::string url(std::string_view path = "/", std::string_view host = {}) const;

  [[nodiscard]] std::vector<Request> requests() const;
  [[nodiscard]] size_t requestCount() const;
  [[nodiscard]] bool waitForRequests(size_t count, std::chrono::milliseconds timeout = kTestDeadline) const;
  [[nodiscard]] size_t connectionsAccepted() const;
  [[nodiscard]] size_t connectionsOpen() const;
  [[nodiscard]] bool waitForConnectionsOpen(size_t count,
                                            std::chrono::milliseconds timeout = kTestDeadline) const;

  // TLS handshakes that were completed, and those of them that took an earlier session up again.
  [[nodiscard]] size_t handshakes() const;
  [[nodiscard]] size_t resumedHandshakes() const;

  void release();           // lets every held request be answered, now and later
  void loseWhatComes();     // on the connections there are: see LostPackets.h
  void closeConnections();  // cuts all connections; goes on listening
  void stop();

 private:
  class Implementation;
  std::unique_ptr<Implementation> implementation_;
};

}  // namespace kyt
