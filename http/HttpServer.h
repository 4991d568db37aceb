// One port: HTTP/1.1, or HTTPS when an identity is given. Speaks the protocol through libmicrohttpd, with a small
// pool of threads that each poll their share of the connections; a request that waits is suspended and
// occupies none of them. Used by the development server and the receiver.
#pragma once

#include <microhttpd.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_set>

#include "http/Http.h"
#include "http/Suspensions.h"
#include "platform/base/Mutex.h"

namespace kyt::http {

struct Identity {
  std::string certificate, key;  // PEM
};

struct ServerOptions {
  std::string address = "127.0.0.1";
  uint16_t port = 0;                       // 0: any free one
  unsigned threads = 2;                    // at least 1
  unsigned maxConnections = 4096;          // further ones wait to be accepted
  std::chrono::seconds requestTime{60};    // for a body to be whole
  std::chrono::seconds idleTime{60};       // a connection without a byte ends
  uint64_t maxBodiesBytes = ~uint64_t{0};  // of all requests that are not yet answered
  // Of a body that is refused or too large so much is read before the answer. One that says it is longer is answered at once,
  // and the connection ends; so it ends, without an answer, where more comes than was said.
  uint64_t maxDrainBytes = ~uint64_t{0};
};

class HttpServer {
 public:
  // Null, with a text for people, when the port can't be opened. `identity`, when given, makes it HTTPS. The
  // handler and the suspensions must outlive the server.
  [[nodiscard]] static std::unique_ptr<HttpServer> start(const ServerOptions& options,
                                                         const Identity* identity, HttpHandler& handler,
                                                         Suspensions& suspensions, std::string& error);
  // Ends all connections. The suspensions must have been stopped, all streams closed, all later replies given.
  ~HttpServer();
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;

  [[nodiscard]] uint16_t port() const;

  // Any thread, from here on.
  // No further connection is accepted, and each ends with the next answer.
  void refuseConnections();
  // Requests whose headers are there and whose answer has not left.
  [[nodiscard]] uint64_t inProgress() const { return inProgress_.load(); }
  [[nodiscard]] uint64_t bodiesBytes() const { return bodiesBytes_.load(std::memory_order_relaxed); }
  [[nodiscard]] uint64_t connections() EXCLUDES(mutex_);
  // Ends connections on which no request's headers have been whole for so long, however busily bytes of them come, and
  // those whose body is not whole in the options' time. To be called now and then.
  void endSlowConnections(std::chrono::seconds withoutRequest) EXCLUDES(mutex_);

 private:
  class Exchange;
  struct Connection;
  HttpServer(const ServerOptions& options, bool secure, HttpHandler& handler, Suspensions& suspensions)
      : bodyTime_(options.requestTime),
        maxBodiesBytes_(options.maxBodiesBytes),
        maxDrainBytes_(options.maxDrainBytes),
        secure_(secure),
        handler_(handler),
        suspensions_(suspensions) {}
  static MHD_Result onRequest(void* self, MHD_Connection* connection, const char* path, const char* method,
                              const char* version, const char* body, size_t* bodySize, void** exchange);
  static void onEnd(void* self, MHD_Connection* connection, void** exchange, MHD_RequestTerminationCode code);
  static void onConnection(void* self, MHD_Connection* connection, void** context,
                           MHD_ConnectionNotificationCode code);

  const std::chrono::seconds bodyTime_;
  const uint64_t maxBodiesBytes_;
  const uint64_t maxDrainBytes_;
  const bool secure_;
  HttpHandler& handler_;
  Suspensions& suspensions_;
  MHD_Daemon* daemon_ = nullptr;
  std::atomic<bool> refusesConnections_{false};
  std::atomic<uint64_t> inProgress_{0}, bodiesBytes_{0};
  Mutex mutex_;
  std::unordered_set<Connection*> connections_ GUARDED_BY(mutex_);
};

}  // namespace kyt::http
