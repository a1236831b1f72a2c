#include "pkgserver/auto_update.h"

#include <sys/stat.h>

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "settings/web_utils.h"

#include <strings.h>

namespace KIVOPackageServer {

namespace {

std::string ListPath() { return KIVORootPath("/usr/kivo/etc/packages/autoupdate.json"); }

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

}  // namespace KIVOPackageServer
