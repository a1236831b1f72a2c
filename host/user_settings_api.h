// "KIVO.API.UserSettings" "set": where the web desktop's applications keep
// what a user chose (platform/settings/kivo_settings.h), for example that the
// user agreed to the package center's terms of service. Browser storage would
// forget it with the browser; the appliance keeps it per account.
//
//   app       the application's key in the user's document, 1 to 64 of
//             [A-Za-z0-9._-] (e.g. "KIVO.PXS.PkgManApp.Instance")
//   settings  a JSON object; each of its members replaces the member of the
//             same name in the application's object, the others stay
//
// Any signed-in account may write its own document, and only its own: the
// account is the session's, never a parameter.
#pragma once

#include <string>

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// Answers "set" for `account` (the caller's session), or 120 for a bad
// parameter, or 100 when the document cannot be read or written.
void UserSettingsSet(const APIRequest& request, const std::string& account, APIResponse* response);
