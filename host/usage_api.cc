#include "host/usage_api.h"

#include <string>
#include <utility>

#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_confinement.h"
#include "pkgtool/registry.h"
#include "webapi/api_codes.h"

namespace {

Json::Value FigureJson(const UsageFigure& f) {
  Json::Value out(Json::objectValue);
  out["measured"] = f.measured;
  if (f.measured) {
    out["value"] = static_cast<Json::UInt64>(f.value);
  } else {
    out["reason"] = f.reason;
  }
  return out;
}

Json::Value UsageJson(const std::string& id, const PackageUsage& usage, KIVOJsonParser* parser) {
  Json::Value out(Json::objectValue);
  out["id"] = id;
  out["cpu_ns"] = FigureJson(usage.cpu_ns);
  out["memory_bytes"] = FigureJson(usage.memory_bytes);
  out["memory_limit_bytes"] = FigureJson(usage.memory_limit_bytes);
  out["process_limit"] = FigureJson(usage.process_limit);
  // The record as the package's scripts last wrote it; null when there is
  // none yet, which the page shows as not confined yet.
  Json::Value confinement;
  if (!PMSLoadConfinement(id, &confinement, parser)) confinement = Json::Value(Json::nullValue);
  out["confinement"] = std::move(confinement);
  return out;
}

}  // namespace

void UsageList(const APIRequest&, APIResponse* response) {
  Json::Value packages(Json::arrayValue);
  const std::vector<std::string> ids = PackageRegistry::List();
  const std::vector<PackageUsage> usages = PackageCgroupUsages(ids);
  KIVOJsonParser parser;
  for (size_t i = 0; i < ids.size(); ++i) packages.append(UsageJson(ids[i], usages[i], &parser));
  Json::Value data(Json::objectValue);
  data["total"] = packages.size();
  data["packages"] = std::move(packages);
  response->SetSuccess(std::move(data));
}

void UsageGet(const APIRequest& request, APIResponse* response) {
  APIParameter<std::string> id = request.GetAndCheckString("id", PARAM_REQUIRED);
  if (id.IsInvalid() || !PMSIsValidPackageId(id.Get())) {
    Json::Value data(Json::objectValue);
    data["name"] = "id";
    data["reason"] = id.IsInvalid() ? (id.IsSet() ? "type" : "required") : "condition";
    return response->SetError(kErrParameter, data);
  }
  if (!PackageRegistry::IsInstalled(id.Get())) {
    Json::Value data(Json::objectValue);
    data["message"] = id.Get() + " is not installed";
    return response->SetError(kErrUsageNotInstalled, data);
  }
  KIVOJsonParser parser;
  response->SetSuccess(UsageJson(id.Get(), PackageCgroupUsage(id.Get()), &parser));
}
