#include "platform/linux/url/URLTransfer.h"

#include <net/if.h>
#include <strings.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/linux/url/URLNetwork.h"
#include "platform/linux/url/URLSessionState.h"

namespace kyt {
namespace {

constexpr size_t kMaxReplyHeaderBytes = 256u << 10;
constexpr size_t kMaxAddresses = 16;          // of one server that are remembered
constexpr uint8_t kMaxEndedConnections = 32;  // a session keeps eight to a server

bool isControl(char c) {
  return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
}

bool sameName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::string_view trim(std::string_view text) {
  const size_t first = text.find_first_not_of(" \t\r\n");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t\r\n") - first + 1);
}

std::string withoutControls(std::string_view text) {
  std::string result(text);
  std::erase_if(result, isControl);
  return result;
}

// Of a line as in "HTTP/1.1 200 OK"; 0 of one that is only preliminary.
int statusOf(std::string_view line) {
  int status = 0;
  line.remove_prefix(std::min(line.find(' '), line.size()));
  line.remove_prefix(std::min(line.find_first_not_of(' '), line.size()));
  (void)std::from_chars(line.data(), line.data() + line.size(), status);
  return status >= 200 ? status : 0;
}

}  // namespace

URLTransfer::URLTransfer(std::shared_ptr<URLSessionState> state, URLRequest wanted, URLCompletion completion)
    : session(std::move(state)),
      request(std::move(wanted)),
      deadline(
          session->network->deadlines(),
          [](void* transfer) {
            auto* expired = static_cast<URLTransfer*>(transfer);
            expired->session->network->transferDeadline(*expired);
          },
          this),
      completion_(std::move(completion)) {}

URLTransfer::~URLTransfer() {
  giveReplyBack();
}

void URLTransfer::cancel() {
  session->network->cancel(shared_from_this());
}

void URLTransfer::deliver() {
  // What the completion holds is gone before anyone who waits for the last request goes on.
  if (URLCompletion completion = std::move(completion_)) {
    const bool answered = !error_ || response_.status != 0;
    completion(std::move(data_), answered ? std::optional(std::move(response_)) : std::nullopt,
               std::move(error_));
  }
  giveReplyBack();
  session->network->completionHasRun();
}

void URLTransfer::takeReply(int status) {
  response_.status = status;
  data_.emplace(std::string_view(body_));
  body_ = {};
}

void URLTransfer::takeError(int32_t code, std::string description) {
  URLResponse response = std::move(response_);
  clearReply();
  const bool isOnTheWay = request.maxRedirects > 0 && response.status / 100 == 3;
  if (!isOnTheWay) response_ = std::move(response);
  error_.emplace(Error{kKYTURLErrorDomain, code, std::move(description)});
}

void URLTransfer::clearReply() {
  body_ = {};
  giveReplyBack();
  response_ = {};
  headerBytes_ = 0;
  moved_ = 0;
  errorText[0] = 0;
  addresses.clear();
  onlyCellularRoutes = replyTooLong = false;
  hasBegun = wasToBeRepeated = foundEndedConnection = false;
  endedWith.reset();
  leaveConnection();
  connection.reset();
}

bool URLTransfer::isUnheard() {
  return connection != nullptr && connection->hasAcknowledgedNothingBehind(mark);
}

bool URLTransfer::sharesItsConnection() const {
  return connection != nullptr &&
         std::any_of(connection->transfers.begin(), connection->transfers.end(), [this](URLTransfer* other) {
           return other != this && !other->endedWith && !other->isUnheard();
         });
}

void URLTransfer::leaveConnection() {
  if (connection) std::erase(connection->transfers, this);
}

void URLTransfer::configure(CURL* easy) {
  const CurlLibrary& curl = session->network->curl();
  if (headerList_.empty()) buildHeaders();
  curl.easySetOption(easy, CURLOPT_PRIVATE, this);
  curl.easySetOption(easy, CURLOPT_URL, request.url.c_str());
  curl.easySetOption(easy, CURLOPT_HTTPHEADER, headerList_.data());
  curl.easySetOption(easy, CURLOPT_ERRORBUFFER, errorText);
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

void URLTransfer::buildHeaders() {
  std::erase_if(request.method, [](char c) { return isControl(c) || c == ' '; });
  size_t bytes = 128 + session->configuration.sourceApplication.size();
  for (const auto& [name, value] : request.headers) bytes += name.size() + value.size() + 3;
  headerText_.reserve(bytes);
  bool hasAccept = false, hasType = false;
  for (const auto& [name, value] : request.headers) {
    hasAccept = hasAccept || sameName(name, "Accept");
    hasType = hasType || sameName(name, "Content-Type");
    addHeader(name, value);
  }
  if (!session->configuration.sourceApplication.empty())
    addHeader("X-KYT-Source-Application", session->configuration.sourceApplication);
  // A name with nothing after its colon takes libcurl's own header away.
  for (const auto& [suppressed, wanted] :
       {std::pair("Expect:", true), std::pair("Accept:", !hasAccept), std::pair("Content-Type:", !hasType)}) {
    if (wanted) headerText_.append(suppressed).push_back('\0');
  }
  headerList_.resize(static_cast<size_t>(std::count(headerText_.begin(), headerText_.end(), '\0')));
  char* line = headerText_.data();
  for (size_t i = 0; i < headerList_.size(); ++i) {
    headerList_[i] = {line, i + 1 < headerList_.size() ? &headerList_[i + 1] : nullptr};
    line += std::strlen(line) + 1;
  }
  request.headers = {};  // the lines are what is sent, at each attempt
}

void URLTransfer::addHeader(std::string_view name, std::string_view value) {
  const auto isForbiddenInName = [](char c) { return isControl(c) || c == ':' || c == ' '; };
  if (std::all_of(name.begin(), name.end(), isForbiddenInName)) return;
  std::copy_if(name.begin(), name.end(), std::back_inserter(headerText_),
               [&](char c) { return !isForbiddenInName(c); });
  const bool isEmpty =
      std::all_of(value.begin(), value.end(), [](char c) { return isControl(c) || c == ' '; });
  if (isEmpty) {
    headerText_.push_back(';');  // how libcurl is told of a header without a value
  } else {
    headerText_.append(": ");
    std::copy_if(value.begin(), value.end(), std::back_inserter(headerText_),
                 [](char c) { return !isControl(c); });
  }
  headerText_.push_back('\0');
}

size_t URLTransfer::receiveHeader(char* bytes, size_t size, size_t count, void* transfer) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  const std::string_view line(bytes, size * count);
  self.lastProgress = self.session->network->now();
  self.headerBytes_ += line.size();
  self.replyTooLong = self.headerBytes_ > kMaxReplyHeaderBytes;
  if (self.replyTooLong) return 0;
  if (line.starts_with("HTTP/")) {  // a redirect's or an interim reply's headers are forgotten
    self.response_ = {statusOf(line), {}};
    return line.size();
  }
  const bool isTrailer = !self.body_.empty();
  const size_t colon = line.find(':');
  if (isTrailer || colon == std::string_view::npos || colon == 0) return line.size();
  if (line.front() == ' ' || line.front() == '\t') return line.size();
  self.response_.headers.emplace_back(withoutControls(trim(line.substr(0, colon))),
                                      withoutControls(trim(line.substr(colon + 1))));
  return line.size();
}

size_t URLTransfer::receiveBody(char* bytes, size_t size, size_t count, void* transfer) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  self.lastProgress = self.session->network->now();
  const size_t length = self.body_.size() + size * count;
  self.replyTooLong = length > Limits::maxHTTPReplyBytes || !self.hasRoomFor(length);
  if (self.replyTooLong) return 0;
  self.body_.append(bytes, size * count);
  return size * count;
}

// Mostly what a request counts covers its reply too. What is more counts in large steps.
bool URLTransfer::hasRoomFor(size_t bodyBytes) {
  constexpr size_t kStep = 65536;
  const size_t covered = Limits::freeBytes + replyCharge_;
  if (bodyBytes <= covered) return true;
  const size_t more = std::max(kStep, bodyBytes - covered);
  if (!user->takeReply(more)) {
    session->network->countReplyWithoutRoom();
    return false;
  }
  replyCharge_ += more;
  return true;
}

void URLTransfer::giveReplyBack() {
  if (replyCharge_ != 0) user->giveReplyBack(std::exchange(replyCharge_, 0));
}

int URLTransfer::noteProgress(void* transfer, curl_off_t, curl_off_t received, curl_off_t, curl_off_t sent) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  if (self.moved_ != received + sent) {
    self.moved_ = received + sent;
    self.lastProgress = self.session->network->now();
  }
  return 0;
}

// Runs before each time that libcurl sends the request. It would do so again, up to five times, when a kept connection
// ends without an answer, whatever the server has done with what it got: no setting forbids that.
int URLTransfer::beginOn(void* transfer, char* peer, char* local, int peerPort, int localPort) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  self.wasToBeRepeated = self.hasBegun && !self.mayBeRepeated();
  if (self.wasToBeRepeated) return CURL_PREREQFUNC_ABORT;
  self.leaveConnection();
  self.connection = self.pool->connectionBetween(local, localPort, peer, peerPort);
  if (URLConnection* const chosen = self.connection.get()) {
    self.foundEndedConnection =
        chosen->requests > 0 && chosen->hasEnded() && self.endedConnections < kMaxEndedConnections;
    if (self.foundEndedConnection) {
      ++self.endedConnections;
      return CURL_PREREQFUNC_ABORT;
    }
    self.mark = chosen->mark();
    ++chosen->requests;
    chosen->transfers.push_back(&self);
    if (self.addresses.empty()) self.addresses.push_back(chosen->peer());
  }
  self.hasBegun = true;
  self.response_ = {};
  return CURL_PREREQFUNC_OK;
}

curl_socket_t URLTransfer::openSocket(void* transfer, curlsocktype, curl_sockaddr* address) {
  auto& self = *static_cast<URLTransfer*>(transfer);
  URLNetwork& network = *self.session->network;
  self.wasToBeRepeated = self.hasBegun && !self.mayBeRepeated();
  if (self.wasToBeRepeated) return CURL_SOCKET_BAD;
  sockaddr_storage peer{};
  if (address->addrlen > sizeof peer) return CURL_SOCKET_BAD;
  std::memcpy(&peer, &address->addr, address->addrlen);
  if (self.addresses.size() < kMaxAddresses) self.addresses.push_back(peer);

  std::string interface;
  if (!self.request.allowsCellularAccess) {
    std::optional<std::string> found = network.routes().interfaceAvoidingCellular(address->addr);
    if (!found) {
      self.onlyCellularRoutes = network.routes().isReachable(address->addr, false);
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
  network.sockets().opened(opened);
  self.pool->opened(opened, std::move(interface), peer);
  return opened;
}

}  // namespace kyt
