#include "host/auto_update_api.h"

#include <ctime>
#include <syslog.h>

#include "klibc/json_text.h"
#include "pkgserver/auto_update.h"
#include "pkgserver/update_holds.h"
#include "pkgserver/update_last_run.h"
#include "pkgserver/update_window.h"
#include "pkgtool/registry.h"
#include "webapi/api_codes.h"

namespace {

using namespace KIVOPackageServer;

// Refuses parameter `name` with 120, saying why in words.
void Refuse(const std::string& name, const std::string& reason, const std::string& detail,
            APIResponse* response) {
  Json::Value data(Json::objectValue);
  data["name"] = name;
  data["reason"] = reason;
  if (!detail.empty()) data["detail"] = detail;
  response->SetError(kErrParameter, data);
}

void Failed(int code, const char* reason, APIResponse* response) {
  syslog(LOG_ERR, "auto_update_api: %s", reason);
  Json::Value data(Json::objectValue);
  data["reason"] = reason;
  response->SetError(code, data);
}

const char* ModeName(AutoUpdateMode mode) {
  switch (mode) {
    case AutoUpdateMode::kAll:
      return "all";
    case AutoUpdateMode::kChosen:
      return "chosen";
    case AutoUpdateMode::kOff:
      break;
  }
  return "off";
}

Json::Value Opening(const WindowOpening& o) {
  Json::Value v(Json::objectValue);
  v["opens"] = static_cast<Json::Int64>(o.opens);
  v["closes"] = static_cast<Json::Int64>(o.closes);
  return v;
}

// What get answers; false (with the error set) when the holds cannot be
// read.
bool Overview(Json::Value* data, APIResponse* response) {
  const int64_t now = static_cast<int64_t>(time(nullptr));
  UpdateHolds holds;
  if (!ReadHolds(&holds)) {
    Failed(kErrHoldsUnreadable, "the holds of automatic updates cannot be read", response);
    return false;
  }
  UpdateRun last;
  bool ran = false;
  if (!ReadLastRun(&last, &ran)) syslog(LOG_WARNING, "auto_update_api: no last run readable");
  UpdateWindow window;
  WindowError bad;
  const bool valid = LoadUpdateWindow(&window, &bad);
  Json::Value& d = *data;
  d = Json::Value(Json::objectValue);
  d["mode"] = ModeName(ReadMode());
  d["window"] = UpdateWindowJson(window);
  d["window_error"] = Json::Value();
  if (!valid) {
    d["window_error"]["key"] = bad.key;
    d["window_error"]["reason"] = bad.reason;
  }
  d["holds"] = Json::Value(Json::objectValue);
  for (const auto& [id, hold] : holds) d["holds"][id] = UpdateHoldJson(hold, now);
  d["last_run"] = ran ? UpdateRunJson(last) : Json::Value();
  d["now"] = static_cast<Json::Int64>(now);
  // A window that is not valid lets no run go ahead: nothing is next.
  const WindowState state = WindowStateAt(window, now, ran ? last.started : 0);
  d["inside"] = valid && state.inside;
  d["already_ran"] = valid && state.already_ran;
  d["next_run"] = valid && state.has_next ? Opening(state.next) : Json::Value();
  return true;
}

void AnswerOverview(APIResponse* response, const Json::Value& extra = Json::Value()) {
  Json::Value data;
  if (!Overview(&data, response)) return;
  for (const std::string& name : extra.getMemberNames()) data[name] = extra[name];
  response->SetSuccess(data);
}

// A text parameter, "" when absent; false (with 120) when it is not text.
bool Text(const APIRequest& request, const char* name, std::string* out, APIResponse* response) {
  APIParameter<std::string> p = request.GetAndCheckString(name, PARAM_OPTIONAL);
  if (p.IsInvalid()) {
    Refuse(name, "type", "", response);
    return false;
  }
  *out = p.IsSet() ? p.Get() : "";
  if (out->size() > 256) {
    Refuse(name, "condition", "too long", response);
    return false;
  }
  return true;
}

// `days` as the window file's "mon,tue": a JSON array of names, or the
// names as text. Each name is checked by the window's rules.
bool Days(const APIRequest& request, std::string* out, APIResponse* response) {
  Json::Value days = request.GetParam("days");
  Json::Value parsed;
  if (days.isString() && !days.asString().empty() && days.asString()[0] == '[' &&
      KIVOParseJson(days.asString(), &parsed))
    days = parsed;
  out->clear();
  if (days.isNull()) return true;
  if (days.isString()) {
    *out = days.asString();
  } else if (days.isArray()) {
    for (const Json::Value& d : days) {
      if (!d.isString() || d.asString().find(',') != std::string::npos) {
        Refuse("days", "condition", "each day is one of sun, mon, tue, wed, thu, fri, sat",
               response);
        return false;
      }
      *out += (out->empty() ? "" : ",") + d.asString();
    }
  } else {
    Refuse("days", "type", "", response);
    return false;
  }
  if (out->size() > 256) {
    Refuse("days", "condition", "too long", response);
    return false;
  }
  return true;
}

// The web API's name of a window file key.
const char* ParamOf(const std::string& key) {
  if (key == "window_days") return "days";
  if (key == "window_start") return "start";
  if (key == "window_end") return "end";
  return "random_delay_minutes";
}

void SetWindow(const APIRequest& request, APIResponse* response) {
  APIParameter<bool> limited = request.GetAndCheckBool("limited", PARAM_REQUIRED);
  if (limited.IsInvalid())
    return Refuse("limited", limited.IsSet() ? "type" : "required", "", response);
  std::string days, start, end, delay;
  if (!Days(request, &days, response) || !Text(request, "start", &start, response) ||
      !Text(request, "end", &end, response) ||
      !Text(request, "random_delay_minutes", &delay, response))
    return;
  KeyValueMap conf;
  if (limited.Get()) {
    if (days.empty()) return Refuse("days", "required", "name at least one day", response);
    conf = {{"window_days", days}, {"window_start", start}, {"window_end", end}};
  } else if (!days.empty() || !start.empty() || !end.empty()) {
    return Refuse(!days.empty()    ? "days"
                  : !start.empty() ? "start"
                                   : "end",
                  "condition", "a window that is not limited has no days or hours", response);
  }
  if (!delay.empty()) conf["random_delay_minutes"] = delay;
  UpdateWindow window;
  WindowError bad;
  if (!ParseUpdateWindow(conf, &window, &bad))
    return Refuse(ParamOf(bad.key), "condition", bad.reason, response);
  if (!SaveUpdateWindow(window))
    return Failed(kErrAutoUpdateNotStored, "the maintenance window cannot be written", response);
  AnswerOverview(response);
}

// The `id` parameter, a valid package id; false (with 120) otherwise.
bool PackageId(const APIRequest& request, std::string* id, APIResponse* response) {
  APIParameter<std::string> p = request.GetAndCheckString("id", PARAM_REQUIRED);
  if (p.IsInvalid()) {
    Refuse("id", p.IsSet() ? "type" : "required", "", response);
    return false;
  }
  if (!PMSIsValidPackageId(p.Get())) {
    Refuse("id", "condition", "not a package id", response);
    return false;
  }
  *id = p.Get();
  return true;
}

void Hold(const APIRequest& request, APIResponse* response) {
  std::string id, until;
  if (!PackageId(request, &id, response) || !Text(request, "until", &until, response)) return;
  const int64_t now = static_cast<int64_t>(time(nullptr));
  if (!until.empty() && !IsHoldDate(until))
    return Refuse("until", "condition", "not a date as YYYY-MM-DD", response);
  if (!until.empty() && HoldEnds(until) <= now)
    return Refuse("until", "condition", "the day has begun already", response);
  if (!PackageRegistry::IsInstalled(id)) {
    Json::Value data(Json::objectValue);
    data["reason"] = "the package is not installed";
    return response->SetError(kErrHoldNotInstalled, data);
  }
  if (!SetHold(id, {until, now, request.GetLoginUserName()}, now))
    return Failed(kErrAutoUpdateNotStored, "the hold cannot be written", response);
  AnswerOverview(response);
}

void Release(const APIRequest& request, APIResponse* response) {
  std::string id;
  if (!PackageId(request, &id, response)) return;
  bool lifted = false;
  if (!LiftHold(id, static_cast<int64_t>(time(nullptr)), &lifted))
    return Failed(kErrAutoUpdateNotStored, "the holds cannot be written", response);
  Json::Value extra(Json::objectValue);
  extra["lifted"] = lifted;
  AnswerOverview(response, extra);
}

}  // namespace

bool IsAutoUpdateMethod(const std::string& method) {
  return method == "get" || method == "set" || method == "hold" || method == "release";
}

void AutoUpdateAnswer(const APIRequest& request, APIResponse* response) {
  const std::string& method = request.GetAPIMethod();
  if (method == "get") return AnswerOverview(response);
  if (method == "set") return SetWindow(request, response);
  if (method == "hold") return Hold(request, response);
  Release(request, response);
}
