// Removing a package, with the answers of its uninstall wizard.

#include <unistd.h>

#include <json/reader.h>

#include "log_line.h"
#include "package_webapi.h"

namespace KIVO_PACKAGE {

void PackageWebAPI::Uninstall() {
  const std::string id = request->GetParam("id", "").asString();
  const std::string user = request->GetLoginUserName();
  PackageManager manager;
  Json::Value result;
  Json::Value wizard;
  bool called = false;
  if (!manager.init()) {
    response->SetError(4501, Json::Value());
  } else {
    const std::string extra = request->GetParam("extra_values", "").asString();
    Json::Reader reader(Json::Features::strictMode());
    if (!extra.empty() && !reader.parse(extra, wizard)) {
      PKG_LOG_ERR("Error: parsing error, reason = %s\n",
                  reader.getFormattedErrorMessages().c_str());
      response->SetError(4561, Json::Value());
    } else {
      called = true;
      bool ok =
          manager.uninstall(id, &wizard, request->GetUILanguage(), PKG_OP_UNINSTALL, false, user);
      result["message"] = PMSReadPackageLog(manager.getLogFilePath());
      result["worker_message"] = manager.getJsonParam("worker_msg");
      if (!result["worker_message"].isArray())
        result["worker_message"] = Json::Value(Json::arrayValue);
      if (ok) {
        response->SetSuccess(result);
      } else if (manager.getResult() == 268) {
        result["code"] = 4562;
        result["packages"] = manager.getMapParam("deppkg");
        response->SetError(4562, Json::Value());
      } else {
        response->SetError(manager.getResult() == 275 ? 4530 : 4560, Json::Value());
      }
    }
  }
  if (called && !response->IsSuccess() && !result.empty())
    response->SetError(response->GetError(), result);
  if (!manager.getLogFilePath().empty()) unlink(manager.getLogFilePath().c_str());
}

}  // namespace KIVO_PACKAGE
