#include "devserver/Database.h"

#include <sqlite3.h>

#include <cstdio>

namespace kyt::devserver {
namespace {

constexpr int kBusyMilliseconds = 10000;

void tell(sqlite3* handle, const char* what) {
  std::fprintf(stderr, "kytdevserver: database: %s: %s\n", what, sqlite3_errmsg(handle));
}

}  // namespace

void Statement::Finalize::operator()(sqlite3_stmt* statement) const {
  sqlite3_finalize(statement);
}

Statement& Statement::bind(int64_t value) {
  sqlite3_bind_int64(statement_.get(), ++parameter_, value);
  return *this;
}

Statement& Statement::bind(double value) {
  sqlite3_bind_double(statement_.get(), ++parameter_, value);
  return *this;
}

Statement& Statement::bind(std::string_view text) {
  sqlite3_bind_text64(statement_.get(), ++parameter_, text.data() != nullptr ? text.data() : "", text.size(),
                      SQLITE_TRANSIENT, SQLITE_UTF8);
  return *this;
}

Statement& Statement::bindBlob(std::string_view bytes) {
  sqlite3_bind_blob64(statement_.get(), ++parameter_, bytes.data() != nullptr ? bytes.data() : "",
                      bytes.size(), SQLITE_TRANSIENT);
  return *this;
}

Statement& Statement::bindNull() {
  sqlite3_bind_null(statement_.get(), ++parameter_);
  return *this;
}

bool Statement::step() {
  if (!statement_) return false;
  const int result = sqlite3_step(statement_.get());
  if (result == SQLITE_ROW) return true;
  if (result != SQLITE_DONE) tell(sqlite3_db_handle(statement_.get()), sqlite3_sql(statement_.get()));
  return false;
}

bool Statement::run() {
  if (!statement_) return false;
  int result = SQLITE_ROW;
  while (result == SQLITE_ROW) result = sqlite3_step(statement_.get());
  if (result != SQLITE_DONE) tell(sqlite3_db_handle(statement_.get()), sqlite3_sql(statement_.get()));
  reset();
  return result == SQLITE_DONE;
}

void Statement::reset() {
  sqlite3_reset(statement_.get());
  parameter_ = 0;
}

int64_t Statement::integer(int column) const {
  return sqlite3_column_int64(statement_.get(), column);
}

double Statement::real(int column) const {
  return sqlite3_column_double(statement_.get(), column);
}

std::string_view Statement::text(int column) const {
  const void* bytes = sqlite3_column_blob(statement_.get(), column);
  if (bytes == nullptr) return {};
  return {static_cast<const char*>(bytes),
          static_cast<size_t>(sqlite3_column_bytes(statement_.get(), column))};
}

bool Statement::isNull(int column) const {
  return sqlite3_column_type(statement_.get(), column) == SQLITE_NULL;
}

std::unique_ptr<Database> Database::open(const std::string& path, std::string& error) {
  sqlite3* handle = nullptr;
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_FULLMUTEX;
  if (sqlite3_open_v2(path.c_str(), &handle, flags, nullptr) != SQLITE_OK) {
    error = "can't open " + path + ": " + (handle != nullptr ? sqlite3_errmsg(handle) : "out of memory");
    sqlite3_close(handle);
    return nullptr;
  }
  sqlite3_busy_timeout(handle, kBusyMilliseconds);
  return std::unique_ptr<Database>(new Database(handle));
}

Database::~Database() {
  sqlite3_close_v2(handle_);
}

bool Database::execute(const char* sql) {
  if (sqlite3_exec(handle_, sql, nullptr, nullptr, nullptr) == SQLITE_OK) return true;
  tell(handle_, sql);
  return false;
}

Statement Database::prepare(std::string_view sql) {
  sqlite3_stmt* statement = nullptr;
  const int size = static_cast<int>(sql.size());
  if (sqlite3_prepare_v2(handle_, sql.data(), size, &statement, nullptr) != SQLITE_OK) {
    tell(handle_, std::string(sql).c_str());
  }
  return Statement(statement);
}

int64_t Database::number(std::string_view sql) {
  Statement statement = prepare(sql);
  return statement.step() ? statement.integer(0) : 0;
}

int64_t Database::lastInsertedRow() const {
  return sqlite3_last_insert_rowid(handle_);
}

}  // namespace kyt::devserver
