#include "pkgserver/update_last_run.h"

#include <cerrno>
#include <iterator>
#include <sys/stat.h>
#include <syslog.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "pkgserver/auto_update.h"
#include "pkgtool/registry.h"
#include "pkgtool/version.h"

namespace KIVOPackageServer {

namespace {

std::string LastRunPath() {
  return KIVORootPath("/usr/kivo/etc/packages/autoupdate-last-run.json");
}

constexpr size_t kMaxFileBytes = 4 << 20;
constexpr int kMaxExitStatus = 255;

bool IsOutcome(const std::string& s) {
  for (const char* o : {kOutcomeUpgraded, kOutcomeFailed, kOutcomeHeld, kOutcomeFailedBefore,
                        kOutcomeUpToDate, kOutcomeNotChosen, kOutcomeSkipped}) {
    if (s == o) return true;
  }
  return false;
}

bool IsVersionOrEmpty(const Json::Value& v) {
  return v.isString() && (v.asString().empty() || PMSIsValidVersion(v.asString()));
}

// A line as the run keeps it: FailureReasonLine leaves it as it is.
bool IsWordsLine(const Json::Value& v) {
  return v.isString() && FailureReasonLine(v.asString()) == v.asString();
}

bool ParseOutcome(const Json::Value& v, PackageOutcome* out) {
  static const char* const kMembers[] = {"from", "outcome", "to", "words"};
  if (!v.isObject() || v.size() != std::size(kMembers)) return false;
  for (const char* member : kMembers) {
    if (!v.isMember(member)) return false;
  }
  if (!v["outcome"].isString() || !IsOutcome(v["outcome"].asString()) ||
      !IsVersionOrEmpty(v["from"]) || !IsVersionOrEmpty(v["to"]) || !IsWordsLine(v["words"]))
    return false;
  *out = {v["outcome"].asString(), v["from"].asString(), v["to"].asString(), v["words"].asString()};
  return true;
}

bool ParseRun(const Json::Value& doc, UpdateRun* out) {
  static const char* const kMembers[] = {"ended", "exit_status", "packages", "started"};
  if (!doc.isObject() || doc.size() != std::size(kMembers)) return false;
  for (const char* member : kMembers) {
    if (!doc.isMember(member)) return false;
  }
  const Json::Value &started = doc["started"], &ended = doc["ended"], &status = doc["exit_status"],
                    &packages = doc["packages"];
  if (!started.isInt64() || started.asInt64() < 0 || !ended.isInt64() ||
      ended.asInt64() < started.asInt64() || !status.isInt() || status.asInt() < 0 ||
      status.asInt() > kMaxExitStatus || !packages.isObject())
    return false;
  UpdateRun run;
  run.started = started.asInt64();
  run.ended = ended.asInt64();
  run.exit_status = status.asInt();
  for (const std::string& id : packages.getMemberNames()) {
    PackageOutcome outcome;
    if (!PMSIsValidPackageId(id) || !ParseOutcome(packages[id], &outcome)) return false;
    run.packages[id] = outcome;
  }
  *out = run;
  return true;
}

}  // namespace

Json::Value UpdateRunJson(const UpdateRun& run) {
  Json::Value doc(Json::objectValue);
  doc["started"] = static_cast<Json::Int64>(run.started);
  doc["ended"] = static_cast<Json::Int64>(run.ended);
  doc["exit_status"] = run.exit_status;
  doc["packages"] = Json::Value(Json::objectValue);
  for (const auto& [id, o] : run.packages) {
    Json::Value& p = doc["packages"][id];
    p["outcome"] = o.outcome;
    p["from"] = o.from;
    p["to"] = o.to;
    p["words"] = o.words;
  }
  return doc;
}

bool ReadLastRun(UpdateRun* out, bool* found) {
  *found = false;
  struct stat st;
  if (stat(LastRunPath().c_str(), &st) != 0 && errno == ENOENT) return true;
  std::string text;
  if (!KIVOReadFile(LastRunPath(), &text, kMaxFileBytes + 1)) return false;
  Json::Value doc;
  if (text.size() > kMaxFileBytes || !KIVOParseJson(text, &doc) || !ParseRun(doc, out)) {
    syslog(LOG_WARNING, "auto_update: %s is damaged; it reads as no run", LastRunPath().c_str());
    return true;
  }
  *found = true;
  return true;
}

bool WriteLastRun(const UpdateRun& run) {
  const Json::Value doc = UpdateRunJson(run);
  UpdateRun checked;
  if (!ParseRun(doc, &checked)) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  if (KIVOFSMkdirP(KIVORootPath("/usr/kivo/etc/packages").c_str()) != 0) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  return KIVOWriteFileAtomic(LastRunPath(), KIVOWriteJson(doc, "  ") + "\n");
}

}  // namespace KIVOPackageServer
