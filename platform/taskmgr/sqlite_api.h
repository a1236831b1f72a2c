// The SQLite functions the task store uses, loaded from libsqlite3 on first
// use. Every web API request is a new process, and Debian's libsqlite3
// binds some 1600 symbols when it is loaded; most requests never open the
// task store. Internal to the platform libraries that keep a database
// (platform/taskmgr, platform/activity).
#pragma once

#include <string>

#include <sqlite3.h>

namespace NVX {

struct SqliteApi {
  decltype(&::sqlite3_open_v2) open_v2;
  decltype(&::sqlite3_close) close;
  decltype(&::sqlite3_busy_timeout) busy_timeout;
  decltype(&::sqlite3_exec) exec;
  decltype(&::sqlite3_free) free;
  decltype(&::sqlite3_errmsg) errmsg;
  decltype(&::sqlite3_prepare_v2) prepare_v2;
  decltype(&::sqlite3_finalize) finalize;
  decltype(&::sqlite3_reset) reset;
  decltype(&::sqlite3_clear_bindings) clear_bindings;
  decltype(&::sqlite3_bind_text) bind_text;
  decltype(&::sqlite3_bind_int64) bind_int64;
  decltype(&::sqlite3_step) step;
  decltype(&::sqlite3_column_text) column_text;
  decltype(&::sqlite3_column_int64) column_int64;
};

// The loaded functions, or null when libsqlite3 cannot be loaded.
const SqliteApi* Sqlite();

// Opens the database file `path` with `flags` (SQLITE_OPEN_*) the way every
// store of the platform does: a writer waits up to `busy_ms` for the others,
// the file keeps the rollback journal (several processes write it, and the
// SQLite of Debian 12 predates a fix for WAL files written by several
// processes), synchronous=NORMAL, and `schema` is run. *db is the
// connection, or null when the file could not be opened. Returns SQLITE_OK
// or the code of the step that failed, logged under `what` (the store's
// name); a failure after the open leaves *db open for the caller to close or
// keep. Needs Sqlite().
[[nodiscard]] int SqliteOpenStore(const std::string& path, int flags, int busy_ms,
                                  const char* schema, const char* what, sqlite3** db);

// One use of a prepared statement: binds values, steps, reads columns. A
// null statement (a prepare that failed) binds nothing and neither runs nor
// has a row. Who ends the statement (finalize, or reset to keep it) is the
// class that holds it, which derives from this one.
class SqliteStatementUse {
 public:
  SqliteStatementUse(const SqliteStatementUse&) = delete;
  SqliteStatementUse& operator=(const SqliteStatementUse&) = delete;

  SqliteStatementUse& Bind(int i, const std::string& text);
  SqliteStatementUse& Bind(int i, long long value);
  // Runs a statement without results. False on failure.
  bool Run();
  // Steps to the next row. False when there is none (or on failure).
  bool Row();
  bool ok() const { return stmt_ != nullptr; }
  // Column `col` of the current row; "" or 0 for NULL.
  std::string Text(int col);
  long long Int(int col);

 protected:
  explicit SqliteStatementUse(sqlite3_stmt* stmt) : stmt_(stmt) {}
  ~SqliteStatementUse() = default;

  sqlite3_stmt* stmt_;
};

}  // namespace NVX
