// The SQLite database behind the task manager. Internal to platform/taskmgr.
#pragma once

#include <map>
#include <string>
#include <sys/types.h>

struct sqlite3;
struct sqlite3_stmt;

namespace NVX {

class TaskStore {
 public:
  TaskStore();
  ~TaskStore();
  TaskStore(const TaskStore&) = delete;
  TaskStore& operator=(const TaskStore&) = delete;

  // The connection of this process, opened (and the schema made) on first
  // use and again after a fork. Null when the database cannot be opened.
  sqlite3* db();
  // Runs `sql` (no results). False on failure.
  bool Exec(const char* sql);
  // The prepared statement for `sql`, reset and with its bindings cleared;
  // kept for the connection's life (a list looks tasks up thousands of
  // times). Null on failure.
  sqlite3_stmt* Prepared(const char* sql);

 private:
  sqlite3* db_ = nullptr;
  pid_t pid_ = 0;
  std::string path_;
  std::map<const char*, sqlite3_stmt*> statements_;  // by the address of their SQL text
  void Close();
};

}  // namespace NVX
