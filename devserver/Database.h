// SQLite behind values and RAII: a connection and its prepared statements. A connection belongs to one thread
// at a time. An error of SQLite is told once on standard error and answered false; nothing throws.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

struct sqlite3;
struct sqlite3_stmt;

namespace kyt::devserver {

class Statement {
 public:
  // Parameters in their order, from the first. A bound text is copied.
  Statement& bind(int64_t value);
  Statement& bind(double value);
  Statement& bind(std::string_view text);
  Statement& bindBlob(std::string_view bytes);
  Statement& bindNull();
  template <typename T>
  Statement& bind(const std::optional<T>& value) {
    return value ? bind(*value) : bindNull();
  }
  // Goes to the next row; false at the end and on errors.
  bool step();
  // Runs to the end and makes the statement ready for new parameters.
  bool run();
  void reset();

  [[nodiscard]] int64_t integer(int column) const;
  [[nodiscard]] double real(int column) const;
  [[nodiscard]] std::string_view text(int column) const;  // valid until the next step
  [[nodiscard]] bool isNull(int column) const;

 private:
  friend class Database;
  struct Finalize {
    void operator()(sqlite3_stmt* statement) const;
  };
  explicit Statement(sqlite3_stmt* statement) : statement_(statement) {}
  std::unique_ptr<sqlite3_stmt, Finalize> statement_;
  int parameter_ = 0;
};

class Database {
 public:
  // Opens or creates; the error is a text for people.
  [[nodiscard]] static std::unique_ptr<Database> open(const std::string& path, std::string& error);
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;

  bool execute(const char* sql);
  // A statement that could not be prepared has no rows.
  [[nodiscard]] Statement prepare(std::string_view sql);
  [[nodiscard]] int64_t number(std::string_view sql);  // the one number that a query returns, or 0
  [[nodiscard]] int64_t lastInsertedRow() const;

 private:
  explicit Database(sqlite3* handle) : handle_(handle) {}
  sqlite3* handle_;
};

}  // namespace kyt::devserver
