// The package tool's start, stop and removal of installed packages (the
// web API's requests for them are package/control.cc).

#include <cerrno>
#include <cstring>
#include <memory>
#include <unistd.h>
#include <utility>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_confinement.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/revisions.h"
#include "pkgtool/upgrade_recovery.h"
#include "pkgtool/watchdog_record.h"
#include "taskmgr/task.h"
#include "taskmgr/task_names.h"

namespace {

// The task that shows readers an operation on `id` is under way, with this
// process as its worker; removed when the operation ends. A task whose data
// cannot be written is removed at once: a reader must never find a task
// that says nothing about its worker.
class OperationTask {
 public:
  OperationTask(const std::string& id, const char* prefix, const char* status) {
    task_.reset(GetNewTask(KIVOPackageTasks::kTaskOwner, (prefix + id).c_str()));
    if (!task_) return;
    Json::Value data(Json::objectValue);
    data["status"] = status;
    data["pid"] = static_cast<int>(getpid());
    if (!task_->setProperty("data", data)) End();
  }
  ~OperationTask() { End(); }
  OperationTask(const OperationTask&) = delete;
  OperationTask& operator=(const OperationTask&) = delete;

 private:
  void End() {
    // The task only informs readers; if the store refuses the removal, a
    // reader finds a task whose worker is gone and reads it as ended.
    if (task_) static_cast<void>(task_->remove());
    task_.reset();
  }

  std::unique_ptr<NVX::Task> task_;
};

std::string JoinIds(const std::vector<std::string>& ids) {
  std::string out;
  for (const std::string& id : ids) out += (out.empty() ? "" : ", ") + id;
  return out;
}

// Removes what an uninstalled package leaves after its published name is
// gone: payload, data folder, record. Each folder is removed only inside
// the folder that owns it. False (after logging what stays) when something
// could not be removed; the package is uninstalled all the same, and the
// next operation's clean-up retries the record and the payload.
bool RemoveUnpublished(const std::string& record, const Operation& op) {
  char target[4096], data[4096];
  ssize_t t = readlink((record + "/target").c_str(), target, sizeof(target) - 1);
  ssize_t d = readlink((record + "/var").c_str(), data, sizeof(data) - 1);
  bool ok = true;
  for (auto link :
       {std::make_pair(std::string(target, t > 0 ? static_cast<size_t>(t) : 0), "@appstore"),
        std::make_pair(std::string(data, d > 0 ? static_cast<size_t>(d) : 0), "@appdata")}) {
    if (link.first.empty()) continue;
    if (!PMSRemoveTree(PMSVolumeFolderHolding(link.first, link.second), link.first)) {
      op.Log("cannot remove " + link.first);
      ok = false;
    }
  }
  if (!PMSRemoveTree(PackageRegistry::RecordsDir(), record)) {
    op.Log("cannot remove " + record);
    ok = false;
  }
  return ok;
}

}  // namespace

int PackageManager::LockAndLoad(const std::string& id, PackageInfo* info, int wait_seconds) {
  if (!PMSIsValidPackageId(id)) return PKG_ERR_NOT_INSTALLED;
  // The record is read only once the lock is held: read before, it may be
  // the state another operation is about to change.
  if (!ExLock(wait_seconds < 0 ? PMSLockWaitSeconds() : wait_seconds)) return PKG_ERR_BUSY;
  // An upgrade killed half way may have left a version over data that is
  // not its own; it is put right before anything starts or stops it. What
  // cannot be put right yet is in the system log and is tried again.
  static_cast<void>(PMSRecoverUpgrades(nullptr));
  return PMSLoadInstalled(id, info) ? PKG_OK : PKG_ERR_NOT_INSTALLED;
}

int PackageManager::CheckCanRun(const PackageInfo& info, const Operation& op,
                                Json::Value* services) {
  for (const std::string& s : checkServiceStarted(PMSServiceSet(info.getServiceString()))) {
    services->append(s);
  }
  if (!services->empty()) return PKG_ERR_SERVICE_NOT_RUNNING;
  Json::Value missing;
  std::string stopped;
  if (arePackagesInstallAndStart(info.getDependencies(), missing, stopped, nullptr)) return PKG_OK;
  op.Log("needed packages missing or stopped: " + missing.toStyledString() + stopped);
  return result_ == PKG_ERR_VERSION_LIMIT ? PKG_ERR_VERSION_LIMIT : PKG_ERR_DEPENDENCY;
}

int PackageManager::CheckCanStop(const std::string& id, const Operation& op) {
  std::string running;
  if (areDependentPackageStop(id, nullptr, running)) return PKG_OK;
  map_params_["deppkg"] = running;
  op.Log("running packages depend on " + id + ": " + running);
  return PKG_ERR_DEPENDENTS_RUNNING;
}

bool PackageManager::serviceControl(int opType, const std::string& id, bool start,
                                    const std::string& language, const std::string& user,
                                    void* list, bool checkDeps, bool recordState) {
  Operation op(start ? "start" : "stop", PMSIsValidPackageId(id) ? id : "invalid");
  Json::Value services(Json::arrayValue);
  PackageInfo info;
  int result = LockAndLoad(id, &info);
  if (result == PKG_OK && checkDeps) {
    result = start ? CheckCanRun(info, op, &services) : CheckCanStop(id, op);
  }
  std::string record = PMSIsValidPackageId(id) ? PackageRegistry::RecordDir(id) : "";
  if (result == PKG_OK) result = RunStartStop(id, info, start, op);
  if (result == PKG_OK && recordState && !RecordEnabled(record, start, op)) {
    result = PKG_ERR_INTERNAL;
  }
  // The administrator's start gives a package the watchdog gave up on a
  // fresh count of restarts (watchdog_record.h).
  if (result == PKG_OK && recordState && start && !PMSClearWatchdogMarks(record)) {
    op.Log("started, but the watchdog's marks stay: it may take the package for crashed");
  }
  UnLock();
  auto params = map_params_;
  setOutcome(result, op.log_path(), op.WorkerMessages(), params, services);
  return result == PKG_OK;
}

int PackageManager::RunStartStop(const std::string& id, const PackageInfo& info, bool start,
                                 const Operation& op) {
  if (!info.isStartable()) return PKG_OK;
  const std::string record = PackageRegistry::RecordDir(id);
  // A package installed before packages had accounts gets its own here.
  if (std::string error;
      start && PMSSettlePackageAccount(id, record, op.log_path(), DataOwnership::kUnlessSettled,
                                       &error) != PKG_OK) {
    op.Log("cannot give " + id + " an account of its own: " + error);
    return PKG_ERR_INTERNAL;
  }
  OperationTask task(id, KIVOPackageTasks::kStartStopPrefix, start ? "starting" : "stopping");
  auto env = PMSScriptEnv(info, record, start ? "start" : "stop", op, Json::Value());
  return PMSRunPackageScript(record, "start-stop-status", start ? "start" : "stop", env, op)
             ? PKG_OK
             : PKG_ERR_SCRIPT_FAILED;
}

int PackageManager::lockAndLoadNow(const std::string& id, PackageInfo* info) {
  return LockAndLoad(id, info, 0);
}

bool PackageManager::startLocked(const std::string& id, const PackageInfo& info) {
  Operation op("start", id);
  Json::Value services(Json::arrayValue);
  int result = CheckCanRun(info, op, &services);
  if (result == PKG_OK) result = RunStartStop(id, info, true, op);
  setOutcome(result, op.log_path(), op.WorkerMessages(), map_params_, services);
  return result == PKG_OK;
}

bool PackageManager::RecordEnabled(const std::string& record, bool enabled, const Operation& op) {
  const std::string marker = record + "/enabled";
  bool ok = enabled ? KIVOWriteFileAtomic(marker, "", SyncToDisk::No)
                    : unlink(marker.c_str()) == 0 || errno == ENOENT;
  if (!ok) {
    op.Log(std::string(enabled ? "started" : "stopped") +
           ", but cannot record whether the package is meant to run");
  }
  return ok;
}

bool PackageManager::uninstall(const std::string& id, const Json::Value* wizardValues,
                               const std::string& language, int opType, bool force,
                               const std::string& user) {
  Operation op("uninstall", PMSIsValidPackageId(id) ? id : "invalid");
  std::map<std::string, std::string> params;
  PackageInfo info;
  int result = LockAndLoad(id, &info);
  if (result == PKG_OK) {
    if (!PMSRecoverLeftovers()) op.Log("some leftovers of earlier operations stay");
    std::vector<std::string> dependents = PMSInstalledDependents(id);
    if (!dependents.empty() && !force) {
      params["deppkg"] = JoinIds(dependents);
      op.Log("installed packages depend on " + id + ": " + params["deppkg"]);
      result = PKG_ERR_DEPENDENCY;
    }
  }
  if (result == PKG_OK) {
    OperationTask task(id, KIVOPackageTasks::kUninstallPrefix, "uninstalling");
    result = RemovePackage(id, info, wizardValues ? *wizardValues : Json::Value(), op);
  }
  UnLock();
  setOutcome(result, op.log_path(), op.WorkerMessages(), params, Json::Value(Json::arrayValue));
  return result == PKG_OK;
}

int PackageManager::RemovePackage(const std::string& id, const PackageInfo& info,
                                  const Json::Value& wizard, const Operation& op) {
  // Read under the lock that LockAndLoad took: the record this call removes.
  const std::string record = PackageRegistry::PublishedRecordPath(id);
  if (record.empty()) {
    op.Log(id + " is not published as a record of its own; nothing was removed");
    return PKG_ERR_INTERNAL;
  }
  auto env = PMSScriptEnv(info, record, "uninstall", op, wizard);
  if (PMSIsRunning(id, info) &&
      !PMSRunPackageScript(record, "start-stop-status", "stop", env, op)) {
    op.Log(id + " did not stop; it stays installed");
    return PKG_ERR_SCRIPT_FAILED;
  }
  if (!PMSRunPackageScript(record, "preuninst", "", env, op)) return PKG_ERR_SCRIPT_FAILED;
  PMSFaultPoint("uninstall_before_unpublish");
  if (!PackageRegistry::Unpublish(id)) {
    op.Log(std::string("cannot remove the published name of ") + id + ": " + strerror(errno));
    return PKG_ERR_INTERNAL;
  }
  PMSFaultPoint("unpublished");
  // The package is uninstalled from here on; what follows cannot undo that.
  if (!PMSRunPackageScript(record, "postuninst", "", env, op)) op.Log("postuninst failed");
  if (!RemoveUnpublished(record, op)) op.Log("uninstalled; some of its files stay");
  // Then its account; what stays of its data is root's from now on.
  const std::string data = KIVORootPath(info.get("install_volume") + "/@appdata/" + id);
  if (std::string error; !PMSRetirePackageAccount(
          id, PMSVolumeFolderHolding(data, "@appdata").empty() ? "" : data, &error)) {
    op.Log("uninstalled; " + error);
  }
  // Its control group too: what its scripts left running dies with it.
  if (std::string problem; !PackageCgroupRemove(id, &problem)) op.Log("uninstalled; " + problem);
  // Its kept earlier versions go with it: no rollback can reach them now.
  if (!PMSTrimRevisions(id, 0)) op.Log("uninstalled; some of its earlier versions stay");
  PMSFaultPoint("uninstall_done");
  return PKG_OK;
}
