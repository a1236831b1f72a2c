#include "tools/kivoctl/watchdog.h"

#include <csignal>
#include <ctime>
#include <iostream>
#include <unistd.h>

#include "activity/activity_log.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/registry.h"
#include "pkgtool/watchdog_record.h"

namespace {

namespace Activity = KivoActivity;

bool HasMember(const std::string& record, const char* name) {
  return access((record + "/" + name).c_str(), F_OK) == 0;
}

// A package the watchdog looks after: meant to run, not given up on, with
// a service. `info` gets its record.
bool IsLookedAfter(const std::string& id, PackageInfo* info) {
  const std::string record = PackageRegistry::RecordDir(id);
  return HasMember(record, "enabled") && !HasMember(record, "crashed") &&
         PMSLoadInstalled(id, info) && info->isStartable();
}

Activity::Operation EntryFor(const char* name, const std::string& id, const PackageInfo& info) {
  Activity::Operation op;
  op.name = name;
  op.target["id"] = id;
  op.target["version"] = info.getVersion();
  op.packages.push_back(id);
  return op;
}

// Holds the tool's lock that lockAndLoadNow took until the scope ends.
class LockHold {
 public:
  explicit LockHold(PackageManager* pm) : pm_(pm) {}
  ~LockHold() { pm_->UnLock(); }
  LockHold(const LockHold&) = delete;
  LockHold& operator=(const LockHold&) = delete;

 private:
  PackageManager* pm_;
};

class Watchdog {
 public:
  explicit Watchdog(const WatchdogSettings& settings) : settings_(settings) {}

  // One check of every installed package.
  void CheckAll() {
    for (const std::string& id : PackageRegistry::List()) Check(id);
  }

  // Reads the settings file again; a file that breaks a rule keeps the
  // settings in force and is reported once until it changes.
  void Reload() {
    std::string problem;
    if (PMSLoadWatchdogSettings(&settings_, &problem)) {
      reported_.clear();
    } else if (problem != reported_) {
      std::cerr << "kivoctl watchdog: " << problem << "; the settings in force stay\n";
      reported_ = problem;
    }
  }

  int interval_seconds() const { return settings_.interval_seconds; }

 private:
  // Looks at one package: the look without the lock decides cheaply that a
  // running package needs nothing (no process for one with a pid file);
  // what the watchdog does is decided again under the lock.
  void Check(const std::string& id) {
    PackageInfo info;
    if (!IsLookedAfter(id, &info) || PMSIsRunning(id, info)) return;
    PackageManager pm;
    const int loaded = pm.lockAndLoadNow(id, &info);
    LockHold hold(&pm);
    if (loaded == PKG_ERR_BUSY) {
      Say("skipped " + id + ": another package operation is under way; next check");
      return;
    }
    // Read again under the lock: stopped, uninstalled, restarted or given up
    // on since the first look.
    if (loaded != PKG_OK || !IsLookedAfter(id, &info) || PMSIsRunning(id, info)) return;
    const std::string record = PackageRegistry::RecordDir(id);
    const long long now = PMSNowMs();
    std::vector<WatchdogRestart> restarts = PMSReadRestarts(record, now);
    long long due = 0;
    switch (PMSWatchdogDecide(restarts, settings_, now, &due)) {
      case WatchdogDecision::kWait:
        return;
      case WatchdogDecision::kGiveUp:
        return GiveUp(id, info, record, restarts, now);
      case WatchdogDecision::kStart:
        return Restart(&pm, id, info, record, &restarts, now);
    }
  }

  void Restart(PackageManager* pm, const std::string& id, const PackageInfo& info,
               const std::string& record, std::vector<WatchdogRestart>* restarts, long long now) {
    const long long entry = log_.Begin(Actor(), EntryFor("restart", id, info));
    const bool ok = pm->startLocked(id, info);
    const int result = pm->getResult();
    // The operation log is the tool's; the watchdog keeps only the outcome.
    if (!pm->getLogFilePath().empty()) unlink(pm->getLogFilePath().c_str());
    restarts->push_back({now, ok ? PKG_OK : result});
    const std::string count = std::to_string(restarts->size()) + " in the last hour";
    if (!PMSWriteRestarts(record, *restarts, now)) {
      Say("cannot record the restart of " + id + " in " + record);
    }
    const std::string words =
        ok ? "restarted (" + count + ")"
           : std::string("did not start: ") + PMSResultText(result) + " (" + count + ")";
    // A failure to record is in syslog already; the restart stands.
    static_cast<void>(log_.Finish(entry, {ok ? 0 : result, words}));
    Say(ok ? "restarted " + id + " (" + count + ")"
           : id + " " + words + " [" + std::to_string(result) + "]");
  }

  void GiveUp(const std::string& id, const PackageInfo& info, const std::string& record,
              const std::vector<WatchdogRestart>& restarts, long long now) {
    CrashedMark mark;
    mark.time_ms = now;
    mark.restarts = static_cast<int>(restarts.size());
    mark.reason = PMSGiveUpReason(restarts);
    mark.log = PMSPackageLogTail(id, 10);
    const std::string words =
        "stopped trying after " + std::to_string(mark.restarts) + " restarts: " + mark.reason;
    if (!PMSWriteCrashed(record, mark)) {
      // Without the mark the next check gives up again, and says so again.
      Say("cannot mark " + id + " crashed in " + record);
      return;
    }
    static_cast<void>(
        log_.Record(Actor(), EntryFor("give-up", id, info), {PKG_ERR_CRASHED, words}));
    Say("gave up on " + id + ": " + words);
  }

  static Activity::Actor Actor() { return {"watchdog", Activity::kOriginWatchdog, ""}; }

  static void Say(const std::string& line) { std::cout << line << std::endl; }

  WatchdogSettings settings_;
  std::string reported_;
  Activity::ActivityLog log_;
};

// Waits `seconds` for SIGTERM, SIGINT or SIGHUP (blocked in `signals`).
// False when the watchdog is to end.
bool WaitForNextCheck(const sigset_t& signals, int seconds) {
  struct timespec wait = {seconds, 0};
  int signal = sigtimedwait(&signals, nullptr, &wait);
  return signal != SIGTERM && signal != SIGINT;
}

}  // namespace

int KivoctlWatchdog(const std::vector<std::string>& args) {
  bool once = false;
  for (const std::string& a : args) {
    if (a != "--once") {
      std::cerr << "kivoctl: usage: kivoctl watchdog [--once]\n";
      return 2;
    }
    once = true;
  }
  WatchdogSettings settings;
  std::string problem;
  if (!PMSLoadWatchdogSettings(&settings, &problem)) {
    std::cerr << "kivoctl: " << problem << " [" << PKG_ERR_WATCHDOG_SETTINGS << "]\n";
    return 1;
  }
  PackageManager pm;
  if (!pm.init()) {
    std::cerr << "kivoctl: the package registry cannot be read [" << pm.getResult() << "]\n";
    return 1;
  }
  // The signals that end the watchdog or wake it are taken between checks
  // only, so a check under way (a start under the lock) is never cut short.
  sigset_t signals;
  sigemptyset(&signals);
  for (int s : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&signals, s);
  sigprocmask(SIG_BLOCK, &signals, nullptr);
  Watchdog watchdog(settings);
  for (;;) {
    watchdog.CheckAll();
    if (once || !WaitForNextCheck(signals, watchdog.interval_seconds())) return 0;
    watchdog.Reload();
  }
}
