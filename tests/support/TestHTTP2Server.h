// A small HTTP/2 server over TLS for tests, with a thread for each connection. It does by itself only what keeps a
// client going (settings, windows, pings); every answer is a test's, and so is every way to misbehave: whole frames and
// any bytes at any moment.
//
// All operations may be called from any thread; the handlers run on the connections' threads. The destructor stops the
// server, whatever its connections are doing.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "tests/support/Eventually.h"
#include "tests/support/TestCertificates.h"

namespace kyt {

class TestHTTP2Server {
 public:
  // Of frames, and of errors, as the protocol numbers them.
  enum Type : uint8_t {
    kData = 0,
    kHeaders = 1,
    kReset = 3,
    kSettings = 4,
    kPing = 6,
    kGoAway = 7,
    kWindow = 8
  };
  enum Code : uint32_t {
    kNoError = 0,
    kProtocolError = 1,
    kInternalError = 2,
    kRefusedStream = 7,
    kCancel = 8
  };
  static constexpr uint8_t kEndStream = 1, kAcknowledge = 1, kEndHeaders = 4;

  class Connection {
   public:
    virtual ~Connection() = default;
    [[nodiscard]] virtual size_t number() const = 0;  // from 1, in the order of acceptance
    virtual void write(std::string bytes) = 0;
    virtual void end() = 0;    // orderly, after what was written
    virtual void reset() = 0;  // at once
    // Every packet with data in it is lost before this side's TCP has seen it, while what it sends itself arrives and is
    // acknowledged; or no longer.
    virtual void loseWhatComes(bool loses) = 0;
    void frame(uint8_t type, uint8_t flags, uint32_t stream, std::string_view payload = {});
    void answer(uint32_t stream, int status = 200, std::string_view body = {});
    void headers(uint32_t stream, int status, bool last);
    void resetStream(uint32_t stream, uint32_t code);
    void goAway(uint32_t lastStream, uint32_t code = kNoError);
    void allowStreams(uint32_t count);  // settings
  };
  struct Request {
    uint32_t stream = 0;
    std::string body;
    size_t connection = 0;
  };
  using Handler = std::function<void(Connection&, const Request&)>;

  struct Options {
    TestCertificate certificate;
    uint32_t streams = 100;  // that its first settings allow
    // Called before anything; false: this side says nothing more by itself.
    std::function<bool(Connection&)> greet = nullptr;
  };

  explicit TestHTTP2Server(Options options);
  ~TestHTTP2Server();
  TestHTTP2Server(const TestHTTP2Server&) = delete;
  TestHTTP2Server& operator=(const TestHTTP2Server&) = delete;

  // For each whole request; without one it is answered 200. `begins`: for its headers, the body is still to come.
  void setHandler(Handler handler, Handler begins = nullptr);
  [[nodiscard]] uint16_t port() const;
  [[nodiscard]] std::string url() const;  // "https://ADDRESS:PORT/"
  [[nodiscard]] std::vector<Request> requests() const;
  [[nodiscard]] size_t times(std::string_view body) const;
  [[nodiscard]] bool waitForRequests(size_t count) const;
  [[nodiscard]] size_t connectionsAccepted() const;
  // Calls it with each connection that has not ended.
  void forEachConnection(const std::function<void(Connection&)>& use) const;

 private:
  class Implementation;
  std::unique_ptr<Implementation> implementation_;
};

}  // namespace kyt
