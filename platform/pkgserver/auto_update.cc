#include "pkgserver/auto_update.h"

#include <algorithm>
#include <cerrno>
#include <functional>
#include <iterator>
#include <sys/stat.h>
#include <syslog.h>

#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"
#include "pkgtool/version.h"
#include "settings/web_utils.h"

#include <strings.h>

namespace KIVOPackageServer {

namespace {

std::string ListPath() { return KIVORootPath("/usr/kivo/etc/packages/autoupdate.json"); }
std::string FailuresPath() {
  return KIVORootPath("/usr/kivo/etc/packages/autoupdate-failures.json");
}

constexpr size_t kMaxReasonBytes = 300;
constexpr int kMaxResultCode = 999;
// Far beyond one entry for every package an appliance could hold; a larger
// file is not one of ours.
constexpr size_t kMaxFailuresFileBytes = 1 << 20;

// Whether `key` of the settings file holds `value`, ignoring case.
bool InfoIs(const char* key, const char* value) {
  char buf[128] = {0};
  if (KLIBCFileGetKeyValue(KIVORootPath("/etc/kivoinfo.conf").c_str(), key, buf, sizeof(buf), 0) <=
      0) {
    return false;
  }
  return strcasecmp(buf, value) == 0;
}

bool IsIdArray(const Json::Value& ids) {
  if (!ids.isArray()) return false;
  for (const Json::Value& id : ids) {
    if (!id.isString()) return false;
  }
  return true;
}

bool IsControl(char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7f; }

bool IsReasonLine(const std::string& reason) {
  return !reason.empty() && reason.size() <= kMaxReasonBytes &&
         std::none_of(reason.begin(), reason.end(), IsControl);
}

// The failure `value` describes for package `id`; false when any part of it
// is missing, of the wrong kind, not valid, or more than a failure holds.
bool ParseFailure(const std::string& id, const Json::Value& value, AutoUpdateFailure* out) {
  static const char* const kMembers[] = {"code", "reason", "record", "time", "version"};
  if (!value.isObject() || value.size() != std::size(kMembers)) return false;
  for (const char* member : kMembers) {
    if (!value.isMember(member)) return false;
  }
  const Json::Value &version = value["version"], &time = value["time"], &code = value["code"],
                    &reason = value["reason"], &record = value["record"];
  if (!version.isString() || !PMSIsValidVersion(version.asString()) || !time.isInt64() ||
      time.asInt64() < 0 || !code.isInt() || code.asInt() <= 0 || code.asInt() > kMaxResultCode ||
      !reason.isString() || !IsReasonLine(reason.asString()) || !record.isString() ||
      !PackageRegistry::IsRecordNameOf(id, record.asString())) {
    return false;
  }
  *out = {version.asString(), time.asInt64(), code.asInt(), reason.asString(), record.asString()};
  return true;
}

Json::Value FailureJson(const AutoUpdateFailure& f) {
  Json::Value v(Json::objectValue);
  v["version"] = f.version;
  v["time"] = static_cast<Json::Int64>(f.time);
  v["code"] = f.code;
  v["reason"] = f.reason;
  v["record"] = f.record;
  return v;
}

Json::Value FailuresJson(const AutoUpdateFailures& failures) {
  Json::Value doc(Json::objectValue);
  for (const auto& [id, failure] : failures) doc[id] = FailureJson(failure);
  return doc;
}

// The failures of the stored file, checked whole. False when the file
// exists but fails a check (*out is then empty); a missing file is empty.
bool LoadFailures(AutoUpdateFailures* out) {
  out->clear();
  struct stat st;
  if (stat(FailuresPath().c_str(), &st) != 0 && errno == ENOENT) return true;  // none failed yet
  std::string text;
  if (!KIVOReadFile(FailuresPath(), &text, kMaxFailuresFileBytes + 1) ||
      text.size() > kMaxFailuresFileBytes)
    return false;
  Json::Value doc;
  if (!KIVOParseJson(text, &doc) || !doc.isObject()) return false;
  for (const std::string& id : doc.getMemberNames()) {
    AutoUpdateFailure failure;
    if (!PMSIsValidPackageId(id) || !ParseFailure(id, doc[id], &failure)) {
      out->clear();
      return false;
    }
    (*out)[id] = failure;
  }
  return true;
}

// Whether the failure of `id` still holds: the record published after it
// is still the one published.
bool StillHolds(const std::string& id, const AutoUpdateFailure& failure) {
  return PackageRegistry::PublishedRecord(id) == failure.record;
}

void DropWhatNoLongerHolds(AutoUpdateFailures* failures) {
  for (auto it = failures->begin(); it != failures->end();) {
    it = StillHolds(it->first, it->second) ? std::next(it) : failures->erase(it);
  }
}

void LogDamaged(const char* what_now) {
  syslog(LOG_WARNING, "auto_update: %s is damaged; it is read as empty%s", FailuresPath().c_str(),
         what_now);
}

// Reads the stored failures under the file's lock, lets `change` change
// them (after the entries that no longer hold are dropped) and writes them
// back atomically when anything differs or the file was damaged.
bool ChangeFailures(const std::function<void(AutoUpdateFailures&)>& change) {
  if (KIVOFSMkdirP(KIVORootPath("/usr/kivo/etc/packages").c_str()) != 0) return false;
  FileLock lock(FailuresPath() + ".lock");
  if (!lock.held()) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  AutoUpdateFailures failures;
  const bool whole = LoadFailures(&failures);
  if (!whole) LogDamaged(" and replaced");
  const Json::Value before = FailuresJson(failures);
  DropWhatNoLongerHolds(&failures);
  change(failures);
  const Json::Value after = FailuresJson(failures);
  if (whole && after == before) return true;
  return KIVOWriteFileAtomic(FailuresPath(), KIVOWriteJson(after, "  ") + "\n");
}

}  // namespace

AutoUpdateMode ReadMode() {
  if (!InfoIs("enable_pkg_autoupdate_all", "yes")) return AutoUpdateMode::kOff;
  return InfoIs("pkg_autoupdate_all", "no") ? AutoUpdateMode::kChosen : AutoUpdateMode::kAll;
}

bool List(Json::Value& ids) {
  ids = Json::Value(Json::arrayValue);
  struct stat st;
  if (stat(ListPath().c_str(), &st) != 0) return true;  // nothing chosen yet
  Json::Value stored;
  if (!WebUtils::LoadJsonFile(ListPath(), stored) || !IsIdArray(stored)) return false;
  ids = stored;
  return true;
}

bool Save(bool enable, bool all, const Json::Value& ids) {
  if (!ids.isNull() && !IsIdArray(ids)) return false;
  Json::Value list = ids.isNull() ? Json::Value(Json::arrayValue) : ids;
  return WebUtils::SaveJsonFile(ListPath(), list) &&
         KLIBCINFOSetKeyValue("enable_pkg_autoupdate_all", enable ? "yes" : "no") == 0 &&
         KLIBCINFOSetKeyValue("pkg_autoupdate_all", all ? "yes" : "no") == 0;
}

AutoUpdateFailures ReadFailures() {
  // No lock: every writer replaces the file in one rename, so a reader
  // alone sees one whole state, and a dry run creates no lock file. The
  // lock keeps writers from losing each other's changes.
  AutoUpdateFailures failures;
  if (!LoadFailures(&failures)) LogDamaged("");
  DropWhatNoLongerHolds(&failures);
  return failures;
}

bool RecordFailure(const std::string& id, const AutoUpdateFailure& failure) {
  AutoUpdateFailure checked;
  if (!PMSIsValidPackageId(id) || !ParseFailure(id, FailureJson(failure), &checked)) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  return ChangeFailures([&](AutoUpdateFailures& failures) { failures[id] = checked; });
}

bool ForgetFailure(const std::string& id) {
  return ChangeFailures([&](AutoUpdateFailures& failures) { failures.erase(id); });
}

bool DropFailuresThatNoLongerHold() {
  return ChangeFailures([](AutoUpdateFailures&) {});
}

std::string FailureReasonLine(const std::string& message) {
  std::string line = message.substr(0, message.find('\n'));
  std::replace_if(line.begin(), line.end(), IsControl, ' ');
  if (line.size() > kMaxReasonBytes) {
    size_t cut = kMaxReasonBytes;
    // Never cut through a character of several bytes.
    while (cut > 0 && (static_cast<unsigned char>(line[cut]) & 0xC0) == 0x80) --cut;
    line.resize(cut);
  }
  while (!line.empty() && (line.back() == ' ' || line.back() == '.')) line.pop_back();
  return line;
}

}  // namespace KIVOPackageServer
