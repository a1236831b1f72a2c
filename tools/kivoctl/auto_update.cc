#include "tools/kivoctl/auto_update.h"

#include <iostream>
#include <map>
#include <memory>
#include <syslog.h>
#include <unistd.h>

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/auto_update.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/download.h"
#include "pkgserver/server_config.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "pkgtool/version.h"
#include "taskmgr/task.h"

namespace {

constexpr char kInfoConf[] = "/etc/kivoinfo.conf";
constexpr char kLanguage[] = "enu";
// The download runs in the same task the desktop's downloads use, so the
// desktop sees it and never starts a second download of the same package.
constexpr char kTaskOwner[] = "@administrators";
constexpr char kTaskPrefix[] = "@KIVOPKG_DOWNLOAD_";
constexpr char kUser[] = "root";

enum class Mode { kOff, kAll, kChosen };

bool InfoIs(const char* key, const char* value) {
  return KLIBCFileCheckKeyValue(KIVORootPath(kInfoConf).c_str(), key, value, 0) == 1;
}

// The same reading of the switches as the settings' "get".
Mode ReadMode() {
  if (!InfoIs("enable_pkg_autoupdate_all", "yes")) return Mode::kOff;
  return InfoIs("pkg_autoupdate_all", "no") ? Mode::kChosen : Mode::kAll;
}

// One outcome: a line on stdout and the same in syslog (stderr too when
// it is a failure, for a scheduler that mails what a job writes there).
void Report(const std::string& line, bool failure) {
  std::cout << line << "\n";
  syslog(failure ? LOG_ERR : LOG_INFO, "%s", line.c_str());
  if (failure) std::cerr << "kivoctl: " << line << "\n";
}

// The vendor's and the feeds' entries in one array. False when a server
// that is configured gave no usable answer: the run cannot tell what is
// newest, so it counts as failed (what the other servers offer is still
// applied).
bool ReadCatalogues(Json::Value& entries) {
  entries = Json::Value(Json::arrayValue);
  bool ok = true;
  Json::Value vendor;
  if (!PMSLoadServerConfig().vendor_url.empty()) {
    const Json::Value* listed = nullptr;
    if (KIVOPackageServer::PMSQueryKivoPkgServer(true, kLanguage, vendor) &&
        (listed = KIVOPackageServer::PMSCatalogueEntries(vendor)) != nullptr) {
      for (const Json::Value& e : *listed) entries.append(e);
    } else {
      Report("catalogue: the vendor's catalogue cannot be read", true);
      ok = false;
    }
  }
  Json::Value feeds;
  if (KIVOPackageServer::PMSQueryOtherPkgServer(true, kLanguage, feeds) && feeds.isArray()) {
    for (const Json::Value& e : feeds) entries.append(e);
  } else {
    Report("catalogue: no feed's catalogue can be read", true);
    ok = false;
  }
  return ok;
}

bool IsBeta(const Json::Value& entry) { return entry["beta"].isBool() && entry["beta"].asBool(); }

// Downloads the plan's file and upgrades the package with it, in a task of
// its own; false with `message` and `code` (the package tool's result, 0
// for a download failure) on failure.
bool Upgrade(const AutoUpdatePlan& plan, bool run, std::string& message, int& code) {
  const Json::Value& e = plan.entry;
  const std::string link = e["link"].isString() ? e["link"].asString() : "";
  const std::string md5 = e["md5"].isString() ? e["md5"].asString() : "";
  const uint64_t size = e["size"].isUInt64() ? e["size"].asUInt64() : 0;
  code = 0;
  if (KIVOPackageServer::IsInstalling(plan.id)) {
    message = "a download of it is under way";
    return false;
  }
  std::string volume, folder;
  if (!PMSGetPackageVol(plan.id, volume)) volume.clear();
  if (!PMSCreateDownloadTmpDir(volume, plan.id, static_cast<int64_t>(size), folder)) {
    message = "no room for the download";
    return false;
  }
  NVX::TaskMgr mgr(kTaskOwner);
  std::unique_ptr<NVX::Task> task(mgr.createTask(kTaskPrefix + plan.id));
  if (!task ||
      !KIVOPackageServer::InitDownload(task.get(), plan.id, size, link, folder, true, getpid())) {
    (void)KIVOPackageServer::PMSRemoveDownloadDir(folder);
    message = "the download task cannot be written";
    return false;
  }
  std::string path;
  bool ok = KIVOPackageServer::DownloadPackage(task.get(), kUser, plan.id, link, md5, true, folder,
                                               kLanguage, path) &&
            KIVOPackageServer::Install(task.get(), kUser, volume, plan.id, folder, run, "", false,
                                       kLanguage);
  if (ok) return true;
  // Both steps leave their reason in the task.
  Json::Value error = task->getProperty("data")["error"];
  message = error["message"].isString() ? error["message"].asString() : "the upgrade failed";
  code = error["result"].isInt() ? error["result"].asInt() : 0;
  return false;
}

// Carries out one plan (or says what it would do); false when it failed.
bool Apply(PackageManager& manager, const AutoUpdatePlan& plan, bool dry_run) {
  if (plan.action == AutoUpdatePlan::Action::kSkip) {
    Report(plan.id + ": skipped: " + plan.reason, false);
    return true;
  }
  const std::string step = plan.installed + " -> " + plan.version;
  if (dry_run) {
    Report(plan.id + ": would upgrade " + step + " from " + plan.entry["link"].asString(), false);
    return true;
  }
  const bool run = (manager.getPkgRoughStatus(plan.id) & 2) != 0;
  std::string message;
  int code = 0;
  if (!Upgrade(plan, run, message, code)) {
    Report(plan.id + ": failed " + step + ": " + message +
               (code ? " [" + std::to_string(code) + "]" : ""),
           true);
    return false;
  }
  Report(plan.id + ": upgraded " + step, false);
  return true;
}

// The installed packages the settings choose, with their versions; the
// others are reported as skipped. False when the chosen list cannot be read.
bool ChosenPackages(PackageManager& manager, Mode mode, std::map<std::string, std::string>& out) {
  std::map<std::string, PackageInfo> installed;
  if (!manager.enumPackageInfoMap(installed, kLanguage, ~0ULL)) {
    Report("the installed packages cannot be read", true);
    return false;
  }
  Json::Value chosen(Json::arrayValue);
  if (mode == Mode::kChosen && !KIVOPackageServer::List(chosen)) {
    Report("the chosen list of automatic updates cannot be read", true);
    return false;
  }
  for (const auto& [id, info] : installed) {
    bool picked = mode == Mode::kAll;
    for (const Json::Value& c : chosen) picked = picked || (c.isString() && c.asString() == id);
    if (picked) {
      out[id] = info.getVersion();
    } else {
      Report(id + ": skipped: not chosen for automatic update", false);
    }
  }
  return true;
}

}  // namespace

AutoUpdatePlan PlanAutoUpdate(const std::string& id, const std::string& installed,
                              const Json::Value& entries, bool beta) {
  AutoUpdatePlan plan;
  plan.id = id;
  plan.installed = installed;
  plan.reason = "no newer version offered";
  if (PMSThirdPartyCheckLimit(id, installed) != 0) {
    plan.reason = "version " + installed + " is restricted to stay as it is";
    return plan;
  }
  bool beta_held_back = false;
  for (const Json::Value& e : entries) {
    if (!e.isObject() || !e["package"].isString() || e["package"].asString() != id ||
        !e["version"].isString() || !e["link"].isString())
      continue;
    const std::string version = e["version"].asString();
    if (!PMSIsValidVersion(version) || PMSCompareVersion(version, installed) <= 0 ||
        PMSThirdPartyCheckLimit(id, version) != 0)
      continue;
    if (IsBeta(e) && !beta) {
      beta_held_back = true;
      continue;
    }
    if (plan.action == AutoUpdatePlan::Action::kSkip ||
        PMSCompareVersion(version, plan.version) > 0) {
      plan.action = AutoUpdatePlan::Action::kUpgrade;
      plan.version = version;
      plan.entry = e;
    }
  }
  if (plan.action == AutoUpdatePlan::Action::kSkip && beta_held_back)
    plan.reason = "only a beta version is newer and the update channel is stable";
  return plan;
}

int KivoctlAutoUpdate(const std::vector<std::string>& args) {
  bool dry_run = false;
  for (const std::string& a : args) {
    if (a != "--dry-run") {
      std::cerr << "kivoctl: unknown option for auto-update: " << a << "\n";
      return 2;
    }
    dry_run = true;
  }
  openlog("kivoctl-auto-update", LOG_PID, LOG_USER);
  const Mode mode = ReadMode();
  if (mode == Mode::kOff) {
    Report("automatic update is off", false);
    return 0;
  }
  PackageManager manager;
  std::map<std::string, std::string> chosen;
  if (!manager.init() || !ChosenPackages(manager, mode, chosen)) return 1;
  if (chosen.empty()) return 0;
  Json::Value entries;
  bool ok = ReadCatalogues(entries);
  const bool beta = InfoIs("package_update_channel", "beta");
  for (const auto& [id, version] : chosen) {
    ok = Apply(manager, PlanAutoUpdate(id, version, entries, beta), dry_run) && ok;
  }
  return ok ? 0 : 1;
}
