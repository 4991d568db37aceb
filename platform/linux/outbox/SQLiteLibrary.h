// The functions of SQLite, loaded when there is a post to keep or one was left by an earlier process: a daemon whose posts
// all arrive does not have it in memory.
#pragma once

#include <sqlite3.h>

#include <string>
#include <variant>

// The one table of SQLite's functions: what each is called here, and there.
#define KYT_SQLITE_FUNCTIONS(ROW)            \
  ROW(open, sqlite3_open_v2)                 \
  ROW(close, sqlite3_close)                  \
  ROW(execute, sqlite3_exec)                 \
  ROW(prepare, sqlite3_prepare_v2)           \
  ROW(finalize, sqlite3_finalize)            \
  ROW(step, sqlite3_step)                    \
  ROW(reset, sqlite3_reset)                  \
  ROW(clearBindings, sqlite3_clear_bindings) \
  ROW(bindInteger, sqlite3_bind_int64)       \
  ROW(bindBlob, sqlite3_bind_blob64)         \
  ROW(columnInteger, sqlite3_column_int64)   \
  ROW(columnBlob, sqlite3_column_blob)       \
  ROW(columnBytes, sqlite3_column_bytes)     \
  ROW(columnType, sqlite3_column_type)       \
  ROW(errorText, sqlite3_errmsg)             \
  ROW(textOfCode, sqlite3_errstr)            \
  ROW(isAutoCommit, sqlite3_get_autocommit)

namespace kyt {

struct SQLiteLibrary {
  // Loads it, or says why that failed.
  [[nodiscard]] static std::variant<SQLiteLibrary, std::string> load(const char* name);

// NOLINTNEXTLINE(bugprone-macro-parentheses): a name that is declared cannot stand in parentheses
#define ROW(here, there) decltype(::there)* here = nullptr;
  KYT_SQLITE_FUNCTIONS(ROW)
#undef ROW
};

}  // namespace kyt
