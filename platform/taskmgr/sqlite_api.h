// The SQLite functions the task store uses, loaded from libsqlite3 on first
// use. Every web API request is a new process, and Debian's libsqlite3
// binds some 1600 symbols when it is loaded; most requests never open the
// task store. Internal to the platform libraries that keep a database
// (platform/taskmgr, platform/activity).
#pragma once

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

}  // namespace NVX
