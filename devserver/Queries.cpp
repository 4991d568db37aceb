#include "devserver/Queries.h"

#include <algorithm>
#include <array>

#include "devserver/JsonText.h"
#include "devserver/Rows.h"
#include "platform/base/TextEscape.h"

namespace kyt::devserver {
namespace {

constexpr int64_t kDefaultLimit = 100;
constexpr int64_t kMaxLimit = 10000;
constexpr int64_t kDefaultMinutes = 30;
constexpr int64_t kMaxMinutes = 24 * 60;
constexpr std::array kTextFilters = {"client", "service", "sender", "session"};
constexpr std::array kNumberFilters = {"method", "status", "post"};

Reply json(std::string text) {
  return {200, std::move(text), "application/json", {}};
}
Reply wrong(const std::string& what) {
  return {400, what + "\n", "text/plain; charset=utf-8", {}};
}
Reply missing(const std::string& what) {
  return {404, what + "\n", "text/plain; charset=utf-8", {}};
}

// An argument that is a number of at least 0; absent it is `otherwise`, wrong it is -1.
int64_t numberArgument(const Request& request, std::string_view name, int64_t otherwise) {
  const auto text = request.argument(name);
  if (!text) return otherwise;
  const auto value = parseInteger(*text);
  return value && *value >= 0 ? *value : -1;
}

int64_t limitOf(const Request& request) {
  return std::min(numberArgument(request, "limit", kDefaultLimit), kMaxLimit);
}

// "WHERE …" for the filters that the request names, to be bound with bindFilters.
std::string filterClause(const Request& request) {
  std::string clause;
  const auto add = [&](const char* name) {
    if (request.argument(name)) clause += (clause.empty() ? " WHERE " : " AND ") + std::string(name) + " = ?";
  };
  std::for_each(kTextFilters.begin(), kTextFilters.end(), add);
  std::for_each(kNumberFilters.begin(), kNumberFilters.end(), add);
  return clause;
}

void bindFilters(const Request& request, Statement& statement) {
  for (const char* name : kTextFilters) {
    if (const auto text = request.argument(name)) statement.bind(*text);
  }
  for (const char* name : kNumberFilters) {
    if (request.argument(name)) statement.bind(numberArgument(request, name, 0));
  }
}

int64_t countEventsIn(Database& database, const Request& request) {
  Statement statement = database.prepare("SELECT count(*) FROM events" + filterClause(request));
  bindFilters(request, statement);
  return statement.step() ? statement.integer(0) : 0;
}

std::vector<Header> headersFromRow(std::string_view json) {
  // The store writes [["Name","value"],…]; only the encoding is looked for here.
  for (const char* encoding : {"gzip", "identity"}) {
    const std::string entry = std::string("[\"Content-Encoding\",\"") + encoding + "\"]";
    if (std::search(json.begin(), json.end(), entry.begin(), entry.end(), [](char a, char b) {
          return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
        }) != json.end()) {
      return {{"Content-Encoding", encoding}};
    }
  }
  return {};
}

void groupRows(JsonText& out, const char* name, Statement statement,
               const std::vector<const char*>& columns) {
  out.key(name).array();
  while (statement.step()) {
    out.object();
    for (size_t i = 0; i < columns.size(); ++i) {
      const std::string_view column = columns[i];
      const int index = static_cast<int>(i);
      if (column == "client" || column == "service" || column == "sender" || column == "session") {
        out.member(column, statement.text(index));
      } else if (column == "first" || column == "last") {
        out.member(column, statement.real(index));
      } else {
        optionalNumber(out, columns[i], statement, index);
      }
    }
    out.endObject();
  }
  out.endArray();
}

}  // namespace

Reply Queries::answer(const Request& request) {
  if (limitOf(request) < 0) return wrong("limit is no number");
  if (numberArgument(request, "since", 0) < 0) return wrong("since is no number");
  for (const char* name : kNumberFilters) {
    if (numberArgument(request, name, 0) < 0) return wrong(std::string(name) + " is no number");
  }
  const std::string_view path = std::string_view(request.path).substr(4);  // past "/api"
  if (path == "/posts") return posts(request);
  if (path == "/events") return events(request);
  if (path == "/sessions") return sessions(request);
  if (path == "/counts") return counts(request);
  if (path == "/storebags") return storebags(request);
  if (path == "/lines") return arrivals(request, Arrival::Kind::line);
  if (path == "/logs") return arrivals(request, Arrival::Kind::log);
  if (path == "/totals") return json(totalsAsJson(store_.totals()));
  if (path.starts_with("/posts/")) {
    std::string_view rest = path.substr(7);
    const bool raw = rest.ends_with("/body");
    if (raw) rest.remove_suffix(5);
    if (const auto id = parseInteger(rest)) return raw ? body(*id) : post(*id);
  }
  return missing("no such query");
}

int64_t Queries::countEvents(const Request& request) {
  return store_.read([&](Database& database) { return countEventsIn(database, request); });
}

bool Queries::hasFilters(const Request& request) {
  return !filterClause(request).empty();
}

Reply Queries::posts(const Request& request) {
  const bool onward = request.argument("since").has_value();
  return store_.read([&](Database& database) {
    const std::string where = request.argument("bad") ? " AND NOT good" : "";
    Statement row = database.prepare("SELECT " + std::string(kPostColumns) + " FROM posts WHERE id > ?" +
                                     where + " ORDER BY id " + (onward ? "ASC" : "DESC") + " LIMIT ?");
    row.bind(numberArgument(request, "since", 0)).bind(limitOf(request));
    JsonText out;
    out.object().key("posts").array();
    while (row.step()) {
      postMembers(out.object(), row);
      out.endObject();
    }
    return json(out.endArray().endObject().text());
  });
}

Reply Queries::post(int64_t id) {
  return store_.read([&](Database& database) {
    Statement row =
        database.prepare("SELECT " + std::string(kPostColumns) + ", headers, body FROM posts WHERE id = ?");
    row.bind(id);
    if (!row.step()) return missing("no such post");
    JsonText out;
    postMembers(out.object(), row);
    out.key("headers").json(row.text(19));
    std::string reason;
    const std::string_view sent = row.text(20);
    const std::optional<std::string> text = checker_.textOf(headersFromRow(row.text(19)), sent, reason);
    const std::string_view shown = text ? std::string_view(*text) : sent;
    out.member("bodyIsText", isValidUTF8(shown)).member("body", shown);
    const std::optional<std::string> compact = rewriteJson(shown, false);
    out.key("json").json(compact ? *compact : "null");
    out.member("pretty", rewriteJson(shown, true));
    return json(out.endObject().text());
  });
}

Reply Queries::body(int64_t id) {
  return store_.read([&](Database& database) {
    Statement row = database.prepare("SELECT body FROM posts WHERE id = ?");
    row.bind(id);
    if (!row.step()) return missing("no such post");
    Reply reply{200, std::string(row.text(0)), "application/octet-stream", {}};
    reply.headers.push_back(
        {"Content-Disposition", "attachment; filename=\"post-" + std::to_string(id) + "\""});
    return reply;
  });
}

Reply Queries::events(const Request& request) {
  const bool onward = request.argument("since").has_value();
  return store_.read([&](Database& database) {
    const std::string where = filterClause(request);
    Statement row = database.prepare(
        "SELECT id, post, received, client, service, sender, method, status, session, number, time, record "
        "FROM events" +
        where + (where.empty() ? " WHERE" : " AND") + " id > ? ORDER BY id " + (onward ? "ASC" : "DESC") +
        " LIMIT ?");
    bindFilters(request, row);
    row.bind(numberArgument(request, "since", 0)).bind(limitOf(request));
    JsonText out;
    out.object().member("total", countEventsIn(database, request)).key("events").array();
    while (row.step()) eventObject(out, row);
    return json(out.endArray().endObject().text());
  });
}

Reply Queries::sessions(const Request& request) {
  return store_.read([&](Database& database) {
    Statement rows = database.prepare(
        "SELECT session, client, service, sender, count(*), min(received), max(received), max(number) FROM "
        "events "
        "GROUP BY session, client, service, sender ORDER BY max(received) DESC LIMIT ?");
    rows.bind(limitOf(request));
    JsonText out;
    out.object();
    groupRows(out, "sessions", std::move(rows),
              {"session", "client", "service", "sender", "events", "first", "last", "highestNumber"});
    return json(out.endObject().text());
  });
}

Reply Queries::counts(const Request& request) {
  const int64_t minutes = std::min(numberArgument(request, "minutes", kDefaultMinutes), kMaxMinutes);
  if (minutes < 0) return wrong("minutes is no number");
  const Totals totals = store_.totals();
  return store_.read([&](Database& database) {
    JsonText out;
    const auto now = static_cast<int64_t>(timeNow());
    out.object().key("totals").json(totalsAsJson(totals)).member("now", now).member("minutes", minutes);
    groupRows(out, "byClient",
              database.prepare(
                  "SELECT client, service, sender, count(*) FROM events GROUP BY client, service, sender "
                  "ORDER BY count(*) DESC LIMIT 1000"),
              {"client", "service", "sender", "events"});
    groupRows(out, "byMethod",
              database.prepare("SELECT method, status, count(*) FROM events GROUP BY method, status "
                               "ORDER BY count(*) DESC LIMIT 1000"),
              {"method", "status", "events"});
    Statement perMinute = database.prepare(
        "SELECT CAST(received / 60 AS INTEGER) * 60 AS minute, client, method, count(*) FROM events "
        "WHERE received >= ? GROUP BY minute, client, method ORDER BY minute");
    perMinute.bind((now / 60 - minutes + 1) * 60);
    groupRows(out, "perMinute", std::move(perMinute), {"minute", "client", "method", "events"});
    return json(out.endObject().text());
  });
}

Reply Queries::storebags(const Request& request) {
  const bool onward = request.argument("since").has_value();
  return store_.read([&](Database& database) {
    Statement row = database.prepare(
        std::string("SELECT id, time, secure, name, path, version, status, if_modified_since, last_modified, "
                    "user_agent FROM fetches WHERE id > ? ORDER BY id ") +
        (onward ? "ASC" : "DESC") + " LIMIT ?");
    row.bind(numberArgument(request, "since", 0)).bind(limitOf(request));
    JsonText out;
    out.object().key("fetches").array();
    while (row.step()) {
      const auto text = [&](int column) { return std::string(row.text(column)); };
      fetchObject(out, Fetch{row.integer(0), row.real(1), row.integer(2) != 0, text(3), text(4), text(5),
                             static_cast<unsigned>(row.integer(6)), text(7), text(8), text(9)});
    }
    return json(out.endArray().endObject().text());
  });
}

Reply Queries::arrivals(const Request& request, Arrival::Kind kind) {
  const bool onward = request.argument("since").has_value();
  return store_.read([&](Database& database) {
    Statement row = database.prepare(
        std::string("SELECT id, received, good, json FROM arrivals WHERE kind = ? AND id > ? ORDER BY id ") +
        (onward ? "ASC" : "DESC") + " LIMIT ?");
    row.bind(int64_t{kind == Arrival::Kind::line ? 0 : 1}).bind(numberArgument(request, "since", 0));
    row.bind(limitOf(request));
    JsonText out;
    out.object().key(kind == Arrival::Kind::line ? "lines" : "logs").array();
    while (row.step())
      arrivalObject(
          out, Arrival{row.integer(0), kind, row.real(1), row.integer(2) != 0, std::string(row.text(3))});
    return json(out.endArray().endObject().text());
  });
}

}  // namespace kyt::devserver
