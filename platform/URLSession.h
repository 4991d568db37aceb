// HTTP requests. Callers: the storebag fetch (one process-wide session) and the connectivity helper of each reporting
// session. The real one is libcurl on one network thread (platform/linux/url/CurlURLSession.h).
//
// start() may be called from any thread and never blocks. A completion runs exactly once, on a serial delegate queue that
// the URL session has for each user whose requests it carries (one, for most), never on the caller's thread before start()
// has returned, never on the network thread. Users take turns: however many completions of one are due, another's runs
// after a few hundred of them at most.
// A request other than GET and HEAD is sent again by itself only where the server's TCP has acknowledged not a byte of
// it. Only http and https; TLS 1.2 or newer, always verified; no cookies, no cache. 60 s without progress is a
// time-out, and so is an attempt that takes longer than `Limits::requestSeconds` and what its body may take; a reply
// body over `Limits::maxHTTPReplyBytes` is an error.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/Error.h"
#include "platform/base/Function.h"
#include "platform/objects/Value.h"

namespace kyt {

class BookedEvents;
class UserAccount;

// The domain of transport failures; the code is libcurl's (CURLcode), or one of those below.
inline constexpr char kKYTURLErrorDomain[] = "KYTURLErrorDomain";
inline constexpr int32_t kURLErrorCancelled = -999;            // the session was cancelled (shut-down)
inline constexpr int32_t kURLErrorWaitingTooMuch = -1001;      // displaced while waiting for connectivity
inline constexpr int32_t kURLErrorOutstandingTooMuch = -1002;  // see URLSession::start

struct URLRequest {
  std::string method = "GET";
  std::string url;
  // Sent in this order; control characters are removed.
  std::vector<std::pair<std::string, std::string>> headers;
  Data body;
  std::optional<Duration> timeout;  // from start to end, progress or not; none: only the no-progress time-out
  bool allowsCellularAccess = true;
  // A thread does nothing else until it completes; see URLSessionFactory::cancelAwaited.
  bool isAwaited = false;
  std::shared_ptr<UserAccount> account;  // of the client's user; null: the daemon's own request
  int maxRedirects = 0;                  // followed only while they stay on https
  // What the server can tell from the request anyway about who sends it: requests of one identity may let it see that they
  // come from the same device, those of two never, unless they go through one URL session. Empty: none.
  std::string identity;
  std::shared_ptr<const BookedEvents> events;  // what is told when it begins and ceases to wait; null: nobody
  // Its body exists only since the owner consents: what keeps the request forgets it with the consent.
  bool isByConsent = false;
  // Without a network it fails at once, although the session waits for one.
  bool neverWaits = false;
};

// What a request counts towards what is outstanding, in bytes: header lines, body, and what keeping any request costs.
// At most half of `Limits::maxOutstandingBytes`, so that a large upload, which has a limit of its own, neither fails
// for its size nor shuts out what is posted meanwhile.
[[nodiscard]] size_t countedBytes(const URLRequest& request);

struct URLResponse {
  int status = 0;
  // Of the last response, in order, names as received.
  std::vector<std::pair<std::string, std::string>> headers;
  // The value of that name, compared without case; of several lines of it all values, with ", " between them.
  [[nodiscard]] std::optional<std::string> header(std::string_view name) const;
};

// (data, response, error): with an error there is no data; there is a response when its status line had come, and of its
// headers what had come by then. The status a server has decided on counts even if its reply breaks off.
using URLCompletion = Function<void(std::optional<Data>, std::optional<URLResponse>, std::optional<Error>)>;

// Whether something of the body may have left the device: the server answered, or the connection to it was made.
[[nodiscard]] bool mayHaveLeft(const std::optional<URLResponse>& response, const std::optional<Error>& error);

// What a completion was called with.
struct URLReply {
  std::optional<Data> data;
  std::optional<URLResponse> response;
  std::optional<Error> error;
};

// Marks the request as awaited, has `start` start it with the completion that it is given, and blocks until that
// has run; as long as the request takes. Any thread, but none that completions need to run on.
[[nodiscard]] URLReply startAndWait(URLRequest request, Function<void(URLRequest, URLCompletion)> start);

struct URLSessionConfiguration {
  std::string sourceApplication;  // sent as X-KYT-Source-Application; empty: not sent
  // A request that cannot leave (no route, no resolver) waits for the network.
  bool waitsForConnectivity = false;
};

// A handle to a request that was started; dropping it changes nothing.
class URLTask {
 public:
  virtual ~URLTask() = default;
  virtual void cancel() = 0;  // its completion gets kURLErrorCancelled unless it has run
};

// One connection pool. Destroying it is finishTasksAndInvalidate().
class URLSession {
 public:
  virtual ~URLSession() = default;
  // A request that would make what its user has outstanding in this session count more than
  // `Limits::maxOutstandingBytes`, or more than its user has room for, fails at once with kURLErrorOutstandingTooMuch;
  // those before it, and other users', go on.
  virtual std::shared_ptr<URLTask> start(URLRequest request, URLCompletion completion) = 0;
  // Requests already started still complete and call their completions; later ones fail with kURLErrorCancelled.
  virtual void finishTasksAndInvalidate() = 0;
};

struct URLFigures {
  uint64_t started = 0, completed = 0, failed = 0, waiting = 0, waitingBytes = 0, droppedWhileWaiting = 0,
           refused = 0;  // too much was outstanding; they count as failed too
};

class URLSessionFactory {
 public:
  virtual ~URLSessionFactory() = default;
  [[nodiscard]] virtual std::unique_ptr<URLSession> create(URLSessionConfiguration configuration) = 0;
  // Shut-down, its beginning: requests that threads wait for end with kURLErrorCancelled, wherever they are on
  // their way, and no such request can be started any more. All others go on, and new ones can be started.
  virtual void cancelAwaited() = 0;
  // Shut-down, its end: every request of every session ends with kURLErrorCancelled, and none can be started any more.
  virtual void cancelAll() = 0;
  [[nodiscard]] virtual URLFigures figures() const = 0;
  // Requests not completed yet; the daemon's shut-down waits for zero.
  [[nodiscard]] virtual size_t outstanding() const = 0;
  // From the next request on `changed` runs a moment after each change of the kernel's routes and addresses; null: no more.
  // On the network thread: it must not block. Any thread.
  virtual void watchConnectivity(std::shared_ptr<Function<void()>> changed) = 0;
};

}  // namespace kyt
