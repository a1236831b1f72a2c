#include "tools/kivoctl/auto_update.h"

#include <chrono>
#include <ctime>
#include <iostream>
#include <map>
#include <random>
#include <syslog.h>
#include <thread>

#include "activity/activity_log.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/auto_update.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/server_config.h"
#include "pkgserver/update_holds.h"
#include "pkgserver/update_last_run.h"
#include "pkgserver/update_window.h"
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
using KIVOPackageServer::PackageOutcome;
using KIVOPackageServer::UpdateRun;
using KIVOPackageServer::UpdateWindow;
using KIVOPackageServer::WindowState;

constexpr char kNoNewerVersion[] = "no newer version offered";
constexpr char kNotChosen[] = "not chosen for automatic update";

// What one run works with: its clock (the real one, or the one --now
// gives), the seed of its random delay, and what it records.
struct RunContext {
  bool dry_run = false;
  int64_t now = 0;        // the run's start by its clock
  time_t real_start = 0;  // the same instant by the real clock
  bool seeded = false;
  uint64_t seed = 0;
  UpdateRun record;  // each package's outcome, written when the run ends
};

// The run's clock now: the given start plus the real time since.
int64_t ClockNow(const RunContext& run) {
  return run.now + static_cast<int64_t>(time(nullptr) - run.real_start);
}

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

// Records `outcome` for the plan's package, with the run's line for it.
void Note(RunContext& run, const AutoUpdatePlan& plan, const char* outcome,
          const std::string& words) {
  run.record.packages[plan.id] = {
      outcome, plan.installed, plan.action == AutoUpdatePlan::Action::kUpgrade ? plan.version : "",
      KIVOPackageServer::FailureReasonLine(words)};
}

// The activity log's entry of one upgrade the run makes: begun before the
// download, so that a run killed half way leaves it unfinished.
class UpgradeRecord {
 public:
  explicit UpgradeRecord(const AutoUpdatePlan& plan) {
    KivoActivity::Operation op;
    op.name = "Installation.install";
    op.target["id"] = plan.id;
    op.target["from_version"] = plan.installed;
    op.target["version"] = plan.version;
    op.packages = {plan.id};
    id_ = log_.Begin({KivoActivity::kOriginAutoUpdate, KivoActivity::kOriginAutoUpdate, ""}, op);
  }
  // `code` is the package tool's result, or 1 for a failure before it ran.
  void Finish(bool ok, int code, const std::string& words) {
    // A failure to record is in syslog already; the upgrade's outcome stands.
    static_cast<void>(log_.Finish(id_, {ok ? 0 : (code ? code : 1), words}));
  }

 private:
  KivoActivity::ActivityLog log_;
  long long id_ = 0;
};

// Tells and notes that the plan's package is skipped, as `outcome`.
void Skip(const AutoUpdatePlan& plan, const char* outcome, RunContext& run) {
  const std::string line = "skipped: " + plan.reason;
  Report(plan.id + ": " + line, false);
  Note(run, plan, outcome, line);
}

// Carries out one plan (or says what it would do); false when it failed.
// A skip is noted as `skip_outcome`.
bool Apply(PackageManager& manager, const AutoUpdatePlan& plan, const char* skip_outcome,
           RunContext& run) {
  if (plan.action == AutoUpdatePlan::Action::kSkip) {
    Skip(plan, skip_outcome, run);
    return true;
  }
  const std::string step = plan.installed + " -> " + plan.version;
  if (run.dry_run) {
    Report(plan.id + ": would upgrade " + step + " from " + plan.entry["link"].asString(), false);
    return true;
  }
  const bool running = (manager.getPkgRoughStatus(plan.id) & 2) != 0;
  std::string message;
  int code = 0;
  UpgradeRecord record(plan);
  if (!KivoctlDownloadAndInstall(plan.id, plan.entry, running, "", PMSInstallChoices(), message,
                                 code)) {
    const std::string line =
        "failed " + step + ": " + message + (code ? " [" + std::to_string(code) + "]" : "");
    Report(plan.id + ": " + line, true);
    record.Finish(false, code, message);
    Note(run, plan, KIVOPackageServer::kOutcomeFailed, line);
    RememberFailure(plan, code, message);
    return false;
  }
  Report(plan.id + ": upgraded " + step, false);
  record.Finish(true, 0, "upgraded " + step);
  Note(run, plan, KIVOPackageServer::kOutcomeUpgraded, "upgraded " + step);
  // The entry no longer holds once another record is published; this only
  // keeps the file tidy.
  if (!KIVOPackageServer::ForgetFailure(plan.id))
    syslog(LOG_WARNING, "%s: the record of its failed version cannot be cleared", plan.id.c_str());
  return true;
}

// The installed packages the settings choose, with their versions; the
// others are reported as skipped. False when the chosen list cannot be read.
bool ChosenPackages(PackageManager& manager, Mode mode, std::map<std::string, std::string>& out,
                    RunContext& run) {
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
      Report(id + ": skipped: " + kNotChosen, false);
      AutoUpdatePlan plan;
      plan.id = id;
      plan.installed = info.getVersion();
      Note(run, plan, KIVOPackageServer::kOutcomeNotChosen, std::string("skipped: ") + kNotChosen);
    }
  }
  return true;
}

// Reads the options; false (with the usage error told) on a bad one.
bool ReadOptions(const std::vector<std::string>& args, RunContext& run) {
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& a = args[i];
    const bool has_value = i + 1 < args.size();
    if (a == "--dry-run") {
      run.dry_run = true;
    } else if (a == "--now" && has_value) {
      if (!KIVOPackageServer::ParseLocalTime(args[++i], &run.now)) {
        std::cerr << "kivoctl: --now takes a local time as YYYY-MM-DDTHH:MM\n";
        return false;
      }
    } else if (a == "--seed" && has_value) {
      const std::string& v = args[++i];
      if (v.empty() || v.size() > 19 || v.find_first_not_of("0123456789") != std::string::npos) {
        std::cerr << "kivoctl: --seed takes a whole number\n";
        return false;
      }
      run.seeded = true;
      run.seed = std::stoull(v);
    } else {
      std::cerr << "kivoctl: unknown option for auto-update: " << a << "\n";
      return false;
    }
  }
  return true;
}

// "mon,thu 02:00-05:00".
std::string WindowText(const UpdateWindow& window) {
  const Json::Value w = KIVOPackageServer::UpdateWindowJson(window);
  std::string days;
  for (const Json::Value& d : w["days"]) days += (days.empty() ? "" : ",") + d.asString();
  return days + " " + w["start"].asString() + "-" + w["end"].asString();
}

// Why a run at this moment upgrades nothing, in one line.
std::string WhyNotNow(const UpdateWindow& window, const WindowState& state, int64_t last_run) {
  std::string line = state.already_ran
                         ? "already ran in this opening of the maintenance window (" +
                               WindowText(window) + ", at " +
                               KIVOPackageServer::LocalTimeText(last_run) + ")"
                         : "outside the maintenance window (" + WindowText(window) + ")";
  if (state.has_next)
    line += "; it opens next at " + KIVOPackageServer::LocalTimeText(state.next.opens);
  return line;
}

// Tells each chosen package's skip when the window is shut: held ones as
// held, the others as waiting for the window.
void SkipAll(const std::map<std::string, std::string>& chosen,
             const KIVOPackageServer::UpdateHolds& holds, const std::string& why,
             const RunContext& run) {
  for (const auto& [id, version] : chosen) {
    auto held = holds.find(id);
    if (held != holds.end() && KIVOPackageServer::HoldHolds(held->second, run.now)) {
      Report(id + ": skipped: held " + KIVOPackageServer::HoldText(held->second), false);
    } else {
      Report(id + ": skipped: " + why, false);
    }
  }
}

// Takes the held packages out of `chosen`, each reported and noted.
void SkipHeld(std::map<std::string, std::string>& chosen,
              const KIVOPackageServer::UpdateHolds& holds, RunContext& run) {
  for (auto it = chosen.begin(); it != chosen.end();) {
    auto held = holds.find(it->first);
    if (held == holds.end() || !KIVOPackageServer::HoldHolds(held->second, run.now)) {
      ++it;
      continue;
    }
    AutoUpdatePlan plan;
    plan.id = it->first;
    plan.installed = it->second;
    plan.reason = "held " + KIVOPackageServer::HoldText(held->second);
    Skip(plan, KIVOPackageServer::kOutcomeHeld, run);
    it = chosen.erase(it);
  }
}

// Waits the random delay, or says it would.
void WaitRandomDelay(const UpdateWindow& window, const WindowState& state, RunContext& run) {
  const uint64_t seed =
      run.seeded ? run.seed
                 : (static_cast<uint64_t>(std::random_device()()) << 32) ^ std::random_device()();
  const int64_t delay = KIVOPackageServer::RandomDelaySeconds(window, state, run.now, seed);
  if (delay <= 0) return;
  const std::string until = KIVOPackageServer::LocalTimeText(run.now + delay);
  if (run.dry_run) {
    Report("would wait " + std::to_string(delay) + " s (the random delay, until " + until +
               ") before asking the package servers",
           false);
    return;
  }
  Report("waiting " + std::to_string(delay) + " s (the random delay, until " + until +
             ") before asking the package servers",
         false);
  std::this_thread::sleep_for(std::chrono::seconds(delay));
}

// The outcome a skip of PlanAutoUpdate's (`planned`) turned into `plan` by
// HoldBackFailed has.
const char* SkipOutcome(const AutoUpdatePlan& planned, const AutoUpdatePlan& plan) {
  if (planned.action == AutoUpdatePlan::Action::kUpgrade)
    return KIVOPackageServer::kOutcomeFailedBefore;
  return plan.reason == kNoNewerVersion ? KIVOPackageServer::kOutcomeUpToDate
                                        : KIVOPackageServer::kOutcomeSkipped;
}

// Upgrades what the catalogues offer for `chosen`; false when anything
// failed.
bool UpgradeChosen(PackageManager& manager, const std::map<std::string, std::string>& chosen,
                   RunContext& run) {
  std::vector<CatalogueOffer> offers;
  bool ok = ReadCatalogues(offers);
  const bool beta = InfoIs("package_update_channel", "beta");
  for (const auto& [id, version] : chosen) {
    const AutoUpdatePlan planned =
        PlanAutoUpdate(id, version, PMSInstalledOrigin(id), offers, beta);
    const AutoUpdatePlan plan = HoldBackFailed(planned);
    ok = Apply(manager, plan, SkipOutcome(planned, plan), run) && ok;
  }
  return ok;
}

// Writes the run's record (not for a dry run).
void RecordRun(RunContext& run, int exit_status) {
  if (run.dry_run) return;
  run.record.ended = std::max(ClockNow(run), run.record.started);
  run.record.exit_status = exit_status;
  if (!KIVOPackageServer::WriteLastRun(run.record))
    Report("the record of this run cannot be written", true);
}

}  // namespace

AutoUpdatePlan PlanAutoUpdate(const std::string& id, const std::string& installed,
                              const PMSPackageOrigin& origin,
                              const std::vector<CatalogueOffer>& offers, bool beta) {
  AutoUpdatePlan plan;
  plan.id = id;
  plan.installed = installed;
  plan.reason = kNoNewerVersion;
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
  RunContext run;
  run.real_start = time(nullptr);
  run.now = static_cast<int64_t>(run.real_start);
  if (!ReadOptions(args, run)) return 2;
  openlog("kivoctl-auto-update", LOG_PID, LOG_USER);
  const Mode mode = KIVOPackageServer::ReadMode();
  if (mode == Mode::kOff) {
    Report("automatic update is off", false);
    return 0;
  }
  // A window or holds that cannot be read are no licence to upgrade at any
  // time or to upgrade a held package: the run does nothing.
  UpdateWindow window;
  KIVOPackageServer::WindowError bad;
  if (!KIVOPackageServer::LoadUpdateWindow(&window, &bad)) {
    Report("the maintenance window of " + KIVOPackageServer::UpdateWindowPath() +
               " is not valid (" + bad.key + ": " + bad.reason + "); nothing is upgraded",
           true);
    return 1;
  }
  KIVOPackageServer::UpdateHolds holds;
  if (!KIVOPackageServer::ReadHolds(&holds)) {
    Report("the holds of automatic updates cannot be read; nothing is upgraded", true);
    return 1;
  }
  UpdateRun last;
  bool ran_before = false;
  if (!KIVOPackageServer::ReadLastRun(&last, &ran_before))
    syslog(LOG_WARNING, "the record of the last automatic update cannot be read");
  const WindowState state =
      KIVOPackageServer::WindowStateAt(window, run.now, ran_before ? last.started : 0);
  PackageManager manager;
  std::map<std::string, std::string> chosen;
  if (!manager.init() || !ChosenPackages(manager, mode, chosen, run)) return 1;
  if (!state.inside || state.already_ran) {
    const std::string why = WhyNotNow(window, state, last.started);
    Report(why, false);
    SkipAll(chosen, holds, why, run);
    return 0;
  }
  WaitRandomDelay(window, state, run);
  run.record.started = run.now;
  SkipHeld(chosen, holds, run);
  // Failures of packages since uninstalled (or installed afresh) are gone
  // from the record before anything else; a dry run writes nothing.
  if (!run.dry_run && !KIVOPackageServer::DropFailuresThatNoLongerHold())
    syslog(LOG_WARNING, "the record of failed versions cannot be tidied");
  const bool ok = chosen.empty() || UpgradeChosen(manager, chosen, run);
  RecordRun(run, ok ? 0 : 1);
  return ok ? 0 : 1;
}
