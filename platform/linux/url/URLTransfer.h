// One request on its way: from start() until its completion has run. It is the task handed to the caller,
// what libcurl's callbacks work on, and what waits for connectivity.
//
// The request and completion are the starter's until they reach the network thread, then everything is the
// network thread's until the result is handed to the session's delegate queue, where deliver() runs.
#pragma once

#include <curl/curl.h>
#include <sys/socket.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/URLSession.h"
#include "platform/base/OutstandingBytes.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/HeaderLines.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/ReceivedReply.h"
#include "platform/linux/url/URLConnection.h"

namespace kyt {

class URLConnectionPool;
struct URLSessionState;

class URLTransfer final : public URLTask, public std::enable_shared_from_this<URLTransfer> {
 public:
  // Started too late, the session was invalidated; or while too much of it was outstanding.
  enum class Refusal : uint8_t { none, invalidated, tooMuch };
  // `user`: its part of the session's account.
  URLTransfer(std::shared_ptr<URLSessionState> session, OutstandingBytes::User& user, URLRequest request,
              URLCompletion completion, Refusal refusal);
  ~URLTransfer() override = default;
  URLTransfer(const URLTransfer&) = delete;
  URLTransfer& operator=(const URLTransfer&) = delete;
  void cancel() override;

  // Delegate queue: calls the completion with the result.
  void deliver();

  // Its user, for whom it stands in line (OutstandingBytes::User::owner).
  [[nodiscard]] uint64_t owner() const { return user.owner(); }

  // The rest is for the network thread.
  enum class Phase : uint8_t { submitted, inLine, active, waiting, done };

  // One go at sending it. Of the last one, while it waits.
  struct Attempt {
    bool onlyCellularRoutes = false;  // why it opened no connection
    bool replyTooLong = false;        // … or ended
    bool hasBegun = false;            // it was handed to a connection, which may have sent some of it
    bool wasToBeRepeated = false;     // libcurl was about to send it again, and was not let
    // The kept connection that was chosen for it had ended already, so the request has not begun.
    bool foundEndedConnection = false;
    // libcurl has ended it, and what becomes of it is not decided: the server may not have it, and others need the
    // answers that its connection still brings.
    std::optional<CURLcode> endedWith;
    std::shared_ptr<URLConnection> connection;  // that it began on last
    URLConnection::Mark mark;                   // before its first byte
    uint64_t routes = 0;                        // the number of their last change when it began
    curl_off_t moved = 0;                       // bytes, both ways
    MonotonicTime lastProgress;
    MonotonicTime latestEnd;
    MonotonicTime lostLook = MonotonicTime::max();  // when to look again at a connection that is lost
    std::vector<sockaddr_storage> addresses;        // that it tried to connect to
    char errorText[CURL_ERROR_SIZE] = {};
  };

  // Sets what differs between requests; everything else was set when the handle was made.
  void configure(CURL* handle);
  // Forgets an earlier attempt and what it received.
  void clearAttempt();
  // Whether the peer's TCP is known to have acknowledged not a byte of it. Of one that has begun.
  [[nodiscard]] bool isUnheard();
  // Whether the server has something of another request on its connection, so that breaking that off would lose an
  // answer.
  [[nodiscard]] bool sharesItsConnection() const;
  // It is on its way on no connection any more; what is known of the one it was on stays.
  void leaveConnection();
  // Of the request's headers, once it has been configured.
  [[nodiscard]] size_t headerSize() const { return headers_.size(); }
  void takeReply(int status);
  void takeError(int32_t code, std::string description);

  const std::shared_ptr<URLSessionState> session;
  OutstandingBytes::User& user;
  const Refusal refusal;
  URLRequest request;
  Phase phase = Phase::submitted;
  uint8_t immediateRetries = 0;
  uint8_t endedConnections = 0;       // that were chosen for it
  Links<URLTransfer> links;           // among its session's
  Links<URLTransfer> waitingLinks;    // those of its user that wait, while it waits
  std::shared_ptr<URLTransfer> self;  // keeps it alive while the network thread has it
  Links<URLTransfer> unbegunLinks;    // those of its pool that have not begun, while isUnbegun
  bool isUnbegun = false;             // no connection has been found for it
  CURL* handle = nullptr;             // while active
  std::shared_ptr<CURLSH> tickets;    // while active: the TLS sessions that it may take up again
  URLConnectionPool* pool = nullptr;  // while active
  Attempt attempt;
  size_t waitingCharge = 0;      // while waiting
  size_t countedBytes = 0;       // RequestLines's, while it is on its way
  size_t outstandingCharge = 0;  // until its result is set
  MonotonicTime started;
  Deadline deadline;

 private:
  void deadlinePassed();
  static size_t receiveHeader(char* bytes, size_t size, size_t count, void* transfer);
  static size_t receiveBody(char* bytes, size_t size, size_t count, void* transfer);
  static int beginOn(void* transfer, char* peer, char* local, int peerPort, int localPort);
  static int noteProgress(void* transfer, curl_off_t, curl_off_t received, curl_off_t, curl_off_t sent);
  static curl_socket_t openSocket(void* transfer, curlsocktype, curl_sockaddr* address);
  [[nodiscard]] bool mayBeRepeated() const { return request.method == "GET" || request.method == "HEAD"; }

  URLCompletion completion_;
  HeaderLines headers_;
  ReceivedReply reply_;
  std::optional<Data> data_;
  std::optional<Error> error_;
};

}  // namespace kyt
