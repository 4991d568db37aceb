// Everything that came in, in SQLite: posts, their events, fetches of storebags,
// lines of the dashboard feed, log data.
//
// Additions are queued and written by one thread, all that waits in one transaction, so that a flood of posts
// costs few commits; an addition waits only while more than `kMaxQueuedBytes` are queued. Queries first wait
// until everything added before them is written: who was answered 200 finds the post. The oldest posts go
// when there are more of them, or more bytes, than are to be kept. Any thread.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "devserver/Database.h"
#include "devserver/Post.h"
#include "platform/base/Mutex.h"

namespace kyt::devserver {

struct Totals {
  // Since the store was made or cleared.
  int64_t posts = 0, bad = 0, events = 0, fetches = 0, lines = 0, logs = 0;
};

// What one transaction wrote.
struct Commit {
  std::vector<Post> posts;
  std::vector<Fetch> fetches;
  std::vector<Arrival> arrivals;
  Totals totals;
};

struct Retention {
  uint64_t posts, bytes;
};

class Store {
 public:
  static constexpr size_t kMaxQueuedBytes = 64 << 20;

  // `committed` is called on the writer's thread after each transaction. Null, with a text for people, on
  // failure.
  [[nodiscard]] static std::unique_ptr<Store> open(const std::filesystem::path& file, Retention retention,
                                                   std::function<void(const Commit&)> committed,
                                                   std::string& error);
  ~Store();  // writes what is queued

  void add(Post post) EXCLUDES(mutex_);
  void add(Fetch fetch) EXCLUDES(mutex_);
  void add(Arrival arrival) EXCLUDES(mutex_);
  void clear() EXCLUDES(mutex_);
  [[nodiscard]] Totals totals() EXCLUDES(mutex_);

  // Runs a query on the connection for readers, one at a time.
  template <typename Query>
  auto read(Query&& query) EXCLUDES(mutex_, readerMutex_) {
    drain();
    MutexLock lock(readerMutex_);
    return query(*reader_);
  }

 private:
  struct Pending {
    std::vector<Post> posts;
    std::vector<Fetch> fetches;
    std::vector<Arrival> arrivals;
    size_t bytes = 0;
    bool clear = false;
  };
  Store(std::unique_ptr<Database> writer, std::unique_ptr<Database> reader, Retention retention,
        std::function<void(const Commit&)> committed);
  [[nodiscard]] static bool makeTables(Database& database);
  void drain() EXCLUDES(mutex_);
  void writeLoop() EXCLUDES(mutex_);
  void write(Pending& pending);
  void nameBody(Post& post);
  void writePost(Post& post);
  void writeFetch(Fetch& fetch);
  void writeArrival(Arrival& arrival);
  void applyRetention();

  // Constant after construction.
  const Retention retention_;
  const std::function<void(const Commit&)> committed_;
  // The writer's thread alone.
  std::unique_ptr<Database> writer_;
  Statement insertPost_, insertEvent_, insertFetch_, insertArrival_, firstOfBody_;
  uint64_t keptPosts_ = 0, keptBytes_ = 0;
  Totals writtenTotals_;

  Mutex readerMutex_;
  std::unique_ptr<Database> reader_ PT_GUARDED_BY(readerMutex_);

  Mutex mutex_;
  std::condition_variable_any changed_;
  Pending pending_ GUARDED_BY(mutex_);
  uint64_t added_ GUARDED_BY(mutex_) = 0;
  uint64_t written_ GUARDED_BY(mutex_) = 0;
  Totals totals_ GUARDED_BY(mutex_);
  bool stopping_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace kyt::devserver
