// The health gate an upgrade passes before it counts as done: the new
// version, started because the old one ran or the caller asked, must report
// running (package_state.h) within a grace period, and then pass its own
// health check when it has one: `scripts/health`, run with the upgrade's
// environment, exit status 0 meaning healthy.
//
// Limits: "health_grace_seconds" (30 by default, 1 to 600) and
// "health_check_timeout_seconds" (10 by default, 1 to 300) of
// /etc/kivo/pkgtool.conf; a package's INFO may set either key for itself
// within the same bounds. A setting outside them is ignored; an INFO value
// outside them makes the package file unacceptable (PMSHealthInfoProblem).
#pragma once

#include <map>
#include <string>

#include "klibc/key_value_file.h"
#include "pkgtool/operation.h"
#include "pkgtool/package_info.h"

struct HealthLimits {
  int grace_seconds = 30;
  int check_seconds = 10;
};

// The limits for `info`: its INFO keys, else the tool's settings, else the
// defaults.
HealthLimits PMSHealthLimits(const PackageInfo& info);

// "" when INFO's health keys are absent or in bounds; else what is wrong,
// as "<key>: ..." (PMSCheckInfo's form).
std::string PMSHealthInfoProblem(const KeyValueMap& info);

enum class HealthVerdict {
  kHealthy,
  kNotRunning,     // it did not report running within the grace period
  kCheckFailed,    // its health check exited with another status than 0
  kCheckTimedOut,  // its health check did not end in time and was killed
};

// Waits until the published package `id` reports running or the grace
// period ends, then runs `record`/scripts/health with `env`, when it has
// one. The check's output goes to `op`'s log, only its last 16 KiB however
// much it writes.
[[nodiscard]] HealthVerdict PMSHealthGate(const std::string& id, const PackageInfo& info,
                                          const std::string& record,
                                          const std::map<std::string, std::string>& env,
                                          const Operation& op);

// What a failed gate says of the new version, for the administrator: "did
// not start within 30 s", "failed its health check", ...
std::string PMSHealthVerdictText(HealthVerdict verdict, const HealthLimits& limits);
