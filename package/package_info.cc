// The web API's rendering of package information (the package tool's own
// record of a package is platform/pkgtool/package_info.cc), the part that
// needs the request: a package's live status (from the tasks of running
// operations and the package tool), its web address, its uninstall wizard
// pages, and the description of a package file for the install wizard.

#include "package_status.h"
#include "package_webapi.h"
#include "task_record.h"
#include "utils/package_utils.h"
#include "webapi/api_names.h"

namespace KIVO_PACKAGE {

namespace {

using PackageUtils::kInstallingProgress;
using PackageUtils::kStatus;
using PackageUtils::kUninstallPages;
using PackageUtils::kUrl;

// The address of a running package's own web page, "" when it has no port.
std::string PackageUrl(const PackageInfo& info) {
  if (info.getAdminPort() <= 0) return "";
  std::string protocol = info.get("adminprotocol").empty() ? "http" : info.get("adminprotocol");
  std::string path = info.get("adminurl");
  if (path.empty() || path[0] != '/') path = "/" + path;
  return protocol + "://" + RequestHost() + ":" + std::to_string(info.getAdminPort()) + path;
}

}  // namespace

void PackageWebAPI::DumpStatusInfo(const PackageInfo& info, uint64_t mask,
                                   Json::Value& additional) {
  if (!(mask & (kUrl | kStatus))) return;
  NVX::TaskMgr mgr(kTaskOwner);
  // Under the legacy API name a package whose installed files are gone reads
  // as stopped, not broken, as it always has.
  const PackageState state = ReadPackageState(
      PackageTasks(mgr), pkgMgr, info.getId(), &info,
      request->GetAPIClass() == WebAPIName::kLegacyPackage ? BrokenCheck::kNo : BrokenCheck::kYes);
  if (mask & kStatus) additional["status"] = state.status;
  if ((mask & kInstallingProgress) && state.progress != -1.0)
    additional["installing_progress"] = state.progress;
  const std::string url = state.running && (mask & kUrl) ? PackageUrl(info) : "";
  if (!url.empty()) additional["url"] = url;
}

void PackageWebAPI::DumpUninstallPages(const PackageInfo& info, uint64_t mask,
                                       Json::Value& additional) {
  if (!(mask & kUninstallPages) || !info.hasWizard(PKG_OP_UNINSTALL)) return;
  PackageInfo pages;
  if (!pkgMgr.readUIFile(PKG_OP_UNINSTALL, info, pages, request->GetUILanguage())) return;
  if (!pages.getUIFile().empty()) PackageUtils::DumpUIFIle(pages, additional["uninstall_pages"]);
}

void PackageWebAPI::DumpPkgInfo(const std::string& path, const PackageInfo& info,
                                Json::Value& out) {
  out["path"] = path;
  out["id"] = info.getId();
  out["version"] = info.getVersion();
  out["name"] = info.getDisplayName();
  out["description"] = info.getDescription();
  out["maintainer"] = info.get("maintainer");
  if (!info.getUIFile().isNull() && !info.getUIFile().empty()) {
    PackageUtils::DumpUIFIle(info, out["install_pages"]);
  }
  PackageInfo installed;
  const bool known = pkgMgr.getPackageInfo(info.getId(), installed, request->GetUILanguage());
  NVX::TaskMgr mgr(kTaskOwner);
  out["status"] = ReadPackageState(PackageTasks(mgr), pkgMgr, info.getId(),
                                   known ? &installed : nullptr, BrokenCheck::kYes)
                      .status;
}

}  // namespace KIVO_PACKAGE
