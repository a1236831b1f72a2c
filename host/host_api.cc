#include "host/host_api.h"

#include <syslog.h>

#include "accounts/accounts.h"
#include "host/host_config.h"

namespace {

constexpr char kInfoAPI[] = "KIVO.API.Info";
constexpr char kAuthAPI[] = "KIVO.API.Auth";
constexpr char kAdminGroup[] = "administrators";

Json::Value Reason(const std::string& reason) {
  Json::Value data(Json::objectValue);
  data["reason"] = reason;
  return data;
}

void AddRange(Json::Value* out, const std::string& api, int min, int max) {
  Json::Value& entry = (*out)[api];
  entry["path"] = "entry.cgi";
  entry["minVersion"] = min;
  entry["maxVersion"] = max;
}

void InfoQuery(const ModuleTable& modules, APIResponse* response) {
  Json::Value data(Json::objectValue);
  AddRange(&data, kInfoAPI, 1, 1);
  AddRange(&data, kAuthAPI, 1, 1);
  for (const APIVersionRange& r : modules.Versions())
    AddRange(&data, r.api, r.min_version, r.max_version);
  response->SetSuccess(data);
}

// Reads a required string parameter of a host API; answers 120 when missing.
bool RequireString(const APIRequest& request, const char* name, std::string* out,
                   APIResponse* response) {
  APIParameter<std::string> p = request.GetAndCheckString(name, PARAM_REQUIRED);
  if (p.IsInvalid()) {
    Json::Value data(Json::objectValue);
    data["name"] = name;
    data["reason"] = p.IsSet() ? "type" : "required";
    response->SetError(kErrParameter, data);
    return false;
  }
  *out = p.Get();
  return true;
}

void Login(const APIRequest& request, APIResponse* response) {
  std::string account, password;
  if (!RequireString(request, "account", &account, response) ||
      !RequireString(request, "passwd", &password, response)) {
    return;
  }
  if (!KIVOAccountCheckPassword(account, password)) {
    syslog(LOG_WARNING, "%s:%d failed sign-in for account [%s]", "host_api", __LINE__,
           KIVOAccountNameValid(account) ? account.c_str() : "(invalid name)");
    response->SetError(kErrWrongPassword, Reason("wrong account or password"));
    return;
  }
  SessionStore store(LoadSessionLimits());
  Session session;
  if (!store.Create(account, &session)) {
    syslog(LOG_ERR, "%s:%d cannot store a session for [%s]", "host_api", __LINE__, account.c_str());
    response->SetError(kErrUnknown, Reason("cannot store the session"));
    return;
  }
  Json::Value data(Json::objectValue);
  data["sid"] = session.id;
  data["token"] = session.token;
  response->AddHeader("Set-Cookie: id=" + session.id + "; Path=/; HttpOnly; SameSite=Strict");
  response->SetSuccess(data);
}

// The session id a call carries: the "_sid" parameter first (scripts), else
// the cookie. `from_cookie` tells which.
std::string SessionIdOf(const CgiRequest& cgi, const APIRequest& request, bool* from_cookie) {
  APIParameter<std::string> sid = request.GetAndCheckString("_sid", PARAM_OPTIONAL);
  *from_cookie = !sid.IsSet();
  return sid.IsSet() ? sid.Get() : CookieValue(cgi.cookie, "id");
}

// Finds the caller's session; on failure sets 119 or 106 and answers false.
bool FindSession(const CgiRequest& cgi, const APIRequest& request, Session* session,
                 bool* from_cookie, APIResponse* response) {
  std::string sid = SessionIdOf(cgi, request, from_cookie);
  if (sid.empty()) {
    response->SetError(kErrNotSignedIn, Reason("not signed in"));
    return false;
  }
  SessionStore store(LoadSessionLimits());
  switch (store.Find(sid, session)) {
    case SessionLookup::Found:
      return true;
    case SessionLookup::Expired:
      response->SetError(kErrSessionExpired, Reason("session expired"));
      return false;
    case SessionLookup::Unknown:
      break;
  }
  response->SetError(kErrNotSignedIn, Reason("unknown session"));
  return false;
}

void Logout(const CgiRequest& cgi, const APIRequest& request, APIResponse* response) {
  Session session;
  bool from_cookie = false;
  if (!FindSession(cgi, request, &session, &from_cookie, response)) return;
  if (from_cookie && !ConstantTimeEquals(cgi.token, session.token)) {
    response->SetError(kErrNotPermitted, Reason("missing or wrong X-KIVO-Token"));
    return;
  }
  SessionStore(LoadSessionLimits()).Remove(session.id);
  response->AddHeader("Set-Cookie: id=; Path=/; HttpOnly; SameSite=Strict; Max-Age=0");
  response->SetSuccess();
}

}  // namespace

bool IsHostAPI(const std::string& api) { return api == kInfoAPI || api == kAuthAPI; }

void RunHostAPI(const CgiRequest& cgi, APIRequest* request, const ModuleTable* modules,
                APIResponse* response) {
  const std::string& api = request->GetAPIClass();
  const std::string& method = request->GetAPIMethod();
  bool known = (api == kInfoAPI && method == "query") ||
               (api == kAuthAPI && (method == "login" || method == "logout"));
  if (!known) {
    response->SetError(kErrNoSuchMethod);
  } else if (request->GetAPIVersion() != 1) {
    response->SetError(kErrBadVersion);
  } else if (api == kInfoAPI) {
    InfoQuery(*modules, response);
  } else if (method == "login") {
    Login(*request, response);
  } else {
    Logout(cgi, *request, response);
  }
}

bool AuthorizeAdministrator(const CgiRequest& cgi, bool token_exempt, APIRequest* request,
                            APIResponse* response) {
  Session session;
  bool from_cookie = false;
  if (!FindSession(cgi, *request, &session, &from_cookie, response)) return false;
  // A cookie rides along with any request a browser makes, including forged
  // cross-site ones; the token proves the page that sent it read our answer.
  if (from_cookie && !token_exempt && !ConstantTimeEquals(cgi.token, session.token)) {
    response->SetError(kErrNotPermitted, Reason("missing or wrong X-KIVO-Token"));
    return false;
  }
  if (!KIVOAccountInGroup(session.user, kAdminGroup)) {
    response->SetError(kErrNotPermitted, Reason("administrators only"));
    return false;
  }
  request->SetLoginUserName(session.user);
  return true;
}
