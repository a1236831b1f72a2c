// What the watchdog (`kivoctl watchdog`, tools/kivoctl/watchdog.h) keeps in
// a package's record, its settings, and the rule by which it restarts a
// package whose service died or gives up on it. Two record files, next to
// the "enabled" marker (registry.h), neither of which a package file can
// hold (its members are an allow-list):
//
//   restarts   JSON {"restarts": [{"time": ms, "result": code}, ...]}: the
//              watchdog's restarts within the last hour, oldest first, with
//              the package tool's result of each start (0 when it started)
//   crashed    JSON {"time": ms, "restarts": N, "reason": words, "log":
//              the last lines of the package's own log}: the watchdog gave up
//
// Both are written atomically by the watchdog under the tool's lock, and
// removed by a start that the administrator asks for (PackageManager::
// serviceControl), which gives the package a fresh count. An upgrade's new
// record starts without them.
#pragma once

#include <string>
#include <vector>

#include <json/value.h>

// The watchdog's settings, from the root's "etc/kivo/watchdog.conf"
// (key/value). Every key is optional; the defaults are below.
struct WatchdogSettings {
  int interval_seconds = 30;       // between two checks (1 to 3600)
  int max_restarts = 5;            // restarts within an hour before giving up (1 to 20)
  int restart_delay_seconds = 10;  // before the second restart, doubling after (1 to 3600)
};

// "<root>/etc/kivo/watchdog.conf".
std::string PMSWatchdogSettingsPath();

// Reads the settings file whole: every key must be one of the settings
// above and hold a whole number within its bounds, and the delays before
// `max_restarts` restarts plus one check interval each must fit in an hour
// (else the watchdog could never count that many restarts within one). A
// missing file gives the defaults. False, with `*problem` saying what is
// wrong in words and `*out` unchanged, when the file breaks a rule or
// cannot be read.
[[nodiscard]] bool PMSLoadWatchdogSettings(WatchdogSettings* out, std::string* problem);

// One restart by the watchdog.
struct WatchdogRestart {
  long long time_ms = 0;
  int result = 0;  // the package tool's result of the start; 0 when it started
};

// The watchdog's mark on a package it gave up on.
struct CrashedMark {
  long long time_ms = 0;
  int restarts = 0;
  std::string reason;
  std::string log;
};

// The restarts of the record at `record` (a record folder, or the
// published name var/packages/<id>) within the hour before `now_ms`, oldest
// first; none when there are none or the file cannot be read.
std::vector<WatchdogRestart> PMSReadRestarts(const std::string& record, long long now_ms);
// Replaces the record's restarts (only those within the hour before
// `now_ms` are kept). False when it cannot be written.
[[nodiscard]] bool PMSWriteRestarts(const std::string& record,
                                    const std::vector<WatchdogRestart>& restarts, long long now_ms);

// Reads the record's crashed mark; false when it has none (or an unreadable
// one: a mark is only ever written whole).
bool PMSReadCrashed(const std::string& record, CrashedMark* mark);
[[nodiscard]] bool PMSWriteCrashed(const std::string& record, const CrashedMark& mark);
// Removes both files: the administrator started the package. False when one
// stays.
[[nodiscard]] bool PMSClearWatchdogMarks(const std::string& record);

// What the watchdog does with a package meant to run whose service is dead.
enum class WatchdogDecision {
  kStart,   // start it now
  kWait,    // its growing delay has not passed yet
  kGiveUp,  // max_restarts within the hour did not keep it running
};

// The rule: with no restart within the hour the package is started at
// once; after k restarts it waits restart_delay_seconds * 2^(k-1) from the
// last one; after max_restarts it is given up. `restarts` are those within
// the hour before `now_ms`. `*due_ms` gets when a waiting package is due.
WatchdogDecision PMSWatchdogDecide(const std::vector<WatchdogRestart>& restarts,
                                   const WatchdogSettings& settings, long long now_ms,
                                   long long* due_ms);

// Why the watchdog gave up, in words, from the restarts it made.
std::string PMSGiveUpReason(const std::vector<WatchdogRestart>& restarts);

// What the page shows of a package: {"id", "restarts_last_hour", "crashed":
// null or {"time", "restarts", "reason", "log"}} from the published record of
// `id`, as of `now_ms`.
Json::Value PMSWatchdogView(const std::string& id, long long now_ms);

// The milliseconds since the epoch.
long long PMSNowMs();
