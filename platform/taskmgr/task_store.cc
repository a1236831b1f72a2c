#include "taskmgr/task_store.h"

#include <syslog.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "taskmgr/sqlite_api.h"

namespace NVX {

namespace {

constexpr int kBusyTimeoutMs = 10000;

const char kSchema[] =
    "CREATE TABLE IF NOT EXISTS tasks ("
    "  owner TEXT NOT NULL, id TEXT NOT NULL, finished INTEGER NOT NULL DEFAULT 0,"
    "  ok INTEGER NOT NULL DEFAULT 0, created INTEGER NOT NULL, PRIMARY KEY (owner, id));"
    "CREATE TABLE IF NOT EXISTS properties ("
    "  owner TEXT NOT NULL, id TEXT NOT NULL, name TEXT NOT NULL, value TEXT NOT NULL,"
    "  PRIMARY KEY (owner, id, name));";

}  // namespace

TaskStore::TaskStore() = default;

TaskStore::~TaskStore() { Close(); }

void TaskStore::Close() {
  // A child never closes its parent's connection: that would touch the
  // parent's locks and journal.
  if (db_ && pid_ == getpid()) {
    for (auto& s : statements_) Sqlite()->finalize(s.second);
    Sqlite()->close(db_);
  }
  statements_.clear();
  db_ = nullptr;
}

sqlite3_stmt* TaskStore::Prepared(const char* sql) {
  if (!db()) return nullptr;
  auto it = statements_.find(sql);
  if (it != statements_.end()) {
    Sqlite()->reset(it->second);
    Sqlite()->clear_bindings(it->second);
    return it->second;
  }
  sqlite3_stmt* stmt = nullptr;
  if (Sqlite()->prepare_v2(db_, sql, -1, &stmt, nullptr) != SQLITE_OK) return nullptr;
  statements_[sql] = stmt;
  return stmt;
}

sqlite3* TaskStore::db() {
  if (!Sqlite()) return nullptr;
  std::string dir = KIVORootPath("/run/kivo");
  std::string path = dir + "/tasks.db";
  if (db_ && pid_ == getpid() && path == path_) return db_;
  Close();
  pid_ = getpid();
  path_ = path;
  // A folder that cannot be made shows as the open failure below.
  static_cast<void>(KIVOFSMkdirP(dir.c_str()));
  // A file that cannot be opened leaves db_ null; a schema that cannot be
  // made shows as the failure of each statement.
  static_cast<void>(SqliteOpenStore(path, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE,
                                    kBusyTimeoutMs, kSchema, "task store", &db_));
  return db_;
}

bool TaskStore::Exec(const char* sql) {
  if (!db_) return false;
  char* error = nullptr;
  if (Sqlite()->exec(db_, sql, nullptr, nullptr, &error) == SQLITE_OK) return true;
  syslog(LOG_ERR, "%s:%d task store: %s", "task_store", __LINE__, error ? error : "?");
  Sqlite()->free(error);
  return false;
}

}  // namespace NVX
