// One port: HTTP, or HTTPS when an identity is given. Speaks the protocol through libmicrohttpd, with a small
// pool of threads that each poll their share of the connections; a request that waits is suspended and
// occupies none of them.
#pragma once

#include <microhttpd.h>

#include <memory>
#include <string>

#include "devserver/Certificates.h"
#include "devserver/Http.h"
#include "devserver/Options.h"
#include "devserver/Suspensions.h"

namespace kyt::devserver {

class HttpServer {
 public:
  // Null, with a text for people, when the port can't be opened. `identity`, when given, makes it HTTPS. The
  // handler and the suspensions must outlive the server.
  [[nodiscard]] static std::unique_ptr<HttpServer> start(const Options& options, uint16_t port,
                                                         const Identity* identity, HttpHandler& handler,
                                                         Suspensions& suspensions, std::string& error);
  ~HttpServer();  // ends all connections. The suspensions must have been stopped and all streams closed.
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;

  [[nodiscard]] uint16_t port() const;

 private:
  class Exchange;
  HttpServer(const Options& options, bool secure, HttpHandler& handler, Suspensions& suspensions)
      : bodyTime_(options.requestTimeout), secure_(secure), handler_(handler), suspensions_(suspensions) {}
  static MHD_Result onRequest(void* self, MHD_Connection* connection, const char* path, const char* method,
                              const char* version, const char* body, size_t* bodySize, void** exchange);
  static void onEnd(void* self, MHD_Connection* connection, void** exchange, MHD_RequestTerminationCode code);

  const std::chrono::seconds bodyTime_;
  const bool secure_;
  HttpHandler& handler_;
  Suspensions& suspensions_;
  MHD_Daemon* daemon_ = nullptr;
};

}  // namespace kyt::devserver
