// kivoctl auto-update: applies the package center's automatic-update
// settings, as the appliance's scheduler runs it (a systemd timer or a cron
// line, see README.md).
//
// The settings say off, all installed packages, or the chosen list
// (KIVOPackageServer::ReadMode, which the web API reads them with too, and
// KIVOPackageServer::List). For each chosen installed package the newest
// entry of the catalogue it came from (the vendor's or its feed's, never
// another's: package_origin.h) that is newer than the installed version is
// taken, unless the update channel is "stable" and the entry is a beta, or
// the restriction list refuses it. Each is downloaded
// with the catalogue's checksums and upgraded by the package tool under its
// lock, one package at a time, with the trust level and signature checks of
// any install; a package that ran before runs again afterwards. A failed
// upgrade leaves the old version in place (the package tool's guarantee),
// and the version that failed is recorded (KIVOPackageServer::RecordFailure)
// and skipped by later runs until a newer one is offered.
//
// A run upgrades only inside the maintenance window (pkgserver/
// update_window.h), once per opening of it and after its random delay, and
// never a held package (pkgserver/update_holds.h). A run that goes ahead
// records each package's outcome (pkgserver/update_last_run.h), and each
// upgrade it makes is an entry of origin "auto-update" in the activity log.
#pragma once

#include <string>
#include <vector>

#include <json/value.h>

#include "pkgtool/package_origin.h"

// What happens to one installed package.
struct AutoUpdatePlan {
  enum class Action { kUpgrade, kSkip };
  Action action = Action::kSkip;
  std::string id;
  std::string installed;  // installed version
  std::string version;    // the version to upgrade to (kUpgrade)
  std::string reason;     // why it is skipped (kSkip)
  Json::Value entry;      // the catalogue entry to upgrade to (kUpgrade)
};

// One catalogue entry, with the source that offers it.
struct CatalogueOffer {
  PMSPackageOrigin source;
  Json::Value entry;
};

// The plan for package `id` at version `installed`, which came from
// `origin`, against the entries of every catalogue (vendor and feeds
// together). Only entries of `origin` are taken; a newer version that only
// other sources offer is skipped, and the reason names who offers it.
// `beta` is true on the "beta" update channel. Restricted versions
// (PMSThirdPartyCheckLimit) are never taken.
AutoUpdatePlan PlanAutoUpdate(const std::string& id, const std::string& installed,
                              const PMSPackageOrigin& origin,
                              const std::vector<CatalogueOffer>& offers, bool beta);

// `kivoctl auto-update [--dry-run] [--now YYYY-MM-DDTHH:MM] [--seed N]`: one
// line per installed package on stdout, each outcome also to syslog. --now
// runs by that local time instead of the clock's, and --seed fixes the
// random delay, so that what a run would do at any moment can be seen (and
// tested) without waiting for it. Exit status 0 when nothing failed (a
// version held back because it failed before, a held package and a window
// that is shut are skips), 1 when an upgrade or the catalogue failed or the
// window or the holds cannot be read, 2 on a usage error. --dry-run writes
// nothing.
int KivoctlAutoUpdate(const std::vector<std::string>& args);
