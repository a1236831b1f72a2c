// Starting and stopping packages, one or a batch in dependency order.

#include <algorithm>
#include <unistd.h>

#include "package_webapi.h"
#include "pkgtool/package_manager.h"
#include "webapi/webapi_util.h"

namespace KIVO_PACKAGE {

namespace {

// The package tool's operation type for a start or stop.
int OperationType(const std::string& type, bool start) {
  if (type == "install") return PKG_OP_INSTALL;  // the tail of an installation
  return start ? PKG_OP_START : PKG_OP_STOP;
}

}  // namespace

void PackageWebAPI::Start() { StartStop(true); }

void PackageWebAPI::Stop() { StartStop(false); }

bool PackageWebAPI::ServiceControl(const char* name, bool start, Json::Value& result) {
  PackageManager manager;
  const std::string type = request->GetParam("type", "").asString();
  if (!name || !*name) {
    response->SetError(4500, Json::Value());
    return false;
  }
  if (!manager.init()) {
    response->SetError(4501, Json::Value());
    return false;
  }
  if (start) {
    PackageInfo info;
    if (!manager.getPackageInfo(name, info, request->GetUILanguage(), ~0ULL)) {
      response->SetError(4501, Json::Value());
      return false;
    }
    std::string not_started;
    if (!manager.arePackagesInstallAndStart(info.getDependencies(), result["uninstall_packages"],
                                            not_started, nullptr)) {
      result["unstart_packages"] = not_started;
      response->SetError(4584, result);
      return false;
    }
  } else {
    std::string running;
    if (!manager.areDependentPackageStop(name, request->GetUILanguage().c_str(), running)) {
      result["packages"] = running;
      response->SetError(4582, result);
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
    switch (manager.getResult(services)) {
      case 260:
        result["code"] = 4525;
        result["services"] = services;
        response->SetError(4525, Json::Value());
        break;
      case 259:
        result["code"] = 4583;
        result["current_version"] = manager.getMapParam("curver");
        result["require_version"] = manager.getMapParam("oldver");
        response->SetError(4583, Json::Value());
        break;
      case 275:
        response->SetError(4530, Json::Value());
        break;
      case 297:
        response->SetError(4502, Json::Value());
        break;
      case 296:
        response->SetError(4505, Json::Value());
        break;
      default:
        response->SetError(start ? 4580 : 4581, Json::Value());
        break;
    }
  }
  // Each operation log is read once, here, and then removed.
  if (!manager.getLogFilePath().empty()) unlink(manager.getLogFilePath().c_str());
  return ok;
}

void PackageWebAPI::StartStop(bool start) {
  APIParameter<Json::Value> ids = request->GetAndCheckUnitArray("id", PARAM_REQUIRED);
  if (ids.IsInvalid() || ids.Get().empty()) {
    response->SetError(4500, Json::Value());
    return;
  }
  if (ids.Get().size() == 1) {
    Json::Value result;
    if (ServiceControl(ids.Get()[0].asCString(), start, result)) {
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
    if (ServiceControl(id.c_str(), start, data)) {
      entry["data"] = data;
    } else {
      entry["code"] = response->GetError();
      if (!data.isNull()) entry["errors"] = data;
      failed = true;
    }
    if (!data.empty()) batch[id] = entry;
  }
  if (failed) {
    response->SetError(start ? 4580 : 4581, batch);
  } else {
    response->SetSuccess(batch);
  }
}

}  // namespace KIVO_PACKAGE
