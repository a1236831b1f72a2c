#include "tools/kivoctl/auto_update.h"

#include <ctime>
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
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/version.h"
#include "tools/kivoctl/server_install.h"

namespace {

constexpr char kInfoConf[] = "/etc/kivoinfo.conf";
constexpr char kLanguage[] = "enu";

using Mode = KIVOPackageServer::AutoUpdateMode;
using KIVOPackageServer::AutoUpdateFailure;

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

// Whether a failed upgrade says something about the version itself, so
// that trying it again would fail again. A failure that says the appliance
// was not ready (the download, another operation holding the lock, no room
// on the volume or for the data's safety copy, no temporary space, a
// crashed or missing volume, a needed package or service not running, a
// cancel, an internal error) is tried again by the next run.
bool SaysTheVersionFailed(int code) {
  switch (code) {
    case PKG_OK:  // the failure came before the package tool: the download
    case PKG_ERR_BUSY:
    case PKG_ERR_NO_SPACE:
    case PKG_ERR_NO_ROOM_FOR_DATA_COPY:
    case PKG_ERR_NO_TMP:
    case PKG_ERR_VOLUME_CRASHED:
    case PKG_ERR_NO_VOLUME:
    case PKG_ERR_DEPENDENCY:
    case PKG_ERR_SERVICE_NOT_RUNNING:
    case PKG_ERR_CANCELLED:
    case PKG_ERR_INTERNAL:
      return false;
    default:
      return true;
  }
}

// "2024-05-01 14:03 UTC".
std::string DateText(int64_t when) {
  const time_t t = static_cast<time_t>(when);
  struct tm utc {};
  char text[32] = "";
  if (gmtime_r(&t, &utc) == nullptr ||
      strftime(text, sizeof(text), "%Y-%m-%d %H:%M UTC", &utc) == 0)
    return "an unknown date";
  return text;
}

// Remembers that `plan.version` failed with `code` and `message`, so that
// the next run waits for a newer version; a failure of the appliance's
// rather than the version's is not remembered.
void RememberFailure(const AutoUpdatePlan& plan, int code, const std::string& message) {
  if (!SaysTheVersionFailed(code)) return;
  AutoUpdateFailure failure;
  failure.version = plan.version;
  failure.time = time(nullptr);
  failure.code = code;
  failure.reason = KIVOPackageServer::FailureReasonLine(message);
  if (failure.reason.empty()) failure.reason = PMSResultText(code);
  // What is published now is what the failure holds for; nothing published
  // means the package is gone, and there is nothing left to hold back.
  failure.record = PackageRegistry::PublishedRecord(plan.id);
  if (failure.record.empty()) return;
  if (!KIVOPackageServer::RecordFailure(plan.id, failure)) {
    Report(plan.id + ": the failure of " + plan.version +
               " cannot be recorded; the next run tries it again",
           true);
  }
}

// `plan`, turned into a skip when it would upgrade to a version that is
// not newer than one that failed before.
AutoUpdatePlan HoldBackFailed(AutoUpdatePlan plan) {
  if (plan.action != AutoUpdatePlan::Action::kUpgrade) return plan;
  const KIVOPackageServer::AutoUpdateFailures failures = KIVOPackageServer::ReadFailures();
  const auto failed = failures.find(plan.id);
  if (failed == failures.end() || PMSCompareVersion(plan.version, failed->second.version) > 0)
    return plan;
  const AutoUpdateFailure& f = failed->second;
  // Only 305 says the previous version was put back whole; any other
  // failure is told in the package tool's own words.
  plan.action = AutoUpdatePlan::Action::kSkip;
  plan.reason = f.version + " failed on " + DateText(f.time) +
                (f.code == PKG_ERR_UPGRADE_ROLLED_BACK ? " and was restored" : "") + " (" +
                f.reason + "); waiting for a newer version";
  return plan;
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
  if (!KivoctlDownloadAndInstall(plan.id, plan.entry, run, "", PMSOriginChange::kRefuse, message,
                                 code)) {
    Report(plan.id + ": failed " + step + ": " + message +
               (code ? " [" + std::to_string(code) + "]" : ""),
           true);
    RememberFailure(plan, code, message);
    return false;
  }
  Report(plan.id + ": upgraded " + step, false);
  // The entry no longer holds once another record is published; this only
  // keeps the file tidy.
  if (!KIVOPackageServer::ForgetFailure(plan.id))
    syslog(LOG_WARNING, "%s: the record of its failed version cannot be cleared", plan.id.c_str());
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
  // Failures of packages since uninstalled (or installed afresh) are gone
  // from the record before anything else; a dry run writes nothing.
  if (!dry_run && !KIVOPackageServer::DropFailuresThatNoLongerHold())
    syslog(LOG_WARNING, "the record of failed versions cannot be tidied");
  if (chosen.empty()) return 0;
  std::vector<CatalogueOffer> offers;
  bool ok = ReadCatalogues(offers);
  const bool beta = InfoIs("package_update_channel", "beta");
  for (const auto& [id, version] : chosen) {
    const AutoUpdatePlan plan =
        HoldBackFailed(PlanAutoUpdate(id, version, PMSInstalledOrigin(id), offers, beta));
    ok = Apply(manager, plan, dry_run) && ok;
  }
  return ok ? 0 : 1;
}
