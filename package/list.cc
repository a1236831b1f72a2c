// The installed packages: "list" (also under the legacy API name) and "get".

#include "error_codes.h"
#include "package_webapi.h"
#include "pkgserver/auto_update.h"
#include "pkgtool/pms.h"
#include "pkgtool/result_codes.h"
#include "request_values.h"
#include "storage/volume_lookup.h"
#include "utils/package_utils.h"
#include "webapi/webapi_util.h"

namespace KIVO_PACKAGE {

namespace {

using PackageUtils::kAutoupdate;
using PackageUtils::kInstalledInfo;
using PackageUtils::kLogPath;

}  // namespace

PackageWebAPI::AutoUpdateState PackageWebAPI::ReadAutoUpdateState(uint64_t mask) {
  AutoUpdateState state;
  if (!(mask & kAutoupdate)) return state;
  switch (KIVOPackageServer::ReadMode()) {
    case KIVOPackageServer::AutoUpdateMode::kOff:
      break;
    case KIVOPackageServer::AutoUpdateMode::kAll:
      state.all = true;
      break;
    case KIVOPackageServer::AutoUpdateMode::kChosen:
      // An unreadable list leaves it empty: no package shows as chosen.
      (void)KIVOPackageServer::List(state.list);
      break;
  }
  return state;
}

void PackageWebAPI::RenderInstalled(const PackageInfo& info, uint64_t mask,
                                    const AutoUpdateState& autoupdate, Json::Value& out) {
  PackageUtils::DumpInfo(info, mask, out);
  if (mask == 0) return;
  DumpStatusInfo(info, mask, out["additional"]);
  DumpUninstallPages(info, mask, out["additional"]);
  if (mask & kAutoupdate) {
    out["additional"]["autoupdate"] =
        autoupdate.all || WebAPIUtil::JsonArrayHasString(autoupdate.list, info.getId());
  }
}

bool PackageWebAPI::IsBrickCached(const std::string& target, std::map<std::string, bool>& cache) {
  std::string volume;
  if (VolumePathParseEx(target, volume) != 0) volume = target;
  auto it = cache.find(volume);
  if (it == cache.end()) it = cache.emplace(volume, KIVOVolumeIsUsedByGlusterFs(target) == 1).first;
  return it->second;
}

void PackageWebAPI::List() {
  uint64_t mask =
      PackageUtils::ParseAdditional(request->GetParam("additional", Json::Value(Json::arrayValue)));
  AutoUpdateState autoupdate = ReadAutoUpdateState(mask);
  std::map<std::string, bool> bricks;
  Json::Value packages(Json::arrayValue);
  const std::string language = request->GetUILanguage();
  for (const std::string& id : pkgMgr.enumPackages("", ~0ULL)) {
    PackageInfo info;
    if (!pkgMgr.getPackageInfo(id, info, language, ~0ULL)) continue;
    Json::Value object(Json::objectValue);
    RenderInstalled(info, mask, autoupdate, object);
    if (mask & kLogPath) object["additional"]["log_path"] = pkgMgr.getPackageLog(id, true);
    if (mask & kInstalledInfo) {
      std::string target = PMSGetPackageTarget(info);
      object["additional"]["installed_info"]["is_brick"] = IsBrickCached(target, bricks);
      object["additional"]["installed_info"]["path"] = target;
    }
    packages.append(std::move(object));
  }
  Json::Value result(Json::objectValue);
  result["total"] = packages.size();
  result["packages"] = std::move(packages);
  response->SetSuccess(std::move(result));
}

void PackageWebAPI::Get() {
  std::string id;
  if (!SinglePackageId(request->GetParam("id", ""), &id)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  if (!pkgMgr.init()) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  uint64_t mask =
      PackageUtils::ParseAdditional(request->GetParam("additional", Json::Value(Json::arrayValue)));
  AutoUpdateState autoupdate = ReadAutoUpdateState(mask);
  PackageInfo info;
  if (!pkgMgr.getPackageInfo(id, info, request->GetUILanguage(), ~0ULL) &&
      pkgMgr.getResult() == PKG_ERR_NOT_INSTALLED) {
    response->SetError(kErrInstallNotInstalled, Json::Value());
    return;
  }
  // Any other failure still renders the record as it stands: only an
  // unknown package is an error.
  Json::Value object(Json::objectValue);
  RenderInstalled(info, mask, autoupdate, object);
  if (mask & kInstalledInfo) {
    std::string target = PMSGetPackageTarget(info);
    object["additional"]["installed_info"]["is_brick"] = KIVOVolumeIsUsedByGlusterFs(target) == 1;
    object["additional"]["installed_info"]["path"] = target;
  }
  response->SetSuccess(object);
}

}  // namespace KIVO_PACKAGE
