// What a request is and what can be answered, without the HTTP library: the seam between HttpServer, which
// speaks the protocol, and the programs that serve (the development server's Router, the receiver's door).
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace kyt::http {

struct Header {
  std::string name, value;
};

// The value of a header, whatever the case of its name, or null.
[[nodiscard]] const std::string* findHeader(const std::vector<Header>& headers, std::string_view name);

using SteadyTime = std::chrono::steady_clock::time_point;

struct Request {
  std::string method, path;
  std::vector<Header> headers;
  std::vector<Header> arguments;  // of the query, decoded
  std::string body;               // of one that was refused or too large its beginning at most
  uint64_t bodySize = 0;          // bytes that came, kept or not
  std::optional<uint64_t> contentLength;
  bool secure = false;
  bool tooLarge = false;  // the body was over the limit
  bool tooSlow = false;   // the body was not whole when its time was over
  bool noRoom = false;    // the bodies of all requests together were over the limit: this one was not kept
  SteadyTime began = std::chrono::steady_clock::now();

  [[nodiscard]] const std::string* header(std::string_view name) const;
  [[nodiscard]] std::optional<std::string_view> argument(std::string_view name) const;
};

struct Reply {
  unsigned status = 200;
  std::string body;
  std::string type = "text/plain; charset=utf-8";
  std::vector<Header> headers;
  bool close = false;  // end the connection without an answer
};

[[nodiscard]] Reply textReply(unsigned status, std::string text);

// What a waiting request waits for besides its deadline.
enum class WaitFor {
  rules,
  data
};  // data: whatever the store has newly written; both: a change of the reply rules

// The answer is not known yet. `poll` is called again on the server's thread whenever Suspensions::wake says
// that what it waits for may be there, and once with `expired` at the deadline, when it must answer.
// Meanwhile the connection costs no thread.
struct Wait {
  SteadyTime deadline;
  WaitFor what = WaitFor::rules;
  std::function<std::optional<Reply>(bool expired)> poll;
};

class StreamQueue;
class LaterReply;

// LaterReply: whoever holds it gives the reply, once, from any thread.
using Answer = std::variant<Reply, Wait, std::shared_ptr<StreamQueue>, std::shared_ptr<LaterReply>>;

// The application. Called on the server's threads, for several requests at a time.
class HttpHandler {
 public:
  virtual ~HttpHandler() = default;
  // The headers are there. True: answer() gives a reply, whatever the body is. The body is read all the same, within
  // ServerOptions::maxDrainBytes, for whoever is still writing may overlook what is answered before.
  [[nodiscard]] virtual bool isRefused(const Request& /*request*/) const { return false; }
  // Of a body that is refused or too large so many bytes of its beginning are kept.
  [[nodiscard]] virtual uint64_t sampleBytes() const { return 0; }
  // The most bytes of body to be kept for this request (whose headers are there).
  [[nodiscard]] virtual uint64_t bodyLimit(const Request& request) const = 0;
  // The request can be read in two ways, and was answered with 400.
  virtual void ambiguous() {}
  // Called once, when the body is whole, too large or too slow, or need not be waited for.
  [[nodiscard]] virtual Answer answer(Request& request) = 0;
  // The connection ended before the body was whole; nothing can be answered.
  virtual void broken(Request& request) = 0;
};

}  // namespace kyt::http
