#include "settings/kivo_settings.h"

#include "klibc/account_name.h"
#include "klibc/atomic_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "settings/web_utils.h"

KivoSettings::KivoSettings(const std::string& user) {
  if (KIVOAccountNameValid(user)) {
    path_ = KIVORootPath("/usr/kivo/etc/users/" + user + "/settings.json");
  }
}

bool KivoSettings::loadUserJsonSettings(Json::Value& settings) const {
  settings = Json::Value();
  if (path_.empty()) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  if (!KLIBCFileExist(path_.c_str())) {
    settings = Json::Value(Json::objectValue);
    return true;
  }
  if (!WebUtils::LoadJsonFile(path_, settings)) return false;
  if (!settings.isObject()) {
    settings = Json::Value();
    KLIBCErrSet(KLIBC_ERR_FILE_READ);
    return false;
  }
  return true;
}

bool KivoSettings::saveUserJsonSettings(const Json::Value& settings) const {
  if (path_.empty() || !settings.isObject()) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  return WebUtils::SaveJsonFile(path_, settings);
}
