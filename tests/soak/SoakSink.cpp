// The server of the soak's steady programs, plain and over TLS: takes their posts as fast as it can and knows how often
// each event has arrived. It is quick enough for the daemon to be what the load is bounded by.
//
//   kyt_soak_sink CERTIFICATE KEY
//
// Prints its two ports as JSON and serves until its standard input ends. GET /books/NONCE: a byte for each of that
// program's numbers from 0 on, how often it arrived (255: as often or more). GET /figures: posts and events so far, and
// posts that could not be read.
#include <rapidjson/document.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "devserver/Files.h"
#include "http/Gzip.h"
#include "http/HttpServer.h"
#include "platform/base/Mutex.h"

namespace kyt::http {
namespace {

constexpr uint64_t kMostBytes = 64 << 20, kMostEvents = 1 << 24;

class Books : public HttpHandler {
 public:
  uint64_t bodyLimit(const Request&) const override { return kMostBytes; }
  void broken(Request&) override {}

  Answer answer(Request& request) override {
    Reply reply;
    if (request.method == "POST") {
      ++posts_;
      if (!take(request)) ++unreadable_;
    } else if (request.path == "/figures") {
      reply.body = "{\"posts\":" + std::to_string(posts_) + ",\"events\":" + std::to_string(events_) +
                   ",\"unreadable\":" + std::to_string(unreadable_) + "}";
    } else if (request.path.starts_with("/books/")) {
      MutexLock lock(mutex_);
      const auto found = books_.find(request.path.substr(7));
      if (found != books_.end()) reply.body.assign(found->second.begin(), found->second.end());
    } else {
      reply.status = 404;
    }
    return reply;
  }

 private:
  bool take(const Request& request) {
    const std::string* encoding = request.header("content-encoding");
    std::string text = request.body;
    if (encoding != nullptr && *encoding == "gzip") {
      auto inflated = gunzip(request.body, kMostBytes);
      if (std::holds_alternative<GzipError>(inflated)) return false;
      text = std::move(std::get<std::string>(inflated));
    }
    rapidjson::Document document;
    document.Parse(text.data(), text.size());
    if (document.HasParseError() || !document.IsObject()) return false;
    if (!document.HasMember("events") || !document["events"].IsArray()) return false;
    bool good = true;
    MutexLock lock(mutex_);
    for (const auto& record : document["events"].GetArray()) {
      if (record.IsObject() && record.HasMember("nonce")) good = enter(record) && good;
    }
    return good;
  }
  bool enter(const rapidjson::Value& record) REQUIRES(mutex_) {
    if (!record["nonce"].IsString() || !record.HasMember("number") || !record["number"].IsUint64())
      return false;
    const uint64_t index = record["number"].GetUint64();
    if (index >= kMostEvents) return false;
    std::vector<char>& book = books_[record["nonce"].GetString()];
    if (book.size() <= index) book.resize(index + 1);
    if (static_cast<uint8_t>(book[index]) < UINT8_MAX) ++book[index];
    ++events_;
    return true;
  }

  std::atomic<uint64_t> posts_{0}, events_{0}, unreadable_{0};
  Mutex mutex_;
  std::map<std::string, std::vector<char>> books_ GUARDED_BY(mutex_);
};

int serve(const char* certificate, const char* key) {
  const auto chain = devserver::readFile(certificate, 1 << 16), secret = devserver::readFile(key, 1 << 16);
  if (!chain || !secret) {
    std::fprintf(stderr, "kyt_soak_sink: cannot read its certificate or key\n");
    return 1;
  }
  const Identity identity{*chain, *secret};
  const ServerOptions options;
  Books books;
  Suspensions suspensions([] {});
  std::string error;
  const auto plain = HttpServer::start(options, nullptr, books, suspensions, error);
  const auto tls = plain ? HttpServer::start(options, &identity, books, suspensions, error) : nullptr;
  if (!tls) {
    std::fprintf(stderr, "kyt_soak_sink: %s\n", error.c_str());
    return 1;
  }
  std::printf("{\"plain\":%u,\"tls\":%u}\n", unsigned{plain->port()}, unsigned{tls->port()});
  std::fflush(stdout);
  char byte = 0;
  while (::read(STDIN_FILENO, &byte, 1) > 0) {
  }
  suspensions.stop();
  return 0;
}

}  // namespace
}  // namespace kyt::http

int main(int argc, char** argv) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: kyt_soak_sink CERTIFICATE KEY\n");
    return 2;
  }
  std::signal(SIGPIPE, SIG_IGN);
  return kyt::http::serve(argv[1], argv[2]);
}
