// The host's own APIs and the sign-in rules that guard the modules' APIs.
//
//  "KIVO.API.Info" "query"   every API with its lowest and highest version
//  "KIVO.API.Auth" "login"   account + passwd -> {"sid", "token"} and cookie id=<sid>;
//                            only by POST with both in the body, throttled after
//                            failures (host/login_throttle.h)
//  "KIVO.API.Auth" "logout"  ends the calling session
//  "KIVO.API.Auth" "session" the cookie session's {"account", "token",
//                            "administrator"}, for a page that was reloaded
//  "KIVO.API.UserSettings" "set"  the caller's own per-user settings, for any
//                            signed-in account (host/user_settings_api.h)
//  "KIVO.Core.Package.Activity" "list", "export"  the activity log, for
//                            administrators (host/activity_api.h)
#pragma once

#include <string>

#include "host/cgi_request.h"
#include "host/module_table.h"
#include "host/session_store.h"
#include "webapi/api_codes.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"

// The sign-in's own error codes; the codes every API shares are those of
// webapi/api_codes.h.
enum HostError {
  kErrWrongPassword = 400,
  kErrSignInThrottled = 407,  // too many failed sign-ins; "retry_after" seconds
};

// True when `api` is served by the host itself.
bool IsHostAPI(const std::string& api);

// Answers a host API call. `modules` is asked only by "KIVO.API.Info".
void RunHostAPI(const CgiRequest& cgi, APIRequest* request, const ModuleTable* modules,
                APIResponse* response);

// Checks that the caller of a module API is a signed-in administrator. The
// session comes from the cookie "id" (then the X-KIVO-Token header must
// carry its token, except for `token_exempt` calls that browsers load by URL)
// or from the parameter "_sid". Sets the login user on `request`; on refusal
// sets the error on `response` and answers false.
// One method guards itself: "KIVO.Core.Package.FakeIFrame" "get" always
// passes, with its caller (or none, without an error) handed to the raw-page
// session object (webapi/web_man.h), which answers a bare 404 to anyone who is
// not an administrator.
bool AuthorizeAdministrator(const CgiRequest& cgi, bool token_exempt, APIRequest* request,
                            APIResponse* response);
