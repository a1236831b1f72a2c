#include "activity/activity_log.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "taskmgr/sqlite_api.h"

namespace KivoActivity {

namespace {

using NVX::Sqlite;
using NVX::SqliteStatementUse;

// A write waits this long for a reader or another writer; after that the
// operation it records goes on unrecorded rather than wait.
constexpr int kBusyTimeoutMs = 2000;
constexpr size_t kMaxWords = 500;

// Several processes write this file at once (SqliteOpenStore keeps the
// rollback journal for them).
const char kSchema[] =
    "CREATE TABLE IF NOT EXISTS activity ("
    "  id INTEGER PRIMARY KEY AUTOINCREMENT, started INTEGER NOT NULL, ended INTEGER,"
    "  state TEXT NOT NULL, actor TEXT NOT NULL, origin TEXT NOT NULL,"
    "  address TEXT NOT NULL, operation TEXT NOT NULL, target TEXT NOT NULL,"
    "  code INTEGER, words TEXT NOT NULL DEFAULT '', pid INTEGER NOT NULL,"
    "  pid_start INTEGER NOT NULL);"
    "CREATE INDEX IF NOT EXISTS activity_started ON activity (started);"
    "CREATE INDEX IF NOT EXISTS activity_state ON activity (state, id);"
    "CREATE INDEX IF NOT EXISTS activity_actor ON activity (actor, id);"
    "CREATE TABLE IF NOT EXISTS activity_package ("
    "  package TEXT NOT NULL, entry INTEGER NOT NULL, PRIMARY KEY (package, entry));"
    "CREATE INDEX IF NOT EXISTS activity_package_entry ON activity_package (entry);";

// One statement, finalized when it goes out of scope.
class Statement : public SqliteStatementUse {
 public:
  Statement(sqlite3* db, const std::string& sql) : SqliteStatementUse(Prepare(db, sql)) {}
  ~Statement() {
    if (stmt_) Sqlite()->finalize(stmt_);
  }

 private:
  static sqlite3_stmt* Prepare(sqlite3* db, const std::string& sql) {
    sqlite3_stmt* stmt = nullptr;
    if (db && Sqlite()->prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
      syslog(LOG_ERR, "%s:%d activity log: %s", "activity_log", __LINE__, Sqlite()->errmsg(db));
      return nullptr;
    }
    return stmt;
  }
};

// The start time of process `pid` in clock ticks since boot (field 22 of its
// stat file), which tells it apart from a later process given the same id;
// -1 when it is gone or a zombie.
long long ProcessStart(pid_t pid) {
  char path[64];
  snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
  FILE* f = fopen(path, "re");
  if (!f) return -1;
  char buf[1024];
  size_t n = fread(buf, 1, sizeof(buf) - 1, f);
  fclose(f);
  buf[n] = '\0';
  const char* p = strrchr(buf, ')');
  if (!p || p[1] != ' ' || p[2] == 'Z') return -1;
  p += 2;
  for (int field = 3; field < 22 && p; ++field) {
    p = strchr(p, ' ');
    if (p) ++p;
  }
  return p ? strtoll(p, nullptr, 10) : -1;
}

bool ReadBound(const KeyValueMap& conf, const char* key, long long* out) {
  auto it = conf.find(key);
  if (it == conf.end()) return true;
  char* end = nullptr;
  errno = 0;
  long long v = strtoll(it->second.c_str(), &end, 10);
  if (errno != 0 || end == it->second.c_str() || *end != '\0' || v < 1 || v > 100000000) {
    syslog(LOG_WARNING, "%s:%d activity.conf: %s must be a whole number from 1, kept default",
           "activity_log", __LINE__, key);
    return false;
  }
  *out = v;
  return true;
}

std::string Cut(const std::string& text, size_t max) {
  return text.size() <= max ? text : text.substr(0, max);
}

// The filter's conditions as SQL with a `?` for each value: the texts come
// first in `*texts`, then the times in `*numbers`, in the order of the SQL.
// Values are only ever bound, never written into the SQL.
std::string WhereClause(const Filter& f, std::vector<std::string>* texts,
                        std::vector<long long>* numbers) {
  std::string where = " WHERE 1";
  // A condition counts when its value is given: a text not empty, a time
  // not negative.
  auto add_text = [&](const std::string& value, const char* condition) {
    if (value.empty()) return;
    where += condition;
    texts->push_back(value);
  };
  auto add_time = [&](long long value, const char* condition) {
    if (value < 0) return;
    where += condition;
    numbers->push_back(value);
  };
  add_text(f.package, " AND id IN (SELECT entry FROM activity_package WHERE package = ?)");
  add_text(f.account, " AND actor = ?");
  add_text(f.operation, " AND operation = ?");
  add_text(f.state, " AND state = ?");
  add_time(f.since_ms, " AND started >= ?");
  add_time(f.until_ms, " AND started <= ?");
  return where;
}

// Binds the values of WhereClause from position 1; the next free position.
int BindWhere(Statement* s, const std::vector<std::string>& texts,
              const std::vector<long long>& numbers) {
  int i = 1;
  for (const std::string& t : texts) s->Bind(i++, t);
  for (long long n : numbers) s->Bind(i++, n);
  return i;
}

// How an entry ends; its conditions follow, from position 5.
const char kEndEntry[] = "UPDATE activity SET ended = ?, state = ?, code = ?, words = ?";

SqliteStatementUse& BindEnd(Statement* s, const Outcome& outcome) {
  return s->Bind(1, NowMs())
      .Bind(2, outcome.code == 0 ? kStateSuccess : kStateFailure)
      .Bind(3, static_cast<long long>(outcome.code))
      .Bind(4, Cut(outcome.words, kMaxWords));
}

Json::Value EntryOf(Statement& s) {
  Json::Value e(Json::objectValue);
  e["id"] = static_cast<Json::Int64>(s.Int(0));
  e["started"] = static_cast<Json::Int64>(s.Int(1));
  long long ended = s.Int(2);
  e["ended"] = ended < 0 ? Json::Value() : Json::Value(static_cast<Json::Int64>(ended));
  e["duration_ms"] =
      ended < 0 ? Json::Value() : Json::Value(static_cast<Json::Int64>(ended - s.Int(1)));
  e["state"] = s.Text(3);
  e["actor"] = s.Text(4);
  e["origin"] = s.Text(5);
  e["address"] = s.Text(6);
  e["operation"] = s.Text(7);
  Json::Value target;
  e["target"] = KIVOParseJson(s.Text(8), &target) ? target : Json::Value(Json::objectValue);
  long long code = s.Int(9);
  e["code"] = code < 0 ? Json::Value() : Json::Value(static_cast<int>(code));
  e["words"] = s.Text(10);
  Json::Value packages(Json::arrayValue);
  std::string list = s.Text(11);
  for (size_t start = 0; !list.empty() && start <= list.size();) {
    size_t comma = list.find(',', start);
    if (comma == std::string::npos) comma = list.size();
    packages.append(list.substr(start, comma - start));
    start = comma + 1;
  }
  e["packages"] = packages;
  return e;
}

}  // namespace

Bounds LoadBounds() {
  Bounds b;
  KeyValueMap conf;
  const std::string path = KIVORootPath("/etc/kivo/activity.conf");
  // A root without the file keeps the defaults.
  if (access(path.c_str(), F_OK) != 0 || !KIVOKeyValueLoad(path, &conf)) return b;
  static_cast<void>(ReadBound(conf, "max_entries", &b.max_entries));
  static_cast<void>(ReadBound(conf, "max_age_days", &b.max_age_days));
  return b;
}

std::string WithoutCredentials(std::string text) {
  for (size_t scheme = text.find("://"); scheme != std::string::npos;
       scheme = text.find("://", scheme + 3)) {
    size_t host = scheme + 3;
    size_t end = text.find_first_of("/\"?# ", host);
    size_t at = text.rfind('@', end == std::string::npos ? text.size() : end);
    if (at != std::string::npos && at >= host) text.erase(host, at + 1 - host);
  }
  return text;
}

long long NowMs() {
  using namespace std::chrono;
  return duration_cast<milliseconds>(system_clock::now().time_since_epoch()).count();
}

ActivityLog::ActivityLog() = default;

ActivityLog::~ActivityLog() { Close(); }

std::string ActivityLog::Path() { return KIVORootPath("/var/lib/kivo/activity.db"); }

void ActivityLog::Close() {
  // A forked child never closes its parent's connection: that would touch
  // the parent's locks.
  if (db_ && pid_ == getpid()) Sqlite()->close(db_);
  db_ = nullptr;
}

bool ActivityLog::Exec(const char* sql) {
  char* error = nullptr;
  if (Sqlite()->exec(db_, sql, nullptr, nullptr, &error) == SQLITE_OK) return true;
  syslog(LOG_ERR, "%s:%d activity log: %s", "activity_log", __LINE__, error ? error : "?");
  Sqlite()->free(error);
  return false;
}

// Opens `path`, made 0600 before SQLite sees it (its journal takes the same
// mode), and makes the schema. False when the file is not a database.
bool ActivityLog::OpenFile(const std::string& path) {
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd < 0 || fchmod(fd, 0600) != 0) {
    syslog(LOG_ERR, "%s:%d cannot create %s: %s", "activity_log", __LINE__, path.c_str(),
           strerror(errno));
    if (fd >= 0) close(fd);
    return true;
  }
  close(fd);
  int rc = NVX::SqliteOpenStore(path, SQLITE_OPEN_READWRITE, kBusyTimeoutMs, kSchema,
                                "activity log", &db_);
  // Every changing call writes here twice, and three fdatasyncs a commit
  // cost each call milliseconds. Without them an entry is as safe against a
  // process killed half way (the journal still makes each commit whole in
  // the kernel's cache); only a power loss may drop the latest entries or
  // damage the file, which the next open then sets aside. For a record of
  // what happened, that beats slowing every operation down.
  if (rc == SQLITE_OK)
    rc = Sqlite()->exec(db_, "PRAGMA synchronous=OFF;", nullptr, nullptr, nullptr);
  if (rc == SQLITE_OK) return true;
  Sqlite()->close(db_);
  db_ = nullptr;
  return rc != SQLITE_NOTADB && rc != SQLITE_CORRUPT;
}

sqlite3* ActivityLog::Open() {
  if (!Sqlite()) return nullptr;
  const std::string path = Path();
  if (db_ && pid_ == getpid() && path == path_) return db_;
  Close();
  pid_ = getpid();
  path_ = path;
  const std::string dir = path.substr(0, path.rfind('/'));
  if (KIVOFSMkdirP(dir.c_str()) != 0) {
    syslog(LOG_ERR, "%s:%d cannot make %s", "activity_log", __LINE__, dir.c_str());
    return nullptr;
  }
  if (OpenFile(path)) return db_;
  // A damaged log is kept aside for whoever wants to look, and the log
  // starts afresh: losing the history beats losing every entry from now on.
  const std::string aside = path + ".damaged-" + std::to_string(NowMs());
  if (rename(path.c_str(), aside.c_str()) != 0) return nullptr;
  unlink((path + "-journal").c_str());
  syslog(LOG_WARNING, "%s:%d damaged activity log set aside as %s", "activity_log", __LINE__,
         aside.c_str());
  return OpenFile(path) ? db_ : nullptr;
}

bool ActivityLog::DropOutsideBounds(long long newest_id) {
  const Bounds b = LoadBounds();
  long long cutoff = newest_id - b.max_entries;
  // Through the index of start times: the rows it visits are the ones
  // about to go, whereas the plan SQLite picks on its own (the ids from the
  // newest down) reads the whole table when no entry is too old.
  Statement old(db_,
                "SELECT coalesce(max(id), 0) FROM activity INDEXED BY activity_started"
                " WHERE started < ?");
  old.Bind(1, NowMs() - b.max_age_days * 86400000LL);
  if (!old.Row()) return false;
  cutoff = std::max(cutoff, old.Int(0));
  if (cutoff <= 0) return true;
  return Statement(db_, "DELETE FROM activity_package WHERE entry <= ?").Bind(1, cutoff).Run() &&
         Statement(db_, "DELETE FROM activity WHERE id <= ?").Bind(1, cutoff).Run();
}

long long ActivityLog::Begin(const Actor& actor, const Operation& op) {
  if (!Open() || !Exec("BEGIN IMMEDIATE")) return 0;
  long long id = 0;
  {
    Statement insert(db_,
                     "INSERT INTO activity (started, state, actor, origin, address, operation,"
                     " target, pid, pid_start) VALUES (?,?,?,?,?,?,?,?,?) RETURNING id");
    insert.Bind(1, NowMs())
        .Bind(2, kStateRunning)
        .Bind(3, actor.name)
        .Bind(4, actor.origin)
        .Bind(5, actor.address)
        .Bind(6, op.name)
        .Bind(7, KIVOWriteJson(op.target))
        .Bind(8, static_cast<long long>(getpid()))
        .Bind(9, ProcessStart(getpid()));
    if (insert.Row()) id = insert.Int(0);
  }
  bool ok = id > 0;
  for (const std::string& package : op.packages) {
    ok = ok && Statement(db_, "INSERT OR IGNORE INTO activity_package VALUES (?, ?)")
                   .Bind(1, package)
                   .Bind(2, id)
                   .Run();
  }
  ok = ok && DropOutsideBounds(id) && Exec("COMMIT");
  if (ok) return id;
  syslog(LOG_ERR, "%s:%d cannot record %s: %s", "activity_log", __LINE__, op.name.c_str(),
         Sqlite()->errmsg(db_));
  Exec("ROLLBACK");
  return 0;
}

bool ActivityLog::Finish(long long id, const Outcome& outcome) {
  if (id <= 0 || !Open()) return false;
  Statement end(db_, std::string(kEndEntry) + " WHERE id = ? AND pid = ?");
  BindEnd(&end, outcome).Bind(5, id).Bind(6, static_cast<long long>(getpid()));
  if (end.Run()) return true;
  syslog(LOG_ERR, "%s:%d cannot record the end of activity %lld: %s", "activity_log", __LINE__, id,
         Sqlite()->errmsg(db_));
  return false;
}

bool ActivityLog::HandOver(pid_t taker) {
  if (!Open()) return false;
  const pid_t self = getpid();
  bool ok = Statement(db_,
                      "UPDATE activity SET pid = ?, pid_start = ?"
                      " WHERE pid = ? AND pid_start = ? AND state = ?")
                .Bind(1, static_cast<long long>(taker))
                .Bind(2, ProcessStart(taker))
                .Bind(3, static_cast<long long>(self))
                .Bind(4, ProcessStart(self))
                .Bind(5, kStateRunning)
                .Run();
  if (!ok)
    syslog(LOG_ERR, "%s:%d cannot hand activity over to process %d: %s", "activity_log", __LINE__,
           static_cast<int>(taker), Sqlite()->errmsg(db_));
  return ok;
}

bool ActivityLog::FinishHandedOver(const Outcome& outcome) {
  if (!Open()) return false;
  const pid_t self = getpid();
  Statement end(db_, std::string(kEndEntry) + " WHERE pid = ? AND pid_start = ? AND state = ?");
  BindEnd(&end, outcome)
      .Bind(5, static_cast<long long>(self))
      .Bind(6, ProcessStart(self))
      .Bind(7, kStateRunning);
  if (end.Run()) return true;
  syslog(LOG_ERR, "%s:%d cannot record the end of the activity handed over: %s", "activity_log",
         __LINE__, Sqlite()->errmsg(db_));
  return false;
}

bool ActivityLog::Record(const Actor& actor, const Operation& op, const Outcome& outcome) {
  return Finish(Begin(actor, op), outcome);
}

bool ActivityLog::SweepUnfinished() {
  if (!Open()) return false;
  std::vector<long long> gone;
  {
    Statement running(db_, "SELECT id, pid, pid_start FROM activity WHERE state = ?");
    running.Bind(1, kStateRunning);
    while (running.Row()) {
      if (ProcessStart(static_cast<pid_t>(running.Int(1))) != running.Int(2))
        gone.push_back(running.Int(0));
    }
  }
  bool ok = true;
  for (long long id : gone) {
    ok = Statement(db_, "UPDATE activity SET state = ? WHERE id = ? AND state = ?")
             .Bind(1, kStateUnfinished)
             .Bind(2, id)
             .Bind(3, kStateRunning)
             .Run() &&
         ok;
  }
  return ok;
}

bool ActivityLog::List(const Filter& filter, long long offset, int limit, Json::Value* entries,
                       long long* total) {
  *entries = Json::Value(Json::arrayValue);
  *total = 0;
  if (!SweepUnfinished()) return false;
  std::vector<std::string> texts;
  std::vector<long long> numbers;
  const std::string where = WhereClause(filter, &texts, &numbers);
  Statement count(db_, "SELECT count(*) FROM activity" + where);
  BindWhere(&count, texts, numbers);
  if (!count.Row()) return false;
  *total = count.Int(0);
  Statement rows(db_,
                 "SELECT id, started, coalesce(ended, -1), state, actor, origin, address,"
                 " operation, target, coalesce(code, -1), words,"
                 " (SELECT group_concat(package) FROM activity_package WHERE entry = id)"
                 " FROM activity" +
                     where + " ORDER BY id DESC LIMIT ? OFFSET ?");
  int next = BindWhere(&rows, texts, numbers);
  rows.Bind(next, static_cast<long long>(limit)).Bind(next + 1, offset);
  if (!rows.ok()) return false;
  while (rows.Row()) entries->append(EntryOf(rows));
  return true;
}

}  // namespace KivoActivity
