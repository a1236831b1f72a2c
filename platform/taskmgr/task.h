// The task manager: named background jobs and their properties, shared by
// the web API's request processes and the workers they fork. One SQLite
// database under the system root ("/run/kivo/tasks.db") holds them; every
// property write is atomic, and beginUpdate()/endUpdate() make several
// writes one transaction, so a reader never sees half of a change.
//
// SQLite runs with its rollback journal (not WAL) and a busy timeout, so
// several processes can write one database safely. A connection is never
// used across fork(): a process that finds itself a child opens its own.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <json/value.h>

namespace NVX {

class TaskStore;

class Task {
 public:
  ~Task();
  Task(const Task&) = delete;
  Task& operator=(const Task&) = delete;

  const std::string& getTaskId() const { return id_; }
  const std::string& getOwner() const { return owner_; }

  // The property's value; null when unset (or the store cannot be read).
  Json::Value getProperty(const std::string& name);
  // A number property; `def` when unset or not a number.
  double getDoubleProperty(const std::string& name, double def);
  // False when the store cannot be written: the task then does not hold the
  // value, and a caller must not tell anyone that it does. Between
  // beginUpdate and endUpdate the writes are kept (and answer true) and
  // written together by endUpdate, whose result is the batch's.
  [[nodiscard]] bool setProperty(const std::string& name, const Json::Value& value);
  [[nodiscard]] bool unsetProperty(const std::string& name);
  void beginUpdate();
  [[nodiscard]] bool endUpdate();

  // Whether the job has ended. setFinishValue sets it; finish(ok) ends the
  // job and records whether it succeeded. False when not written.
  [[nodiscard]] bool setFinishValue(bool finished);
  [[nodiscard]] bool finish(bool ok);
  bool isFinished();
  // The task is gone for every reader afterwards. False when it could not be
  // removed (it is then still there).
  [[nodiscard]] bool remove();
  // Waits (polling) until `name` is set, at most `seconds`. True when set.
  bool waitForDataReady(const std::string& name, int seconds);

 private:
  friend class TaskMgr;
  Task(std::shared_ptr<TaskStore> store, std::string owner, std::string id);

  struct PendingWrite {
    std::string name;
    bool unset;
    Json::Value value;
  };

  std::shared_ptr<TaskStore> store_;
  std::string owner_;
  std::string id_;
  bool batching_ = false;
  std::vector<PendingWrite> pending_;
};

// The tasks of one owner ("@administrators").
class TaskMgr {
 public:
  explicit TaskMgr(const std::string& owner);
  ~TaskMgr();

  bool hasTask(const std::string& id);
  // The task, or null when there is none. The caller owns it.
  Task* getTask(const std::string& id);
  // Creates the task, replacing any earlier one of that id. Null when the
  // store cannot be written. The caller owns it.
  [[nodiscard]] Task* createTask(const std::string& id);

  // Whether the job that a task's "data" describes still holds the task.
  using InUse = bool (*)(const Json::Value& data);
  enum class Claim { kClaimed, kBusy, kFailed };
  // Takes task `id` for a new job in one transaction: unless a task of that
  // id exists, is not finished and `in_use` says its "data" is still held,
  // the task is created anew (replacing any earlier one) with "data" set to
  // `data`, and `*task` is set to it (the caller owns it): kClaimed. A task
  // still held is left exactly as it is: kBusy. kFailed when the store
  // cannot be written. Two claims at once never both succeed.
  [[nodiscard]] Claim claimTask(const std::string& id, const Json::Value& data, InUse in_use,
                                Task** task);
  // Ids of this owner's tasks with the given prefix, sorted.
  std::vector<std::string> listTasks(const std::string& prefix = "");

 private:
  bool Recreate(const std::string& id);
  bool StillHeld(const std::string& id, InUse in_use);

  std::shared_ptr<TaskStore> store_;
  std::string owner_;
};

namespace TaskUtil {
// A new id in *id, unique among all tasks of `owner` for as long as they
// exist: the time and 64 random bits. False when the system has no random
// bytes to give (*id is then unchanged).
[[nodiscard]] bool getUniqueID(const std::string& owner, int reserved, std::string* id);
}  // namespace TaskUtil

}  // namespace NVX

namespace KIVOPackageTool {
// The task `id` of the registry, or null. The caller frees it.
[[nodiscard]] NVX::Task* GetTaskWithTaskMgr(NVX::TaskMgr& mgr, const std::string& id);
// A new task `id` of `owner` (replacing any earlier one), or null.
[[nodiscard]] NVX::Task* GetNewTask(const char* owner, const char* id);
}  // namespace KIVOPackageTool

using KIVOPackageTool::GetNewTask;
using KIVOPackageTool::GetTaskWithTaskMgr;
