#include "http/HttpServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <string_view>
#include <utility>
#include <vector>

#include "http/LaterReply.h"
#include "http/StreamQueue.h"
#include "http/Text.h"

namespace kyt::http {
namespace {

// At most so much of a body gets its room at once, whatever its length is said to be.
constexpr uint64_t kFirstRoom = 65536;

MHD_Result collect(void* into, MHD_ValueKind, const char* name, const char* value) {
  static_cast<std::vector<Header>*>(into)->push_back({name, value != nullptr ? value : ""});
  return MHD_YES;
}

// A name or path with a zero byte would end there for us, though not for whoever looked at it before: it stays as it came.
size_t unescape(void* /*context*/, MHD_Connection* /*connection*/, char* text) {
  return std::strstr(text, "%00") != nullptr ? std::strlen(text) : MHD_http_unescape(text);
}

constexpr std::array<bool, 256> kNameCharacters = [] {
  std::array<bool, 256> characters{};
  for (unsigned c = '!'; c <= '~'; ++c)
    characters[c] =
        std::string_view("\"(),/:;<=>?@[\\]{}").find(static_cast<char>(c)) == std::string_view::npos;
  return characters;
}();

bool isName(std::string_view text) {
  return !text.empty() && std::all_of(text.begin(), text.end(),
                                      [](char c) { return kNameCharacters[static_cast<unsigned char>(c)]; });
}

// Where the body ends can be read in two ways: a proxy in front may see other requests than we do. The library, which
// takes the first length and overlooks a name that ends with a space, is more tolerant than RFC 9112 allows.
bool isAmbiguous(const std::vector<Header>& headers) {
  size_t lengths = 0, encodings = 0;
  for (const Header& header : headers) {
    if (!isName(header.name)) return true;
    if (equalIgnoringCase(header.name, "Content-Length")) ++lengths;
    if (!equalIgnoringCase(header.name, "Transfer-Encoding")) continue;
    ++encodings;
    if (!equalIgnoringCase(header.value, "chunked")) return true;
  }
  return lengths + encodings > 1;
}

std::optional<uint64_t> lengthOf(std::string_view text) {
  uint64_t length = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), length);
  if (text.empty() || error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return length;
}

ssize_t readStream(void* context, uint64_t, char* out, size_t size) {
  auto& [queue, connection] =
      *static_cast<std::pair<std::shared_ptr<StreamQueue>, MHD_Connection*>*>(context);
  return queue->read(connection, out, size);
}

void freeStream(void* context) {
  delete static_cast<std::pair<std::shared_ptr<StreamQueue>, MHD_Connection*>*>(context);
}

MHD_Result send(MHD_Connection* connection, const Reply& reply, bool isLast) {
  if (reply.close) return MHD_NO;
  MHD_Response* response = MHD_create_response_from_buffer(
      reply.body.size(), const_cast<char*>(reply.body.data()), MHD_RESPMEM_MUST_COPY);
  if (!reply.body.empty()) MHD_add_response_header(response, "Content-Type", reply.type.c_str());
  MHD_add_response_header(response, "X-Content-Type-Options", "nosniff");
  if (isLast) MHD_add_response_header(response, "Connection", "close");
  for (const Header& header : reply.headers) {
    MHD_add_response_header(response, header.name.c_str(), header.value.c_str());
  }
  const MHD_Result result = MHD_queue_response(connection, reply.status, response);
  MHD_destroy_response(response);
  return result;
}

MHD_Result sendStream(MHD_Connection* connection, std::shared_ptr<StreamQueue> queue) {
  constexpr size_t kBlock = 16384;
  auto* context = new std::pair<std::shared_ptr<StreamQueue>, MHD_Connection*>(std::move(queue), connection);
  MHD_Response* response =
      MHD_create_response_from_callback(MHD_SIZE_UNKNOWN, kBlock, readStream, context, freeStream);
  MHD_add_response_header(response, "Content-Type", "text/event-stream");
  MHD_add_response_header(response, "Cache-Control", "no-store");
  const MHD_Result result = MHD_queue_response(connection, 200, response);
  MHD_destroy_response(response);
  return result;
}

// A listening socket on the address, or -1 with the reason.
int listenOn(const std::string& address, uint16_t port, std::string& error) {
  sockaddr_in v4{};
  sockaddr_in6 v6{};
  v4.sin_family = AF_INET;
  v4.sin_port = htons(port);
  v6.sin6_family = AF_INET6;
  v6.sin6_port = htons(port);
  const bool isV4 = inet_pton(AF_INET, address.c_str(), &v4.sin_addr) == 1;
  if (!isV4 && inet_pton(AF_INET6, address.c_str(), &v6.sin6_addr) != 1) {
    error = "\"" + printable(address) + "\" is no address to listen on";
    return -1;
  }
  const int descriptor = socket(isV4 ? AF_INET : AF_INET6, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  const int on = 1;
  const auto* name = isV4 ? reinterpret_cast<const sockaddr*>(&v4) : reinterpret_cast<const sockaddr*>(&v6);
  const socklen_t size = isV4 ? sizeof v4 : sizeof v6;
  if (descriptor < 0 || setsockopt(descriptor, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on) != 0 ||
      bind(descriptor, name, size) != 0 || listen(descriptor, SOMAXCONN) != 0) {
    error = "can't listen on " + address + " port " + std::to_string(port) + ": " + std::strerror(errno);
    if (descriptor >= 0) close(descriptor);
    return -1;
  }
  return descriptor;
}

}  // namespace

// What is known of a connection besides its requests. The mutex guards the times, since others read them.
struct HttpServer::Connection {
  int descriptor = -1;
  SteadyTime since = std::chrono::steady_clock::now();  // its beginning, or its last answer
  bool hasRequest = false;                              // its headers are there
  bool hasBody = false;  // … and its body is whole: what follows takes our time
};

// One request from its headers to its answer. Belongs to the connection's thread.
class HttpServer::Exchange {
 public:
  Exchange(HttpServer& server, MHD_Connection* connection, const char* path, const char* method)
      : server_(server), connection_(connection) {
    ++server_.inProgress_;
    mark(true, false);
    request_.method = method;
    request_.path = path;
    request_.secure = server.secure_;
    MHD_get_connection_values(connection, MHD_HEADER_KIND, collect, &request_.headers);
    MHD_get_connection_values(connection, MHD_GET_ARGUMENT_KIND, collect, &request_.arguments);
    if (const std::string* length = request_.header("Content-Length"))
      request_.contentLength = lengthOf(*length);
    isAmbiguous_ = isAmbiguous(request_.headers);
    limit_ = server.handler_.bodyLimit(request_);
    request_.tooLarge = request_.contentLength && *request_.contentLength > limit_;
    isRefused_ = request_.tooLarge || server.handler_.isRefused(request_);
    if (request_.contentLength && !isRefused_)
      request_.body.reserve(std::min(*request_.contentLength, kFirstRoom));
  }
  ~Exchange() {
    server_.bodiesBytes_ -= kept_;
    mark(false, false);
    --server_.inProgress_;
  }
  Exchange(const Exchange&) = delete;
  Exchange& operator=(const Exchange&) = delete;

  // The headers are there. A client that asks before it sends too much is answered at once.
  MHD_Result begin() {
    if (isAmbiguous_) {
      isLast_ = answered_ = true;
      server_.handler_.ambiguous();
      return finish(textReply(400, "the request can be read in two ways\n"));
    }
    if (!isRefused_) return MHD_YES;
    const bool isLong = request_.contentLength && *request_.contentLength > server_.maxDrainBytes_;
    isLast_ = isLong || request_.header("Expect") != nullptr;
    return isLast_ ? conclude() : MHD_YES;
  }

  MHD_Result take(const char* bytes, size_t* size) {
    request_.bodySize += *size;
    if (request_.bodySize > limit_) request_.tooLarge = true;
    if (isRefused_ || request_.tooLarge)
      sample({bytes, *size});
    else if (!request_.noRoom)
      keep({bytes, *size});
    if (isRefused_ && request_.bodySize > server_.maxDrainBytes_) {
      // In the middle of a body the library sends no answer.
      static_cast<void>(conclude());
      return MHD_NO;
    }
    *size = 0;
    if (std::chrono::steady_clock::now() - request_.began <= server_.bodyTime_) return MHD_YES;
    request_.tooSlow = true;
    server_.handler_.broken(request_);
    answered_ = true;
    return MHD_NO;
  }

  // The body is whole, or the wait is over.
  MHD_Result conclude() {
    if (!answered_) {
      answered_ = true;
      mark(true, true);
      answer_ = server_.handler_.answer(request_);
    }
    if (auto* reply = std::get_if<Reply>(&answer_)) return finish(*reply);
    if (auto* stream = std::get_if<std::shared_ptr<StreamQueue>>(&answer_))
      return sendStream(connection_, *stream);
    if (auto* later = std::get_if<std::shared_ptr<LaterReply>>(&answer_)) {
      const std::optional<Reply> reply = (*later)->takeOrSuspend(connection_);
      return reply ? finish(*reply) : MHD_YES;
    }
    return wait(std::get<Wait>(answer_));
  }

  void end(MHD_RequestTerminationCode code) {
    if (answered_) return;
    const bool isLate = std::chrono::steady_clock::now() - request_.began > server_.bodyTime_;
    request_.tooSlow = isLate || code == MHD_REQUEST_TERMINATED_TIMEOUT_REACHED;
    server_.handler_.broken(request_);
  }

 private:
  // The beginning alone, of which some may be there.
  void sample(std::string_view bytes) {
    const uint64_t wanted = server_.handler_.sampleBytes();
    if (request_.body.size() > wanted) request_.body.resize(wanted);
    if (!request_.noRoom) keep(bytes.substr(0, wanted - request_.body.size()));
  }

  // Takes room for the bytes from that of all requests.
  void keep(std::string_view bytes) {
    if ((server_.bodiesBytes_ += bytes.size()) > server_.maxBodiesBytes_) {
      server_.bodiesBytes_ -= bytes.size();
      request_.noRoom = true;
      request_.body.clear();
      return;
    }
    kept_ += bytes.size();
    request_.body.append(bytes);
  }

  void mark(bool hasRequest, bool hasBody) {
    const MHD_ConnectionInfo* info = MHD_get_connection_info(connection_, MHD_CONNECTION_INFO_SOCKET_CONTEXT);
    if (info == nullptr || info->socket_context == nullptr) return;
    auto& connection = *static_cast<Connection*>(info->socket_context);
    MutexLock lock(server_.mutex_);
    connection.since = std::chrono::steady_clock::now();
    connection.hasRequest = hasRequest;
    connection.hasBody = hasBody;
  }

  MHD_Result finish(const Reply& reply) {
    return send(connection_, reply, isLast_ || server_.refusesConnections_.load(std::memory_order_relaxed));
  }

  MHD_Result wait(Wait& wait) {
    for (;;) {
      const uint64_t generation = server_.suspensions_.generation();
      const bool expired =
          std::chrono::steady_clock::now() >= wait.deadline || server_.suspensions_.stopped();
      if (const std::optional<Reply> reply = wait.poll(expired)) return finish(*reply);
      if (expired) return MHD_NO;
      if (server_.suspensions_.suspend(connection_, wait, generation)) return MHD_YES;
    }
  }

  HttpServer& server_;
  MHD_Connection* connection_;
  Request request_;
  Answer answer_;
  uint64_t limit_ = 0, kept_ = 0;
  bool isRefused_ = false;  // whatever the body is
  bool isAmbiguous_ = false;
  bool isLast_ = false;  // of its connection
  bool answered_ = false;
};

MHD_Result HttpServer::onRequest(void* self, MHD_Connection* connection, const char* path, const char* method,
                                 const char* /*version*/, const char* body, size_t* bodySize,
                                 void** exchange) {
  if (*exchange == nullptr) {
    auto* made = new Exchange(*static_cast<HttpServer*>(self), connection, path, method);
    *exchange = made;
    return made->begin();
  }
  auto* known = static_cast<Exchange*>(*exchange);
  return *bodySize > 0 ? known->take(body, bodySize) : known->conclude();
}

void HttpServer::onEnd(void* /*self*/, MHD_Connection* /*connection*/, void** exchange,
                       MHD_RequestTerminationCode code) {
  const std::unique_ptr<Exchange> ended(static_cast<Exchange*>(*exchange));
  *exchange = nullptr;
  if (ended) ended->end(code);
}

void HttpServer::onConnection(void* self, MHD_Connection* connection, void** context,
                              MHD_ConnectionNotificationCode code) {
  auto& server = *static_cast<HttpServer*>(self);
  MutexLock lock(server.mutex_);
  if (code == MHD_CONNECTION_NOTIFY_STARTED) {
    const MHD_ConnectionInfo* info = MHD_get_connection_info(connection, MHD_CONNECTION_INFO_CONNECTION_FD);
    auto made = std::make_unique<Connection>();
    if (info != nullptr) made->descriptor = info->connect_fd;
    server.connections_.insert(made.get());
    *context = made.release();
  } else if (*context != nullptr) {
    // The library closes the descriptor after this.
    const std::unique_ptr<Connection> ended(static_cast<Connection*>(std::exchange(*context, nullptr)));
    server.connections_.erase(ended.get());
  }
}

uint64_t HttpServer::connections() {
  MutexLock lock(mutex_);
  return connections_.size();
}

void HttpServer::endSlowConnections(std::chrono::seconds withoutRequest) {
  const SteadyTime now = std::chrono::steady_clock::now();
  MutexLock lock(mutex_);
  for (const Connection* connection : connections_) {
    if (connection->hasBody) continue;
    if (now - connection->since > (connection->hasRequest ? bodyTime_ : withoutRequest))
      shutdown(connection->descriptor, SHUT_RDWR);
  }
}

std::unique_ptr<HttpServer> HttpServer::start(const ServerOptions& options, const Identity* identity,
                                              HttpHandler& handler, Suspensions& suspensions,
                                              std::string& error) {
  const int listener = listenOn(options.address, options.port, error);
  if (listener < 0) return nullptr;
  std::unique_ptr<HttpServer> server(new HttpServer(options, identity != nullptr, handler, suspensions));
  // With epoll the library overlooks the end of a connection that came together with its last bytes, until
  // the time-out; poll sees it at once, and suspended connections are not among those it asks about.
  unsigned flags = MHD_USE_POLL_INTERNAL_THREAD | MHD_ALLOW_SUSPEND_RESUME;
  if (identity != nullptr) flags |= MHD_USE_TLS;
  std::vector<MHD_OptionItem> more;
  if (options.threads > 1) more.push_back({MHD_OPTION_THREAD_POOL_SIZE, options.threads, nullptr});
  if (identity != nullptr) {
    more.push_back({MHD_OPTION_HTTPS_MEM_KEY, 0, const_cast<char*>(identity->key.c_str())});
    more.push_back({MHD_OPTION_HTTPS_MEM_CERT, 0, const_cast<char*>(identity->certificate.c_str())});
    more.push_back(
        {MHD_OPTION_HTTPS_PRIORITIES, 0, const_cast<char*>("NORMAL:-VERS-ALL:+VERS-TLS1.3:+VERS-TLS1.2")});
  }
  more.push_back({MHD_OPTION_END, 0, nullptr});
  server->daemon_ = MHD_start_daemon(
      flags, options.port, nullptr, nullptr, &HttpServer::onRequest, server.get(), MHD_OPTION_LISTEN_SOCKET,
      listener, MHD_OPTION_UNESCAPE_CALLBACK, &unescape, nullptr, MHD_OPTION_ARRAY, more.data(),
      MHD_OPTION_CONNECTION_LIMIT, options.maxConnections, MHD_OPTION_CONNECTION_TIMEOUT,
      static_cast<unsigned>(options.idleTime.count()), MHD_OPTION_NOTIFY_COMPLETED, &HttpServer::onEnd,
      server.get(), MHD_OPTION_NOTIFY_CONNECTION, &HttpServer::onConnection, server.get(), MHD_OPTION_END);
  if (server->daemon_ == nullptr) {
    error = "can't start the server on " + options.address + " port " + std::to_string(options.port);
    if (identity != nullptr) error += ": are certificate and key PEM, and of each other?";
    close(listener);
    return nullptr;
  }
  return server;
}

HttpServer::~HttpServer() {
  if (daemon_ != nullptr) MHD_stop_daemon(daemon_);
}

void HttpServer::refuseConnections() {
  if (refusesConnections_.exchange(true)) return;
  const int listener = MHD_quiesce_daemon(daemon_);
  if (listener >= 0) close(listener);
}

uint16_t HttpServer::port() const {
  const MHD_DaemonInfo* info = MHD_get_daemon_info(daemon_, MHD_DAEMON_INFO_LISTEN_FD);
  sockaddr_storage address{};
  socklen_t size = sizeof address;
  if (info == nullptr || getsockname(info->listen_fd, reinterpret_cast<sockaddr*>(&address), &size) != 0)
    return 0;
  return ntohs(address.ss_family == AF_INET ? reinterpret_cast<sockaddr_in*>(&address)->sin_port
                                            : reinterpret_cast<sockaddr_in6*>(&address)->sin6_port);
}

}  // namespace kyt::http
