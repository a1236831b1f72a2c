#include "host/revision_api.h"

#include <cerrno>
#include <fcntl.h>
#include <memory>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "activity/activity_log.h"
#include "host/activity_record.h"
#include "klibc/process.h"
#include "pkgserver/auto_update.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/revisions.h"
#include "taskmgr/task.h"
#include "taskmgr/task_names.h"
#include "webapi/api_codes.h"

namespace {

using KIVOPackageTasks::kRollbackPrefix;
using KIVOPackageTasks::kTaskOwner;

// A rollback's states in its task's data.
constexpr char kRunning[] = "running";
constexpr char kSucceeded[] = "success";
constexpr char kFailed[] = "failure";

constexpr char kNotStarted[] = "the rollback's process could not be started; nothing was changed";

Json::Value Words(const std::string& key, const std::string& text) {
  Json::Value data(Json::objectValue);
  data[key] = text;
  return data;
}

// Reads the required package id; false (with 120 naming it) unless it is a
// whole valid id, so that nothing else ever reaches a path.
bool RequireId(const APIRequest& request, std::string* id, APIResponse* response) {
  APIParameter<std::string> p = request.GetAndCheckString("id", PARAM_REQUIRED);
  if (p.IsInvalid() || !PMSIsValidPackageId(p.Get())) {
    Json::Value data = Words("name", "id");
    data["reason"] = p.IsInvalid() && !p.IsSet() ? "required" : "condition";
    response->SetError(kErrParameter, data);
    return false;
  }
  *id = p.Get();
  return true;
}

// The answer code of a package tool result of rollback or drop; `other`
// for any result not named here.
int CodeOfResult(int result, int other) {
  switch (result) {
    case PKG_OK:
      return 0;
    case PKG_ERR_NO_REVISION:
      return kErrNoRevision;
    case PKG_ERR_BUSY:
      return kErrRevisionBusy;
    case PKG_ERR_NOT_INSTALLED:
      return kErrRevisionNotInstalled;
    default:
      return other;
  }
}

// The installed version of `id`; "" when it is not installed.
std::string InstalledVersion(const std::string& id) {
  KeyValueMap info;
  return PackageRegistry::ReadInfo(id, &info) ? info["version"] : "";
}

bool HasState(const Json::Value& v, const char* state) {
  return v.isString() && v.asString() == state;
}

// A rollback still holds its task while its state says running and its
// worker lives.
bool RollbackInUse(const Json::Value& data) {
  return data.isObject() && HasState(data["state"], kRunning) && data["pid"].isInt() &&
         KLIBCProcAlive(data["pid"].asInt()) == 1;
}

// The rollback of `id` as its task says, null when there is none. A rollback
// whose worker is gone without an outcome reads as failed: the next package
// operation finishes what it left (pkgtool/rollback.h).
Json::Value RollbackState(NVX::TaskMgr& mgr, const std::string& id) {
  std::unique_ptr<NVX::Task> task(mgr.getTask(kRollbackPrefix + id));
  Json::Value data = task ? task->getProperty("data") : Json::Value();
  if (!data.isObject()) return Json::Value();
  if (HasState(data["state"], kRunning) && !RollbackInUse(data)) {
    data["state"] = kFailed;
    data["code"] = kErrRollbackFailed;
    data["message"] =
        "the rollback's process ended before the rollback did; the next package operation "
        "finishes it or puts the package back as it was";
  }
  data.removeMember("pid");
  return data;
}

Json::Value RevisionJson(const PMSRevision& r) {
  Json::Value v(Json::objectValue);
  v["version"] = r.version;
  v["replaced"] = static_cast<Json::Int64>(r.replaced);
  v["bytes"] = static_cast<Json::UInt64>(PMSRevisionBytes(r));
  return v;
}

Json::Value FailureJson(const KIVOPackageServer::AutoUpdateFailure& f) {
  Json::Value v(Json::objectValue);
  v["version"] = f.version;
  v["time"] = static_cast<Json::Int64>(f.time);
  v["code"] = f.code;
  v["reason"] = f.reason;
  return v;
}

// What list says of installed package `id`.
Json::Value PackageEntry(NVX::TaskMgr& mgr, const KIVOPackageServer::AutoUpdateFailures& failures,
                         const std::string& id) {
  Json::Value entry(Json::objectValue);
  entry["id"] = id;
  entry["version"] = InstalledVersion(id);
  entry["kept"] = Json::Value(Json::arrayValue);
  for (const PMSRevision& r : PMSListRevisions(id)) entry["kept"].append(RevisionJson(r));
  const auto failed = failures.find(id);
  if (failed != failures.end()) entry["autoupdate_failure"] = FailureJson(failed->second);
  Json::Value rollback = RollbackState(mgr, id);
  if (!rollback.isNull()) entry["rollback"] = rollback;
  return entry;
}

bool HasAnything(const Json::Value& entry) {
  return !entry["kept"].empty() || entry.isMember("autoupdate_failure") ||
         entry.isMember("rollback");
}

// Records a refusal of a changing call made by `account` in the activity log.
void RecordRefusal(const APIRequest& request, const std::string& account,
                   const APIResponse& response) {
  CallRecord record(request, account);
  record.Finish(response);
}

// A worker that outlives the request lets go of the request's pipes, or the
// web server would keep the request open until the rollback ends.
void DetachFromRequest() {
  int null = open("/dev/null", O_RDWR | O_CLOEXEC);
  for (int fd = 0; fd < 3; ++fd) dup2(null, fd);
  if (null > 2) close(null);
}

// The rollback itself, in the worker: runs the package tool and writes the
// outcome into the task and the activity entry.
void RunRollback(NVX::Task& task, Json::Value data, const std::string& id,
                 const std::string& account, CallRecord& record) {
  PackageManager pm;
  const bool ok = pm.init() && pm.rollback(id, account);
  const std::string message = PMSReadPackageLog(pm.getLogFilePath());
  if (!pm.getLogFilePath().empty()) unlink(pm.getLogFilePath().c_str());
  APIResponse outcome;
  data["state"] = ok ? kSucceeded : kFailed;
  data["ended"] = static_cast<Json::Int64>(KivoActivity::NowMs());
  data["message"] = message;
  data["version"] = InstalledVersion(id);
  if (ok) {
    outcome.SetSuccess(Words("message", message));
  } else {
    data["code"] = CodeOfResult(pm.getResult(), kErrRollbackFailed);
    data["result"] = pm.getResult();
    outcome.SetError(data["code"].asInt(), Words("message", message));
  }
  // A task that cannot be written reads as a rollback whose worker is gone:
  // failed, which it may not have; the activity entry still says how it went.
  if (!task.setProperty("data", data) || !task.finish(ok))
    syslog(LOG_ERR, "%s:%d cannot record the outcome of the rollback of %s", "revision_api",
           __LINE__, id.c_str());
  record.Finish(outcome);
}

// In the worker: begins its activity entry, names itself in the task, then
// tells the request through `ready` that it runs, and rolls back.
[[noreturn]] void Worker(const APIRequest& request, const std::string& account, NVX::Task& task,
                         Json::Value data, const std::string& id, int ready) {
  DetachFromRequest();
  setsid();
  // Begun by this process, so the entry reads running while it works and
  // unfinished should it be killed.
  CallRecord record(request, account);
  data["pid"] = static_cast<int>(getpid());
  if (task.setProperty("data", data) && write(ready, "1", 1) == 1) {
    close(ready);
    RunRollback(task, data, id, account, record);
  } else {
    // The request sees the pipe close without a word and says so.
    APIResponse outcome;
    outcome.SetError(kErrUnknown, Words("reason", kNotStarted));
    record.Finish(outcome);
  }
  _exit(0);
}

// The refusals a rollback gets before it starts, read without the lock
// (the worker's package tool checks again under it); false when refused.
bool MayRollBack(const std::string& id, std::vector<PMSRevision>* kept, APIResponse* response) {
  if (!PackageRegistry::IsInstalled(id)) {
    response->SetError(kErrRevisionNotInstalled, Words("message", id + " is not installed"));
    return false;
  }
  *kept = PMSListRevisions(id);
  if (kept->empty()) {
    response->SetError(kErrNoRevision, Words("message", "no earlier version of " + id +
                                                            " is kept to roll back to"));
    return false;
  }
  return true;
}

// Waits until the worker says it runs (or ended before it could). True
// when it runs.
bool WorkerRuns(int ready) {
  char c = 0;
  ssize_t n;
  do {
    n = read(ready, &c, 1);
  } while (n < 0 && errno == EINTR);
  close(ready);
  return n == 1;
}

enum class Started {
  kRuns,        // the worker runs and has begun its activity entry
  kNotForked,   // there is no worker
  kEndedEarly,  // the worker ended before it could run, its entry finished
};

// Forks the worker for the claimed `task`.
Started StartWorker(const APIRequest& request, const std::string& account, NVX::Task& task,
                    const Json::Value& data, const std::string& id) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return Started::kNotForked;
  const pid_t pid = KLIBCProcFork();
  if (pid == 0) {
    close(fds[0]);
    Worker(request, account, task, data, id, fds[1]);
  }
  close(fds[1]);
  if (pid < 0) {
    close(fds[0]);
    return Started::kNotForked;
  }
  return WorkerRuns(fds[0]) ? Started::kRuns : Started::kEndedEarly;
}

}  // namespace

void RevisionList(const APIRequest& request, APIResponse* response) {
  std::string id;
  if (request.HasParam("id") && !RequireId(request, &id, response)) return;
  if (!id.empty() && !PackageRegistry::IsInstalled(id)) {
    return response->SetError(kErrRevisionNotInstalled, Words("message", id + " is not installed"));
  }
  NVX::TaskMgr mgr(kTaskOwner);
  const KIVOPackageServer::AutoUpdateFailures failures = KIVOPackageServer::ReadFailures();
  Json::Value packages(Json::arrayValue);
  const std::vector<std::string> ids = id.empty() ? PackageRegistry::List() : std::vector{id};
  for (const std::string& each : ids) {
    Json::Value entry = PackageEntry(mgr, failures, each);
    if (!id.empty() || HasAnything(entry)) packages.append(entry);
  }
  Json::Value data(Json::objectValue);
  data["packages"] = packages;
  response->SetSuccess(data);
}

void RevisionRollback(const APIRequest& request, const std::string& account,
                      APIResponse* response) {
  std::string id;
  std::vector<PMSRevision> kept;
  if (!RequireId(request, &id, response) || !MayRollBack(id, &kept, response))
    return RecordRefusal(request, account, *response);
  Json::Value data(Json::objectValue);
  data["state"] = kRunning;
  data["from_version"] = InstalledVersion(id);
  data["to_version"] = kept.front().version;
  data["started"] = static_cast<Json::Int64>(KivoActivity::NowMs());
  // The request holds the task until its worker names itself.
  data["pid"] = static_cast<int>(getpid());
  NVX::TaskMgr mgr(kTaskOwner);
  NVX::Task* claimed = nullptr;
  switch (mgr.claimTask(kRollbackPrefix + id, data, RollbackInUse, &claimed)) {
    case NVX::TaskMgr::Claim::kClaimed:
      break;
    case NVX::TaskMgr::Claim::kBusy:
      response->SetError(kErrRevisionBusy,
                         Words("message", "a rollback of " + id + " is under way already"));
      return RecordRefusal(request, account, *response);
    case NVX::TaskMgr::Claim::kFailed:
      response->SetError(kErrUnknown, Words("reason", "the rollback's task cannot be written"));
      return RecordRefusal(request, account, *response);
  }
  std::unique_ptr<NVX::Task> task(claimed);
  const Started started = StartWorker(request, account, *task, data, id);
  if (started != Started::kRuns) {
    data["state"] = kFailed;
    data["code"] = kErrUnknown;
    data["message"] = kNotStarted;
    if (!task->setProperty("data", data) || !task->finish(false))
      syslog(LOG_ERR, "%s:%d cannot record that the rollback of %s did not start", "revision_api",
             __LINE__, id.c_str());
    response->SetError(kErrUnknown, Words("reason", kNotStarted));
    // A worker that ended early has finished its own entry.
    if (started == Started::kNotForked) RecordRefusal(request, account, *response);
    return;
  }
  Json::Value answer(Json::objectValue);
  answer["task_id"] = kRollbackPrefix + id;
  answer["rollback"] = RollbackState(mgr, id);
  response->SetSuccess(answer);
}

void RevisionDrop(const APIRequest& request, const std::string& account, APIResponse* response) {
  std::string id;
  if (!RequireId(request, &id, response)) return RecordRefusal(request, account, *response);
  CallRecord record(request, account);
  PackageManager pm;
  const bool ok = pm.init() && pm.dropRevisions(id);
  const std::string message = PMSReadPackageLog(pm.getLogFilePath());
  if (!pm.getLogFilePath().empty()) unlink(pm.getLogFilePath().c_str());
  if (ok) {
    response->SetSuccess(Words("message", message));
  } else {
    response->SetError(CodeOfResult(pm.getResult(), kErrDropFailed), Words("message", message));
  }
  record.Finish(*response);
}
