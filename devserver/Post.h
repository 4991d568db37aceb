// What the server keeps: event posts, the events in them, and fetches of storebags. Plain values.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "http/Http.h"

namespace kyt::devserver {

using http::Header;

// One record of a post's "events"; what a record lacks is absent.
struct Event {
  std::optional<int64_t> method, status, number;
  std::optional<double> time;  // "_clientTS"
  std::string client, service, sender, session;
  std::string record;  // JSON
};

struct Post {
  int64_t id = 0;
  double received = 0;  // seconds since 1970
  bool secure = false;
  std::string method, path;
  std::vector<Header> headers;
  std::string body;  // as sent
  std::string client, service, sender;
  bool good = false;
  std::string reason;     // why it is bad
  std::string digest;     // "good", "bad", "missing", "unchecked"
  unsigned answered = 0;  // the HTTP status; 0: the connection was closed without an answer
  std::string clientId;
  std::optional<double> postTime;
  uint64_t textSize = 0;           // of the body after decompression
  std::string sha256;              // of the body as sent, in hexadecimal digits
  std::optional<int64_t> repeats;  // the first post that is kept with the same body; none: this is it
  std::vector<Event> events;
};

struct Fetch {
  int64_t id = 0;
  double time = 0;
  bool secure = false;
  std::string name, path, version;
  unsigned status = 0;
  std::string ifModifiedSince, lastModified, userAgent;
};

// Whatever else came in: a datagram of the dashboard feed, or log data.
struct Arrival {
  enum class Kind : uint8_t { line, log };
  int64_t id = 0;
  Kind kind = Kind::line;
  double received = 0;
  bool good = false;
  std::string json;  // an object
};

}  // namespace kyt::devserver
