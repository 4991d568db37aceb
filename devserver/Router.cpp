#include "devserver/Router.h"

#include <openssl/sha.h>

#include <algorithm>

#include "devserver/JsonText.h"
#include "devserver/LogData.h"
#include "devserver/Page.h"
#include "devserver/Rows.h"
#include "devserver/Text.h"

namespace kyt::devserver {
namespace {

constexpr uint64_t kMaxControlBytes = 1 << 20;
constexpr std::chrono::minutes kLongestHang(10);
constexpr int64_t kDefaultWaitSeconds = 30;
constexpr int64_t kMaxWaitSeconds = 600;

bool isBelow(std::string_view path, std::string_view folder) {
  return path.starts_with(folder) && (path.size() == folder.size() || path[folder.size()] == '/');
}

Reply text(unsigned status, const std::string& what) {
  return {status, what + "\n", "text/plain; charset=utf-8", {}};
}

Reply notAllowed(const char* allowed) {
  Reply reply = text(405, std::string("only ") + allowed);
  reply.headers.push_back({"Allow", allowed});
  return reply;
}

bool isRead(const Request& request) {
  return request.method == "GET" || request.method == "HEAD";
}

// 'sha256-…' of what stands between <tag> and </tag> in the page.
std::string sourceHash(std::string_view tag) {
  const std::string open = "<" + std::string(tag) + ">";
  const size_t begin = kPage.find(open) + open.size();
  const std::string_view content =
      kPage.substr(begin, kPage.find("</" + std::string(tag) + ">", begin) - begin);
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(content.data()), content.size(), digest);
  return "'sha256-" + base64({reinterpret_cast<const char*>(digest), sizeof digest}) + "'";
}

// Only the page's own script and style run, and it talks to this server alone.
std::string policyOfPage() {
  return "default-src 'none'; script-src " + sourceHash("script") + "; style-src " + sourceHash("style") +
         "; connect-src 'self'; img-src data:; base-uri 'none'; form-action 'none'; frame-ancestors 'none'";
}

std::string_view hostWithoutPort(std::string_view host) {
  const size_t colon = host.rfind(':');
  const bool hasPort = colon != std::string_view::npos && host.find(']', colon) == std::string_view::npos;
  if (hasPort) host = host.substr(0, colon);
  if (host.starts_with('[') && host.ends_with(']')) host = host.substr(1, host.size() - 2);
  return host;
}

Post postOf(const Request& request) {
  Post post;
  post.received = timeNow();
  post.secure = request.secure;
  post.method = request.method;
  post.path = validText(request.path);
  post.headers = request.headers;
  post.digest = "unchecked";
  PostChecker::readNames(post);
  return post;
}

// The answer to a post that was kept, by its verdict.
Reply verdict(const Post& post, unsigned status, const char* goodAnswer) {
  if (post.good) return {200, goodAnswer, "application/json", {}};
  return text(status, post.reason);
}

}  // namespace

Router::Router(const Options& options, Store& store, const PostChecker& checker, EventStream& stream,
               Suspensions& suspensions, AcknowledgementRules& acknowledgements,
               std::optional<BagSigner> signer)
    : options_(options),
      store_(store),
      checker_(checker),
      stream_(stream),
      suspensions_(suspensions),
      acknowledgements_(acknowledgements),
      queries_(store, checker),
      storebags_(options.bags, options.maxAge, std::move(signer)),
      uploads_(options.state / "uploads", options.maxInflatedBytes),
      pagePolicy_(policyOfPage()) {}

uint64_t Router::bodyLimit(const Request& request) const {
  const bool large = takesPosts(request) || takesUploads(request) || takesLogData(request);
  return large ? options_.maxBodyBytes : kMaxControlBytes;
}

bool Router::takesPosts(const Request& request) const {
  return isBelow(request.path, "/events") && (request.secure || options_.httpEvents);
}

bool Router::takesLogData(const Request& request) const {
  return isBelow(request.path, "/logdata") && (request.secure || options_.httpEvents);
}

bool Router::takesUploads(const Request& request) const {
  return isBelow(request.path, "/upload") && (request.secure || options_.httpEvents);
}

// The page and its queries answer only to a browser that opened the page itself, and to programs: no other
// site's script may reach them, be it across origins or through a name of its own that leads to this address.
bool Router::comesFromThisPlace(const Request& request) const {
  const std::string* site = request.header("Sec-Fetch-Site");
  if (site != nullptr && *site != "same-origin" && *site != "none") return false;
  const std::string* host = request.header("Host");
  if (host == nullptr) return false;
  const std::string* origin = request.header("Origin");
  if (origin != nullptr && *origin != "http://" + *host) return false;
  const std::string_view name = hostWithoutPort(*host);
  if (name == "localhost" || name == "127.0.0.1" || name == "::1" || name == options_.listen) return true;
  return std::find(options_.hosts.begin(), options_.hosts.end(), name) != options_.hosts.end();
}

template <typename Judge>
Answer Router::answerPost(Request& request, const char* goodAnswer, Judge judge) {
  if (request.method != "POST") return notAllowed("POST");
  Post post = postOf(request);
  unsigned status = 400;
  if (request.tooLarge) {
    status = 413;
    post.reason = "the body is over the limit of " + std::to_string(options_.maxBodyBytes) + " bytes";
  } else if (!request.contentLength) {
    status = 411;
    post.reason = "Content-Length is missing";
    post.body = std::move(request.body);
  } else {
    post.body = std::move(request.body);
    judge(post);
  }
  const std::optional<ReplyRule> rule = rules_.take(request.path);
  Reply reply = verdict(post, status, goodAnswer);
  const bool unanswered = rule && (rule->hang || rule->close);
  post.answered = unanswered ? 0 : rule && rule->status ? *rule->status : reply.status;
  store_.add(std::move(post));
  return applyRule(rule, std::move(reply));
}

Answer Router::answer(Request& request) {
  const std::string_view path = request.path;
  if (takesPosts(request)) return answerPost(request, "{}", [this](Post& post) { checker_.check(post); });
  if (takesUploads(request)) {
    // Devices remove a file once the answer has the word "success" in it.
    return answerPost(request, R"({"result":"success"})",
                      [this, &request](Post& post) { uploads_.keep(request, post); });
  }
  if (takesLogData(request)) return answerLogData(request);
  if (isBelow(path, "/storebags/tolvar") || isBelow(path, "/bags/tolvar")) return answerStorebag(request);
  if (request.secure) return text(404, "nothing is here");
  if (!comesFromThisPlace(request)) return text(403, "this answers only to its own page and to programs");
  if (isBelow(path, "/control")) return answerControl(request);
  if (!isRead(request)) return notAllowed("GET, HEAD");
  if (path == "/") return page();
  if (path == "/api/wait") return answerWait(request);
  if (path == "/api/stream") return answerStream();
  if (!isBelow(path, "/api")) return text(404, "nothing is here");
  Reply reply = queries_.answer(request);
  reply.headers.push_back({"Cache-Control", "no-store"});
  return reply;
}

// Good log data is answered with the place where it can be found, which is named after its content.
Answer Router::answerLogData(Request& request) {
  if (request.method != "POST") return notAllowed("POST");
  Reply reply =
      text(413, "the body is over the limit of " + std::to_string(options_.maxBodyBytes) + " bytes");
  if (!request.tooLarge) {
    const std::string* host = request.header("Host");
    const LogData data = readLogData(request.body);
    const std::string location = std::string(request.secure ? "https" : "http") + "://" +
                                 validText(host != nullptr ? *host : "localhost") + "/logdata/" + data.name;
    reply =
        data.reason.empty() ? Reply{200, location, "text/plain; charset=utf-8", {}} : text(400, data.reason);
    JsonText json;
    json.object().member("path", request.path).member("secure", request.secure);
    json.member("size", request.body.size()).member("location", data.reason.empty() ? location : "");
    json.member("reason", data.reason).member("entries", data.entries).key("data").json(data.json);
    store_.add(Arrival{0, Arrival::Kind::log, timeNow(), data.reason.empty(), json.endObject().text()});
  }
  return applyRule(rules_.take(request.path), std::move(reply));
}

void Router::broken(Request& request) {
  if (!(takesPosts(request) || takesUploads(request)) || request.method != "POST") return;
  Post post = postOf(request);
  post.reason = request.tooSlow
                    ? "the body was not whole in time, " + std::to_string(request.bodySize) + " bytes came"
                    : "the connection ended before the body was whole, " + std::to_string(request.bodySize) +
                          " bytes came";
  post.body = std::move(request.body);
  store_.add(std::move(post));
}

Answer Router::answerStorebag(const Request& request) {
  if (!isRead(request)) return notAllowed("GET, HEAD");
  const auto argument = [&](const char* name) { return validText(request.argument(name).value_or("")); };
  const auto header = [&](const char* name) {
    const std::string* value = request.header(name);
    return value != nullptr ? *value : std::string();
  };
  Fetch fetch;
  fetch.time = timeNow();
  fetch.secure = request.secure;
  fetch.name = request.path.substr(request.path.rfind('/') + 1);
  fetch.path = request.path;
  fetch.version = argument("version");
  fetch.userAgent = header("User-Agent");
  fetch.ifModifiedSince = header("If-Modified-Since");
  const bool oneBelow =
      fetch.path == "/storebags/tolvar/" + fetch.name || fetch.path == "/bags/tolvar/" + fetch.name;
  const std::optional<Storebag> bag = oneBelow ? storebags_.find(fetch.name) : std::nullopt;
  Reply reply = text(404, "no such storebag");
  if (bag && !bag->problem.empty()) {
    reply = text(500, printable(bag->problem));
  } else if (bag) {
    const bool unchanged = !bag->lastModified.empty() && fetch.ifModifiedSince == bag->lastModified;
    reply = {unchanged ? 304U : 200U, *bag->content, "application/xml", {}};
    if (!bag->lastModified.empty()) reply.headers.push_back({"Last-Modified", bag->lastModified});
    reply.headers.push_back({"Cache-Control", bag->cacheControl});
    fetch.lastModified = bag->lastModified;
  }
  const std::optional<ReplyRule> rule = rules_.take(request.path);
  fetch.status = rule && (rule->hang || rule->close) ? 0
                 : rule && rule->status              ? *rule->status
                                                     : reply.status;
  store_.add(std::move(fetch));
  return applyRule(rule, std::move(reply));
}

Answer Router::applyRule(const std::optional<ReplyRule>& rule, Reply reply) {
  if (!rule) return reply;
  const SteadyTime now = std::chrono::steady_clock::now();
  if (rule->hang) {
    const uint64_t generation = rules_.generation();
    return Wait{now + kLongestHang, WaitFor::rules, [this, generation](bool expired) -> std::optional<Reply> {
                  if (!expired && rules_.generation() == generation) return std::nullopt;
                  Reply end;
                  end.close = true;
                  return end;
                }};
  }
  if (rule->status) {
    const bool good = *rule->status < 300;
    reply = {*rule->status,
             good ? "{}" : "told to answer " + std::to_string(*rule->status) + "\n",
             good ? "application/json" : "text/plain; charset=utf-8",
             {}};
  }
  if (rule->body) reply.body = *rule->body;
  reply.headers.insert(reply.headers.end(), rule->headers.begin(), rule->headers.end());
  reply.close = rule->close;
  if (rule->delay.count() == 0) return reply;
  return Wait{now + rule->delay, WaitFor::rules,
              [reply = std::move(reply)](bool expired) -> std::optional<Reply> {
                if (!expired) return std::nullopt;
                return reply;
              }};
}

Answer Router::answerControl(const Request& request) {
  const std::string_view path = request.path;
  if (request.tooLarge) return text(413, "the body is too large");
  if (path == "/control/reply" && request.method == "PUT") {
    auto rule = ReplyRules::parse(request.body);
    if (const auto* wrong = std::get_if<std::string>(&rule)) return text(400, *wrong);
    rules_.add(std::move(std::get<ReplyRule>(rule)));
  } else if ((path == "/control/reply" && request.method == "DELETE") || path == "/control/reset") {
    if (path == "/control/reset") acknowledgements_.clear();
    rules_.clear();
    suspensions_.wake(WaitFor::rules);
  } else if (path == "/control/clear" && (request.method == "PUT" || request.method == "POST")) {
    store_.clear();
  } else if (path == "/control/acknowledgements") {
    return answerAcknowledgements(request);
  } else if (path != "/control/reply" || !isRead(request)) {
    return text(404, "no such control");
  }
  return Reply{200, rules_.asJson(), "application/json", {{"Cache-Control", "no-store"}}};
}

Answer Router::answerAcknowledgements(const Request& request) {
  if (request.method == "PUT") {
    auto rule = AcknowledgementRules::parse(request.body);
    if (const auto* wrong = std::get_if<std::string>(&rule)) return text(400, *wrong);
    acknowledgements_.add(std::get<AcknowledgementRule>(rule));
  } else if (request.method == "DELETE") {
    acknowledgements_.clear();
  } else if (!isRead(request)) {
    return notAllowed("GET, HEAD, PUT, DELETE");
  }
  return Reply{200, acknowledgements_.asJson(), "application/json", {{"Cache-Control", "no-store"}}};
}

// Answers as soon as as many events, posts, bad posts and storebag fetches are there as the request names.
Answer Router::answerWait(const Request& request) {
  const auto number = [&](const char* name, int64_t otherwise) -> int64_t {
    const auto argument = request.argument(name);
    return argument ? parseInteger(*argument).value_or(-1) : otherwise;
  };
  const int64_t events = number("events", 0), posts = number("posts", 0), bad = number("bad", 0);
  const int64_t fetches = number("fetches", 0), lines = number("lines", 0), logs = number("logs", 0);
  const int64_t timeout = number("timeout", kDefaultWaitSeconds);
  if (std::min({events, posts, bad, fetches, lines, logs, timeout}) < 0)
    return text(400, "an argument is no number");
  const auto poll = [this, request, events, posts, bad, fetches, lines,
                     logs](bool expired) -> std::optional<Reply> {
    const Totals totals = store_.totals();
    const int64_t fitting = Queries::hasFilters(request) ? queries_.countEvents(request) : totals.events;
    const bool reached = fitting >= events && totals.posts >= posts && totals.bad >= bad &&
                         totals.fetches >= fetches && totals.lines >= lines && totals.logs >= logs;
    if (!reached && !expired) return std::nullopt;
    JsonText out;
    out.object().member("reached", reached).member("events", fitting);
    out.key("totals").json(totalsAsJson(totals)).endObject();
    return Reply{200, out.text(), "application/json", {{"Cache-Control", "no-store"}}};
  };
  const auto seconds = std::chrono::seconds(std::min(timeout, kMaxWaitSeconds));
  return Wait{std::chrono::steady_clock::now() + seconds, WaitFor::data, poll};
}

Answer Router::answerStream() {
  std::shared_ptr<StreamQueue> queue = stream_.listen();
  if (!queue) return text(503, "too many pages are open");
  return queue;
}

Reply Router::page() const {
  return {200,
          std::string(kPage),
          "text/html; charset=utf-8",
          {{"Content-Security-Policy", pagePolicy_},
           {"Referrer-Policy", "no-referrer"},
           {"Cross-Origin-Resource-Policy", "same-origin"},
           {"Cache-Control", "no-store"}}};
}

}  // namespace kyt::devserver
