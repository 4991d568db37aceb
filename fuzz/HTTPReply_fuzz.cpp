// Feeds a server's reply, byte for byte, to a real URL session over loopback. Whatever the bytes, the
// completion must run once, with a response or an error but not both, and with no more data than is allowed;
// what header values keep must hold no control characters, since they go into log lines.
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/Log.h"

namespace {

class NoSink final : public kyt::LogSink {
 public:
  void write(kyt::LogLevel, std::string_view) override {}
};

void check(bool condition) {
  if (!condition) std::abort();
}

// Answers every connection with the input of the moment once the request has come, and closes it.
class Server {
 public:
  Server() : listener_(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    check(bind(listener_, reinterpret_cast<sockaddr*>(&address), size) == 0 && listen(listener_, 16) == 0);
    getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &size);
    url_ = "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port)) + "/";
    std::thread([this] { serve(); }).detach();
  }
  void setReply(std::string_view reply) {
    const std::lock_guard lock(mutex_);
    reply_ = reply;
  }
  [[nodiscard]] const std::string& url() const { return url_; }

 private:
  void serve() {
    for (;;) {
      const int connection = accept(listener_, nullptr, nullptr);
      if (connection < 0) continue;
      char bytes[4096];
      if (recv(connection, bytes, sizeof bytes, 0) > 0) {
        std::unique_lock lock(mutex_);
        const std::string reply = reply_;
        lock.unlock();
        for (size_t sent = 0; sent < reply.size();) {
          const ssize_t count = send(connection, reply.data() + sent, reply.size() - sent, MSG_NOSIGNAL);
          if (count <= 0) break;
          sent += static_cast<size_t>(count);
        }
        // Closed in order, so that the client reads all of it first.
        shutdown(connection, SHUT_WR);
        while (recv(connection, bytes, sizeof bytes, 0) > 0) continue;
      }
      close(connection);
    }
  }
  int listener_;
  std::string url_, reply_;
  std::mutex mutex_;
};

// Never destroyed: its threads live as long as the fuzzer.
struct World {
  Server server;
  NoSink sink;
  kyt::Log log{sink};
  kyt::Counters counters;
  kyt::CurlURLSessionFactory factory{[] {
                                       kyt::CurlURLSessionOptions options;
                                       options.noProgressTimeout = std::chrono::seconds(2);
                                       return options;
                                     }(),
                                     log, counters};
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  static World& world = *new World;  // NOLINT(cppcoreguidelines-owning-memory)
  if (size == 0) return 0;
  // The first byte chooses the request, the rest is the reply.
  world.server.setReply({reinterpret_cast<const char*>(bytes) + 1, size - 1});
  const auto session = world.factory.create({"com.vantu.system.diagnostics", (bytes[0] & 1) != 0});
  kyt::URLRequest request;
  request.url = world.server.url();
  if ((bytes[0] & 2) != 0) {
    request.method = "POST";
    request.body = kyt::Data(std::string_view("{}"));
  }  // no redirects: the fuzzer would lead us anywhere
  kyt::Semaphore done;
  session->start(std::move(request), [&](auto data, auto response, auto error) {
    // A reply that breaks off after its status line is a response without data, and an error.
    check(error ? !data : data && response);
    if (data) check(data->size() <= kyt::Limits::maxHTTPReplyBytes);
    if (response) {
      for (const auto& [name, value] : response->headers)
        for (const char c : name + value) check(static_cast<unsigned char>(c) >= 0x20 && c != 0x7f);
    }
    done.signal();
  });
  done.wait();
  return 0;
}
