#include "taskmgr/task.h"

#include <ctime>
#include <mutex>
#include <unistd.h>

#include "klibc/hex.h"
#include "klibc/json_text.h"
#include "taskmgr/sqlite_api.h"
#include "taskmgr/task_store.h"

namespace NVX {

namespace {

// One use of a statement the store keeps prepared; reset after use, so the
// store's read locks end with the statement.
class Statement : public SqliteStatementUse {
 public:
  Statement(TaskStore& store, const char* sql) : SqliteStatementUse(store.Prepared(sql)) {}
  ~Statement() {
    if (stmt_) Sqlite()->reset(stmt_);
  }
};

// Runs `sql`, an UPDATE of one task's row whose parameters are a flag, the
// owner and the id, in that order.
bool UpdateTaskRow(TaskStore& store, const char* sql, bool flag, const std::string& owner,
                   const std::string& id) {
  return Statement(store, sql).Bind(1, flag ? 1LL : 0LL).Bind(2, owner).Bind(3, id).Run();
}

bool WriteProperty(TaskStore& db, const std::string& owner, const std::string& id,
                   const std::string& name, bool unset, const Json::Value& value) {
  if (unset) {
    return Statement(db, "DELETE FROM properties WHERE owner=? AND id=? AND name=?")
        .Bind(1, owner)
        .Bind(2, id)
        .Bind(3, name)
        .Run();
  }
  return Statement(db,
                   "INSERT OR REPLACE INTO properties (owner, id, name, value) VALUES (?,?,?,?)")
      .Bind(1, owner)
      .Bind(2, id)
      .Bind(3, name)
      .Bind(4, KIVOWriteJson(value))
      .Run();
}

}  // namespace

Task::Task(std::shared_ptr<TaskStore> store, std::string owner, std::string id)
    : store_(std::move(store)), owner_(std::move(owner)), id_(std::move(id)) {}

Task::~Task() = default;

Json::Value Task::getProperty(const std::string& name) {
  Statement s(*store_, "SELECT value FROM properties WHERE owner=? AND id=? AND name=?");
  s.Bind(1, owner_).Bind(2, id_).Bind(3, name);
  Json::Value value;
  // A stored value that is not JSON reads as absent (null).
  if (s.Row()) (void)KIVOParseJson(s.Text(0), &value);
  return value;
}

double Task::getDoubleProperty(const std::string& name, double def) {
  Json::Value v = getProperty(name);
  return v.isNumeric() ? v.asDouble() : def;
}

bool Task::setProperty(const std::string& name, const Json::Value& value) {
  if (batching_) {
    pending_.push_back(PendingWrite{name, false, value});
    return true;
  }
  return WriteProperty(*store_, owner_, id_, name, false, value);
}

bool Task::unsetProperty(const std::string& name) {
  if (batching_) {
    pending_.push_back(PendingWrite{name, true, Json::Value()});
    return true;
  }
  return WriteProperty(*store_, owner_, id_, name, true, Json::Value());
}

void Task::beginUpdate() {
  batching_ = true;
  pending_.clear();
}

bool Task::endUpdate() {
  batching_ = false;
  TaskStore& db = *store_;
  // BEGIN IMMEDIATE takes the write lock at once, so the batch never fails
  // half-way for another writer.
  bool ok = store_->Exec("BEGIN IMMEDIATE");
  for (const PendingWrite& w : pending_) {
    ok = ok && WriteProperty(db, owner_, id_, w.name, w.unset, w.value);
  }
  pending_.clear();
  if (ok) return store_->Exec("COMMIT");
  store_->Exec("ROLLBACK");
  return false;
}

bool Task::setFinishValue(bool finished) {
  return UpdateTaskRow(*store_, "UPDATE tasks SET finished=? WHERE owner=? AND id=?", finished,
                       owner_, id_);
}

bool Task::finish(bool ok) {
  return UpdateTaskRow(*store_, "UPDATE tasks SET finished=1, ok=? WHERE owner=? AND id=?", ok,
                       owner_, id_);
}

bool Task::isFinished() {
  Statement s(*store_, "SELECT finished FROM tasks WHERE owner=? AND id=?");
  s.Bind(1, owner_).Bind(2, id_);
  return s.Row() && s.Int(0) != 0;
}

bool Task::remove() {
  if (!store_->Exec("BEGIN IMMEDIATE")) return false;
  bool ok = Statement(*store_, "DELETE FROM properties WHERE owner=? AND id=?")
                .Bind(1, owner_)
                .Bind(2, id_)
                .Run() &&
            Statement(*store_, "DELETE FROM tasks WHERE owner=? AND id=?")
                .Bind(1, owner_)
                .Bind(2, id_)
                .Run();
  if (ok) return store_->Exec("COMMIT");
  store_->Exec("ROLLBACK");
  return false;
}

bool Task::waitForDataReady(const std::string& name, int seconds) {
  time_t deadline = time(nullptr) + seconds;
  while (true) {
    if (!getProperty(name).isNull()) return true;
    if (time(nullptr) >= deadline) return false;
    usleep(50000);
  }
}

namespace {

// One connection per process serves every TaskMgr: a list of thousands of
// packages looks tasks up for each of them. It stays open for the life of
// the process (a request); a forked child or a changed system root gets a
// connection of its own (TaskStore::db).
std::shared_ptr<TaskStore> SharedStore() {
  static std::mutex mutex;
  static std::shared_ptr<TaskStore> shared;
  std::lock_guard<std::mutex> lock(mutex);
  if (!shared) shared = std::make_shared<TaskStore>();
  return shared;
}

}  // namespace

TaskMgr::TaskMgr(const std::string& owner) : store_(SharedStore()), owner_(owner) {}

TaskMgr::~TaskMgr() = default;

bool TaskMgr::hasTask(const std::string& id) {
  Statement s(*store_, "SELECT 1 FROM tasks WHERE owner=? AND id=?");
  s.Bind(1, owner_).Bind(2, id);
  return s.Row();
}

Task* TaskMgr::getTask(const std::string& id) {
  return hasTask(id) ? new Task(store_, owner_, id) : nullptr;
}

// Inside a transaction: task `id` anew, with no properties.
bool TaskMgr::Recreate(const std::string& id) {
  return Statement(*store_, "DELETE FROM properties WHERE owner=? AND id=?")
             .Bind(1, owner_)
             .Bind(2, id)
             .Run() &&
         Statement(
             *store_,
             "INSERT OR REPLACE INTO tasks (owner, id, finished, ok, created) VALUES (?,?,0,0,?)")
             .Bind(1, owner_)
             .Bind(2, id)
             .Bind(3, static_cast<long long>(time(nullptr)))
             .Run();
}

// Inside a transaction: whether task `id` exists unfinished and `in_use`
// says its job still holds it.
bool TaskMgr::StillHeld(const std::string& id, InUse in_use) {
  Statement s(*store_, "SELECT finished FROM tasks WHERE owner=? AND id=?");
  s.Bind(1, owner_).Bind(2, id);
  if (!s.Row() || s.Int(0) != 0) return false;
  Statement p(*store_, "SELECT value FROM properties WHERE owner=? AND id=? AND name=?");
  p.Bind(1, owner_).Bind(2, id).Bind(3, std::string("data"));
  // Data that is not JSON reads as none (null), and `in_use` judges that.
  Json::Value data;
  if (p.Row()) (void)KIVOParseJson(p.Text(0), &data);
  return in_use && in_use(data);
}

Task* TaskMgr::createTask(const std::string& id) {
  if (id.empty() || !store_->db()) return nullptr;
  if (!store_->Exec("BEGIN IMMEDIATE")) return nullptr;
  if (!Recreate(id) || !store_->Exec("COMMIT")) {
    store_->Exec("ROLLBACK");
    return nullptr;
  }
  return new Task(store_, owner_, id);
}

TaskMgr::Claim TaskMgr::claimTask(const std::string& id, const Json::Value& data, InUse in_use,
                                  Task** task) {
  *task = nullptr;
  if (id.empty() || !store_->db()) return Claim::kFailed;
  // BEGIN IMMEDIATE takes the write lock before the look, so no other claim
  // can come between the look and the write.
  if (!store_->Exec("BEGIN IMMEDIATE")) return Claim::kFailed;
  if (StillHeld(id, in_use)) {
    store_->Exec("ROLLBACK");
    return Claim::kBusy;
  }
  bool ok = Recreate(id) && WriteProperty(*store_, owner_, id, "data", false, data);
  if (!ok || !store_->Exec("COMMIT")) {
    store_->Exec("ROLLBACK");
    return Claim::kFailed;
  }
  *task = new Task(store_, owner_, id);
  return Claim::kClaimed;
}

std::vector<std::string> TaskMgr::listTasks(const std::string& prefix) {
  std::vector<std::string> ids;
  Statement s(*store_, "SELECT id FROM tasks WHERE owner=? AND substr(id, 1, ?)=? ORDER BY id");
  s.Bind(1, owner_).Bind(2, static_cast<long long>(prefix.size())).Bind(3, prefix);
  while (s.Row()) ids.push_back(s.Text(0));
  return ids;
}

namespace TaskUtil {

bool getUniqueID(const std::string& owner, int reserved, std::string* id) {
  std::string nonce;
  if (!KIVORandomHex(8, &nonce)) return false;
  *id = std::to_string(time(nullptr)) + "_" + nonce;
  return true;
}

}  // namespace TaskUtil

}  // namespace NVX

namespace KIVOPackageTool {

NVX::Task* GetTaskWithTaskMgr(NVX::TaskMgr& mgr, const std::string& id) { return mgr.getTask(id); }

NVX::Task* GetNewTask(const char* owner, const char* id) {
  if (!owner || !id) return nullptr;
  NVX::TaskMgr mgr(owner);
  return mgr.createTask(id);
}

}  // namespace KIVOPackageTool
