#include "pkgtool/health_gate.h"

#include <cstdlib>
#include <ctime>
#include <unistd.h>

#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/script_runner.h"

namespace {

struct Bound {
  const char* key;
  int def;
  int max;
};
constexpr Bound kGrace = {"health_grace_seconds", 30, 600};
constexpr Bound kCheck = {"health_check_timeout_seconds", 10, 300};
// The output of a health check kept for the log: enough to see why it
// failed, never enough to fill the disk.
constexpr size_t kKeptOutput = 16 << 10;

// A whole number of seconds from 1 to `max`, written as plain digits; -1
// when `text` is anything else.
int Seconds(const std::string& text, int max) {
  if (text.empty() || text.size() > 4 || text.find_first_not_of("0123456789") != std::string::npos)
    return -1;
  int value = std::atoi(text.c_str());
  return value >= 1 && value <= max ? value : -1;
}

int Limit(const PackageInfo& info, const Bound& bound) {
  int own = Seconds(info.get(bound.key), bound.max);
  if (own > 0) return own;
  int setting = PMSToolSetting(bound.key, bound.def, 1);
  return setting <= bound.max ? setting : bound.def;
}

double Now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

// Asks whether the package runs, more slowly as time goes on, until it does
// or `seconds` have passed.
bool WaitRunning(const std::string& id, const PackageInfo& info, int seconds) {
  const double deadline = Now() + seconds;
  useconds_t delay = 50000;
  while (!PMSIsRunning(id, info)) {
    double left = deadline - Now();
    if (left <= 0) return false;
    usleep(left * 1e6 < delay ? static_cast<useconds_t>(left * 1e6) : delay);
    if (delay < 500000) delay *= 2;
  }
  return true;
}

void LogOutput(const ScriptOutput& out, const Operation& op) {
  if (out.tail.empty()) return;
  if (out.total > out.tail.size()) {
    op.Log("the health check wrote " + std::to_string(out.total) + " bytes; its last " +
           std::to_string(out.tail.size()) + ":");
  }
  op.Log(out.tail.back() == '\n' ? out.tail.substr(0, out.tail.size() - 1) : out.tail);
}

HealthVerdict JudgeCheck(const ScriptOutput& out, const HealthLimits& limits, const Operation& op) {
  if (out.status == SCRIPT_MISSING) return HealthVerdict::kHealthy;
  LogOutput(out, op);
  if (out.status == 0) {
    op.Log("the health check passed");
    return HealthVerdict::kHealthy;
  }
  if (out.status == SCRIPT_TIMED_OUT) {
    op.Log("the health check did not end within " + std::to_string(limits.check_seconds) +
           " seconds and was killed");
    return HealthVerdict::kCheckTimedOut;
  }
  op.Log(out.status == SCRIPT_NOT_RUN
             ? std::string("the health check could not be run")
             : "the health check failed with status " + std::to_string(out.status));
  return HealthVerdict::kCheckFailed;
}

}  // namespace

HealthLimits PMSHealthLimits(const PackageInfo& info) {
  HealthLimits limits;
  limits.grace_seconds = Limit(info, kGrace);
  limits.check_seconds = Limit(info, kCheck);
  return limits;
}

std::string PMSHealthInfoProblem(const KeyValueMap& info) {
  for (const Bound& bound : {kGrace, kCheck}) {
    auto it = info.find(bound.key);
    if (it != info.end() && Seconds(it->second, bound.max) < 0) {
      return std::string(bound.key) + ": must be a whole number of seconds from 1 to " +
             std::to_string(bound.max);
    }
  }
  return "";
}

HealthVerdict PMSHealthGate(const std::string& id, const PackageInfo& info,
                            const std::string& record,
                            const std::map<std::string, std::string>& env, const Operation& op) {
  const HealthLimits limits = PMSHealthLimits(info);
  // A package without a service of its own has nothing to report running.
  if (info.isStartable() && !WaitRunning(id, info, limits.grace_seconds)) {
    op.Log(id + " did not report running within " + std::to_string(limits.grace_seconds) +
           " seconds");
    return HealthVerdict::kNotRunning;
  }
  return JudgeCheck(
      PMSRunScriptCaptured(record + "/scripts/health", "", env, limits.check_seconds, kKeptOutput),
      limits, op);
}

std::string PMSHealthVerdictText(HealthVerdict verdict, const HealthLimits& limits) {
  switch (verdict) {
    case HealthVerdict::kHealthy:
      return "passed its health gate";
    case HealthVerdict::kNotRunning:
      return "did not start within " + std::to_string(limits.grace_seconds) + " s";
    case HealthVerdict::kCheckFailed:
      return "failed its health check";
    case HealthVerdict::kCheckTimedOut:
      return "did not pass its health check within " + std::to_string(limits.check_seconds) + " s";
  }
  return "failed its health gate";
}
