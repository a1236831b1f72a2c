#include "host/user_settings_api.h"

#include <syslog.h>

#include "host/host_api.h"
#include "klibc/json_text.h"
#include "settings/kivo_settings.h"

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

size_t SerializedSize(const Json::Value& value) { return KIVOWriteJson(value).size(); }

}  // namespace

void UserSettingsSet(const APIRequest& request, const std::string& account, APIResponse* response) {
  APIParameter<std::string> app = request.GetAndCheckString("app", PARAM_REQUIRED);
  if (app.IsInvalid() || !ValidAppKey(app.Get())) {
    ParameterError("app",
                   !app.IsSet()      ? "required"
                   : app.IsInvalid() ? "type"
                                     : "condition",
                   response);
    return;
  }
  APIParameter<Json::Value> settings = request.GetAndCheckObject("settings", PARAM_REQUIRED);
  if (settings.IsInvalid()) {
    ParameterError("settings", settings.IsSet() ? "type" : "required", response);
    return;
  }
  // Under the document's lock: the module caches the terms' hash in the
  // same document, and a change made between a read and a write would be
  // lost.
  bool too_large = false;
  auto merge = [&](Json::Value& document) {
    Json::Value& object = document[app.Get()];
    if (!object.isObject()) object = Json::Value(Json::objectValue);
    for (const std::string& name : settings.Get().getMemberNames())
      object[name] = settings.Get()[name];
    too_large = SerializedSize(document) > kMaxSettingsBytes;
    return !too_large;
  };
  if (!KivoSettings(account).updateUserJsonSettings(merge)) {
    if (too_large) return ParameterError("settings", "condition", response);
    syslog(LOG_ERR, "%s:%d cannot store the settings of [%s]", "user_settings", __LINE__,
           account.c_str());
    response->SetError(kErrUnknown);
    return;
  }
  response->SetSuccess();
}
