// The web API's start and stop (KIVO.Core.Package.Control; the package
// tool's own is platform/pkgtool/control.cc): one package or a batch, in
// dependency order.

#include <algorithm>
#include <unistd.h>

#include "error_codes.h"
#include "package_webapi.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/result_codes.h"
#include "request_values.h"
#include "webapi/webapi_util.h"

namespace KIVO_PACKAGE {

namespace {

// Refusals of a start or stop by the package tool; any other result is a
// failed start (4580) or stop (4581).
constexpr ToolCodeMapping kControlErrors[] = {
    {PKG_ERR_SERVICE_NOT_RUNNING, kErrServiceNotRunning},
    {PKG_ERR_VERSION_LIMIT, kErrStartVersionLimit},
    {PKG_ERR_BUSY, kErrBusy},
    {PKG_ERR_NO_VOLUME, kErrNoVolume},
    {PKG_ERR_VOLUME_CRASHED, kErrVolumeUnusable},
    {PKG_ERR_NO_ACCOUNT_ID, kErrNoAccountId},
    {PKG_ERR_ACCOUNT_FILES, kErrAccountFiles},
};

// The package tool's operation type for a start or stop.
int OperationType(const std::string& type, bool start) {
  if (type == "install") return PKG_OP_INSTALL;  // the tail of an installation
  return start ? PKG_OP_START : PKG_OP_STOP;
}

}  // namespace

void PackageWebAPI::Start() { StartStop(true); }

void PackageWebAPI::Stop() { StartStop(false); }

bool PackageWebAPI::ServiceControl(const std::string& name, bool start, Json::Value& result) {
  PackageManager manager;
  const std::string type = request->GetParam("type", "").asString();
  // The whole id is checked: an id is never cut short into another one.
  if (!IsPackageId(name)) {
    response->SetError(kErrBadParameter, Json::Value());
    return false;
  }
  if (!manager.init()) {
    response->SetError(kErrFailed, Json::Value());
    return false;
  }
  if (start) {
    PackageInfo info;
    if (!manager.getPackageInfo(name, info, request->GetUILanguage(), ~0ULL)) {
      response->SetError(kErrFailed, Json::Value());
      return false;
    }
    std::string not_started;
    if (!manager.arePackagesInstallAndStart(info.getDependencies(), result["uninstall_packages"],
                                            not_started, nullptr)) {
      result["unstart_packages"] = not_started;
      response->SetError(kErrStartDependency, result);
      return false;
    }
  } else {
    std::string running;
    if (!manager.areDependentPackageStop(name, request->GetUILanguage().c_str(), running)) {
      result["packages"] = running;
      response->SetError(kErrStopDependents, result);
      return false;
    }
  }
  bool ok =
      manager.serviceControl(OperationType(type, start), name, start, request->GetUILanguage(),
                             request->GetLoginUserName(), nullptr, true, true);
  result["message"] = PMSReadPackageLog(manager.getLogFilePath());
  result["worker_message"] = manager.getJsonParam("worker_msg");
  if (!result["worker_message"].isArray()) result["worker_message"] = Json::Value(Json::arrayValue);
  if (!ok) {
    Json::Value services;
    const int code = manager.getResult(services);
    const int error = MapToolCode(kControlErrors, code);
    switch (code) {
      case PKG_ERR_SERVICE_NOT_RUNNING:
        result["code"] = error;
        result["services"] = services;
        break;
      case PKG_ERR_VERSION_LIMIT:
        result["code"] = error;
        result["current_version"] = manager.getMapParam("curver");
        result["require_version"] = manager.getMapParam("oldver");
        break;
      default:
        break;
    }
    response->SetError(error == kErrFailed ? (start ? kErrStartFailed : kErrStopFailed) : error,
                       Json::Value());
  }
  // Each operation log is read once, here, and then removed.
  if (!manager.getLogFilePath().empty()) unlink(manager.getLogFilePath().c_str());
  return ok;
}

void PackageWebAPI::StartStop(bool start) {
  APIParameter<Json::Value> ids = request->GetAndCheckUnitArray("id", PARAM_REQUIRED);
  if (ids.IsInvalid() || ids.Get().empty() || !AreIdsOrEmpty(ids.Get())) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  if (ids.Get().size() == 1) {
    Json::Value result;
    if (ServiceControl(ids.Get()[0].asString(), start, result)) {
      response->SetSuccess(result);
    } else if (!result.empty()) {
      response->SetError(response->GetError(), result);
    }
    return;
  }
  std::vector<std::string> order;
  PackageManager sorter;
  // A failed ordering answers nothing of its own; the host's default stands.
  if (!sorter.getDependencyOrder(order)) return;
  if (start) std::reverse(order.begin(), order.end());
  Json::Value batch(Json::objectValue);
  bool failed = false;
  for (const std::string& id : order) {
    if (!WebAPIUtil::JsonArrayHasString(ids.Get(), id)) continue;
    Json::Value data;
    Json::Value entry(Json::objectValue);
    if (ServiceControl(id, start, data)) {
      entry["data"] = data;
    } else {
      entry["code"] = response->GetError();
      if (!data.isNull()) entry["errors"] = data;
      failed = true;
    }
    if (!data.empty()) batch[id] = entry;
  }
  if (failed) {
    response->SetError(start ? kErrStartFailed : kErrStopFailed, batch);
  } else {
    response->SetSuccess(batch);
  }
}

}  // namespace KIVO_PACKAGE
