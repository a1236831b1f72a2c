#include "taskmgr/sqlite_api.h"

#include <dlfcn.h>
#include <syslog.h>

namespace NVX {

namespace {

template <typename T>
bool Load(void* handle, const char* name, T* fn) {
  *fn = reinterpret_cast<T>(dlsym(handle, name));
  return *fn != nullptr;
}

}  // namespace

const SqliteApi* Sqlite() {
  static const SqliteApi* api = []() -> const SqliteApi* {
    static SqliteApi loaded;
    void* h = dlopen("libsqlite3.so.0", RTLD_NOW | RTLD_LOCAL);
    bool ok = h && Load(h, "sqlite3_open_v2", &loaded.open_v2) &&
              Load(h, "sqlite3_close", &loaded.close) &&
              Load(h, "sqlite3_busy_timeout", &loaded.busy_timeout) &&
              Load(h, "sqlite3_exec", &loaded.exec) && Load(h, "sqlite3_free", &loaded.free) &&
              Load(h, "sqlite3_errmsg", &loaded.errmsg) &&
              Load(h, "sqlite3_prepare_v2", &loaded.prepare_v2) &&
              Load(h, "sqlite3_finalize", &loaded.finalize) &&
              Load(h, "sqlite3_reset", &loaded.reset) &&
              Load(h, "sqlite3_clear_bindings", &loaded.clear_bindings) &&
              Load(h, "sqlite3_bind_text", &loaded.bind_text) &&
              Load(h, "sqlite3_bind_int64", &loaded.bind_int64) &&
              Load(h, "sqlite3_step", &loaded.step) &&
              Load(h, "sqlite3_column_text", &loaded.column_text) &&
              Load(h, "sqlite3_column_int64", &loaded.column_int64);
    if (!ok)
      syslog(LOG_ERR, "%s:%d cannot load libsqlite3: %s", "sqlite_api", __LINE__,
             h ? "symbols missing" : dlerror());
    return ok ? &loaded : nullptr;
  }();
  return api;
}

int SqliteOpenStore(const std::string& path, int flags, int busy_ms, const char* schema,
                    const char* what, sqlite3** db) {
  int rc = Sqlite()->open_v2(path.c_str(), db, flags, nullptr);
  if (rc != SQLITE_OK) {
    syslog(LOG_ERR, "%s:%d %s: cannot open %s: %s", "sqlite_api", __LINE__, what, path.c_str(),
           *db ? Sqlite()->errmsg(*db) : "out of memory");
    Sqlite()->close(*db);
    *db = nullptr;
    return rc;
  }
  Sqlite()->busy_timeout(*db, busy_ms);
  char* error = nullptr;
  rc = Sqlite()->exec(*db, "PRAGMA journal_mode=DELETE; PRAGMA synchronous=NORMAL;", nullptr,
                      nullptr, &error);
  if (rc == SQLITE_OK) rc = Sqlite()->exec(*db, schema, nullptr, nullptr, &error);
  if (rc != SQLITE_OK) {
    syslog(LOG_ERR, "%s:%d %s %s: %s", "sqlite_api", __LINE__, what, path.c_str(),
           error ? error : "cannot be read");
    Sqlite()->free(error);
  }
  return rc;
}

SqliteStatementUse& SqliteStatementUse::Bind(int i, const std::string& text) {
  if (stmt_)
    Sqlite()->bind_text(stmt_, i, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
  return *this;
}

SqliteStatementUse& SqliteStatementUse::Bind(int i, long long value) {
  if (stmt_) Sqlite()->bind_int64(stmt_, i, value);
  return *this;
}

bool SqliteStatementUse::Run() { return stmt_ && Sqlite()->step(stmt_) == SQLITE_DONE; }

bool SqliteStatementUse::Row() { return stmt_ && Sqlite()->step(stmt_) == SQLITE_ROW; }

std::string SqliteStatementUse::Text(int col) {
  const unsigned char* t = Sqlite()->column_text(stmt_, col);
  return t ? reinterpret_cast<const char*>(t) : "";
}

long long SqliteStatementUse::Int(int col) { return Sqlite()->column_int64(stmt_, col); }

}  // namespace NVX
