#include "pkgserver/update_holds.h"

#include <cerrno>
#include <ctime>
#include <functional>
#include <iterator>
#include <sys/stat.h>
#include <syslog.h>

#include "klibc/account_name.h"
#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/json_text.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"

namespace KIVOPackageServer {

namespace {

std::string HoldsPath() { return KIVORootPath("/usr/kivo/etc/packages/autoupdate-holds.json"); }

// One hold for every package an appliance could hold, with room to spare.
constexpr size_t kMaxHoldsFileBytes = 1 << 20;

// The hold `value` describes; false when any member is missing, of the
// wrong kind or breaks its rule, or when there are others.
bool ParseHold(const Json::Value& value, UpdateHold* out) {
  static const char* const kMembers[] = {"by", "since", "until"};
  if (!value.isObject() || value.size() != std::size(kMembers)) return false;
  for (const char* member : kMembers) {
    if (!value.isMember(member)) return false;
  }
  const Json::Value &until = value["until"], &since = value["since"], &by = value["by"];
  if (!(until.isNull() || (until.isString() && IsHoldDate(until.asString()))) || !since.isInt64() ||
      since.asInt64() < 0 || !by.isString() || !KIVOAccountNameValid(by.asString())) {
    return false;
  }
  *out = {until.isNull() ? "" : until.asString(), since.asInt64(), by.asString()};
  return true;
}

Json::Value HoldFileJson(const UpdateHold& hold) {
  Json::Value v(Json::objectValue);
  v["until"] = hold.until.empty() ? Json::Value() : Json::Value(hold.until);
  v["since"] = static_cast<Json::Int64>(hold.since);
  v["by"] = hold.by;
  return v;
}

// The stored holds, checked whole; false (and empty) on any fault. A
// missing file holds nothing.
bool LoadHolds(UpdateHolds* out) {
  out->clear();
  struct stat st;
  if (stat(HoldsPath().c_str(), &st) != 0 && errno == ENOENT) return true;
  std::string text;
  Json::Value doc;
  if (!KIVOReadFile(HoldsPath(), &text, kMaxHoldsFileBytes + 1) ||
      text.size() > kMaxHoldsFileBytes || !KIVOParseJson(text, &doc) || !doc.isObject())
    return false;
  for (const std::string& id : doc.getMemberNames()) {
    UpdateHold hold;
    if (!PMSIsValidPackageId(id) || !ParseHold(doc[id], &hold)) {
      out->clear();
      return false;
    }
    (*out)[id] = hold;
  }
  return true;
}

// Reads the holds under the file's lock, drops the ones that ended, lets
// `change` change them and writes them back atomically.
bool ChangeHolds(int64_t now, const std::function<void(UpdateHolds&)>& change) {
  if (KIVOFSMkdirP(KIVORootPath("/usr/kivo/etc/packages").c_str()) != 0) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  FileLock lock(HoldsPath() + ".lock");
  if (!lock.held()) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  UpdateHolds holds;
  if (!LoadHolds(&holds)) {
    syslog(LOG_WARNING, "auto_update: %s is damaged; it is replaced", HoldsPath().c_str());
  }
  for (auto it = holds.begin(); it != holds.end();)
    it = HoldHolds(it->second, now) ? std::next(it) : holds.erase(it);
  change(holds);
  Json::Value doc(Json::objectValue);
  for (const auto& [id, hold] : holds) doc[id] = HoldFileJson(hold);
  return KIVOWriteFileAtomic(HoldsPath(), KIVOWriteJson(doc, "  ") + "\n");
}

}  // namespace

bool IsHoldDate(const std::string& text) {
  if (text.size() != 10 || text[4] != '-' || text[7] != '-') return false;
  for (size_t i : {0, 1, 2, 3, 5, 6, 8, 9}) {
    if (text[i] < '0' || text[i] > '9') return false;
  }
  const int year = std::stoi(text.substr(0, 4)), month = std::stoi(text.substr(5, 2)),
            day = std::stoi(text.substr(8, 2));
  if (year < 2000 || month < 1 || month > 12 || day < 1) return false;
  static const int kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  const bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
  return day <= kDays[month - 1] + (month == 2 && leap ? 1 : 0);
}

int64_t HoldEnds(const std::string& date) {
  struct tm t {};
  t.tm_year = std::stoi(date.substr(0, 4)) - 1900;
  t.tm_mon = std::stoi(date.substr(5, 2)) - 1;
  t.tm_mday = std::stoi(date.substr(8, 2));
  t.tm_isdst = -1;
  return static_cast<int64_t>(mktime(&t));
}

bool HoldHolds(const UpdateHold& hold, int64_t now) {
  return hold.until.empty() || now < HoldEnds(hold.until);
}

std::string HoldText(const UpdateHold& hold) {
  return hold.until.empty() ? "until lifted" : "until " + hold.until;
}

bool ReadHolds(UpdateHolds* out) {
  // No lock: every writer replaces the file in one rename.
  if (LoadHolds(out)) return true;
  syslog(LOG_WARNING, "auto_update: %s is damaged", HoldsPath().c_str());
  return false;
}

bool SetHold(const std::string& id, const UpdateHold& hold, int64_t now) {
  UpdateHold checked;
  if (!PMSIsValidPackageId(id) || !ParseHold(HoldFileJson(hold), &checked)) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  return ChangeHolds(now, [&](UpdateHolds& holds) { holds[id] = checked; });
}

bool LiftHold(const std::string& id, int64_t now, bool* lifted) {
  *lifted = false;
  return ChangeHolds(now, [&](UpdateHolds& holds) { *lifted = holds.erase(id) > 0; });
}

Json::Value UpdateHoldJson(const UpdateHold& hold, int64_t now) {
  Json::Value v = HoldFileJson(hold);
  v["active"] = HoldHolds(hold, now);
  return v;
}

}  // namespace KIVOPackageServer
