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

}  // namespace NVX
