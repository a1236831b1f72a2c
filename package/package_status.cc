#include "package_status.h"

#include <cstdlib>
#include <memory>

#include "pkgtool/pms.h"
#include "pkgtool/result_codes.h"
#include "task_record.h"

namespace KIVO_PACKAGE {

namespace {

// The "data" of task `prefix` + `id` while its worker runs it, else null. A
// task that names no worker yet is left alone: its starter creates it before
// it writes its data, and a reader that removed it then would take a
// starting operation's task away from under it.
Json::Value RunningTaskData(const PackageTasks& tasks, const char* prefix, const std::string& id) {
  std::unique_ptr<NVX::Task> task(tasks.Get(prefix + id));
  if (!task) return Json::Value();
  Json::Value data = task->getProperty("data");
  if (TaskProcessAlive(data)) return task->isFinished() ? Json::Value() : data;
  if (data.isObject() && data["pid"].isInt()) EndStaleTask(*task, data);
  return Json::Value();
}

bool IsTrue(const Json::Value& v) { return v.isBool() && v.asBool(); }

// The state a running operation of `id` gives; a null status when none runs.
PackageState OperationState(const PackageTasks& tasks, const std::string& id) {
  PackageState state;
  const Json::Value startstop = RunningTaskData(tasks, kStartStopPrefix, id);
  if (startstop.isMember("status")) {
    state.status = startstop["status"];
    return state;
  }
  const Json::Value install = RunningTaskData(tasks, kDownloadPrefix, id);
  if (IsTrue(install["installing"])) {
    state.status = install.isMember("status") ? install["status"] : Json::Value("installing");
    state.progress = PMSGetProgress(id);
    return state;
  }
  if (!RunningTaskData(tasks, kUninstallPrefix, id).isNull()) state.status = "uninstalling";
  return state;
}

}  // namespace

NVX::Task* PackageTasks::Get(const std::string& id) const {
  return MayHave(id) ? GetTaskWithTaskMgr(mgr_, id) : nullptr;
}

PackageState ReadPackageState(const PackageTasks& tasks, PackageManager& manager,
                              const std::string& id, const PackageInfo* installed,
                              BrokenCheck broken) {
  PackageState state = OperationState(tasks, id);
  if (!state.status.isNull()) return state;
  if (!installed) {
    state.status = StoppedStatus(PKG_ERR_NOT_INSTALLED);
  } else if (manager.getServiceStatus(*installed, state.running, broken == BrokenCheck::kYes) &&
             state.running) {
    state.status = "running";
  } else {
    state.status = StoppedStatus(manager.getResult());
  }
  return state;
}

const char* StoppedStatus(int result) {
  switch (result) {
    case PKG_ERR_NOT_INSTALLED:
      return "non_installed";
    case PKG_ERR_STATUS_UNKNOWN:
    case PKG_ERR_REGISTRY:
      return "NA";
    case PKG_ERR_SIGNATURE_UNCHECKABLE:
    case PKG_ERR_BROKEN:
      return "broken";
    case PKG_ERR_VERSION_LIMIT:
      return "version_limit";
    case PKG_ERR_BUILTIN:
      return "builtin";
    case PKG_ERR_NOT_SUPPORTED:
      return "non_support";
    default:
      return "stop";
  }
}

std::string RequestHost() {
  const char* env = getenv("HTTP_HOST");
  std::string host = env ? std::string(env).substr(0, 255) : "";
  // The port follows the last colon, unless that colon is inside an IPv6
  // address's brackets.
  size_t colon = host.rfind(':');
  if (colon != std::string::npos && host.find(']', colon) == std::string::npos) host.resize(colon);
  return host;
}

}  // namespace KIVO_PACKAGE
