#include "platform/linux/url/URLConnectionPool.h"

#include <strings.h>
#include <sys/epoll.h>
#include <unistd.h>

#include <algorithm>

#include "platform/base/Limits.h"
#include "platform/linux/url/URLRequests.h"
#include "platform/linux/url/URLSessionState.h"

namespace kyt {
namespace {

constexpr Duration kMostToConnect = std::chrono::seconds(1);  // then others do not wait for it any more
constexpr size_t kKeptHandles = 2;                            // each keeps its buffers

bool usesTLS(const URLTransfer& transfer) {
  return strncasecmp(transfer.request.url.c_str(), "https:", 6) == 0;
}

CURLcode useCertificates(CURL*, void* context, void* connectionsOf) {
  auto& tools = *static_cast<NetworkTools*>(connectionsOf);
  x509_store_st* store = tools.certificates.store();
  if (store == nullptr) return CURLE_SSL_CACERT_BADFILE;
  tools.curl->setCertificateStore(static_cast<ssl_ctx_st*>(context), store);
  return CURLE_OK;
}

}  // namespace

URLConnectionPool::URLConnectionPool(URLRequests& requests, NetworkTools& tools, URLSessionState& session,
                                     size_t number)
    : requests_(requests),
      tools_(tools),
      session_(session),
      number_(number),
      curl_(*tools.curl),
      multi_(curl_.multiInit()),
      growth_(tools,
              {[this](long most) { curl_.multiSetOption(multi_, CURLMOPT_MAX_HOST_CONNECTIONS, most); },
               [this](URLTransfer& transfer) { lookAgain(transfer); }, [this] { return isConnecting(); }}),
      timer_(Deadline::calling<&URLConnectionPool::timerExpired>(tools.deadlines, *this)),
      idle_(Deadline::calling<&URLConnectionPool::closeWhenIdle>(tools.deadlines, *this)) {
  if (multi_ == nullptr) return;
  curl_.multiSetOption(multi_, CURLMOPT_SOCKETFUNCTION, socketChanged);
  curl_.multiSetOption(multi_, CURLMOPT_SOCKETDATA, this);
  curl_.multiSetOption(multi_, CURLMOPT_TIMERFUNCTION, timerChanged);
  curl_.multiSetOption(multi_, CURLMOPT_TIMERDATA, this);
  curl_.multiSetOption(multi_, CURLMOPT_MAX_HOST_CONNECTIONS, 1L);
  curl_.multiSetOption(multi_, CURLMOPT_MAXCONNECTS, ConnectionGrowth::kMost);
}

URLConnectionPool::~URLConnectionPool() {
  leaveIdle();
  for (CURL* handle : idleHandles_) curl_.easyCleanup(handle);
  if (multi_ != nullptr) curl_.multiCleanup(multi_);
}

CURL* URLConnectionPool::takeHandle() {
  if (!idleHandles_.empty()) {
    CURL* handle = idleHandles_.back();
    idleHandles_.pop_back();
    return handle;
  }
  CURL* handle = curl_.easyInit();
  if (handle == nullptr) return nullptr;
  const auto milliseconds = [](Duration duration) {
    return static_cast<long>(std::chrono::duration_cast<std::chrono::milliseconds>(duration).count());
  };
  const auto seconds = [](Duration duration) {
    return static_cast<long>(std::chrono::ceil<std::chrono::seconds>(duration).count());
  };
  const CurlURLSessionOptions& options = tools_.options;
  curl_.easySetOption(handle, CURLOPT_NOSIGNAL, 1L);
  curl_.easySetOption(handle, CURLOPT_NOPROGRESS, 0L);
  curl_.easySetOption(handle, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_.easySetOption(handle, CURLOPT_REDIR_PROTOCOLS_STR, "https");
  curl_.easySetOption(handle, CURLOPT_PROXY, "");  // nor one from the environment
  curl_.easySetOption(handle, CURLOPT_NETRC, static_cast<long>(CURL_NETRC_IGNORED));
  curl_.easySetOption(handle, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
  curl_.easySetOption(handle, CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
  curl_.easySetOption(handle, CURLOPT_SSL_VERIFYPEER, 1L);
  curl_.easySetOption(handle, CURLOPT_SSL_VERIFYHOST, 2L);
  curl_.easySetOption(handle, CURLOPT_CAINFO, nullptr);  // the store below instead
  curl_.easySetOption(handle, CURLOPT_CAPATH, nullptr);
  curl_.easySetOption(handle, CURLOPT_CA_CACHE_TIMEOUT, 0L);  // nor one that libcurl remembers
  curl_.easySetOption(handle, CURLOPT_SSL_CTX_FUNCTION, useCertificates);
  curl_.easySetOption(handle, CURLOPT_SSL_CTX_DATA, &tools_);
  curl_.easySetOption(handle, CURLOPT_BUFFERSIZE, 4096L);  // replies are small, sessions many
  curl_.easySetOption(handle, CURLOPT_TCP_NODELAY, 1L);
  curl_.easySetOption(
      handle, CURLOPT_CONNECTTIMEOUT_MS,
      std::min(milliseconds(options.noProgressTimeout), milliseconds(std::chrono::seconds(30))));
  curl_.easySetOption(handle, CURLOPT_MAXAGE_CONN, seconds(options.idleConnectionTime));
  curl_.easySetOption(handle, CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(Limits::maxHTTPReplyBytes));
  curl_.easySetOption(handle, CURLOPT_CLOSESOCKETFUNCTION, socketClosed);
  curl_.easySetOption(handle, CURLOPT_CLOSESOCKETDATA, this);
  curl_.easySetOption(handle, CURLOPT_QUICK_EXIT, 1L);  // giving up a look-up of a name must not wait for it
  return handle;
}

// A TLS session that is taken up again is not verified again, so none is once authorities have changed.
bool URLConnectionPool::mayResume(const URLTransfer& transfer) {
  if (!usesTLS(transfer)) return true;
  const unsigned generation = tools_.certificates.generation();
  if (!certificates_) certificates_ = generation;
  return *certificates_ == generation;
}

// The server tells those of one identity from others by what they say, so a ticket tells it nothing more.
std::shared_ptr<CURLSH> URLConnectionPool::ticketsFor(const URLTransfer& transfer) {
  const std::string& identity = transfer.request.identity;
  if (!identity.empty())
    return tools_.tickets.of(curl_, identity, tools_.certificates.generation(), routesWhenJudged, tools_.now);
  if (!tickets_) tickets_ = TLSTickets::make(curl_);
  return tickets_;
}

CURLcode URLConnectionPool::add(URLTransfer& transfer) {
  if (!usesTLS(transfer)) growth_.noMatterNow();
  CURL* handle = multi_ == nullptr ? nullptr : takeHandle();
  if (handle == nullptr) return CURLE_OUT_OF_MEMORY;
  transfer.tickets = ticketsFor(transfer);
  if (!transfer.tickets) {
    curl_.easyCleanup(handle);
    return CURLE_OUT_OF_MEMORY;
  }
  transfer.pool = this;
  transfer.configure(handle);
  curl_.easySetOption(handle, CURLOPT_SHARE, transfer.tickets.get());
  curl_.easySetOption(handle, CURLOPT_SSL_SESSIONID_CACHE, mayResume(transfer) ? 1L : 0L);
  if (curl_.multiAdd(multi_, handle) != CURLM_OK) {
    transfer.pool = nullptr;
    curl_.easyCleanup(handle);
    transfer.tickets.reset();
    return CURLE_FAILED_INIT;
  }
  transfer.handle = handle;
  ++active_;
  growth_.wait(transfer);
  leaveIdle();
  return CURLE_OK;
}

void URLConnectionPool::remove(URLTransfer& transfer) {
  CURL* handle = std::exchange(transfer.handle, nullptr);
  curl_.multiRemove(multi_, handle);
  curl_.easySetOption(handle, CURLOPT_SHARE, nullptr);
  transfer.tickets.reset();
  transfer.leaveConnection();
  growth_.leave(transfer);
  transfer.pool = nullptr;
  if (idleHandles_.size() < kKeptHandles) {
    curl_.easySetOption(handle, CURLOPT_ERRORBUFFER, nullptr);
    curl_.easySetOption(handle, CURLOPT_HTTPHEADER, nullptr);
    idleHandles_.push_back(handle);
  } else {
    curl_.easyCleanup(handle);
  }
  --active_;
  closeIfIdle(&transfer);
}

void URLConnectionPool::hasBegun(URLTransfer& transfer) {
  growth_.leave(transfer);
  const std::shared_ptr<URLConnection>& connection = transfer.attempt.connection;
  if (!connection) return;
  if (connection->requests == 1) {
    growth_.connected(tools_.now - connection->opened);
    connection->carriesManyAtOnce = curl_.speaksHTTP2(transfer.handle);
  }
  if (connection->carriesManyAtOnce) growth_.noMatter();
}

// libcurl puts a request aside that no connection is free for, and does not look at it again before another one ends.
void URLConnectionPool::lookAgain(URLTransfer& transfer) {
  curl_.multiRemove(multi_, transfer.handle);
  if (curl_.multiAdd(multi_, transfer.handle) != CURLM_OK)
    requests_.fail(transfer, CURLE_FAILED_INIT, curl_.easyErrorText(CURLE_FAILED_INIT));
}

bool URLConnectionPool::isConnecting() const {
  return connections_.empty() ||
         std::any_of(connections_.begin(), connections_.end(), [this](const auto& one) {
           return !one->isConnected() && tools_.now < one->opened + kMostToConnect;
         });
}

void URLConnectionPool::closeIfIdle(const URLTransfer* leaving) {
  if (active_ != 0 || isRetired_) return;
  leaveIdle();
  growth_.reset();
  const URLTransfer* first = session_.transfers.first();
  const bool othersStandInLine = first != nullptr && (first != leaving || first->links.next != nullptr);
  const bool now = session_.invalidated.load() && !othersStandInLine;
  idle_.set(now ? tools_.now : tools_.now + tools_.options.idleConnectionTime);
  IdlePools& idle = requests_.pools().idle();
  idle.add(*this);
  while (URLConnectionPool* surplus = idle.takeSurplus()) surplus->idle_.set(tools_.now);
}

void URLConnectionPool::leaveIdle() {
  idle_.cancel();
  requests_.pools().idle().remove(*this);
}

void URLConnectionPool::retire() {
  leaveIdle();
  isRetired_ = true;
}

void URLConnectionPool::opened(int socket, std::string interface, const sockaddr_storage& peer) {
  std::erase_if(connections_, [&](const auto& one) { return one->socket() == socket; });
  connections_.push_back(std::make_shared<URLConnection>(socket, std::move(interface), peer, tools_.now));
}

std::shared_ptr<URLConnection> URLConnectionPool::connectionBetween(const char* local, int localPort,
                                                                    const char* peer, int peerPort) {
  for (const auto& one : connections_)
    if (one->isBetween(local, localPort, peer, peerPort)) return one;
  return nullptr;
}

int URLConnectionPool::socketClosed(void* pool, curl_socket_t socket) {
  auto& self = *static_cast<URLConnectionPool*>(pool);
  for (const auto& one : self.connections_) {
    if (one->socket() != socket) continue;
    one->closing();
    for (URLTransfer* transfer : one->transfers)
      self.growth_.wait(*transfer);  // those libcurl would send again
  }
  std::erase_if(self.connections_, [&](const auto& one) { return one->socket() == socket; });
  self.tools_.sockets.closed(socket);
  return close(socket);
}

bool URLConnectionPool::judgeConnections(uint64_t routes) {
  bool good = true;
  routesWhenJudged = routes;
  for (const auto& one : connections_) {
    const RouteTable::Way way = one->way(tools_.routes, number_ == 1);
    good = good && way == RouteTable::Way::same;
    if (!one->isConnected()) continue;  // nothing has begun on it
    if (way != RouteTable::Way::none) {
      one->lostSince.reset();
    } else if (!one->lostSince) {
      one->lostSince = tools_.now;
      for (URLTransfer* transfer : one->transfers) requests_.ends().connectionLost(*transfer);
    }
  }
  return good;
}

int URLConnectionPool::socketChanged(CURL*, curl_socket_t socket, int what, void* pool, void*) {
  auto& self = *static_cast<URLConnectionPool*>(pool);
  self.tools_.sockets.watch(self, socket, what);
  return 0;
}

int URLConnectionPool::timerChanged(CURLM*, long milliseconds, void* pool) {
  auto& self = *static_cast<URLConnectionPool*>(pool);
  if (milliseconds < 0) {
    self.timer_.cancel();
  } else {
    self.timer_.set(self.tools_.now + std::chrono::milliseconds(milliseconds));
  }
  return 0;
}

void URLConnectionPool::timerExpired() {
  int running = 0;
  curl_.multiSocketAction(multi_, CURL_SOCKET_TIMEOUT, 0, &running);
  finishEnded();
}

void URLConnectionPool::closeWhenIdle() {
  requests_.pools().idle().remove(*this);
  requests_.closePool(session_, number_);
}

void URLConnectionPool::socketReady(int socket, uint32_t events) {
  int mask = 0, running = 0;
  if ((events & (EPOLLIN | EPOLLHUP)) != 0) mask |= CURL_CSELECT_IN;
  if ((events & EPOLLOUT) != 0) mask |= CURL_CSELECT_OUT;
  if ((events & EPOLLERR) != 0) mask |= CURL_CSELECT_ERR;
  curl_.multiSocketAction(multi_, socket, mask, &running);
  finishEnded();
}

void URLConnectionPool::finishEnded() {
  int left = 0;
  while (const CURLMsg* message = curl_.multiReadInfo(multi_, &left)) {
    if (message->msg != CURLMSG_DONE) continue;
    URLTransfer* transfer = nullptr;
    const CURLcode code = message->data.result;
    curl_.easyGetInfo(message->easy_handle, CURLINFO_PRIVATE, &transfer);
    requests_.ends().attemptEnded(*transfer, code);
  }
}

}  // namespace kyt
