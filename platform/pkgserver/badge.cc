#include "pkgserver/badge.h"

#include <ctime>
#include <map>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/catalogue.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_origin.h"
#include "pkgtool/pms.h"
#include "settings/web_utils.h"

namespace KIVOPackageTool {

namespace {

// The highest unrestricted server version per package.
std::map<std::string, std::string> OfferedVersions(const Json::Value& entries,
                                                   const PMSThirdPartyLimits& limits) {
  std::map<std::string, std::string> offered;
  for (const Json::Value& e : entries) {
    if (!e.isObject() || !e["package"].isString() || !e["version"].isString()) continue;
    const std::string id = e["package"].asString(), version = e["version"].asString();
    if (limits.Restricts(id, version)) continue;
    auto it = offered.find(id);
    if (it == offered.end() || PMSCompareVersion(version, it->second) > 0) offered[id] = version;
  }
  return offered;
}

}  // namespace

std::string PMSBadgeCountPath() {
  return KIVORootPath("/var/cache/kivo/pkgserver/upgrade_badge.json");
}

int updateBadgeCount(bool forceReload) {
  Json::Value answer;
  if (!KIVOPackageServer::PMSQueryKivoPkgServer(forceReload, "enu", answer)) return -1;
  const Json::Value* entries = KIVOPackageServer::PMSCatalogueEntries(answer);
  PackageManager manager;
  std::map<std::string, PackageInfo> installed;
  if (!entries || !manager.init() || !manager.enumPackageInfoMap(installed, "enu", ~0ULL))
    return -1;
  Json::Value badge(Json::objectValue);
  badge["packages"] = Json::Value(Json::arrayValue);
  const PMSThirdPartyLimits limits;
  for (const auto& [id, version] : OfferedVersions(*entries, limits)) {
    auto it = installed.find(id);
    if (it == installed.end()) continue;
    const std::string& have = it->second.getVersion();
    // The vendor's catalogue offers upgrades only of the packages that came
    // from the vendor's server.
    if (PMSCompareVersion(have, version) < 0 && !limits.Restricts(id, have) &&
        PMSSameSource(PMSInstalledOrigin(id), PMSPackageOrigin::Vendor())) {
      badge["packages"].append(id);
    }
  }
  badge["count"] = badge["packages"].size();
  badge["time"] = static_cast<Json::Int64>(time(nullptr));
  if (KIVOFSMkdirP(KIVORootPath("/var/cache/kivo/pkgserver").c_str()) != 0) return -1;
  if (!WebUtils::SaveJsonFile(PMSBadgeCountPath(), badge)) return -1;
  return static_cast<int>(badge["count"].asUInt());
}

}  // namespace KIVOPackageTool
