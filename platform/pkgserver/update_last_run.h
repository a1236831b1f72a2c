// The record of the last run of `kivoctl auto-update` that went ahead (a
// run outside the maintenance window, one that already ran in it and a dry
// run leave it as it was): when it started and ended, its exit status, and
// each package's outcome. The page shows it; the window (update_window.h)
// reads its start to run once per opening.
//
// It lives in the root's "usr/kivo/etc/packages/autoupdate-last-run.json",
// replaced atomically by each such run:
//
//   {"started": 1714960800, "ended": 1714960860, "exit_status": 0,
//    "packages": {"demo-web": {"outcome": "upgraded", "from": "1.0",
//                              "to": "1.1", "words": "upgraded 1.0 -> 1.1"}}}
//
// It is checked whole when read; a file that fails a check reads as no run.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include <json/value.h>

namespace KIVOPackageServer {

// A package's outcome in one run.
inline constexpr char kOutcomeUpgraded[] = "upgraded";
inline constexpr char kOutcomeFailed[] = "failed";
inline constexpr char kOutcomeHeld[] = "held";
inline constexpr char kOutcomeFailedBefore[] = "failed-before";  // waits for a newer version
inline constexpr char kOutcomeUpToDate[] = "up-to-date";
inline constexpr char kOutcomeNotChosen[] = "not-chosen";
inline constexpr char kOutcomeSkipped[] = "skipped";  // any other reason, told in words

struct PackageOutcome {
  std::string outcome;  // one of the above
  std::string from;     // the installed version before the run
  std::string to;       // the version upgraded (or tried) to, else ""
  std::string words;    // the run's line for the package, one line
};

struct UpdateRun {
  int64_t started = 0;
  int64_t ended = 0;
  int exit_status = 0;
  std::map<std::string, PackageOutcome> packages;
};

// The last run; *found is false when none is on record (or the record fails
// a check, which is logged). False only when the file cannot be read.
[[nodiscard]] bool ReadLastRun(UpdateRun* out, bool* found);

// Replaces the record with `run`. False (the last error set) when it cannot
// be written or breaks a rule.
[[nodiscard]] bool WriteLastRun(const UpdateRun& run);

// The record as the web API answers it (the file's form).
Json::Value UpdateRunJson(const UpdateRun& run);

}  // namespace KIVOPackageServer
