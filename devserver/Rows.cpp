#include "devserver/Rows.h"

#include <algorithm>

namespace kyt::devserver {
namespace {

constexpr size_t kEventsToldAtOnce = 100;

}  // namespace

void optionalNumber(JsonText& out, const char* name, const Statement& row, int column) {
  out.member(name, row.isNull(column) ? std::nullopt : std::optional(row.integer(column)));
}

void optionalReal(JsonText& out, const char* name, const Statement& row, int column) {
  out.member(name, row.isNull(column) ? std::nullopt : std::optional(row.real(column)));
}

void postMembers(JsonText& out, const Statement& row) {
  out.member("id", row.integer(0)).member("received", row.real(1)).member("secure", row.integer(2) != 0);
  out.member("method", row.text(3)).member("path", row.text(4)).member("client", row.text(5));
  out.member("service", row.text(6)).member("sender", row.text(7)).member("good", row.integer(8) != 0);
  out.member("reason", row.text(9)).member("digest", row.text(10)).member("answered", row.integer(11));
  out.member("clientId", row.text(12));
  optionalReal(out, "postTime", row, 13);
  out.member("size", row.integer(14)).member("textSize", row.integer(15)).member("events", row.integer(16));
  out.member("sha256", row.text(17));
  optionalNumber(out, "repeats", row, 18);
}

void postMembers(JsonText& out, const Post& post) {
  out.member("id", post.id).member("received", post.received).member("secure", post.secure);
  out.member("method", post.method).member("path", post.path).member("client", post.client);
  out.member("service", post.service).member("sender", post.sender).member("good", post.good);
  out.member("reason", post.reason).member("digest", post.digest).member("answered", post.answered);
  out.member("clientId", post.clientId).member("postTime", post.postTime).member("size", post.body.size());
  out.member("textSize", post.textSize).member("events", post.events.size());
  out.member("sha256", post.sha256).member("repeats", post.repeats);
}

void eventObject(JsonText& out, const Event& event, const Post& post) {
  out.object().member("post", post.id).member("received", post.received).member("client", event.client);
  out.member("service", event.service).member("sender", event.sender).member("method", event.method);
  out.member("status", event.status).member("session", event.session).member("number", event.number);
  out.member("time", event.time).key("record").json(event.record).endObject();
}

void eventObject(JsonText& out, const Statement& row) {
  out.object().member("id", row.integer(0)).member("post", row.integer(1)).member("received", row.real(2));
  out.member("client", row.text(3)).member("service", row.text(4)).member("sender", row.text(5));
  optionalNumber(out, "method", row, 6);
  optionalNumber(out, "status", row, 7);
  out.member("session", row.text(8));
  optionalNumber(out, "number", row, 9);
  optionalReal(out, "time", row, 10);
  out.key("record").json(row.text(11)).endObject();
}

void fetchObject(JsonText& out, const Fetch& fetch) {
  out.object().member("id", fetch.id).member("time", fetch.time).member("secure", fetch.secure);
  out.member("name", fetch.name).member("path", fetch.path).member("version", fetch.version);
  out.member("status", fetch.status).member("ifModifiedSince", fetch.ifModifiedSince);
  out.member("lastModified", fetch.lastModified).member("userAgent", fetch.userAgent).endObject();
}

void arrivalObject(JsonText& out, const Arrival& arrival) {
  out.object().member("id", arrival.id).member("received", arrival.received).member("good", arrival.good);
  out.key("content").json(arrival.json).endObject();
}

std::string totalsAsJson(const Totals& totals) {
  JsonText out;
  out.object().member("posts", totals.posts).member("bad", totals.bad).member("events", totals.events);
  out.member("fetches", totals.fetches).member("lines", totals.lines).member("logs", totals.logs);
  return out.endObject().text();
}

std::string commitAsJson(const Commit& commit) {
  JsonText out;
  out.object().key("totals").json(totalsAsJson(commit.totals)).key("posts").array();
  size_t skipped = 0;
  for (const Post& post : commit.posts) {
    postMembers(out.object(), post);
    out.endObject();
    skipped += post.events.size();
  }
  skipped -= std::min(skipped, kEventsToldAtOnce);
  out.endArray().member("eventsLeftOut", skipped).key("events").array();
  for (const Post& post : commit.posts) {
    for (const Event& event : post.events) {
      if (skipped > 0) {
        --skipped;
      } else {
        eventObject(out, event, post);
      }
    }
  }
  out.endArray().key("fetches").array();
  for (const Fetch& fetch : commit.fetches) fetchObject(out, fetch);
  for (const auto kind : {Arrival::Kind::line, Arrival::Kind::log}) {
    out.endArray().key(kind == Arrival::Kind::line ? "lines" : "logs").array();
    for (const Arrival& arrival : commit.arrivals)
      if (arrival.kind == kind) arrivalObject(out, arrival);
  }
  return out.endArray().endObject().text();
}

}  // namespace kyt::devserver
