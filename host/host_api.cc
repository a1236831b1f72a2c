#include "host/host_api.h"

#include <cstdlib>
#include <syslog.h>

#include "accounts/accounts.h"
#include "host/activity_api.h"
#include "host/activity_record.h"
#include "host/auto_update_api.h"
#include "host/host_config.h"
#include "host/login_throttle.h"
#include "host/revision_api.h"
#include "host/sources_api.h"
#include "host/usage_api.h"
#include "host/user_settings_api.h"
#include "host/watchdog_api.h"
#include "webapi/api_names.h"
#include "webapi/web_man.h"

namespace {

using WebAPIName::kActivity;
using WebAPIName::kAuth;
using WebAPIName::kAutoUpdate;
using WebAPIName::kInfo;
using WebAPIName::kRevision;
using WebAPIName::kSources;
using WebAPIName::kUsage;
using WebAPIName::kUserSettings;
using WebAPIName::kWatchdog;
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
  AddRange(&data, kInfo, 1, 1);
  AddRange(&data, kAuth, 1, 1);
  AddRange(&data, kUserSettings, 1, 1);
  AddRange(&data, kActivity, 1, 1);
  AddRange(&data, kAutoUpdate, 1, 1);
  AddRange(&data, kWatchdog, 1, 1);
  AddRange(&data, kRevision, 1, 1);
  AddRange(&data, kSources, 1, 1);
  AddRange(&data, kUsage, 1, 1);
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

// Web servers and proxies log request lines, so a password must never travel
// in one: sign-in takes only a POST with its fields in the body.
bool IsPostedSignIn(const CgiRequest& cgi) {
  if (cgi.method != "POST") return false;
  for (const auto& field : cgi.query) {
    if (field.first == "account" || field.first == "passwd") return false;
  }
  return true;
}

const char* LoggedName(const std::string& account) {
  return KIVOAccountNameValid(account) ? account.c_str() : "(invalid name)";
}

// Counts the attempt in the back-off; false (with the answer set) when the
// caller must wait or the attempt cannot be recorded.
bool AdmitSignIn(LoginThrottle* throttle, const std::string& account, const std::string& address,
                 APIResponse* response) {
  long retry_after = 0;
  switch (throttle->Admit(account, address, &retry_after)) {
    case LoginAdmission::Admitted:
      return true;
    case LoginAdmission::Throttled: {
      syslog(LOG_WARNING, "%s:%d sign-in for [%s] from %s held back for %lds", "host_api", __LINE__,
             LoggedName(account), address.c_str(), retry_after);
      Json::Value data = Reason("too many failed sign-ins; try again later");
      data["retry_after"] = static_cast<Json::Int64>(retry_after);
      response->SetError(kErrSignInThrottled, data);
      return false;
    }
    case LoginAdmission::Unavailable:
      break;
  }
  syslog(LOG_ERR, "%s:%d cannot record sign-in attempts", "host_api", __LINE__);
  response->SetError(kErrUnknown, Reason("cannot record the sign-in attempt"));
  return false;
}

void SignIn(const std::string& account, const std::string& password, APIResponse* response);

// Every attempt that names an account is on record, with its outcome; the
// password never is.
void Login(const CgiRequest& cgi, const APIRequest& request, APIResponse* response) {
  if (!IsPostedSignIn(cgi)) {
    response->SetError(kErrBadRequest,
                       Reason("sign in by POST, with account and passwd in the body"));
    return;
  }
  std::string account, password;
  if (!RequireString(request, "account", &account, response) ||
      !RequireString(request, "passwd", &password, response)) {
    return;
  }
  SignIn(account, password, response);
  RecordSignIn(account, *response);
}

// Checks the password of `account` and opens a session for it.
void SignIn(const std::string& account, const std::string& password, APIResponse* response) {
  const HostConfig config = LoadHostConfig();
  const std::string address = LoginAddressKey(getenv("REMOTE_ADDR"));
  LoginThrottle throttle(config.login);
  if (!AdmitSignIn(&throttle, account, address, response)) return;
  if (!KIVOAccountCheckPassword(account, password)) {
    syslog(LOG_WARNING, "%s:%d failed sign-in for account [%s] from %s", "host_api", __LINE__,
           LoggedName(account), address.c_str());
    // The attempt is counted already; only its wait would start earlier.
    if (!throttle.Failed(account, address))
      syslog(LOG_ERR, "%s:%d cannot record a failed sign-in", "host_api", __LINE__);
    response->SetError(kErrWrongPassword, Reason("wrong account or password"));
    return;
  }
  if (!throttle.Succeeded(account, address)) {
    syslog(LOG_ERR, "%s:%d cannot clear the failed sign-ins of [%s]", "host_api", __LINE__,
           account.c_str());
  }
  SessionStore store(config.session);
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

// Finds the caller's session and, when it came in the cookie, checks the
// token that proves the page read our answer; on refusal sets the error and
// answers false.
bool FindProvenSession(const CgiRequest& cgi, const APIRequest& request, Session* session,
                       APIResponse* response) {
  bool from_cookie = false;
  if (!FindSession(cgi, request, session, &from_cookie, response)) return false;
  if (from_cookie && !ConstantTimeEquals(cgi.token, session->token)) {
    response->SetError(kErrNotPermitted, Reason("missing or wrong X-KIVO-Token"));
    return false;
  }
  return true;
}

void Logout(const CgiRequest& cgi, const APIRequest& request, APIResponse* response) {
  Session session;
  if (!FindProvenSession(cgi, request, &session, response)) return;
  SessionStore(LoadSessionLimits()).Remove(session.id);
  response->AddHeader("Set-Cookie: id=; Path=/; HttpOnly; SameSite=Strict; Max-Age=0");
  response->SetSuccess();
}

// Settings belong to the caller's own account, so any signed-in account may
// write them; a cookie session still proves its page with the token.
void UserSettings(const CgiRequest& cgi, const APIRequest& request, APIResponse* response) {
  Session session;
  if (!FindProvenSession(cgi, request, &session, response)) return;
  // The agreement to the terms of service is stored here: a change on record.
  CallRecord record(request, session.user);
  UserSettingsSet(request, session.user, response);
  record.Finish(*response);
}

// The activity log is for administrators only, as every module API is.
void Activity(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (!AuthorizeAdministrator(cgi, false, request, response)) return;
  if (request->GetAPIMethod() == "list") return ActivityList(*request, response);
  ActivityExport(*request, response);
}

// Kept versions and rollback are for administrators only, as every package
// API is.
void Revision(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (!AuthorizeAdministrator(cgi, false, request, response)) return;
  const std::string& method = request->GetAPIMethod();
  const std::string account = request->GetLoginUserName();
  if (method == "list") return RevisionList(*request, response);
  if (method == "rollback") return RevisionRollback(*request, account, response);
  RevisionDrop(*request, account, response);
}

// How fresh the catalogue is: for administrators, as the catalogue is.
void Sources(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (AuthorizeAdministrator(cgi, false, request, response)) SourcesList(*request, response);
}

// What the watchdog did: for administrators, as every package API is.
void Watchdog(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (AuthorizeAdministrator(cgi, false, request, response)) WatchdogList(*request, response);
}

// What each package uses: for administrators, as every package API is.
void Usage(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (!AuthorizeAdministrator(cgi, false, request, response)) return;
  if (request->GetAPIMethod() == "list") return UsageList(*request, response);
  UsageGet(*request, response);
}

// The window and holds of automatic updates are for administrators only, as
// every package API is; a change is on record.
void AutoUpdate(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  if (!AuthorizeAdministrator(cgi, false, request, response)) return;
  CallRecord record(*request, request->GetLoginUserName());
  AutoUpdateAnswer(*request, response);
  record.Finish(*response);
}

// Tells a page that was reloaded who it is signed in as and hands it the
// session's token again, so that the page keeps the token in memory only and
// never needs to store it. Only the cookie session is asked: a cross-site
// page cannot read the answer, and the SameSite cookie does not even travel
// with its requests.
void SessionQuery(const CgiRequest& cgi, APIResponse* response) {
  const std::string sid = CookieValue(cgi.cookie, "id");
  Session session;
  SessionStore store(LoadSessionLimits());
  SessionLookup found = sid.empty() ? SessionLookup::Unknown : store.Find(sid, &session);
  if (found == SessionLookup::Expired) {
    response->SetError(kErrSessionExpired, Reason("session expired"));
    return;
  }
  if (found != SessionLookup::Found) {
    response->SetError(kErrNotSignedIn, Reason("not signed in"));
    return;
  }
  Json::Value data(Json::objectValue);
  data["account"] = session.user;
  data["token"] = session.token;
  data["administrator"] = KIVOAccountInGroup(session.user, kAdminGroup);
  response->SetSuccess(data);
}

// The inline-frame page answers everyone who is not an administrator with a
// bare 404 of its own, which hides that the page exists; a JSON refusal here
// would tell. So the host only tells the page's session object who calls.
bool IsSelfGuarded(const APIRequest& request) {
  return request.GetAPIClass() == WebAPIName::kFakeIFrame && request.GetAPIMethod() == "get";
}

// Hands the caller of a self-guarded method, if any session is valid, to the
// module's raw-page session object. A session from the cookie needs no token
// here: browsers load the page by URL, and it shows nothing.
void HandOverCaller(const CgiRequest& cgi, APIRequest* request) {
  bool from_cookie = false;
  std::string sid = SessionIdOf(cgi, *request, &from_cookie);
  Session session;
  bool found =
      !sid.empty() && SessionStore(LoadSessionLimits()).Find(sid, &session) == SessionLookup::Found;
  WebManSetCaller(found ? session.user : std::string(), KIVOAccountInGroup);
  if (found) request->SetLoginUserName(session.user);
}

}  // namespace

bool IsHostAPI(const std::string& api) {
  if (api == kAutoUpdate) return true;
  return api == kInfo || api == kAuth || api == kUserSettings || api == kActivity ||
         api == kSources || api == kRevision || api == kWatchdog || api == kUsage;
}

void RunHostAPI(const CgiRequest& cgi, APIRequest* request, const ModuleTable* modules,
                APIResponse* response) {
  const std::string& api = request->GetAPIClass();
  const std::string& method = request->GetAPIMethod();
  bool known = (api == kInfo && method == "query") ||
               (api == kAuth && (method == "login" || method == "logout" || method == "session")) ||
               (api == kUserSettings && method == "set") ||
               (api == kAutoUpdate && IsAutoUpdateMethod(method)) ||
               (api == kActivity && (method == "list" || method == "export")) ||
               (api == kSources && method == "list") || (api == kWatchdog && method == "list") ||
               (api == kUsage && (method == "list" || method == "get")) ||
               (api == kRevision && (method == "list" || method == "rollback" || method == "drop"));
  if (!known) {
    response->SetError(kErrNoSuchMethod);
  } else if (request->GetAPIVersion() != 1) {
    response->SetError(kErrBadVersion);
  } else if (api == kInfo) {
    InfoQuery(*modules, response);
  } else if (api == kUserSettings) {
    UserSettings(cgi, *request, response);
  } else if (api == kAutoUpdate) {
    AutoUpdate(cgi, request, response);
  } else if (api == kActivity) {
    Activity(cgi, request, response);
  } else if (api == kRevision) {
    Revision(cgi, request, response);
  } else if (api == kSources) {
    Sources(cgi, request, response);
  } else if (api == kWatchdog) {
    Watchdog(cgi, request, response);
  } else if (api == kUsage) {
    Usage(cgi, request, response);
  } else if (method == "login") {
    Login(cgi, *request, response);
  } else if (method == "session") {
    SessionQuery(cgi, response);
  } else {
    Logout(cgi, *request, response);
  }
}

bool AuthorizeAdministrator(const CgiRequest& cgi, bool token_exempt, APIRequest* request,
                            APIResponse* response) {
  if (IsSelfGuarded(*request)) {
    HandOverCaller(cgi, request);
    return true;
  }
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
