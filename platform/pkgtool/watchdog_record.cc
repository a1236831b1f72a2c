#include "pkgtool/watchdog_record.h"

#include <cerrno>
#include <chrono>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"

namespace {

constexpr long long kHourMs = 3600 * 1000LL;
constexpr char kRestartsFile[] = "/restarts";
constexpr char kCrashedFile[] = "/crashed";
// Either file is a few hundred bytes; the log lines in a mark at most 4 KiB.
constexpr size_t kMaxFileBytes = 64 * 1024;

struct Bound {
  const char* key;
  int WatchdogSettings::*field;
  int min;
  int max;
};

constexpr Bound kBounds[] = {
    {"interval_seconds", &WatchdogSettings::interval_seconds, 1, 3600},
    {"max_restarts", &WatchdogSettings::max_restarts, 1, 20},
    {"restart_delay_seconds", &WatchdogSettings::restart_delay_seconds, 1, 3600},
};

// The delay before the restart that follows `done` restarts within the hour.
long long DelayMs(const WatchdogSettings& s, size_t done) {
  if (done == 0) return 0;
  // max_restarts is at most 20, so the shift stays far from overflow.
  return s.restart_delay_seconds * 1000LL * (1LL << (done - 1));
}

bool ParseWhole(const std::string& text, int min, int max, int* out) {
  if (text.empty() || text.size() > 9 || text.find_first_not_of("0123456789") != std::string::npos)
    return false;
  int v = std::stoi(text);
  if (v < min || v > max) return false;
  *out = v;
  return true;
}

bool ReadJson(const std::string& path, Json::Value* out) {
  std::string text;
  return KIVOReadFile(path, &text, kMaxFileBytes) && KIVOParseJson(text, out) && out->isObject();
}

bool WriteJson(const std::string& path, const Json::Value& value) {
  return KIVOWriteFileAtomic(path, KIVOWriteJson(value) + "\n", SyncToDisk::No, 0644);
}

}  // namespace

std::string PMSWatchdogSettingsPath() { return KIVORootPath("/etc/kivo/watchdog.conf"); }

bool PMSLoadWatchdogSettings(WatchdogSettings* out, std::string* problem) {
  const std::string path = PMSWatchdogSettingsPath();
  WatchdogSettings s;
  KeyValueMap conf;
  if (access(path.c_str(), F_OK) != 0 && errno == ENOENT) {
    *out = s;
    return true;
  }
  if (!KIVOKeyValueLoad(path, &conf)) {
    *problem = path + " cannot be read";
    return false;
  }
  for (const auto& kv : conf) {
    const Bound* bound = nullptr;
    for (const Bound& b : kBounds) {
      if (kv.first == b.key) bound = &b;
    }
    if (!bound) {
      *problem = path + ": unknown setting " + kv.first;
      return false;
    }
    if (!ParseWhole(kv.second, bound->min, bound->max, &(s.*bound->field))) {
      *problem = path + ": " + kv.first + " takes a whole number from " +
                 std::to_string(bound->min) + " to " + std::to_string(bound->max);
      return false;
    }
  }
  long long span_ms = 0;
  for (int k = 0; k < s.max_restarts; ++k) {
    span_ms += DelayMs(s, static_cast<size_t>(k)) + s.interval_seconds * 1000LL;
  }
  if (span_ms >= kHourMs) {
    *problem = path + ": " + std::to_string(s.max_restarts) + " restarts " +
               std::to_string(s.restart_delay_seconds) + " s apart and doubling, checked every " +
               std::to_string(s.interval_seconds) +
               " s, take an hour or more, so the watchdog would never give up: lower "
               "max_restarts, restart_delay_seconds or interval_seconds";
    return false;
  }
  *out = s;
  return true;
}

std::vector<WatchdogRestart> PMSReadRestarts(const std::string& record, long long now_ms) {
  std::vector<WatchdogRestart> out;
  Json::Value doc;
  if (!ReadJson(record + kRestartsFile, &doc) || !doc["restarts"].isArray()) return out;
  for (const Json::Value& r : doc["restarts"]) {
    if (!r.isObject() || !r["time"].isInt64() || !r["result"].isInt()) continue;
    WatchdogRestart restart{r["time"].asInt64(), r["result"].asInt()};
    if (restart.time_ms > now_ms - kHourMs && restart.time_ms <= now_ms) out.push_back(restart);
  }
  return out;
}

bool PMSWriteRestarts(const std::string& record, const std::vector<WatchdogRestart>& restarts,
                      long long now_ms) {
  Json::Value doc(Json::objectValue);
  doc["restarts"] = Json::Value(Json::arrayValue);
  for (const WatchdogRestart& r : restarts) {
    if (r.time_ms <= now_ms - kHourMs) continue;
    Json::Value entry(Json::objectValue);
    entry["time"] = static_cast<Json::Int64>(r.time_ms);
    entry["result"] = r.result;
    doc["restarts"].append(entry);
  }
  return WriteJson(record + kRestartsFile, doc);
}

bool PMSReadCrashed(const std::string& record, CrashedMark* mark) {
  Json::Value doc;
  if (!ReadJson(record + kCrashedFile, &doc)) return false;
  if (!doc["time"].isInt64() || !doc["restarts"].isInt() || !doc["reason"].isString() ||
      !doc["log"].isString()) {
    return false;
  }
  mark->time_ms = doc["time"].asInt64();
  mark->restarts = doc["restarts"].asInt();
  mark->reason = doc["reason"].asString();
  mark->log = doc["log"].asString();
  return true;
}

bool PMSWriteCrashed(const std::string& record, const CrashedMark& mark) {
  Json::Value doc(Json::objectValue);
  doc["time"] = static_cast<Json::Int64>(mark.time_ms);
  doc["restarts"] = mark.restarts;
  doc["reason"] = mark.reason;
  doc["log"] = mark.log;
  return WriteJson(record + kCrashedFile, doc);
}

bool PMSClearWatchdogMarks(const std::string& record) {
  bool ok = true;
  for (const char* name : {kCrashedFile, kRestartsFile}) {
    if (unlink((record + name).c_str()) != 0 && errno != ENOENT) ok = false;
  }
  return ok;
}

WatchdogDecision PMSWatchdogDecide(const std::vector<WatchdogRestart>& restarts,
                                   const WatchdogSettings& settings, long long now_ms,
                                   long long* due_ms) {
  if (restarts.size() >= static_cast<size_t>(settings.max_restarts)) {
    return WatchdogDecision::kGiveUp;
  }
  *due_ms =
      restarts.empty() ? now_ms : restarts.back().time_ms + DelayMs(settings, restarts.size());
  return now_ms >= *due_ms ? WatchdogDecision::kStart : WatchdogDecision::kWait;
}

std::string PMSGiveUpReason(const std::vector<WatchdogRestart>& restarts) {
  const std::string count = std::to_string(restarts.size());
  if (!restarts.empty() && restarts.back().result != PKG_OK) {
    return std::string("its start failed (") + PMSResultText(restarts.back().result) + ", " +
           std::to_string(restarts.back().result) + ") after " + count + " restarts within an hour";
  }
  return "it stopped running again after each of " + count + " restarts within an hour";
}

Json::Value PMSWatchdogView(const std::string& id, long long now_ms) {
  Json::Value view(Json::objectValue);
  view["id"] = id;
  const std::string record = PackageRegistry::RecordDir(id);
  view["restarts_last_hour"] = static_cast<int>(PMSReadRestarts(record, now_ms).size());
  CrashedMark mark;
  if (PMSReadCrashed(record, &mark)) {
    Json::Value& crashed = view["crashed"];
    crashed["time"] = static_cast<Json::Int64>(mark.time_ms);
    crashed["restarts"] = mark.restarts;
    crashed["reason"] = mark.reason;
    crashed["log"] = mark.log;
  } else {
    view["crashed"] = Json::Value();
  }
  return view;
}

long long PMSNowMs() {
  using namespace std::chrono;
  return duration_cast<milliseconds>(system_clock::now().time_since_epoch()).count();
}
