#include "devserver/Store.h"

#include <openssl/sha.h>
#include <pthread.h>
#include <sys/stat.h>

#include "devserver/JsonText.h"
#include "platform/base/Hex.h"

namespace kyt::devserver {
namespace {

constexpr int64_t kKeptFetches = 10000;
constexpr int64_t kKeptLines = 10000;
constexpr int64_t kKeptLogs = 200;  // each may be as large as a post

constexpr char kTables[] = R"sql(
PRAGMA journal_mode = WAL;
PRAGMA synchronous = NORMAL;
PRAGMA foreign_keys = ON;
CREATE TABLE IF NOT EXISTS posts (
  id INTEGER PRIMARY KEY AUTOINCREMENT, received REAL, secure INTEGER, http_method TEXT, path TEXT, client TEXT,
  service TEXT, sender TEXT, good INTEGER, reason TEXT, digest TEXT, answered INTEGER, client_id TEXT, post_time REAL,
  text_size INTEGER, events INTEGER, headers TEXT, size INTEGER, body BLOB, sha256 TEXT, repeats INTEGER);
CREATE TABLE IF NOT EXISTS events (
  id INTEGER PRIMARY KEY AUTOINCREMENT, post INTEGER REFERENCES posts(id) ON DELETE CASCADE, received REAL,
  client TEXT, service TEXT, sender TEXT, method INTEGER, status INTEGER, session TEXT, number INTEGER, time REAL,
  record TEXT);
CREATE INDEX IF NOT EXISTS events_post ON events(post);
CREATE INDEX IF NOT EXISTS events_client ON events(client, service, sender, method, status);
CREATE INDEX IF NOT EXISTS events_method ON events(method, status);
CREATE INDEX IF NOT EXISTS events_session ON events(session, number);
CREATE INDEX IF NOT EXISTS events_received ON events(received, client, method);
CREATE TABLE IF NOT EXISTS fetches (
  id INTEGER PRIMARY KEY AUTOINCREMENT, time REAL, secure INTEGER, name TEXT, path TEXT, version TEXT, status INTEGER,
  if_modified_since TEXT, last_modified TEXT, user_agent TEXT);
CREATE TABLE IF NOT EXISTS arrivals (
  id INTEGER PRIMARY KEY AUTOINCREMENT, kind INTEGER, received REAL, good INTEGER, json TEXT);
CREATE INDEX IF NOT EXISTS arrivals_kind ON arrivals(kind, id);
)sql";
// A database of before has no such columns yet.
constexpr char kAddBodyNames[] =
    "ALTER TABLE posts ADD COLUMN sha256 TEXT; ALTER TABLE posts ADD COLUMN repeats INTEGER";
constexpr char kIndexBodyNames[] = "CREATE INDEX IF NOT EXISTS posts_sha256 ON posts(sha256)";

std::string sha256Of(std::string_view bytes) {
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(), digest);
  std::string text;
  appendHex(std::string_view(reinterpret_cast<const char*>(digest), sizeof digest), text);
  return text;
}

std::string headersAsJson(const std::vector<Header>& headers) {
  JsonText json;
  json.array();
  for (const Header& header : headers) json.array().value(header.name).value(header.value).endArray();
  return json.endArray().text();
}

size_t sizeOf(const Post& post) {
  size_t size = 1024 + post.body.size();
  for (const Event& event : post.events) size += 256 + event.record.size();
  return size;
}

uint64_t keptSizeOf(const Post& post) {
  return post.body.size() + post.textSize;
}

}  // namespace

bool Store::makeTables(Database& database) {
  if (!database.execute(kTables)) return false;
  const bool isOld =
      database.number("SELECT count(*) FROM pragma_table_info('posts') WHERE name = 'sha256'") == 0;
  return (!isOld || database.execute(kAddBodyNames)) && database.execute(kIndexBodyNames);
}

std::unique_ptr<Store> Store::open(const std::filesystem::path& file, Retention retention,
                                   std::function<void(const Commit&)> committed, std::string& error) {
  auto writer = Database::open(file, error);
  if (!writer) return nullptr;
  chmod(file.c_str(), 0600);
  if (!makeTables(*writer)) {
    error = "can't make the tables in " + file.string();
    return nullptr;
  }
  auto reader = Database::open(file, error);
  if (!reader) return nullptr;
  return std::unique_ptr<Store>(
      new Store(std::move(writer), std::move(reader), retention, std::move(committed)));
}

Store::Store(std::unique_ptr<Database> writer, std::unique_ptr<Database> reader, Retention retention,
             std::function<void(const Commit&)> committed)
    : retention_(retention),
      committed_(std::move(committed)),
      writer_(std::move(writer)),
      insertPost_(writer_->prepare("INSERT INTO posts VALUES(NULL,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?)")),
      insertEvent_(writer_->prepare("INSERT INTO events VALUES(NULL,?,?,?,?,?,?,?,?,?,?,?)")),
      insertFetch_(writer_->prepare("INSERT INTO fetches VALUES(NULL,?,?,?,?,?,?,?,?,?)")),
      insertArrival_(writer_->prepare("INSERT INTO arrivals VALUES(NULL,?,?,?,?)")),
      firstOfBody_(writer_->prepare("SELECT min(id) FROM posts WHERE sha256 = ?")),
      reader_(std::move(reader)) {
  writtenTotals_ = {writer_->number("SELECT count(*) FROM posts"),
                    writer_->number("SELECT count(*) FROM posts WHERE NOT good"),
                    writer_->number("SELECT count(*) FROM events"),
                    writer_->number("SELECT count(*) FROM fetches"),
                    writer_->number("SELECT count(*) FROM arrivals WHERE kind = 0"),
                    writer_->number("SELECT count(*) FROM arrivals WHERE kind = 1")};
  keptPosts_ = static_cast<uint64_t>(writtenTotals_.posts);
  keptBytes_ = static_cast<uint64_t>(writer_->number("SELECT sum(size + text_size) FROM posts"));
  totals_ = writtenTotals_;
  thread_ = std::thread([this] { writeLoop(); });
}

Store::~Store() {
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    changed_.notify_all();
  }
  thread_.join();
}

void Store::add(Post post) {
  const size_t size = sizeOf(post);
  MutexLock lock(mutex_);
  while (pending_.bytes > kMaxQueuedBytes) changed_.wait(mutex_);
  pending_.bytes += size;
  pending_.posts.push_back(std::move(post));
  ++added_;
  changed_.notify_all();
}

void Store::add(Fetch fetch) {
  MutexLock lock(mutex_);
  pending_.fetches.push_back(std::move(fetch));
  ++added_;
  changed_.notify_all();
}

void Store::add(Arrival arrival) {
  MutexLock lock(mutex_);
  while (pending_.bytes > kMaxQueuedBytes) changed_.wait(mutex_);
  pending_.bytes += arrival.json.size() + 256;
  pending_.arrivals.push_back(std::move(arrival));
  ++added_;
  changed_.notify_all();
}

void Store::clear() {
  {
    MutexLock lock(mutex_);
    pending_ = Pending();
    pending_.clear = true;
    ++added_;
    changed_.notify_all();
  }
  drain();
}

Totals Store::totals() {
  drain();
  MutexLock lock(mutex_);
  return totals_;
}

void Store::drain() {
  MutexLock lock(mutex_);
  const uint64_t target = added_;
  while (written_ < target) changed_.wait(mutex_);
}

void Store::writeLoop() {
  pthread_setname_np(pthread_self(), "kyt-store");
  for (;;) {
    Pending pending;
    uint64_t target = 0;
    {
      MutexLock lock(mutex_);
      while (written_ == added_ && !stopping_) changed_.wait(mutex_);
      if (written_ == added_) return;
      std::swap(pending, pending_);
      target = added_;
      changed_.notify_all();
    }
    write(pending);
    {
      MutexLock lock(mutex_);
      written_ = target;
      totals_ = writtenTotals_;
      changed_.notify_all();
    }
    committed_(Commit{std::move(pending.posts), std::move(pending.fetches), std::move(pending.arrivals),
                      writtenTotals_});
  }
}

void Store::write(Pending& pending) {
  writer_->execute("BEGIN IMMEDIATE");
  if (pending.clear) {
    writer_->execute("DELETE FROM events; DELETE FROM posts; DELETE FROM fetches; DELETE FROM arrivals");
    writtenTotals_ = Totals();
    keptPosts_ = keptBytes_ = 0;
  }
  for (Post& post : pending.posts) writePost(post);
  for (Fetch& fetch : pending.fetches) writeFetch(fetch);
  for (Arrival& arrival : pending.arrivals) writeArrival(arrival);
  applyRetention();
  if (!writer_->execute("COMMIT")) writer_->execute("ROLLBACK");
}

// A device sends a post of events again byte for byte: its body, which holds the device and the moment, names it. Two
// uploads may well have the same contents.
void Store::nameBody(Post& post) {
  if (post.body.empty()) return;
  post.sha256 = sha256Of(post.body);
  if (post.clientId.empty()) return;
  firstOfBody_.bind(post.sha256);
  if (firstOfBody_.step() && !firstOfBody_.isNull(0)) post.repeats = firstOfBody_.integer(0);
  firstOfBody_.reset();
}

void Store::writePost(Post& post) {
  nameBody(post);
  insertPost_.bind(post.received).bind(int64_t{post.secure}).bind(post.method).bind(post.path);
  insertPost_.bind(post.client)
      .bind(post.service)
      .bind(post.sender)
      .bind(int64_t{post.good})
      .bind(post.reason);
  insertPost_.bind(post.digest).bind(int64_t{post.answered}).bind(post.clientId).bind(post.postTime);
  insertPost_.bind(static_cast<int64_t>(post.textSize)).bind(static_cast<int64_t>(post.events.size()));
  insertPost_.bind(headersAsJson(post.headers))
      .bind(static_cast<int64_t>(post.body.size()))
      .bindBlob(post.body)
      .bind(post.sha256)
      .bind(post.repeats);
  if (!insertPost_.run()) return;
  post.id = writer_->lastInsertedRow();
  for (const Event& event : post.events) {
    insertEvent_.bind(post.id).bind(post.received).bind(event.client).bind(event.service).bind(event.sender);
    insertEvent_.bind(event.method)
        .bind(event.status)
        .bind(event.session)
        .bind(event.number)
        .bind(event.time);
    insertEvent_.bind(event.record).run();
  }
  writtenTotals_.posts += 1;
  writtenTotals_.bad += post.good ? 0 : 1;
  writtenTotals_.events += static_cast<int64_t>(post.events.size());
  keptPosts_ += 1;
  keptBytes_ += keptSizeOf(post);
}

void Store::writeFetch(Fetch& fetch) {
  insertFetch_.bind(fetch.time)
      .bind(int64_t{fetch.secure})
      .bind(fetch.name)
      .bind(fetch.path)
      .bind(fetch.version);
  insertFetch_.bind(int64_t{fetch.status})
      .bind(fetch.ifModifiedSince)
      .bind(fetch.lastModified)
      .bind(fetch.userAgent);
  if (!insertFetch_.run()) return;
  fetch.id = writer_->lastInsertedRow();
  writtenTotals_.fetches += 1;
  if (fetch.id > kKeptFetches && fetch.id % 100 == 0) {
    writer_->prepare("DELETE FROM fetches WHERE id <= ?").bind(fetch.id - kKeptFetches).run();
  }
}

void Store::writeArrival(Arrival& arrival) {
  const bool isLine = arrival.kind == Arrival::Kind::line;
  const int64_t kind = isLine ? 0 : 1;
  insertArrival_.bind(kind).bind(arrival.received).bind(int64_t{arrival.good}).bind(arrival.json);
  if (!insertArrival_.run()) return;
  arrival.id = writer_->lastInsertedRow();
  int64_t& total = isLine ? writtenTotals_.lines : writtenTotals_.logs;
  total += 1;
  const int64_t kept = isLine ? kKeptLines : kKeptLogs;
  if (total <= kept || total % 100 != 0) return;
  writer_
      ->prepare(
          "DELETE FROM arrivals WHERE kind = ?1 AND id <= "
          "(SELECT id FROM arrivals WHERE kind = ?1 ORDER BY id DESC LIMIT 1 OFFSET ?2)")
      .bind(kind)
      .bind(kept)
      .run();
}

void Store::applyRetention() {
  if (keptPosts_ <= retention_.posts && keptBytes_ <= retention_.bytes) return;
  int64_t last = 0;
  {
    Statement oldest = writer_->prepare("SELECT id, size + text_size FROM posts ORDER BY id");
    while ((keptPosts_ > retention_.posts || keptBytes_ > retention_.bytes) && oldest.step()) {
      last = oldest.integer(0);
      keptPosts_ -= 1;
      keptBytes_ -= static_cast<uint64_t>(oldest.integer(1));
    }
  }
  writer_->prepare("DELETE FROM posts WHERE id <= ?").bind(last).run();
}

}  // namespace kyt::devserver
