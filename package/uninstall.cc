// Removing a package, with the answers of its uninstall wizard.

#include <unistd.h>

#include "error_codes.h"
#include "klibc/json_text.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgtool/result_codes.h"
#include "request_values.h"

namespace KIVO_PACKAGE {

namespace {

// Refusals of an uninstall by the package tool; any other result is 4560.
constexpr ToolCodeMapping kUninstallErrors[] = {
    {PKG_ERR_DEPENDENCY, kErrUninstallDependents},
    {PKG_ERR_BUSY, kErrBusy},
};

}  // namespace

void PackageWebAPI::Uninstall() {
  // "id" names one package (the checker has let a string or an array in);
  // the whole id is checked before the package tool sees it.
  std::string id;
  if (!SinglePackageId(request->GetParam("id", ""), &id)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  const std::string user = request->GetLoginUserName();
  PackageManager manager;
  Json::Value result;
  Json::Value wizard;
  bool called = false;
  if (!manager.init()) {
    response->SetError(kErrFailed, Json::Value());
  } else {
    const std::string extra = request->GetParam("extra_values", "").asString();
    if (!extra.empty() && !KIVOParseJson(extra, &wizard)) {
      PKG_LOG_ERR("extra_values is not a JSON document");
      response->SetError(kErrUninstallBadValues, Json::Value());
    } else {
      called = true;
      bool ok =
          manager.uninstall(id, &wizard, request->GetUILanguage(), PKG_OP_UNINSTALL, false, user);
      result["message"] = PMSReadPackageLog(manager.getLogFilePath());
      result["worker_message"] = manager.getJsonParam("worker_msg");
      if (!result["worker_message"].isArray())
        result["worker_message"] = Json::Value(Json::arrayValue);
      const int error = MapToolCode(kUninstallErrors, manager.getResult());
      if (ok) {
        response->SetSuccess(result);
      } else if (error == kErrUninstallDependents) {
        result["code"] = error;
        result["packages"] = manager.getMapParam("deppkg");
        response->SetError(error, Json::Value());
      } else {
        response->SetError(error == kErrFailed ? kErrUninstallFailed : error, Json::Value());
      }
    }
  }
  if (called && !response->IsSuccess() && !result.empty())
    response->SetError(response->GetError(), result);
  if (!manager.getLogFilePath().empty()) unlink(manager.getLogFilePath().c_str());
}

}  // namespace KIVO_PACKAGE
