// Starting, stopping and removing installed packages.

#include <memory>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"

namespace {

constexpr int kLockWaitSeconds = 3;

// The task that shows readers an operation on `id` is under way, with this
// process as its worker; removed when the operation ends.
class OperationTask {
 public:
  OperationTask(const std::string& id, const char* prefix, const char* status) {
    task_.reset(GetNewTask("@administrators", (prefix + id).c_str()));
    if (!task_) return;
    Json::Value data(Json::objectValue);
    data["status"] = status;
    data["pid"] = static_cast<int>(getpid());
    task_->setProperty("data", data);
  }
  ~OperationTask() {
    if (task_) task_->remove();
  }
  OperationTask(const OperationTask&) = delete;
  OperationTask& operator=(const OperationTask&) = delete;

 private:
  std::unique_ptr<NVX::Task> task_;
};

std::string JoinIds(const std::vector<std::string>& ids) {
  std::string out;
  for (const std::string& id : ids) out += (out.empty() ? "" : ", ") + id;
  return out;
}

}  // namespace

int PackageManager::LoadAndLock(const std::string& id, PackageInfo* info) {
  if (!PMSLoadInstalled(id, info)) return PKG_ERR_NOT_INSTALLED;
  return ExLock(kLockWaitSeconds) ? PKG_OK : PKG_ERR_BUSY;
}

bool PackageManager::serviceControl(int opType, const std::string& id, bool start,
                                    const std::string& language, const std::string& user,
                                    void* list, bool checkDeps, bool recordState) {
  Operation op(start ? "start" : "stop", PMSIsValidPackageId(id) ? id : "invalid");
  Json::Value services(Json::arrayValue);
  PackageInfo info;
  int result = LoadAndLock(id, &info);
  if (result != PKG_OK) {
    // Nothing to do: not installed, or the tool is busy.
  } else if (start && checkDeps) {
    for (const std::string& s : checkServiceStarted(PMSServiceSet(info.getServiceString()))) {
      services.append(s);
    }
    Json::Value missing;
    std::string stopped;
    if (!services.empty()) {
      result = PKG_ERR_SERVICE_NOT_RUNNING;
    } else if (!arePackagesInstallAndStart(info.getDependencies(), missing, stopped, nullptr)) {
      result = result_ == PKG_ERR_VERSION_LIMIT ? PKG_ERR_VERSION_LIMIT : PKG_ERR_DEPENDENCY;
      op.Log("needed packages missing or stopped: " + missing.toStyledString() + stopped);
    }
  } else if (!start && checkDeps) {
    std::string running;
    if (!areDependentPackageStop(id, nullptr, running)) {
      result = PKG_ERR_DEPENDENTS_RUNNING;
      map_params_["deppkg"] = running;
      op.Log("running packages depend on " + id + ": " + running);
    }
  }
  std::string record = PMSIsValidPackageId(id) ? PackageRegistry::RecordDir(id) : "";
  if (result == PKG_OK && info.isStartable()) {
    OperationTask task(id, "@KIVOPKG_STARTSTOP_", start ? "starting" : "stopping");
    auto env = PMSScriptEnv(info, record, start ? "start" : "stop", op, Json::Value());
    if (!PMSRunPackageScript(record, "start-stop-status", start ? "start" : "stop", env, op)) {
      result = PKG_ERR_SCRIPT_FAILED;
    }
  }
  if (result == PKG_OK && recordState) {
    if (start) {
      KIVOWriteFileAtomic(record + "/enabled", "", SyncToDisk::No);
    } else {
      unlink((record + "/enabled").c_str());
    }
  }
  UnLock();
  auto params = map_params_;
  setOutcome(result, op.log_path(), op.WorkerMessages(), params, services);
  return result == PKG_OK;
}

bool PackageManager::uninstall(const std::string& id, const Json::Value* wizardValues,
                               const std::string& language, int opType, bool force,
                               const std::string& user) {
  Operation op("uninstall", PMSIsValidPackageId(id) ? id : "invalid");
  std::map<std::string, std::string> params;
  PackageInfo info;
  int result = LoadAndLock(id, &info);
  if (result == PKG_OK) {
    PMSRecoverLeftovers();
    std::vector<std::string> dependents = PMSInstalledDependents(id);
    if (!dependents.empty() && !force) {
      params["deppkg"] = JoinIds(dependents);
      op.Log("installed packages depend on " + id + ": " + params["deppkg"]);
      result = PKG_ERR_DEPENDENCY;
    }
  }
  if (result == PKG_OK) {
    OperationTask task(id, "@KIVOPKG_UNINSTALL_", "uninstalling");
    std::string published = PackageRegistry::RecordDir(id);
    std::string record = PackageRegistry::Dir() + "/" + PackageRegistry::PublishedRecord(id);
    Json::Value wizard = wizardValues ? *wizardValues : Json::Value();
    auto env = PMSScriptEnv(info, record, "uninstall", op, wizard);
    if (PMSIsRunning(id, info)) PMSRunPackageScript(record, "start-stop-status", "stop", env, op);
    if (!PMSRunPackageScript(record, "preuninst", "", env, op)) {
      result = PKG_ERR_SCRIPT_FAILED;
    } else {
      PMSFaultPoint("uninstall_before_unpublish");
      PackageRegistry::Unpublish(id);
      PMSFaultPoint("unpublished");
      PMSRunPackageScript(record, "postuninst", "", env, op);
      char data[4096];
      ssize_t n = readlink((record + "/var").c_str(), data, sizeof(data) - 1);
      PMSRemoveTree(info.getTarget());
      if (n > 0) PMSRemoveTree(std::string(data, static_cast<size_t>(n)));
      PMSRemoveTree(record);
      PMSFaultPoint("uninstall_done");
    }
  }
  UnLock();
  setOutcome(result, op.log_path(), op.WorkerMessages(), params, Json::Value(Json::arrayValue));
  return result == PKG_OK;
}
