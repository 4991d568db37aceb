// The database that posts go into: PostgreSQL. Each post is stored once, whatever its number of repeats, with its events as
// rows that people query; what cannot be read, or is too much for the database, stands aside with its reason and its body, its
// facts escaped. One thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "reader/Post.h"

namespace kyt::reader {

// How many were new, came again (also those that stand aside), or were set aside.
struct Stored {
  uint64_t posts = 0, repeats = 0, unreadable = 0;
};

// An error is a text for people.
class Table {
 public:
  explicit Table(std::string database);  // as libpq takes it: "host=… dbname=…"
  ~Table();
  Table(const Table&) = delete;
  Table& operator=(const Table&) = delete;

  // Connects, and makes the tables where there are none.
  [[nodiscard]] std::optional<std::string> open();
  // All of them in one transaction, committed when this returns without an error. After one none of them is stored, and
  // open() is due: the connection or the database failed, not a post.
  [[nodiscard]] std::optional<std::string> store(const std::vector<Post>& posts, Stored& stored);

 private:
  struct Connection;
  // Whether the post could be read; none: the transaction failed, with the reason in `problem`.
  [[nodiscard]] std::optional<bool> storeOne(const Post& post, Stored& stored, std::string& problem);
  [[nodiscard]] bool setAside(const Post& post, const std::string& reason, Stored& stored,
                              std::string& problem);
  // As storeOne(); what cannot be read takes nothing else with it.
  [[nodiscard]] bool storeEach(const std::vector<Post>& posts, Stored& stored, std::string& problem);

  const std::string database_;
  std::unique_ptr<Connection> connection_;
};

}  // namespace kyt::reader
