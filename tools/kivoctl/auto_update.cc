#include "tools/kivoctl/auto_update.h"

#include <iostream>
#include <map>
#include <syslog.h>

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/auto_update.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/server_config.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "pkgtool/version.h"
#include "tools/kivoctl/server_install.h"

namespace {

constexpr char kInfoConf[] = "/etc/kivoinfo.conf";
constexpr char kLanguage[] = "enu";

using Mode = KIVOPackageServer::AutoUpdateMode;

bool InfoIs(const char* key, const char* value) {
  return KLIBCFileCheckKeyValue(KIVORootPath(kInfoConf).c_str(), key, value, 0) == 1;
}

// One outcome: a line on stdout and the same in syslog (stderr too when
// it is a failure, for a scheduler that mails what a job writes there).
void Report(const std::string& line, bool failure) {
  std::cout << line << "\n";
  syslog(failure ? LOG_ERR : LOG_INFO, "%s", line.c_str());
  if (failure) std::cerr << "kivoctl: " << line << "\n";
}

void AddOffers(const PMSPackageOrigin& source, const Json::Value& entries,
               std::vector<CatalogueOffer>& offers) {
  for (const Json::Value& e : entries) offers.push_back({source, e});
}

// The vendor's and every feed's entries, each with its source. False when a
// server that is configured gave no usable answer: the run cannot tell what
// is newest, so it counts as failed (what the other servers offer is still
// applied).
bool ReadCatalogues(std::vector<CatalogueOffer>& offers) {
  bool ok = true;
  Json::Value vendor;
  if (!PMSLoadServerConfig().vendor_url.empty()) {
    const Json::Value* listed = nullptr;
    if (KIVOPackageServer::PMSQueryKivoPkgServer(true, kLanguage, vendor) &&
        (listed = KIVOPackageServer::PMSCatalogueEntries(vendor)) != nullptr) {
      AddOffers(PMSPackageOrigin::Vendor(), *listed, offers);
    } else {
      Report("catalogue: the vendor's catalogue cannot be read", true);
      ok = false;
    }
  }
  for (const std::string& url : KIVOPackageServer::PMSFeedUrls()) {
    Json::Value entries;
    if (KIVOPackageServer::PMSQueryFeedServer(url, true, kLanguage, entries)) {
      AddOffers(PMSPackageOrigin::Feed(url), entries, offers);
    } else {
      Report("catalogue: the catalogue of the feed " + url + " cannot be read", true);
      ok = false;
    }
  }
  return ok;
}

bool IsBeta(const Json::Value& entry) { return entry["beta"].isBool() && entry["beta"].asBool(); }

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
  if (!KivoctlDownloadAndInstall(plan.id, plan.entry, run, "", PMSOriginChange::kRefuse, message,
                                 code)) {
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
                              const PMSPackageOrigin& origin,
                              const std::vector<CatalogueOffer>& offers, bool beta) {
  AutoUpdatePlan plan;
  plan.id = id;
  plan.installed = installed;
  plan.reason = "no newer version offered";
  if (PMSThirdPartyCheckLimit(id, installed) != 0) {
    plan.reason = "version " + installed + " is restricted to stay as it is";
    return plan;
  }
  bool beta_held_back = false;
  const CatalogueOffer* elsewhere = nullptr;  // the newest offer of another source
  for (const CatalogueOffer& offer : offers) {
    const Json::Value& e = offer.entry;
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
    if (!PMSSameSource(origin, offer.source)) {
      if (!elsewhere || PMSCompareVersion(version, elsewhere->entry["version"].asString()) > 0)
        elsewhere = &offer;
      continue;
    }
    if (plan.action == AutoUpdatePlan::Action::kSkip ||
        PMSCompareVersion(version, plan.version) > 0) {
      plan.action = AutoUpdatePlan::Action::kUpgrade;
      plan.version = version;
      plan.entry = e;
    }
  }
  if (plan.action == AutoUpdatePlan::Action::kUpgrade) return plan;
  if (elsewhere) {
    plan.reason = elsewhere->entry["version"].asString() + " is offered by " +
                  PMSSourceText(elsewhere->source) + ", but " + id + " was installed from " +
                  PMSSourceText(origin) +
                  "; only an administrator who switches its origin can upgrade it from there";
  } else if (beta_held_back) {
    plan.reason = "only a beta version is newer and the update channel is stable";
  }
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
  const Mode mode = KIVOPackageServer::ReadMode();
  if (mode == Mode::kOff) {
    Report("automatic update is off", false);
    return 0;
  }
  PackageManager manager;
  std::map<std::string, std::string> chosen;
  if (!manager.init() || !ChosenPackages(manager, mode, chosen)) return 1;
  if (chosen.empty()) return 0;
  std::vector<CatalogueOffer> offers;
  bool ok = ReadCatalogues(offers);
  const bool beta = InfoIs("package_update_channel", "beta");
  for (const auto& [id, version] : chosen) {
    const AutoUpdatePlan plan = PlanAutoUpdate(id, version, PMSInstalledOrigin(id), offers, beta);
    ok = Apply(manager, plan, dry_run) && ok;
  }
  return ok ? 0 : 1;
}
