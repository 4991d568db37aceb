#include "tools/demo/Checks.h"

#include <cstdio>
#include <functional>
#include <map>

#include "platform/Cryptography.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/Stage.h"

namespace kyt::tools {

namespace {

const Value& at(const Value& container, const char* key) {
  static const Value none;
  const Dictionary* dictionary = container.dictionary();
  const Value* value = dictionary != nullptr ? dictionary->find(key) : nullptr;
  return value != nullptr ? *value : none;
}

std::vector<Value> list(const Value& value) {
  const Array* array = value.array();
  return array != nullptr ? std::vector<Value>(array->begin(), array->end()) : std::vector<Value>();
}

std::string hexSHA256(const std::string& text) {
  OpenSSLCryptography cryptography;
  std::string hex;
  for (const std::byte byte : cryptography.sha256(std::as_bytes(std::span(text)))) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", std::to_integer<unsigned>(byte));
    hex += digits;
  }
  return hex;
}

class Arrivals {
 public:
  Arrivals(const Stage& stage, std::string client) : client_(std::move(client)) {
    events_ = list(at(stage.query("/api/events?since=0&limit=1000&client=" + client_), "events"));
    for (const Value& post : list(at(stage.query("/api/posts?since=0&limit=1000"), "posts")))
      if (at(post, "client") == Value(client_)) posts_.push_back(post);
  }

  std::vector<Value> records(int method, int status) const {
    std::vector<Value> out;
    for (const Value& event : events_)
      if (at(event, "method") == Value(method) && at(event, "status") == Value(status))
        out.push_back(at(event, "record"));
    return out;
  }

  void count(std::vector<Check>& out, const std::string& what, int method, int status, size_t wanted) const {
    const size_t found = records(method, status).size();
    out.push_back(
        {client_ + ": " + what, found == wanted, std::to_string(found) + " of " + std::to_string(wanted)});
  }

  void every(std::vector<Check>& out, const std::string& what, int method, int status,
             const std::function<bool(const Value&)>& holds) const {
    const std::vector<Value> all = records(method, status);
    Check check{client_ + ": " + what, !all.empty(), "no such event"};
    for (const Value& record : all) {
      if (holds(record)) continue;
      check.holds = false;
      check.found = description(record);
    }
    out.push_back(std::move(check));
  }

  void posts(std::vector<Check>& out, const std::string& what,
             const std::function<bool(const Value&)>& holds) const {
    Check check{client_ + ": " + what, !posts_.empty(), "no post"};
    for (const Value& post : posts_) {
      if (holds(post)) continue;
      check.holds = false;
      check.found = description(post);
    }
    out.push_back(std::move(check));
  }

  size_t postsTo(const std::string& path) const {
    size_t count = 0;
    for (const Value& post : posts_)
      if (at(post, "path") == Value(path)) ++count;
    return count;
  }

 private:
  std::string client_;
  std::vector<Value> events_, posts_;
};

void checkClient(const Stage& stage, const std::string& name, bool digest, std::vector<Check>& out) {
  const Arrivals arrivals(stage, name);
  arrivals.count(out, "the session's start message", 0, 0, 1);
  arrivals.every(out, "its payload is that of a release build", 0, 0, [](const Value& record) {
    return at(record, "Locale") == Value("DE") && !at(record, "AutomaticTimeSet").isNull() &&
           at(record, "SerialNum").isNull();
  });
  arrivals.count(out, "5 batched events, posted by a flush", 10, 1, 5);
  arrivals.every(out, "the field \"secret\" was removed", 10, 1, [](const Value& record) {
    return at(record, "secret").isNull() && at(record, "duration") == Value(1.5) &&
           at(record, "count") == Value(3);
  });
  const std::string hash = hexSHA256(kDemoAccount);
  arrivals.every(out, "the field \"account\" was hashed", 10, 1,
                 [&hash](const Value& record) { return at(record, "account") == Value(hash); });
  arrivals.every(out, "records carry the user information", 10, 1,
                 [&name](const Value& record) { return at(record, "ClientName") == Value(name); });
  arrivals.count(out, "the realtime event", 20, 2, 1);
  const size_t realtime = arrivals.postsTo("/events/" + name + "/realtime");
  out.push_back(
      {name + ": it went alone to the realtime address", realtime == 1, std::to_string(realtime) + " posts"});
  arrivals.count(out, "2 events posted when the session ended", 11, 1, 2);
  arrivals.count(out, "the session's stop message", 0, 1, 1);
  arrivals.every(out, "it names the storebag and the graceful end", 0, 1, [](const Value& record) {
    return at(record, "StorebagVersion") == Value("demo-1") &&
           at(record, "GracefulTermination").boolValue() && !at(record, "CalculatedMemoryUsage").isNull();
  });
  arrivals.posts(out, "every post was whole and well-formed",
                 [](const Value& post) { return at(post, "good").boolValue(); });
  if (digest)
    arrivals.posts(out, "every post carried the digest that its key gives",
                   [](const Value& post) { return at(post, "digest") == Value("good"); });
}

}  // namespace

std::vector<Check> checkArrivals(const Stage& stage) {
  std::vector<Check> out;
  checkClient(stage, "kytdemo", true, out);
  checkClient(stage, "kytdemo-plain", false, out);
  const Value total = at(at(stage.query("/api/counts"), "totals"), "events");
  out.push_back({"nothing else arrived: " + std::to_string(kDemoEvents) + " events in all",
                 total == Value(kDemoEvents), description(total)});
  return out;
}

void printArrivals(const Stage& stage) {
  std::map<std::string, int> counts;
  for (const Value& event : list(at(stage.query("/api/events?since=0&limit=1000"), "events"))) {
    const Value& record = at(event, "record");
    counts["client " + description(at(event, "client")) + ", sender " + description(at(event, "sender")) +
           ", method " + description(at(record, "_method")) + ", status " +
           description(at(record, "_status"))]++;
  }
  std::printf("\narrived at the server:\n");
  for (const auto& [what, count] : counts) std::printf("  %3d × %s\n", count, escapedText(what).c_str());
}

}  // namespace kyt::tools
