// Package logs (and, later, deletion of temporary files).

#include "package_webapi.h"

namespace KIVO_PACKAGE {

void PackageWebAPI::GetLog() {
  const std::string name = request->GetParam("name", "").asString();
  PackageManager manager;
  if (!manager.init()) {
    response->SetError(4501, Json::Value());
    return;
  }
  Json::Value result(Json::objectValue);
  result["pkglog"] = "";
  const std::string path = manager.getPackageLog(name);
  if (!path.empty()) result["pkglog"] = PMSReadPackageLog(path);
  response->SetSuccess(result);
}

}  // namespace KIVO_PACKAGE
