#include "reader/Table.h"

#include <libpq-fe.h>

#include <array>
#include <cstring>
#include <string_view>
#include <utility>
#include <variant>

#include "platform/base/TextEscape.h"

namespace kyt::reader {

namespace {

constexpr char kTables[] = R"(
CREATE TABLE IF NOT EXISTS kyt_posts (
  id text PRIMARY KEY,            -- SHA-256 of the body as it came
  received timestamptz NOT NULL,
  path text, sender text, client text, service text, client_version text, digest text,
  client_id text                  -- the device, or the program on it, under its random identifier
);
CREATE TABLE IF NOT EXISTS kyt_events (
  post text NOT NULL REFERENCES kyt_posts ON DELETE CASCADE,
  number integer NOT NULL,        -- in the post, from 1
  received timestamptz NOT NULL,
  record jsonb NOT NULL,
  PRIMARY KEY (post, number)
);
CREATE INDEX IF NOT EXISTS kyt_events_received ON kyt_events (received);
CREATE TABLE IF NOT EXISTS kyt_unreadable (
  id text PRIMARY KEY,
  received timestamptz NOT NULL,
  path text, sender text, client text, service text, client_version text, digest text,
  encoding text,
  reason text NOT NULL,
  body bytea NOT NULL
);)";

constexpr char kStorePost[] = R"(
WITH message AS (SELECT $9::jsonb AS value),
post AS (
  INSERT INTO kyt_posts (id, received, path, sender, client, service, client_version, digest, client_id)
  SELECT $1, to_timestamp($2::bigint / 1000.0), $3, $4, $5, $6, $7, $8, value ->> 'clientId' FROM message
  ON CONFLICT (id) DO NOTHING
  RETURNING id, received
),
events AS (
  INSERT INTO kyt_events (post, number, received, record)
  SELECT post.id, event.number, post.received, event.record
  FROM post, message, jsonb_array_elements(message.value -> 'events') WITH ORDINALITY AS event(record, number)
)
SELECT count(*) FROM post)";

constexpr char kStoreUnreadable[] = R"(
INSERT INTO kyt_unreadable
  (id, received, path, sender, client, service, client_version, digest, encoding, reason, body)
VALUES ($1, to_timestamp($2::bigint / 1000.0), $3, $4, $5, $6, $7, $8, $9, $10, $11)
ON CONFLICT (id) DO NOTHING)";

struct Clearer {
  void operator()(PGresult* result) const { PQclear(result); }
};
using Result = std::unique_ptr<PGresult, Clearer>;

bool isGood(const Result& result) {
  const ExecStatusType status = PQresultStatus(result.get());
  return status == PGRES_COMMAND_OK || status == PGRES_TUPLES_OK;
}

// Whether another post may do better. 22: its values are wrong. 54: it is too deep, too long. 53200 and XX000: what it makes
// of them takes more memory than there is, or than PostgreSQL asks for at a time. All else is of the database.
bool isAboutThePost(const Result& result) {
  const char* field = PQresultErrorField(result.get(), PG_DIAG_SQLSTATE);
  const std::string_view state = field != nullptr ? field : "";
  return state.substr(0, 2) == "22" || state.substr(0, 2) == "54" || state == "53200" || state == "XX000";
}

std::string messageOf(const Result& result) {
  const char* text = PQresultErrorField(result.get(), PG_DIAG_MESSAGE_PRIMARY);
  return text != nullptr ? text : PQresultErrorMessage(result.get());
}

// Seconds until a server that says nothing is given up, and milliseconds until one that takes nothing is: a program that
// waits for either does not end when it is told to. What the user says of them comes later, and counts.
PGconn* connect(const std::string& database) {
  const std::array<const char*, 4> names = {"connect_timeout", "tcp_user_timeout", "dbname", nullptr};
  const std::array<const char*, 4> values = {"10", "30000", database.c_str(), nullptr};
  return PQconnectdbParams(names.data(), values.data(), /*expand_dbname=*/1);
}

}  // namespace

struct Table::Connection {
  explicit Connection(const std::string& database) : handle(connect(database)) {}
  ~Connection() { PQfinish(handle); }
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  Result run(const char* statement) { return Result(PQexec(handle, statement)); }
  [[nodiscard]] bool runs(const char* statement, std::string& problem) {
    const Result result = run(statement);
    if (!isGood(result)) problem = PQresultErrorMessage(result.get());
    return isGood(result);
  }
  PGconn* handle;
};

Table::Table(std::string database) : database_(std::move(database)) {}

Table::~Table() = default;

std::optional<std::string> Table::open() {
  connection_ = std::make_unique<Connection>(database_);
  PGconn* handle = connection_->handle;
  if (PQstatus(handle) != CONNECTION_OK) return std::string(PQerrorMessage(handle));
  std::string problem;
  // A post that takes longer than the role may would be tried for ever, and nothing behind it.
  // Several readers that begin at once would trip over each other's tables.
  for (const char* statement :
       {"SET statement_timeout = 0", "SET client_min_messages = warning", "SET client_encoding = 'UTF8'",
        "BEGIN", "SELECT pg_advisory_xact_lock(7543210)", kTables, "COMMIT"})
    if (!connection_->runs(statement, problem)) return problem;
  for (const auto& [name, statement] :
       {std::pair("post", kStorePost), std::pair("unreadable", kStoreUnreadable)}) {
    const Result prepared(PQprepare(handle, name, statement, 0, nullptr));
    if (!isGood(prepared)) return std::string(PQresultErrorMessage(prepared.get()));
  }
  return std::nullopt;
}

std::optional<bool> Table::storeOne(const Post& post, Stored& stored, std::string& problem) {
  const auto text = textOf(post);
  if (const auto* unreadable = std::get_if<Unreadable>(&text)) {
    problem = unreadable->reason;
    return false;
  }
  const std::array<const char*, 9> values = {post.id.c_str(),
                                             post.received.c_str(),
                                             post.path.c_str(),
                                             post.sender.c_str(),
                                             post.client.c_str(),
                                             post.service.c_str(),
                                             post.clientVersion.c_str(),
                                             post.digest.c_str(),
                                             std::get<std::string>(text).c_str()};
  const Result result(
      PQexecPrepared(connection_->handle, "post", values.size(), values.data(), nullptr, nullptr, 0));
  if (!isGood(result)) {
    problem = messageOf(result);
    return isAboutThePost(result) ? std::optional(false) : std::nullopt;
  }
  if (std::strcmp(PQgetvalue(result.get(), 0, 0), "0") == 0)
    ++stored.repeats;
  else
    ++stored.posts;
  return true;
}

bool Table::setAside(const Post& post, const std::string& reason, Stored& stored, std::string& problem) {
  // Facts that are no text would not go aside either.
  std::array<std::string, 10> facts = {post.id,       post.received, post.path,          post.sender,
                                       post.client,   post.service,  post.clientVersion, post.digest,
                                       post.encoding, reason};
  std::array<const char*, 11> values{};
  for (size_t i = 0; i < facts.size(); ++i) {
    facts[i] = escapedText(facts[i]);
    values[i] = facts[i].c_str();
  }
  values[10] = post.body.data();
  std::array<int, 11> lengths{}, formats{};
  lengths[10] = static_cast<int>(post.body.size());
  formats[10] = 1;  // as bytes
  const Result result(PQexecPrepared(connection_->handle, "unreadable", values.size(), values.data(),
                                     lengths.data(), formats.data(), 0));
  if (!isGood(result)) problem = messageOf(result);
  if (isGood(result))
    ++(std::strcmp(PQcmdTuples(result.get()), "0") == 0 ? stored.repeats : stored.unreadable);
  return isGood(result);
}

bool Table::storeEach(const std::vector<Post>& posts, Stored& stored, std::string& problem) {
  for (const Post& post : posts) {
    if (!connection_->runs("SAVEPOINT one", problem)) return false;
    const std::optional<bool> read = storeOne(post, stored, problem);
    if (!read) return false;
    if (*read) continue;
    const std::string reason = problem;
    if (!connection_->runs("ROLLBACK TO SAVEPOINT one", problem) || !setAside(post, reason, stored, problem))
      return false;
  }
  return true;
}

std::optional<std::string> Table::store(const std::vector<Post>& posts, Stored& stored) {
  std::string problem;
  Stored now;
  bool isWhole = connection_ != nullptr && connection_->runs("BEGIN", problem);
  bool allRead = true;
  for (const Post& post : posts) {
    if (!isWhole || !allRead) break;
    const std::optional<bool> read = storeOne(post, now, problem);
    isWhole = read.has_value();
    allRead = read.value_or(false);
  }
  // Rarely: then one by one, which costs more.
  if (isWhole && !allRead) {
    now = Stored();
    isWhole = connection_->runs("ROLLBACK", problem) && connection_->runs("BEGIN", problem) &&
              storeEach(posts, now, problem);
  }
  if (!isWhole || !connection_->runs("COMMIT", problem)) return problem.empty() ? "no connection" : problem;
  stored.posts += now.posts;
  stored.repeats += now.repeats;
  stored.unreadable += now.unreadable;
  return std::nullopt;
}

}  // namespace kyt::reader
