#include "platform/linux/url/URLTransfer.h"

#include <net/if.h>
#include <strings.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/linux/url/URLNetwork.h"
#include "platform/linux/url/URLSessionState.h"

namespace kyt {
namespace {

constexpr size_t kMaxAddresses = 16;          // of one server that are remembered
constexpr uint8_t kMaxEndedConnections = 32;  // a session keeps eight to a server

}  // namespace

URLTransfer::URLTransfer(std::shared_ptr<URLSessionState> state, OutstandingBytes::User& itsUser,
                         URLRequest wanted, URLCompletion completion, Refusal refused)
    : session(std::move(state)),
      user(itsUser),
      refusal(refused),
      request(std::move(wanted)),
      deadline(Deadline::calling<&URLTransfer::deadlinePassed>(session->network->tools().deadlines, *this)),
      completion_(std::move(completion)),
      reply_(itsUser) {}

void URLTransfer::cancel() {
  session->network->cancel(shared_from_this());
}

void URLTransfer::deadlinePassed() {
  session->network->requests().ends().deadlinePassed(*this);
}

void URLTransfer::deliver() {
  // What the completion holds is gone before anyone who waits for the last request goes on.
  if (URLCompletion completion = std::move(completion_)) {
    const bool answered = !error_ || reply_.response().status != 0;
    completion(std::move(data_), answered ? std::optional(reply_.takeResponse()) : std::nullopt,
               std::move(error_));
  }
  reply_.giveBack();
  session->network->completionHasRun();
}

void URLTransfer::takeReply(int status) {
  URLResponse response = reply_.takeResponse();
  response.status = status;
  reply_.setResponse(std::move(response));
  data_ = reply_.takeBody();
}

void URLTransfer::takeError(int32_t code, std::string description) {
  URLResponse response = reply_.takeResponse();
  clearAttempt();
  const bool isOnTheWay = request.maxRedirects > 0 && response.status / 100 == 3;
  if (!isOnTheWay) reply_.setResponse(std::move(response));
  error_.emplace(Error{kKYTURLErrorDomain, code, std::move(description)});
}

void URLTransfer::clearAttempt() {
  reply_.clear();
  leaveConnection();
  attempt = {};
}

bool URLTransfer::isUnheard() {
  return attempt.connection != nullptr && attempt.connection->hasAcknowledgedNothingBehind(attempt.mark);
}

bool URLTransfer::sharesItsConnection() const {
  if (!attempt.connection) return false;
  const std::vector<URLTransfer*>& all = attempt.connection->transfers;
  return std::any_of(all.begin(), all.end(), [this](URLTransfer* other) {
    return other != this && !other->attempt.endedWith && !other->isUnheard();
  });
}

void URLTransfer::leaveConnection() {
  if (attempt.connection) std::erase(attempt.connection->transfers, this);
}

void URLTransfer::configure(CURL* easy) {
  const CurlLibrary& curl = *session->network->tools().curl;
  if (headers_.empty()) {
    std::erase_if(request.method, [](char c) { return isControl(c) || c == ' '; });
    headers_.make(request.headers, session->configuration.sourceApplication);
    request.headers = {};  // the lines are what is sent, at each attempt
  }
  curl.easySetOption(easy, CURLOPT_PRIVATE, this);
  curl.easySetOption(easy, CURLOPT_URL, request.url.c_str());
  curl.easySetOption(easy, CURLOPT_HTTPHEADER, headers_.list());
  curl.easySetOption(easy, CURLOPT_ERRORBUFFER, attempt.errorText);
  curl.easySetOption(easy, CURLOPT_HEADERFUNCTION, receiveHeader);
  curl.easySetOption(easy, CURLOPT_HEADERDATA, this);
  curl.easySetOption(easy, CURLOPT_WRITEFUNCTION, receiveBody);
  curl.easySetOption(easy, CURLOPT_WRITEDATA, this);
  curl.easySetOption(easy, CURLOPT_XFERINFOFUNCTION, noteProgress);
  curl.easySetOption(easy, CURLOPT_XFERINFODATA, this);
  // A burst shares one HTTP/2 connection. Over plain HTTP there is none to wait for, and waiting would not end before
  // the first answer.
  curl.easySetOption(easy, CURLOPT_PIPEWAIT, strncasecmp(request.url.c_str(), "https", 5) == 0 ? 1L : 0L);
  curl.easySetOption(easy, CURLOPT_PREREQFUNCTION, beginOn);
  curl.easySetOption(easy, CURLOPT_PREREQDATA, this);
  curl.easySetOption(easy, CURLOPT_OPENSOCKETFUNCTION, openSocket);
  curl.easySetOption(easy, CURLOPT_OPENSOCKETDATA, this);
  curl.easySetOption(easy, CURLOPT_FOLLOWLOCATION, request.maxRedirects > 0 ? 1L : 0L);
  curl.easySetOption(easy, CURLOPT_MAXREDIRS, static_cast<long>(request.maxRedirects));

  curl.easySetOption(easy, CURLOPT_HTTPGET, 1L);
  curl.easySetOption(easy, CURLOPT_CUSTOMREQUEST, nullptr);
  if (request.method == "HEAD") {
    curl.easySetOption(easy, CURLOPT_NOBODY, 1L);
  } else if (request.method != "GET" || !request.body.empty()) {
    const std::string_view body = request.body.view();
    curl.easySetOption(easy, CURLOPT_POST, 1L);
    curl.easySetOption(easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
    curl.easySetOption(easy, CURLOPT_POSTFIELDS, body.empty() ? "" : body.data());
    if (request.method != "POST") curl.easySetOption(easy, CURLOPT_CUSTOMREQUEST, request.method.c_str());
  }
}

size_t URLTransfer::receiveHeader(char* bytes, size_t size, size_t count, void* transfer) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  self.attempt.lastProgress = self.session->network->tools().now;
  self.attempt.replyTooLong = self.reply_.takeHeader({bytes, size * count}) != ReceivedReply::Taken::yes;
  return self.attempt.replyTooLong ? 0 : size * count;
}

size_t URLTransfer::receiveBody(char* bytes, size_t size, size_t count, void* transfer) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  self.attempt.lastProgress = self.session->network->tools().now;
  const ReceivedReply::Taken taken = self.reply_.takeBody({bytes, size * count});
  if (taken == ReceivedReply::Taken::noRoom) self.session->network->requests().countReplyWithoutRoom();
  self.attempt.replyTooLong = taken != ReceivedReply::Taken::yes;
  return self.attempt.replyTooLong ? 0 : size * count;
}

int URLTransfer::noteProgress(void* transfer, curl_off_t, curl_off_t received, curl_off_t, curl_off_t sent) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  if (self.attempt.moved != received + sent) {
    self.attempt.moved = received + sent;
    self.attempt.lastProgress = self.session->network->tools().now;
  }
  return 0;
}

// Runs before each time that libcurl sends the request. It would do so again, up to five times, when a kept connection
// ends without an answer, whatever the server has done with what it got: no setting forbids that.
int URLTransfer::beginOn(void* transfer, char* peer, char* local, int peerPort, int localPort) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  self.attempt.wasToBeRepeated = self.attempt.hasBegun && !self.mayBeRepeated();
  if (self.attempt.wasToBeRepeated) return CURL_PREREQFUNC_ABORT;
  self.leaveConnection();
  self.attempt.connection = self.pool->connectionBetween(local, localPort, peer, peerPort);
  if (URLConnection* const chosen = self.attempt.connection.get()) {
    self.attempt.foundEndedConnection =
        chosen->requests > 0 && chosen->hasEnded() && self.endedConnections < kMaxEndedConnections;
    if (self.attempt.foundEndedConnection) {
      ++self.endedConnections;
      return CURL_PREREQFUNC_ABORT;
    }
    self.attempt.mark = chosen->mark();
    ++chosen->requests;
    chosen->transfers.push_back(&self);
    if (self.attempt.addresses.empty()) self.attempt.addresses.push_back(chosen->peer());
  }
  self.attempt.hasBegun = true;
  self.pool->hasBegun(self);
  self.reply_.forgetHeaders();
  return CURL_PREREQFUNC_OK;
}

curl_socket_t URLTransfer::openSocket(void* transfer, curlsocktype, curl_sockaddr* address) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  NetworkTools& tools = self.session->network->tools();
  self.attempt.wasToBeRepeated = self.attempt.hasBegun && !self.mayBeRepeated();
  if (self.attempt.wasToBeRepeated) return CURL_SOCKET_BAD;
  sockaddr_storage peer{};
  if (address->addrlen > sizeof peer) return CURL_SOCKET_BAD;
  std::memcpy(&peer, &address->addr, address->addrlen);
  if (self.attempt.addresses.size() < kMaxAddresses) self.attempt.addresses.push_back(peer);

  std::string interface;
  if (!self.request.allowsCellularAccess) {
    std::optional<std::string> found = tools.routes.interfaceAvoidingCellular(address->addr);
    if (!found) {
      self.attempt.onlyCellularRoutes = tools.routes.isReachable(address->addr, false);
      errno = ENETUNREACH;
      return CURL_SOCKET_BAD;
    }
    interface = std::move(*found);
  }
  const int opened =
      socket(address->family, address->socktype | SOCK_CLOEXEC | SOCK_NONBLOCK, address->protocol);
  if (opened < 0) return CURL_SOCKET_BAD;
  // Bound, so that a change of routes cannot move the connection. Where that is not permitted the route
  // stands.
  if (!interface.empty())
    (void)setsockopt(opened, SOL_SOCKET, SO_BINDTODEVICE, interface.c_str(),
                     static_cast<socklen_t>(interface.size() + 1));
  tools.sockets.opened(opened);
  self.pool->opened(opened, std::move(interface), peer);
  return opened;
}

}  // namespace kyt
