#include "settings/kivo_settings.h"

#include "klibc/account_name.h"
#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
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

bool KivoSettings::updateUserJsonSettings(const std::function<bool(Json::Value&)>& change) const {
  if (path_.empty()) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  if (KIVOFSMkdirP(path_.substr(0, path_.rfind('/')).c_str()) != 0) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  FileLock lock(path_ + ".lock");
  if (!lock.held()) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  Json::Value settings;
  if (!loadUserJsonSettings(settings)) return false;
  if (!change(settings)) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  return saveUserJsonSettings(settings);
}
