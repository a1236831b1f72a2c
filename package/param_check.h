// The parameter checkers the host runs before the handlers; the module's
// method table (main.cc) pairs each method with its checker.
//
// A checker reads all of its parameters in a fixed order, then reports the
// first fault with kErrParameter (webapi/api_codes.h) and {"name", "reason"}:
// a missing required parameter ("required"), a wrong type or a non-string
// array element ("type"), then the value conditions in order
// ("condition"). It answers true when the request may reach its handler,
// false with the fault answered.
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

namespace KIVO_PACKAGE {

// Methods without parameters to check.
bool AlwaysAccept(APIRequest* request, APIResponse* response);

// Installed packages: "list", "get", "feasibility_check".
bool CheckList(APIRequest* request, APIResponse* response);
bool CheckGet(APIRequest* request, APIResponse* response);
bool CheckFeasibility(APIRequest* request, APIResponse* response);
// The package's log: "name".
bool CheckLogName(APIRequest* request, APIResponse* response);

// Installation "check"; version 2 also reads "ver".
bool CheckInstallationCheck(APIRequest* request, APIResponse* response);
bool CheckInstall(APIRequest* request, APIResponse* response);
// "task_id" of "status" and "clean"; "taskid" of "cancel" and of a
// download's "check"; "path" of "delete".
bool CheckTaskId(APIRequest* request, APIResponse* response);
bool CheckTaskid(APIRequest* request, APIResponse* response);
bool CheckTmpPath(APIRequest* request, APIResponse* response);

// "id" of start and uninstall (at least one id), and of stop and the
// automatic-update list's add and delete (any number).
bool CheckStart(APIRequest* request, APIResponse* response);
bool CheckUninstall(APIRequest* request, APIResponse* response);
bool CheckIds(APIRequest* request, APIResponse* response);

// Settings.
bool CheckSettingSet(APIRequest* request, APIResponse* response);
bool CheckVolumeSet(APIRequest* request, APIResponse* response);

// Feeds ("list") and keyrings.
bool CheckFeedList(APIRequest* request, APIResponse* response);
bool CheckKeyringAdd(APIRequest* request, APIResponse* response);
bool CheckKeyringDelete(APIRequest* request, APIResponse* response);

// The catalogue and images.
bool CheckServerList(APIRequest* request, APIResponse* response);
bool CheckThumb(APIRequest* request, APIResponse* response);
bool CheckThumbServer(APIRequest* request, APIResponse* response);
bool CheckScreenshot(APIRequest* request, APIResponse* response);
bool CheckScreenshotServer(APIRequest* request, APIResponse* response);

}  // namespace KIVO_PACKAGE
