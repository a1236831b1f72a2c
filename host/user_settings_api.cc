#include "host/user_settings_api.h"

#include <syslog.h>

#include <json/writer.h>

#include "host/host_api.h"
#include "settings/kivo_settings.h"

const char kUserSettingsAPI[] = "KIVO.API.UserSettings";

namespace {

// An application key never holds more than a page of preferences; the limit
// keeps one account from growing its document without bound.
constexpr size_t kMaxSettingsBytes = 64 * 1024;
constexpr size_t kMaxAppKey = 64;

bool ValidAppKey(const std::string& app) {
  if (app.empty() || app.size() > kMaxAppKey) return false;
  for (char c : app) {
    bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
              c == '.' || c == '_' || c == '-';
    if (!ok) return false;
  }
  return true;
}

void ParameterError(const char* name, const char* reason, APIResponse* response) {
  Json::Value data(Json::objectValue);
  data["name"] = name;
  data["reason"] = reason;
  response->SetError(kErrParameter, data);
}

size_t SerializedSize(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value).size();
}

}  // namespace

void UserSettingsSet(const APIRequest& request, const std::string& account, APIResponse* response) {
  APIParameter<std::string> app = request.GetAndCheckString("app", PARAM_REQUIRED);
  if (app.IsInvalid() || !ValidAppKey(app.Get())) {
    ParameterError("app",
                   !app.IsSet()      ? "required"
                   : app.IsInvalid() ? "type"
                                     : "invalid",
                   response);
    return;
  }
  APIParameter<Json::Value> settings = request.GetAndCheckObject("settings", PARAM_REQUIRED);
  if (settings.IsInvalid()) {
    ParameterError("settings", settings.IsSet() ? "type" : "required", response);
    return;
  }
  // Read, change and replace: another writer of the same account's document
  // between the read and the rename loses its change (the later rename wins,
  // as kivo_settings.h says); both writers are the same person's pages.
  KivoSettings store(account);
  Json::Value document;
  if (!store.loadUserJsonSettings(document)) {
    syslog(LOG_ERR, "%s:%d cannot read the settings of [%s]", "user_settings", __LINE__,
           account.c_str());
    response->SetError(kErrUnknown);
    return;
  }
  Json::Value& object = document[app.Get()];
  if (!object.isObject()) object = Json::Value(Json::objectValue);
  for (const std::string& name : settings.Get().getMemberNames())
    object[name] = settings.Get()[name];
  if (SerializedSize(document) > kMaxSettingsBytes) {
    ParameterError("settings", "too large", response);
    return;
  }
  if (!store.saveUserJsonSettings(document)) {
    syslog(LOG_ERR, "%s:%d cannot write the settings of [%s]", "user_settings", __LINE__,
           account.c_str());
    response->SetError(kErrUnknown);
    return;
  }
  response->SetSuccess();
}
