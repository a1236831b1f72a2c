// Package information rendering that needs the request: a package's live
// status (from the tasks of running operations and the package tool), its
// web address, its uninstall wizard pages, and the description of a package
// file for the install wizard.

#include <cstdlib>
#include <memory>

#include "package_status.h"
#include "package_webapi.h"
#include "pkgtool/pms.h"
#include "pkgtool/result_codes.h"
#include "task_record.h"
#include "utils/package_utils.h"

namespace KIVO_PACKAGE {

namespace {

using PackageUtils::kInstallingProgress;
using PackageUtils::kStatus;
using PackageUtils::kUninstallPages;
using PackageUtils::kUrl;

// The "data" of task `prefix`+id when a living process runs it. Null when
// there is no such live task. A task whose process is gone is stale: an
// install or download job that never finished is recorded as failed (its
// starter polls "status" for the outcome), any other stale task is removed.
Json::Value LiveTaskData(NVX::TaskMgr& mgr, const std::string& id, const char* prefix) {
  std::unique_ptr<NVX::Task> task(GetTaskWithTaskMgr(mgr, prefix + id));
  if (!task) return Json::Value();
  Json::Value data = task->getProperty("data");
  if (TaskProcessAlive(data) && !task->isFinished()) return data;
  if (!TaskProcessAlive(data)) EndStaleTask(*task, data);
  return Json::Value();
}

}  // namespace

void PackageWebAPI::DumpStatusInfo(const PackageInfo& info, uint64_t mask,
                                   Json::Value& additional) {
  if (!(mask & (kUrl | kStatus))) return;
  const std::string id = info.getId();
  NVX::TaskMgr mgr(kTaskOwner);
  Json::Value startstop = LiveTaskData(mgr, id, kStartStopPrefix);
  if (startstop.isMember("status")) {
    if (mask & kStatus) additional["status"] = startstop["status"];
    return;
  }
  Json::Value download = LiveTaskData(mgr, id, kDownloadPrefix);
  if (download["installing"].isBool() && download["installing"].asBool()) {
    if (mask & kStatus)
      additional["status"] = download.isMember("status") ? download["status"] : "installing";
    double progress = PMSGetProgress(id);
    if ((mask & kInstallingProgress) && progress != -1.0)
      additional["installing_progress"] = progress;
    return;
  }
  if (!LiveTaskData(mgr, id, kUninstallPrefix).isNull()) {
    if (mask & kStatus) additional["status"] = "uninstalling";
    return;
  }
  bool running = false;
  bool ok = pkgMgr.getServiceStatus(info, running, request->GetAPIClass() != "KIVO.Package");
  if (ok && running) {
    if (mask & kStatus) additional["status"] = "running";
    if ((mask & kUrl) && info.getAdminPort() > 0) {
      std::string protocol = info.get("adminprotocol").empty() ? "http" : info.get("adminprotocol");
      std::string path = info.get("adminurl");
      if (path.empty() || path[0] != '/') path = "/" + path;
      additional["url"] =
          protocol + "://" + RequestHost() + ":" + std::to_string(info.getAdminPort()) + path;
    }
    return;
  }
  if (mask & kStatus) additional["status"] = StoppedStatus(pkgMgr.getResult());
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
  std::string status = "NA";
  bool running = false;
  PackageInfo installed;
  bool known = pkgMgr.getPackageInfo(info.getId(), installed, request->GetUILanguage());
  if (!known || !pkgMgr.getServiceStatus(installed, running, true) || !running) {
    status = StoppedStatus(pkgMgr.getResult());
    if (pkgMgr.getResult() == PKG_ERR_STATUS_UNKNOWN || pkgMgr.getResult() == PKG_ERR_REGISTRY)
      status = "NA";
  } else {
    status = "running";
  }
  if (status == "NA" || status == "running" || status == "stop") {
    NVX::TaskMgr mgr(kTaskOwner);
    for (const char* prefix : {kDownloadPrefix, kStartStopPrefix}) {
      Json::Value data = LiveTaskData(mgr, info.getId(), prefix);
      bool installing = data["installing"].isBool() && data["installing"].asBool();
      if (prefix == kDownloadPrefix && installing) {
        status = data.isMember("status") ? data["status"].asString() : "installing";
        break;
      }
      if (prefix == kStartStopPrefix && data.isMember("status")) status = data["status"].asString();
    }
  }
  out["status"] = status;
}

}  // namespace KIVO_PACKAGE
